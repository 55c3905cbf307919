// The process-wide binding to scribo.dll, driven directly: this program holds
// no reference of its own, so each test starts with nothing bound. The
// recording double lies beside the program (where the binding looks) and a
// second copy in host\ (for a host that loaded it first). Child runs of this
// program show what the library sees when a process ends.
#include <gtest/gtest.h>

#include <windows.h>

#include <atomic>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include <vorbel/host.h>

#include "logging/log_dll.h"
#include "logging/logger.h"
#include "platform/handles.h"
#include "support/log_capture.h"

// Lets a test make the binding's allocation fail.
std::atomic<bool> g_fail_nothrow_new{false};
void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  if (g_fail_nothrow_new) return nullptr;
  return std::malloc(size != 0 ? size : 1);
}
void operator delete(void* p, const std::nothrow_t&) noexcept { std::free(p); }

namespace {

const wchar_t unbind_events[] =
    L"LogDeinit,LogUninitMetrics,LogRemoveModule:logging::CLogDLL::~CLogDLL";

std::wstring program_dir() {
  std::wstring path(MAX_PATH, L'\0');
  path.resize(::GetModuleFileNameW(nullptr, &path[0], MAX_PATH));
  return path.substr(0, path.rfind(L'\\'));
}

std::string read_text(const std::wstring& path) {
  winapi::unique_handle file(::CreateFileW(path.c_str(), GENERIC_READ,
                                           FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE,
                                           nullptr, OPEN_EXISTING, 0, nullptr));
  if (file.get() == INVALID_HANDLE_VALUE) {
    (void)file.release();
    return std::string();
  }
  std::string text;
  char buffer[4096];
  DWORD n = 0;
  while (::ReadFile(file.get(), buffer, sizeof buffer, &n, nullptr) && n > 0) text.append(buffer, n);
  return text;
}

// Runs this program with `mode`; the recording double also writes what it is
// asked to do into `events_file`. Returns the child's exit code.
DWORD run_child(const std::wstring& mode, const std::wstring& events_file) {
  ::DeleteFileW(events_file.c_str());
  ::SetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", events_file.c_str());
  std::wstring exe(MAX_PATH, L'\0');
  exe.resize(::GetModuleFileNameW(nullptr, &exe[0], MAX_PATH));
  std::wstring command = L"\"" + exe + L"\" --child=" + mode;
  STARTUPINFOW startup{};
  startup.cb = sizeof startup;
  PROCESS_INFORMATION info{};
  const BOOL started = ::CreateProcessW(exe.c_str(), &command[0], /* process security */ nullptr,
                                        /* thread security */ nullptr, /* inherit handles */ FALSE,
                                        /* flags */ 0, /* environment */ nullptr,
                                        /* directory */ nullptr, &startup, &info);
  const DWORD err = ::GetLastError();
  ::SetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", nullptr);
  if (!started) {
    ADD_FAILURE() << "CreateProcess err=" << err;
    return ~0u;
  }
  winapi::unique_handle process(info.hProcess);
  winapi::unique_handle thread(info.hThread);
  if (::WaitForSingleObject(process.get(), 20000) != WAIT_OBJECT_0) {
    ::TerminateProcess(process.get(), 99);
    ADD_FAILURE() << "child " << std::string(mode.begin(), mode.end()) << " did not end";
    return ~0u;
  }
  DWORD code = 0;
  ::GetExitCodeProcess(process.get(), &code);
  return code;
}

// Child modes: what happens inside a process whose memory the parent cannot
// read. Each ends the process itself, as a host would.
int child_main(const std::wstring& mode) {
  if (mode == L"vorbel-unload" || mode == L"vorbel-exit") {
    HMODULE vorbel = ::LoadLibraryW(L"vorbel.dll");
    if (vorbel == nullptr) return 2;
    if (mode == L"vorbel-unload") ::FreeLibrary(vorbel);
    ::ExitProcess(0);  // a terminating detach for whatever is still loaded
  }
  if (mode == L"terminating-detach") {
    logging::process_attach();
    logging::process_detach(/* process_terminating */ true);
    // Late lines during the same termination, as from another library's
    // detach, must not reach the library again.
    { logging::trace_scope late(L"late_operation"); }
    logging::logger_ref ref;
    if (logging::CLogDLL* log = ref.acquire()) {
      if (log->module != nullptr) return 3;
    }
    ref.release();
    ::ExitProcess(0);
  }
  return 1;
}

class binding : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(0, logging::reference_count());
    ASSERT_EQ(nullptr, ::GetModuleHandleW(L"scribo.dll")) << "a previous test leaked it";
  }
  void TearDown() override {
    EXPECT_EQ(0, logging::reference_count());
    EXPECT_EQ(nullptr, logging::current_instance());
    EXPECT_EQ(nullptr, ::GetModuleHandleW(L"scribo.dll")) << "the library was not given back";
  }
};

TEST_F(binding, first_reference_loads_beside_and_last_release_unbinds_in_order) {
  // Unload shows up in the events file as the double's DLL detach.
  const std::wstring events = program_dir() + L"\\order_events.txt";
  ::DeleteFileW(events.c_str());
  ::SetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", events.c_str());

  logging::CLogDLL* log = logging::add_reference();
  ASSERT_NE(nullptr, log);
  ASSERT_NE(nullptr, log->module);
  wchar_t path[MAX_PATH] = {};
  ::GetModuleFileNameW(log->module, path, MAX_PATH);
  EXPECT_EQ(0, ::_wcsicmp((program_dir() + L"\\scribo.dll").c_str(), path)) << path;
  EXPECT_NE(nullptr, log->LogWrite);
  EXPECT_NE(&logging::noop_log_write, log->LogWrite);
  EXPECT_NE(nullptr, log->LogUninitMetrics);
  EXPECT_NE(nullptr, log->LogRemoveModule);
  EXPECT_EQ(nullptr, log->LogSetLevel) << "absent exports stay null";

  EXPECT_EQ(log, logging::add_reference()) << "a second reference binds nothing new";
  EXPECT_EQ(2, logging::reference_count());
  EXPECT_EQ(L"LogInit", test_support::log_events());
  logging::release_reference();
  EXPECT_EQ(L"LogInit", test_support::log_events()) << "unbound before the last release";
  logging::release_reference();
  logging::release_reference();  // one too many changes nothing
  EXPECT_EQ(0, logging::reference_count());
  ::SetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", nullptr);
  EXPECT_EQ("LogInit\nLogDeinit\nLogUninitMetrics\nLogRemoveModule:logging::CLogDLL::~CLogDLL\n"
            "unload\n",
            read_text(events));
  ::DeleteFileW(events.c_str());
}

TEST_F(binding, a_library_the_host_loaded_is_used_and_its_reference_given_back) {
  HMODULE host_copy = ::LoadLibraryW((program_dir() + L"\\host\\scribo.dll").c_str());
  ASSERT_NE(nullptr, host_copy);
  logging::CLogDLL* log = logging::add_reference();
  ASSERT_NE(nullptr, log);
  EXPECT_EQ(host_copy, log->module) << "the copy beside the program was loaded instead";
  logging::release_reference();
  EXPECT_EQ(std::wstring(L"LogInit,") + unbind_events, test_support::log_events());
  EXPECT_EQ(host_copy, ::GetModuleHandleW(L"scribo.dll")) << "the host's own reference was taken";
  ::FreeLibrary(host_copy);
}

TEST_F(binding, logger_ref_gives_back_every_reference_it_took) {
  winapi::unique_module pin(::LoadLibraryW(L"scribo.dll"));
  {
    logging::logger_ref ref;
    logging::CLogDLL* first = ref.acquire();
    EXPECT_EQ(first, ref.acquire());
    EXPECT_EQ(2, logging::reference_count());
  }
  EXPECT_EQ(0, logging::reference_count());
  EXPECT_EQ(std::wstring(L"LogInit,") + unbind_events, test_support::log_events());
}

TEST_F(binding, threads_taking_the_first_reference_together_bind_once) {
  winapi::unique_module pin(::LoadLibraryW(L"scribo.dll"));
  auto set_delay = reinterpret_cast<void (*)(DWORD)>(
      reinterpret_cast<void*>(::GetProcAddress(pin.get(), "ScriboDoubleSetInitDelay")));
  ASSERT_NE(nullptr, set_delay);
  set_delay(100);  // the first binder sits in LogInit while the others arrive

  winapi::unique_handle go(::CreateEventW(nullptr, /* manual reset */ TRUE, FALSE, nullptr));
  std::vector<logging::CLogDLL*> seen(6, nullptr);
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&, i] {
      ::WaitForSingleObject(go.get(), 10000);
      seen[i] = logging::add_reference();
    });
  }
  ::SetEvent(go.get());
  for (auto& t : threads) t.join();
  set_delay(0);

  EXPECT_EQ(L"LogInit", test_support::log_events());
  EXPECT_EQ(6, logging::reference_count());
  for (auto* log : seen) {
    EXPECT_EQ(seen[0], log);
    ASSERT_NE(nullptr, log);
    EXPECT_NE(&logging::noop_log_write, log->LogWrite) << "a reference saw a half-made binding";
  }
  for (std::size_t i = 0; i < seen.size(); ++i) logging::release_reference();
  EXPECT_EQ(std::wstring(L"LogInit,") + unbind_events, test_support::log_events());
}

TEST_F(binding, without_a_binding_stream_lines_drop_and_trace_lines_bind_for_themselves) {
  winapi::unique_module pin(::LoadLibraryW(L"scribo.dll"));
  logging::logger_stream(logging::level_error, L"lonely") << L"dropped";
  EXPECT_TRUE(test_support::log_lines().empty());
  EXPECT_EQ(L"", test_support::log_events()) << "a stream line must not bind";

  { logging::trace_scope trace(L"lonely_operation"); }
  const auto lines = test_support::log_lines();
  ASSERT_EQ(2u, lines.size());
  EXPECT_EQ(L"-> lonely_operation()", lines[0].text);
  EXPECT_EQ(0u, lines[1].text.rfind(L"<- lonely_operation() [", 0));
  const std::wstring once = std::wstring(L"LogInit,") + unbind_events;
  EXPECT_EQ(once + L"," + once, test_support::log_events()) << "each line binds and unbinds";
}

TEST_F(binding, no_memory_for_the_binding_drops_lines_without_a_crash) {
  winapi::unique_module pin(::LoadLibraryW(L"scribo.dll"));
  g_fail_nothrow_new = true;
  EXPECT_EQ(nullptr, logging::add_reference());
  { logging::trace_scope trace(L"starved"); }
  logging::logger_stream(logging::level_error, L"starved") << L"no binding";
  g_fail_nothrow_new = false;
  logging::release_reference();
  EXPECT_TRUE(test_support::log_lines().empty());
  EXPECT_EQ(L"", test_support::log_events());

  // The next first reference binds normally again.
  EXPECT_NE(nullptr, logging::add_reference());
  logging::release_reference();
  EXPECT_EQ(std::wstring(L"LogInit,") + unbind_events, test_support::log_events());
}

TEST_F(binding, lines_from_the_component_carry_its_own_module_handle) {
  vorbel::host_library lib;
  ASSERT_EQ(0u, lib.open(program_dir()));
  ASSERT_NE(nullptr, ::GetModuleHandleW(L"scribo.dll")) << "process attach did not bind";
  test_support::clear_log();
  const GUID unknown = {0x1, 0x2, 0x3, {0x4, 0x5, 0x6, 0x7, 0x8, 0x9, 0xA, 0xB}};
  EXPECT_EQ(nullptr, lib.registry()->GetInterface(unknown));
  const auto lines = test_support::find_lines(L"vorbel_impl::GetInterface", L"unknown interface ");
  ASSERT_EQ(1u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(lib.module(), lines[0].module) << "the host's handle instead of the component's";
  lib.close();  // the detach unbinds: TearDown finds the library gone
}

TEST_F(binding, unloading_the_component_unbinds_but_process_exit_calls_nothing) {
  const std::wstring events = program_dir() + L"\\child_events.txt";
  ASSERT_EQ(0u, run_child(L"vorbel-unload", events));
  EXPECT_EQ("LogInit\nLogDeinit\nLogUninitMetrics\nLogRemoveModule:logging::CLogDLL::~CLogDLL\n"
            "unload\n",
            read_text(events));

  ASSERT_EQ(0u, run_child(L"vorbel-exit", events));
  EXPECT_EQ("LogInit\n", read_text(events)) << "called into the library while the process ended";

  EXPECT_EQ(0u, run_child(L"terminating-detach", events));
  EXPECT_EQ("LogInit\n", read_text(events)) << "a late line bound the library again";
  ::DeleteFileW(events.c_str());
}

}  // namespace

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg.rfind("--child=", 0) == 0) {
      const std::string mode = arg.substr(8);
      return child_main(std::wstring(mode.begin(), mode.end()));
    }
  }
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
