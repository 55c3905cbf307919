// Diagnostic lines: logger_stream builds one line per statement, trace_scope
// writes the entry and exit lines of a traced operation. Both hand their
// lines to scribo.dll through the process-wide binding of log_dll.h.
//
//   logging::logger_stream(logging::level_error, L"adjust_process_priviledges")
//       << L"AdjustTokenPrivileges err=" << code;
//
// Rendering: numbers are decimal; after a wide literal that ends in "0x" the
// rest of the line is hexadecimal (lower case, no prefix of its own); narrow
// strings are widened byte by byte; handles and pointers are written as
// unsigned decimal numbers.
#pragma once

#include <cstdint>
#include <ios>
#include <sstream>
#include <string>
#include <string_view>
#include <system_error>
#include <type_traits>

namespace logging {

enum : std::uint32_t {
  level_critical = 2,
  level_error = 4,
  level_warning = 8,
  level_info = 16,
  level_trace = 32,
};

class logger_stream : public std::wostringstream {
 public:
  logger_stream(std::uint32_t level, const wchar_t* function)
      : std::wostringstream(std::ios_base::out), level_(level), function_(function) {}
  logger_stream(const logger_stream&) = delete;
  logger_stream& operator=(const logger_stream&) = delete;
  // Writes the line, unless no binding exists in the process.
  ~logger_stream() override;

  logger_stream& operator<<(const wchar_t* text);
  logger_stream& operator<<(wchar_t* text) { return *this << static_cast<const wchar_t*>(text); }
  logger_stream& operator<<(const std::wstring& text) { return *this << text.c_str(); }
  logger_stream& operator<<(std::wstring_view text);
  logger_stream& operator<<(const char* text);
  logger_stream& operator<<(char* text) { return *this << static_cast<const char*>(text); }
  logger_stream& operator<<(const std::string& text) { return *this << std::string_view(text); }
  logger_stream& operator<<(std::string_view text);
  logger_stream& operator<<(const void* pointer);
  logger_stream& operator<<(void* pointer) { return *this << static_cast<const void*>(pointer); }
  logger_stream& operator<<(std::ios_base& (*manip)(std::ios_base&)) {
    manip(*this);
    return *this;
  }
  template <typename T, typename = std::enable_if_t<!std::is_pointer_v<T>>>
  logger_stream& operator<<(const T& value) {
    static_cast<std::wostream&>(*this) << value;
    return *this;
  }

  std::uint32_t level() const { return level_; }
  const wchar_t* function() const { return function_; }

 private:
  std::uint32_t level_;
  const wchar_t* function_;
};

// Inside a catch block: writes the level_error line "failed: " and the text
// of the exception in flight under `function`. For the entries that hosts
// and sibling libraries call, which let no exception out.
void log_current_exception(const wchar_t* function) noexcept;

// Entry and exit lines of a traced operation; place it first in the
// operation. The exit line carries the elapsed milliseconds and is written on
// every way out, exceptions included.
struct trace_scope {
  explicit trace_scope(const wchar_t* name);
  trace_scope(const trace_scope&) = delete;
  trace_scope& operator=(const trace_scope&) = delete;
  ~trace_scope();

  std::uint32_t start;
  wchar_t display_name[260];   // name cut to 257 characters, then "()"
  wchar_t function_name[260];  // name cut to 259 characters
};

}  // namespace logging
