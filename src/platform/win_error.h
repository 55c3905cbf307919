// Win32 error codes as std::error_code, and the throwing helpers.
//
// A failure is a std::error_code whose value is the Win32 code and whose
// category is the one win_error_category instance; success is the default
// std::error_code. Operations that can go on report through an error_code
// out-parameter; those that cannot throw std::system_error.
#pragma once

#include <cstdint>
#include <string>
#include <system_error>

namespace winapi {

namespace details {

class win_error_category final : public std::error_category {
 public:
  constexpr win_error_category() noexcept = default;
  const char* name() const noexcept override { return "win_error"; }
  // The system's text for the code, exactly as FormatMessageA gives it (its
  // trailing line break included), or "unknown error <code>".
  std::string message(int code) const override;
};

}  // namespace details

const std::error_category& win_error_category() noexcept;

// Marks failures that have no system cause (ERROR_GEN_FAILURE).
constexpr std::uint32_t gen_failure = 31;

std::error_code make_win_error(std::uint32_t code) noexcept;

// Throws std::system_error with GetLastError() and `text`. Call it on the
// line after the failing call.
[[noreturn]] void throw_last_error(const char* text);
[[noreturn]] void throw_win_error(std::uint32_t code, const char* text);

}  // namespace winapi
