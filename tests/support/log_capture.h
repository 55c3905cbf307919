// Reads back the lines the component wrote, from the recording scribo.dll
// double (tests/doubles/scribo_recording) loaded beside the test program.
#pragma once

#include <windows.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace test_support {

struct log_line {
  std::int16_t depth;
  std::uint32_t level;
  HMODULE module;
  std::wstring function;
  std::wstring text;
};

// Every line written since the last clear, in order.
std::vector<log_line> log_lines();
// Lines of `function` (all functions when empty) whose text contains `part`.
std::vector<log_line> find_lines(const std::wstring& function, const std::wstring& part);
bool has_line(const std::wstring& function, const std::wstring& part);
// Forgets recorded lines and library calls.
void clear_log();
// LogInit, LogDeinit, ... as recorded, comma-separated.
std::wstring log_events();

// Waits up to `timeout` for a line of `function` containing `part`.
bool wait_for_line(const std::wstring& function, const std::wstring& part,
                   std::chrono::milliseconds timeout = std::chrono::seconds(5));

// Polls `condition` until it holds or `timeout` passes.
bool wait_until(const std::function<bool()>& condition,
                std::chrono::milliseconds timeout = std::chrono::seconds(5));

// All lines joined, one per row ("level function: text"), for failure output.
std::wstring dump_log();

}  // namespace test_support
