// A scribo.dll that records every call, for tests to read back through its
// ScriboDouble* exports. Lines are formatted with the Microsoft wide printf
// conventions the component's formats are written for (%s takes a wide
// string).
#include <windows.h>

#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <deque>
#include <mutex>
#include <string>

namespace {

struct record {
  std::int16_t depth;
  std::uint32_t level;
  HMODULE module;
  std::wstring function;
  std::wstring text;
};

std::mutex g_mutex;
std::deque<record> g_records;  // a deque keeps earlier records in place
std::wstring g_events;

void add_event(const std::wstring& event) {
  std::lock_guard<std::mutex> lock(g_mutex);
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

void LogInit() { add_event(L"LogInit"); }
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
           fmt != nullptr ? format(fmt, args) : std::wstring()};
  va_end(args);
  std::lock_guard<std::mutex> lock(g_mutex);
  g_records.push_back(std::move(r));
  return 0;
}

std::size_t ScriboDoubleCount() {
  std::lock_guard<std::mutex> lock(g_mutex);
  return g_records.size();
}

// Pointers stay valid until ScriboDoubleClear.
bool ScriboDoubleRead(std::size_t index, std::int16_t* depth,
                                            std::uint32_t* level, HMODULE* module,
                                            const wchar_t** function, const wchar_t** text) {
  std::lock_guard<std::mutex> lock(g_mutex);
  if (index >= g_records.size()) return false;
  const record& r = g_records[index];
  *depth = r.depth;
  *level = r.level;
  *module = r.module;
  *function = r.function.c_str();
  *text = r.text.c_str();
  return true;
}

void ScriboDoubleClear() {
  std::lock_guard<std::mutex> lock(g_mutex);
  g_records.clear();
  g_events.clear();
}

// The library calls other than LogWrite, comma-separated, in order.
std::size_t ScriboDoubleEvents(wchar_t* buffer, std::size_t capacity) {
  std::lock_guard<std::mutex> lock(g_mutex);
  if (buffer != nullptr && capacity > 0) {
    const std::size_t n = g_events.size() < capacity - 1 ? g_events.size() : capacity - 1;
    g_events.copy(buffer, n);
    buffer[n] = L'\0';
  }
  return g_events.size();
}

}  // extern "C"
