#include "logging/logger.h"

#include <windows.h>
#include <mmsystem.h>

#include <cwchar>
#include <exception>

#include "logging/log_dll.h"
#include "platform/win_api.h"

namespace logging {
namespace {

constexpr std::uint32_t trace_level = level_trace;

bool ends_with_0x(const wchar_t* text) {
  const std::size_t n = std::wcslen(text);
  return n >= 2 && text[n - 2] == L'0' && text[n - 1] == L'x';
}

// Truncating copy: at most `limit - 1` characters, always terminated.
void copy_truncated(wchar_t* dst, std::size_t limit, const wchar_t* src) {
  std::size_t i = 0;
  if (src != nullptr) {
    for (; i + 1 < limit && src[i] != L'\0'; ++i) dst[i] = src[i];
  }
  dst[i] = L'\0';
}

// Bounded append: the result keeps its terminator within `limit`.
void append_bounded(wchar_t* dst, std::size_t limit, const wchar_t* src) {
  std::size_t n = std::wcslen(dst);
  for (; n + 1 < limit && *src != L'\0'; ++n, ++src) dst[n] = *src;
  dst[n] = L'\0';
}

// This component's own image, never the host's: the handle does not change
// while the code that asks for it is loaded.
HMODULE this_module() {
  static const HMODULE module = [] {
    std::error_code ignored;
    return winapi::current_module(ignored);
  }();
  return module;
}

}  // namespace

logger_stream::~logger_stream() {
  if (reference_count() == 0) return;  // no binding: the line is dropped
  logger_ref ref;
  CLogDLL* log = ref.acquire();
  if (log == nullptr) return;  // no memory for a binding
  try {
    const std::wstring text = str();
    log->LogWrite(0, &level_, this_module(), function_, L"%s", text.c_str());
  } catch (...) {
    // No memory for the text: the line is lost, the caller goes on. A
    // destructor must not let the exception out.
  }
}

logger_stream& logger_stream::operator<<(const wchar_t* text) {
  if (text == nullptr) return *this;
  static_cast<std::wostream&>(*this) << text;
  if (ends_with_0x(text)) *this << std::hex;
  return *this;
}

logger_stream& logger_stream::operator<<(std::wstring_view text) {
  write(text.data(), static_cast<std::streamsize>(text.size()));
  return *this;
}

logger_stream& logger_stream::operator<<(const char* text) {
  if (text == nullptr) return *this;
  return *this << std::string_view(text);
}

logger_stream& logger_stream::operator<<(std::string_view text) {
  // One byte to one wide character through the stream's locale; no UTF-8
  // decoding, so what a peer sent is shown byte for byte.
  for (const char c : text) put(widen(c));
  return *this;
}

logger_stream& logger_stream::operator<<(const void* pointer) {
  static_cast<std::wostream&>(*this) << static_cast<unsigned long long>(
      reinterpret_cast<std::uintptr_t>(pointer));
  return *this;
}

void log_current_exception(const wchar_t* function) noexcept {
  try {
    throw;
  } catch (const std::exception& e) {
    logger_stream(level_error, function) << L"failed: " << e.what();
  } catch (...) {
    logger_stream(level_error, function) << L"failed: unknown exception";
  }
}

trace_scope::trace_scope(const wchar_t* name) : start(::timeGetTime()) {
  copy_truncated(display_name, 258, name);
  append_bounded(display_name, 260, L"()");
  copy_truncated(function_name, 260, name);
  logger_ref ref;
  if (CLogDLL* log = ref.acquire()) {
    log->LogWrite(1, &trace_level, this_module(), function_name, L"-> %s", display_name);
  }
}

trace_scope::~trace_scope() {
  logger_ref ref;
  CLogDLL* log = ref.acquire();
  if (log == nullptr) return;
  const std::uint32_t elapsed = ::timeGetTime() - start;
  log->LogWrite(-1, &trace_level, this_module(), function_name, L"<- %s [%d]", display_name,
                static_cast<int>(elapsed));
}

}  // namespace logging
