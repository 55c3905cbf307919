// The scribo.dll stand-in, loaded and called the way the component does, its
// lines read back from the file it writes.
#include <gtest/gtest.h>

#include <windows.h>

#include <cstdint>
#include <fstream>
#include <iterator>
#include <regex>
#include <string>

namespace {

template <typename Fn>
Fn get(HMODULE module, const char* name) {
  return reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(module, name)));
}

TEST(scribo, a_line_lands_in_the_file_when_its_level_is_kept) {
  HMODULE module = ::LoadLibraryW(L"scribo.dll");
  ASSERT_NE(nullptr, module) << "scribo.dll not found beside the test";
  using write_fn = std::int32_t (*)(std::int16_t, const std::uint32_t*, HMODULE, const wchar_t*,
                                    const wchar_t*, ...);
  const auto init = get<void (*)()>(module, "LogInit");
  const auto deinit = get<void (*)()>(module, "LogDeinit");
  const auto write = get<write_fn>(module, "LogWrite");
  ASSERT_TRUE(init && deinit && write && get<void (*)()>(module, "LogUninitMetrics") &&
              get<void (*)(const char*)>(module, "LogRemoveModule"))
      << "an export is missing";

  ::DeleteFileW(L"scribo_test.log");  // in the test's own folder
  ::SetEnvironmentVariableW(L"SCRIBO_LOG_FILE", L"scribo_test.log");
  ::SetEnvironmentVariableW(L"SCRIBO_LOG_LEVEL", L"warning");
  init();
  for (std::uint32_t level : {4u, 8u, 16u, 32u})
    write(0, &level, nullptr, L"gateway::start", L"level %u %s", level, L"caf\u00E9");
  deinit();
  std::ifstream file("scribo_test.log", std::ios::binary);
  const std::string bytes{std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
  // "YYYY-MM-DD hh:mm:ss.mmm [pid:tid] LEVEL function: text", CR LF ended.
  const std::string head = R"(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d\.\d{3} \[)" +
                           std::to_string(::GetCurrentProcessId()) + ":" +
                           std::to_string(::GetCurrentThreadId()) + "\\] ";
  const std::regex expected(head + "ERROR gateway::start: level 4 caf\xC3\xA9\r\n" + head +
                            "WARN  gateway::start: level 8 caf\xC3\xA9\r\n");
  EXPECT_TRUE(std::regex_match(bytes, expected)) << bytes;
}

}  // namespace
