// Log lines and call tracing, read back through the recording scribo.dll
// double while the test main holds the process's reference to the binding.
#include <gtest/gtest.h>

#include <windows.h>
#include <mmsystem.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "logging/logger.h"
#include "support/log_capture.h"

namespace {

using logging::logger_stream;
using logging::trace_scope;
using test_support::log_line;

// A recorded line with the format it was written with.
struct written {
  log_line line;
  std::wstring format;
};

std::vector<written> written_lines() {
  using format_fn = bool (*)(std::size_t, const wchar_t**);
  auto read_format = reinterpret_cast<format_fn>(reinterpret_cast<void*>(
      ::GetProcAddress(::GetModuleHandleW(L"scribo.dll"), "ScriboDoubleReadFormat")));
  std::vector<written> out;
  for (auto& line : test_support::log_lines()) {
    const wchar_t* format = L"?";
    if (read_format != nullptr) read_format(out.size(), &format);
    out.push_back({std::move(line), format});
  }
  return out;
}

// The number in the exit text "<- name() [N]"; -1 when the text has another form.
long long elapsed_of(const std::wstring& text) {
  const std::size_t open = text.rfind(L" [");
  if (open == std::wstring::npos || text.back() != L']') return -1;
  return std::stoll(text.substr(open + 2, text.size() - open - 3));
}

class logger : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(test_support::log_capture_available()) << "the recording double is not loaded";
    test_support::clear_log();
  }
};

TEST_F(logger, traced_operation_writes_entry_and_exit_around_its_lines) {
  {
    trace_scope trace(L"gateway::start");
    logger_stream(logging::level_info, L"gateway::start") << L"pipe name: " << "bus_a";
  }
  const auto lines = written_lines();
  ASSERT_EQ(3u, lines.size()) << test_support::dump_log();
  const HMODULE self = ::GetModuleHandleW(nullptr);

  EXPECT_EQ(1, lines[0].line.depth);
  EXPECT_EQ(32u, lines[0].line.level);
  EXPECT_EQ(L"gateway::start", lines[0].line.function);
  EXPECT_EQ(L"-> gateway::start()", lines[0].line.text);
  EXPECT_EQ(L"-> %s", lines[0].format);

  EXPECT_EQ(0, lines[1].line.depth);
  EXPECT_EQ(16u, lines[1].line.level);
  EXPECT_EQ(L"pipe name: bus_a", lines[1].line.text);
  EXPECT_EQ(L"%s", lines[1].format);

  EXPECT_EQ(-1, lines[2].line.depth);
  EXPECT_EQ(32u, lines[2].line.level);
  EXPECT_EQ(L"gateway::start", lines[2].line.function);
  EXPECT_EQ(0u, lines[2].line.text.rfind(L"<- gateway::start() [", 0)) << lines[2].line.text;
  EXPECT_GE(elapsed_of(lines[2].line.text), 0);
  EXPECT_EQ(L"<- %s [%d]", lines[2].format);

  for (const auto& w : lines) EXPECT_EQ(self, w.line.module) << "not this image's handle";
}

void failing_operation() {
  trace_scope trace(L"failing_operation");
  ::Sleep(40);
  throw std::runtime_error("boom");
}

TEST_F(logger, exit_line_carries_elapsed_time_also_when_an_exception_leaves) {
  EXPECT_THROW(failing_operation(), std::runtime_error);
  {
    // Elapsed time is the 32-bit difference to the start, whatever the start.
    trace_scope trace(L"shifted_start");
    trace.start -= 1500u;
  }
  const auto lines = test_support::log_lines();
  ASSERT_EQ(4u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(-1, lines[1].depth);
  EXPECT_EQ(0u, lines[1].text.rfind(L"<- failing_operation() [", 0)) << lines[1].text;
  EXPECT_GE(elapsed_of(lines[1].text), 30);
  EXPECT_LT(elapsed_of(lines[1].text), 10000);
  EXPECT_GE(elapsed_of(lines[3].text), 1500);
  EXPECT_LT(elapsed_of(lines[3].text), 11500);
}

TEST_F(logger, long_operation_names_are_cut_to_the_fixed_arrays) {
  std::wstring name;
  for (int i = 0; i < 300; ++i) name += static_cast<wchar_t>(L'a' + i % 26);
  { trace_scope trace(name.c_str()); }
  const auto lines = test_support::log_lines();
  ASSERT_EQ(2u, lines.size());
  EXPECT_EQ(L"-> " + name.substr(0, 257) + L"()", lines[0].text);
  EXPECT_EQ(name.substr(0, 259), lines[0].function);
  EXPECT_EQ(name.substr(0, 259), lines[1].function);
  EXPECT_EQ(0u, lines[1].text.rfind(L"<- " + name.substr(0, 257) + L"() [", 0));

  // Names that fit stay whole, at the edge too.
  const std::wstring edge = name.substr(0, 257);
  { trace_scope trace(edge.c_str()); }
  const auto more = test_support::log_lines();
  ASSERT_EQ(4u, more.size());
  EXPECT_EQ(L"-> " + edge + L"()", more[2].text);
  EXPECT_EQ(edge, more[2].function);
}

TEST_F(logger, stream_lines_keep_level_and_text_as_they_stand) {
  logger_stream(logging::level_critical, L"bus::bus") << L"create_bus fail";
  logger_stream(logging::level_error, L"adjust_process_priviledges")
      << L"AdjustTokenPrivileges err=" << 1300;
  logger_stream(logging::level_warning, L"f") << L"100% %d %s %n %%";
  logging::logger_stream(logging::level_info, L"empty");
  const auto lines = written_lines();
  ASSERT_EQ(4u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(2u, lines[0].line.level);
  EXPECT_EQ(L"bus::bus", lines[0].line.function);
  EXPECT_EQ(L"create_bus fail", lines[0].line.text);
  EXPECT_EQ(4u, lines[1].line.level);
  EXPECT_EQ(L"AdjustTokenPrivileges err=1300", lines[1].line.text);
  EXPECT_EQ(8u, lines[2].line.level);
  EXPECT_EQ(L"100% %d %s %n %%", lines[2].line.text) << "the text is an argument, never a format";
  EXPECT_EQ(16u, lines[3].line.level);
  EXPECT_EQ(L"", lines[3].line.text);
  for (const auto& w : lines) {
    EXPECT_EQ(0, w.line.depth);
    EXPECT_EQ(L"%s", w.format);
  }
}

TEST_F(logger, decimal_by_default_and_hexadecimal_after_0x_to_the_end_of_that_line_only) {
  logger_stream(logging::level_info, L"numbers")
      << L"" << -5 << L" " << 4294967295u << L" " << -9000000000LL << L" " << 18000000000ULL << L" "
      << reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1234));
  logger_stream(logging::level_warning, L"get_signature")
      << L"get_signature err=0x" << 0x800B0100u << L" pid=" << 4096 << L" " << -1;
  logger_stream(logging::level_info, L"next") << L"pid=" << 4096 << L" err=" << 255;
  logger_stream(logging::level_info, L"word") << L"box" << 255;  // "x" alone is no switch
  const std::error_code code(5, std::system_category());
  logger_stream(logging::level_error, L"code") << L"err=0x" << code.value() << L" " << "text";
  std::wstring texts;
  for (const auto& line : test_support::log_lines()) texts += line.text + L"\n";
  EXPECT_EQ(L"-5 4294967295 -9000000000 18000000000 4660\n"
            L"get_signature err=0x800b0100 pid=1000 ffffffff\n"
            L"pid=4096 err=255\n"
            L"box255\n"
            L"err=0x5 text\n",
            texts);
}

// Bytes 0x80-0x9F are left out: under Wine the C locale widens them through
// code page 1252 (0x80 becomes U+20AC), which is the runtime's doing.
TEST_F(logger, narrow_strings_are_widened_byte_by_byte) {
  const char utf8[] = "caf\xC3\xA9 \xFF";
  std::string name("bus\xA0z");
  logger_stream(logging::level_info, L"names")
      << utf8 << L"|" << name << L"|" << std::string_view("ab", 1) << L"|"
      << static_cast<const char*>(nullptr) << static_cast<const wchar_t*>(nullptr);
  const auto lines = test_support::log_lines();
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(std::wstring(L"caf\u00C3\u00A9 \u00FF|bus\u00A0z|a|"), lines[0].text);
}

}  // namespace
