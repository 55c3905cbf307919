// Log lines and call tracing, read back through the recording scribo.dll
// double while the test main holds the process's reference to the binding.
#include <gtest/gtest.h>

#include <windows.h>

#include <stdexcept>
#include <string>
#include <tuple>

#include "logging/logger.h"
#include "support/log_capture.h"

using logging::logger_stream;

// A name longer than the fixed arrays, traced around a stream line by an
// operation that throws.
void failing_operation(const std::wstring& name) {
  logging::trace_scope trace(name.c_str());
  logger_stream(logging::level_info, L"gateway::start") << L"pipe name: " << "bus_a";
  ::Sleep(40);
  throw std::runtime_error("boom");
}

TEST(logger, trace_lines_step_the_depth_cut_long_names_and_come_also_when_an_exception_leaves) {
  test_support::clear_log();
  std::wstring name;
  for (int i = 0; i < 300; ++i) name += static_cast<wchar_t>(L'a' + i % 26);
  const std::wstring shown = name.substr(0, 257), function = name.substr(0, 259);
  EXPECT_THROW(failing_operation(name), std::runtime_error);
  const auto lines = test_support::log_lines();
  ASSERT_EQ(3u, lines.size()) << test_support::dump_log();
  // depth, level, function, start of the text
  const std::tuple<std::int16_t, std::uint32_t, std::wstring, std::wstring> expected[] = {
      {1, 32, function, L"-> " + shown + L"()"}, {0, 16, L"gateway::start", L"pipe name: bus_a"},
      {-1, 32, function, L"<- " + shown + L"() ["}};
  for (std::size_t i = 0; i < lines.size(); ++i) {
    const auto& [depth, level, function_name, text] = expected[i];
    EXPECT_EQ(std::tie(depth, level, function_name), std::tie(lines[i].depth, lines[i].level, lines[i].function)) << i;
    EXPECT_EQ(0u, lines[i].text.rfind(text, 0)) << lines[i].text;
    EXPECT_EQ(::GetModuleHandleW(nullptr), lines[i].module) << "not this image's handle";
  }
  const long elapsed = std::wcstol(lines[2].text.c_str() + shown.size() + 7, nullptr, 10);
  EXPECT_TRUE(elapsed >= 30 && elapsed < 10000 && lines[2].text.back() == L']') << lines[2].text;
}

// Bytes 0x80-0x9F are left out of the narrow row: under Wine the C locale
// widens them through code page 1252, which is the runtime's doing.
TEST(logger, stream_lines_follow_the_rendering_rules) {
  test_support::clear_log();
  logger_stream(logging::level_critical, L"decimal")
      << L"" << -5 << L" " << 4294967295u << L" " << -9000000000LL << L" " << 18000000000ULL << L" "
      << reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1234));
  logger_stream(logging::level_error, L"hex") << L"err=0x" << 0x800B0100u << L" pid=" << 4096 << L" " << -1;
  logger_stream(logging::level_warning, L"next") << L"pid=" << 4096 << L" box" << 255;
  logger_stream(logging::level_info, L"narrow")
      << "caf\xC3\xA9 \xFF" << L"|" << std::string("bus\xA0z") << L"|" << std::string_view("ab", 1)
      << L"|" << static_cast<const char*>(nullptr) << static_cast<const wchar_t*>(nullptr);
  logger_stream(logging::level_trace, L"percent") << L"100% %d %s %n %%";
  const std::pair<std::uint32_t, std::wstring> expected[] = {
      {2, L"-5 4294967295 -9000000000 18000000000 4660"},
      {4, L"err=0x800b0100 pid=1000 ffffffff"},  // hexadecimal to the end of the line
      {8, L"pid=4096 box255"},                   // the next line is decimal; "x" alone switches nothing
      {16, L"caf\u00C3\u00A9 \u00FF|bus\u00A0z|a|"},
      {32, L"100% %d %s %n %%"},  // the text is an argument, never a format
  };
  const auto lines = test_support::log_lines();
  ASSERT_EQ(std::size(expected), lines.size()) << test_support::dump_log();
  for (std::size_t i = 0; i < lines.size(); ++i) {
    EXPECT_EQ(expected[i], std::make_pair(lines[i].level, lines[i].text)) << i;
    EXPECT_EQ(0, lines[i].depth) << i;
  }
}
