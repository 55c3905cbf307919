#include "platform/win_error.h"

#include <windows.h>

namespace winapi {
namespace details {

std::string win_error_category::message(int code) const {
  std::string text(32767, '\0');
  const DWORD n = ::FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                                   /* source */ nullptr, static_cast<DWORD>(code),
                                   /* language */ 0, text.data(),
                                   static_cast<DWORD>(text.size()), /* arguments */ nullptr);
  if (n == 0) return "unknown error " + std::to_string(static_cast<std::uint32_t>(code));
  text.resize(n);
  text.shrink_to_fit();
  return text;
}

}  // namespace details

namespace {
// Constant-initialised: usable from any static initialiser.
const details::win_error_category g_category;
}  // namespace

const std::error_category& win_error_category() noexcept { return g_category; }

std::error_code make_win_error(std::uint32_t code) noexcept {
  return std::error_code(static_cast<int>(code), g_category);
}

void throw_last_error(const char* text) {
  const DWORD code = ::GetLastError();
  throw std::system_error(make_win_error(code), text);
}

void throw_win_error(std::uint32_t code, const char* text) {
  throw std::system_error(make_win_error(code), text);
}

}  // namespace winapi
