// A scribo.dll that records every call, for tests to read back through its
// ScriboDouble* exports. Lines are formatted with the Microsoft wide printf
// conventions the component's formats are written for (%s takes a wide
// string).
//
// For tests that look at a process from outside, SCRIBO_DOUBLE_EVENTS_FILE
// names a file that every library call is also appended to, one per line
// ("LogInit", "LogWrite:<function>", ...), since the process's memory ends
// with it; "unload" marks the double's own unloading by FreeLibrary.
#include <windows.h>

#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <deque>
#include <mutex>
#include <string>

#include "platform/srw_sync.h"

namespace {

struct record {
  std::int16_t depth;
  std::uint32_t level;
  HMODULE module;
  std::wstring function;
  std::wstring text;
  std::wstring format;
};

srw_mutex g_mutex;
std::deque<record> g_records;  // a deque keeps earlier records in place
std::wstring g_events;
volatile DWORD g_init_delay_ms = 0;

// Appends `event` and a line break to SCRIBO_DOUBLE_EVENTS_FILE, when set.
// Keeps the caller's last error.
void append_to_events_file(const std::wstring& event) {
  const DWORD last_error = ::GetLastError();
  wchar_t path[MAX_PATH + 1] = {};
  const DWORD n = ::GetEnvironmentVariableW(L"SCRIBO_DOUBLE_EVENTS_FILE", path, MAX_PATH + 1);
  ::SetLastError(last_error);
  if (n == 0 || n > MAX_PATH) return;
  HANDLE file = ::CreateFileW(path, FILE_APPEND_DATA, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                              OPEN_ALWAYS, FILE_ATTRIBUTE_NORMAL, nullptr);
  if (file == INVALID_HANDLE_VALUE) {
    ::SetLastError(last_error);
    return;
  }
  std::string bytes;
  for (const wchar_t c : event) bytes += c < 0x80 ? static_cast<char>(c) : '?';
  bytes += '\n';
  DWORD written = 0;
  ::WriteFile(file, bytes.data(), static_cast<DWORD>(bytes.size()), &written, nullptr);
  ::CloseHandle(file);
  ::SetLastError(last_error);
}

void add_event(const std::wstring& event) {
  append_to_events_file(event);
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (!g_events.empty()) g_events += L',';
  g_events += event;
}

std::wstring format(const wchar_t* fmt, va_list args) {
  std::wstring text(256, L'\0');
  for (;;) {
    va_list copy;
    va_copy(copy, args);
    const int n = _vsnwprintf(text.data(), text.size(), fmt, copy);
    va_end(copy);
    if (n >= 0 && static_cast<std::size_t>(n) < text.size()) {
      text.resize(static_cast<std::size_t>(n));
      return text;
    }
    text.resize(text.size() * 2);
  }
}

}  // namespace

extern "C" {

void LogInit() {
  if (g_init_delay_ms != 0) ::Sleep(g_init_delay_ms);
  add_event(L"LogInit");
}
void LogDeinit() { add_event(L"LogDeinit"); }
void LogUninitMetrics() { add_event(L"LogUninitMetrics"); }
void LogRemoveModule(const char* who) {
  std::wstring event = L"LogRemoveModule:";
  for (const char* p = who; p != nullptr && *p != '\0'; ++p) event += static_cast<wchar_t>(*p);
  add_event(event);
}

std::int32_t LogWrite(std::int16_t depth, const std::uint32_t* level,
                                            HMODULE module, const wchar_t* function,
                                            const wchar_t* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  record r{depth, level != nullptr ? *level : 0u, module, function != nullptr ? function : L"",
           fmt != nullptr ? format(fmt, args) : std::wstring(),
           fmt != nullptr ? fmt : L""};
  va_end(args);
  append_to_events_file(L"LogWrite:" + r.function);
  std::lock_guard<srw_mutex> lock(g_mutex);
  g_records.push_back(std::move(r));
  return 0;
}

std::size_t ScriboDoubleCount() {
  std::lock_guard<srw_mutex> lock(g_mutex);
  return g_records.size();
}

// Pointers stay valid until ScriboDoubleClear.
bool ScriboDoubleRead(std::size_t index, std::int16_t* depth,
                                            std::uint32_t* level, HMODULE* module,
                                            const wchar_t** function, const wchar_t** text) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (index >= g_records.size()) return false;
  const record& r = g_records[index];
  *depth = r.depth;
  *level = r.level;
  *module = r.module;
  *function = r.function.c_str();
  *text = r.text.c_str();
  return true;
}

// The format string of line `index`; false past the end.
bool ScriboDoubleReadFormat(std::size_t index, const wchar_t** format) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (index >= g_records.size()) return false;
  *format = g_records[index].format.c_str();
  return true;
}

// Makes LogInit take `ms` milliseconds, to widen races around binding.
void ScriboDoubleSetInitDelay(DWORD ms) { g_init_delay_ms = ms; }

void ScriboDoubleClear() {
  std::lock_guard<srw_mutex> lock(g_mutex);
  g_records.clear();
  g_events.clear();
}

// The library calls other than LogWrite, comma-separated, in order.
std::size_t ScriboDoubleEvents(wchar_t* buffer, std::size_t capacity) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (buffer != nullptr && capacity > 0) {
    const std::size_t n = g_events.size() < capacity - 1 ? g_events.size() : capacity - 1;
    g_events.copy(buffer, n);
    buffer[n] = L'\0';
  }
  return g_events.size();
}

}  // extern "C"

BOOL WINAPI DllMain(HINSTANCE /*module*/, DWORD reason, LPVOID reserved) {
  if (reason == DLL_PROCESS_DETACH && reserved == nullptr) append_to_events_file(L"unload");
  return TRUE;
}
