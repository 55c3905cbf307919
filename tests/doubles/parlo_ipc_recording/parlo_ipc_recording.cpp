// A parlo_ipc.dll that records what the component asks of it and hands its
// event sink to the test, which then plays the library's threads.
#include <cstdint>
#include <mutex>
#include <string>

#include "gateway/parlo_ipc/parlo_ipc.h"
#include "platform/srw_sync.h"

namespace {

srw_mutex g_mutex;
std::string g_calls;  // one call per line
parlo::ipc::gateway::events* g_sink = nullptr;
std::uint32_t g_results[5] = {};  // create (non-zero: null gateway), start, stop, export, import
int g_live = 0;

void record(const std::string& call) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  g_calls += call + "\n";
}

std::string text(const char* s) { return s != nullptr ? s : "(null)"; }

class recording_gateway final : public parlo::ipc::gateway {
 public:
  std::uint32_t start() override {
    record("start");
    return g_results[1];
  }
  std::uint32_t stop() override {
    record("stop");
    return g_results[2];
  }
  std::uint32_t export_channel(const char* channel, const char* pipe, std::uint32_t link) override {
    record("export " + text(channel) + " " + text(pipe) + " " + std::to_string(link));
    return g_results[3];
  }
  std::uint32_t import_channel(const char* channel, const char* pipe, const char* bus_name,
                               const char* remote_channel, std::uint32_t link) override {
    record("import " + text(channel) + " " + text(pipe) + " " + text(bus_name) + " " +
           text(remote_channel) + " " + std::to_string(link));
    return g_results[4];
  }
};

}  // namespace

extern "C" {

parlo::ipc::gateway* create_gateway(parlo::bus* bus, parlo::ipc::gateway::events* sink) {
  record(std::string("create ") + (bus != nullptr ? "bus" : "null"));
  if (g_results[0] != 0) return nullptr;
  std::lock_guard<srw_mutex> lock(g_mutex);
  g_sink = sink;
  ++g_live;
  return new recording_gateway();
}

void destroy_gateway(parlo::ipc::gateway* gateway) {
  record("destroy");
  std::lock_guard<srw_mutex> lock(g_mutex);
  delete static_cast<recording_gateway*>(gateway);
  g_sink = nullptr;
  --g_live;
}

// The sink of the live gateway, or null.
parlo::ipc::gateway::events* IpcDoubleSink() {
  std::lock_guard<srw_mutex> lock(g_mutex);
  return g_sink;
}

// Calls since the last reset, one per line, copied into `buffer`; returns
// the full length.
std::size_t IpcDoubleCalls(char* buffer, std::size_t capacity) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (buffer != nullptr && capacity > 0) {
    const std::size_t n = g_calls.size() < capacity - 1 ? g_calls.size() : capacity - 1;
    g_calls.copy(buffer, n);
    buffer[n] = '\0';
  }
  return g_calls.size();
}

// which: 0 create (non-zero makes create_gateway return null), 1 start,
// 2 stop, 3 export, 4 import.
void IpcDoubleSetResult(int which, std::uint32_t result) {
  std::lock_guard<srw_mutex> lock(g_mutex);
  if (which >= 0 && which < 5) g_results[which] = result;
}

// Forgets the recorded calls; the results set stay.
void IpcDoubleClearCalls() {
  std::lock_guard<srw_mutex> lock(g_mutex);
  g_calls.clear();
}

}  // extern "C"
