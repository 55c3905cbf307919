#include "text.h"

#include <windows.h>

#include <charconv>

namespace vorbel_host {

std::string to_utf8(std::wstring_view text) {
  if (text.empty()) return std::string();
  const int size = static_cast<int>(text.size());
  const int needed = ::WideCharToMultiByte(CP_UTF8, /* flags */ 0, text.data(), size,
                                           /* out */ nullptr, 0, /* default_char */ nullptr,
                                           /* used_default */ nullptr);
  if (needed <= 0) return std::string();
  std::string out(static_cast<std::size_t>(needed), '\0');
  ::WideCharToMultiByte(CP_UTF8, /* flags */ 0, text.data(), size, &out[0], needed,
                        /* default_char */ nullptr, /* used_default */ nullptr);
  return out;
}

std::wstring to_utf16(std::string_view text) {
  if (text.empty()) return std::wstring();
  const int size = static_cast<int>(text.size());
  const int needed =
      ::MultiByteToWideChar(CP_UTF8, /* flags */ 0, text.data(), size, /* out */ nullptr, 0);
  if (needed <= 0) return std::wstring();
  std::wstring out(static_cast<std::size_t>(needed), L'\0');
  ::MultiByteToWideChar(CP_UTF8, /* flags */ 0, text.data(), size, &out[0], needed);
  return out;
}

std::optional<std::uint32_t> parse_u32(std::string_view text, std::uint32_t max) {
  if (text.empty() || text.size() > 10) return std::nullopt;
  for (char c : text) {
    if (c < '0' || c > '9') return std::nullopt;
  }
  std::uint64_t value = 0;
  const auto result = std::from_chars(text.data(), text.data() + text.size(), value);
  if (result.ec != std::errc() || value > max) return std::nullopt;
  return static_cast<std::uint32_t>(value);
}

std::string printable(std::string_view name) {
  static const char digits[] = "0123456789abcdef";
  std::string out;
  out.reserve(name.size());
  for (char c : name) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte <= 0x20 || byte == 0x7F) {
      out += "\\x";
      out += digits[byte >> 4];
      out += digits[byte & 0xF];
    } else {
      out += c;
    }
  }
  return out;
}

std::string quoted_word(std::string_view text) {
  static const char digits[] = "0123456789abcdef";
  std::string out = "\"";
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '\\' || c == '"') {
      out += '\\';
      out += c;
    } else if (byte < 0x20 || byte == 0x7F) {
      out += "\\x";
      out += digits[byte >> 4];
      out += digits[byte & 0xF];
    } else {
      out += c;
    }
  }
  return out + "\"";
}

std::string describe_error(std::uint32_t code) {
  std::string out = "err=" + std::to_string(code);
  wchar_t* buffer = nullptr;
  const DWORD length = ::FormatMessageW(
      FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
      /* source */ nullptr, code, /* language */ 0, reinterpret_cast<wchar_t*>(&buffer),
      /* size */ 0, /* arguments */ nullptr);
  if (length > 0 && buffer != nullptr) {
    std::wstring text(buffer, length);
    while (!text.empty() && (text.back() == L'\n' || text.back() == L'\r' || text.back() == L' ' ||
                             text.back() == L'.')) {
      text.pop_back();
    }
    if (!text.empty()) out += " (" + to_utf8(text) + ")";
  }
  if (buffer != nullptr) ::LocalFree(buffer);
  return out;
}

}  // namespace vorbel_host
