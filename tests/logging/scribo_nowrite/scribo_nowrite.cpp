// A scribo.dll without LogWrite: it answers the binding's other calls and
// records them for ScriboDoubleEvents, like the recording double.
#include <windows.h>

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>

namespace {

std::mutex g_mutex;
std::wstring g_events;

void add_event(const wchar_t* event) {
  std::lock_guard<std::mutex> lock(g_mutex);
  if (!g_events.empty()) g_events += L',';
  g_events += event;
}

}  // namespace

extern "C" {

void LogInit() { add_event(L"LogInit"); }
void LogDeinit() { add_event(L"LogDeinit"); }
void LogUninitMetrics() { add_event(L"LogUninitMetrics"); }
void LogRemoveModule(const char*) { add_event(L"LogRemoveModule"); }
// Exports the binding resolves but never calls.
std::uint32_t LogSetLevel(std::uint32_t level) { return level; }
std::uint32_t LogGetLevel() { return 0; }

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
