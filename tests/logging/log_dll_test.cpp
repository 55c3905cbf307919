// The process-wide binding to scribo.dll, driven directly: this program holds
// no reference of its own, so each test starts with nothing bound. The
// recording double beside the program also appends every call to
// SCRIBO_DOUBLE_EVENTS_FILE ("unload" for its own unloading), which shows
// what the library sees when a child run of this program ends.
#include <gtest/gtest.h>

#include <windows.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "logging/log_dll.h"
#include "logging/logger.h"
#include "platform/handles.h"
#include "support/log_capture.h"

// Lets a test make the binding's allocation fail.
std::atomic<bool> g_fail_nothrow_new{false};
void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return g_fail_nothrow_new ? nullptr : std::malloc(size != 0 ? size : 1);
}
void operator delete(void* p, const std::nothrow_t&) noexcept { std::free(p); }

const std::string unbound = "LogInit\nLogDeinit\nLogUninitMetrics\nLogRemoveModule:logging::CLogDLL::~CLogDLL\n"
                            "unload\n";

std::wstring program_path() {
  std::wstring path(MAX_PATH, L'\0');
  path.resize(::GetModuleFileNameW(nullptr, &path[0], MAX_PATH));
  return path;
}
const std::wstring events_file = program_path() + L".events.txt";

std::string recorded_events() {
  std::ifstream in{std::filesystem::path(events_file)};
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Each child mode ends its process itself, as a host would.
int child_main(const std::string& mode) {
  if (mode == "terminating-detach") {
    logging::process_attach();
    logging::process_detach(/* process_terminating */ true);
    // A late line of the same termination, as from another library's detach.
    logging::trace_scope late(L"late_operation");
  } else if (HMODULE vorbel = ::LoadLibraryW(L"vorbel.dll")) {
    if (mode == "vorbel-unload") ::FreeLibrary(vorbel);
  } else {
    return 2;
  }
  ::ExitProcess(0);  // a terminating detach for whatever is still loaded
  return 0;
}

TEST(binding, no_memory_binds_nothing_and_threads_taking_the_first_reference_together_bind_once) {
  ::DeleteFileW(events_file.c_str());
  winapi::unique_module pin(::LoadLibraryW(L"scribo.dll"));
  g_fail_nothrow_new = true;
  EXPECT_EQ(nullptr, logging::add_reference());
  { logging::trace_scope trace(L"starved"); }
  logging::logger_stream(logging::level_error, L"starved") << L"no binding";
  g_fail_nothrow_new = false;
  logging::release_reference();
  EXPECT_TRUE(test_support::log_lines().empty());
  EXPECT_EQ(L"", test_support::log_events());

  auto set_delay = reinterpret_cast<void (*)(DWORD)>(
      reinterpret_cast<void*>(::GetProcAddress(pin.get(), "ScriboDoubleSetInitDelay")));
  ASSERT_NE(nullptr, set_delay);
  set_delay(100);  // the first binder sits in LogInit while the others arrive
  std::vector<logging::CLogDLL*> seen(6, nullptr);
  std::vector<std::thread> threads;
  for (auto& slot : seen) threads.emplace_back([&slot] { slot = logging::add_reference(); });
  for (auto& t : threads) t.join();
  set_delay(0);
  for (auto* log : seen) {
    ASSERT_EQ(seen[0], log);
    EXPECT_NE(&logging::noop_log_write, log->LogWrite) << "a reference saw a half-made binding";
  }
  for (std::size_t i = 0; i <= seen.size(); ++i) logging::release_reference();  // one too many changes nothing
  EXPECT_EQ(0, logging::reference_count());
  EXPECT_EQ(nullptr, logging::current_instance());
  pin.reset();
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"scribo.dll")) << "the library was not given back";
  EXPECT_EQ(unbound, recorded_events());
}

// Process termination may have detached the library already: nothing may
// call into it then, nor bind it again; unloading the component unbinds.
TEST(binding, unloading_the_component_unbinds_but_process_exit_calls_nothing) {
  for (const auto& [mode, events] : {std::pair<std::wstring, std::string>{L"vorbel-unload", unbound},
                                     {L"vorbel-exit", "LogInit\n"}, {L"terminating-detach", "LogInit\n"}}) {
    ::DeleteFileW(events_file.c_str());
    std::wstring command = L"\"" + program_path() + L"\" --child=" + mode;
    STARTUPINFOW startup{};
    startup.cb = sizeof startup;
    PROCESS_INFORMATION info{};
    ASSERT_TRUE(::CreateProcessW(program_path().c_str(), &command[0], nullptr, nullptr, /* inherit */ FALSE, 0,
                                 nullptr, nullptr, &startup, &info));
    winapi::unique_handle process(info.hProcess), thread(info.hThread);
    if (::WaitForSingleObject(process.get(), 20000) != WAIT_OBJECT_0) ::TerminateProcess(process.get(), 99);
    DWORD code = ~0u;
    EXPECT_TRUE(::GetExitCodeProcess(process.get(), &code) && code == 0) << code;
    EXPECT_EQ(events, recorded_events()) << std::string(mode.begin(), mode.end());
  }
}


int main(int argc, char** argv) {
  if (argc > 1 && std::string(argv[1]).rfind("--child=", 0) == 0) return child_main(std::string(argv[1]).substr(8));
  ::SetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", events_file.c_str());  // children inherit it
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
