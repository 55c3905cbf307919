// Benchmark 7: the gateway's notifications with and without observers that
// offer the admission face. The gateway observer is driven directly, as the
// IPC library drives it: connect and disconnect events on one named pipe of
// this process, by this process's own pid (signed like it, so admitted at
// level 0, from the trust cache after the first decision).
#include <windows.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <vorbel/igateway_admission.h>

#include "bench_main.h"
#include "bench_support.h"
#include "gateway/gateway_observer.h"
#include "platform/handles.h"
#include "stats.h"

namespace bench {
namespace {

using namespace std::chrono_literals;

// Counts what it hears; offers the admission face or not.
class counting_gateway_observer final : public igateway_observer, public igateway_admission_observer {
 public:
  explicit counting_gateway_observer(bool admission_face) : admission_face_(admission_face) {}
  void* GetInterface(GUID iid) override {
    if (qm::same_iid(iid, IID_igateway_observer)) return static_cast<igateway_observer*>(this);
    if (admission_face_ && qm::same_iid(iid, IID_igateway_admission_observer)) {
      return static_cast<igateway_admission_observer*>(this);
    }
    return nullptr;
  }
  void on_admission(const gateway_admission* admission) override {
    if (admission->allowed) admitted.fetch_add(1, std::memory_order_relaxed);
  }
  void on_local_connect(const char*, std::uint32_t) override { count(); }
  void on_local_disconnect(const char*, std::uint32_t) override { count(); }
  void on_listen(const char*) override {}
  void on_local_start_communication(const char*, std::uint32_t) override {}
  void on_local_error(const char*, std::uint32_t, std::uint32_t) override {}
  void on_remote_connect(const char*, std::uint32_t) override {}
  void on_remote_disconnect(const char*, std::uint32_t) override {}
  void on_remote_start_communication(const char*, std::uint32_t) override {}
  void on_remote_error(const char*, std::uint32_t, std::uint32_t) override {}

  std::atomic<std::uint64_t> notifications{0};
  std::atomic<std::uint64_t> admitted{0};

 private:
  void count() { notifications.fetch_add(1, std::memory_order_relaxed); }
  const bool admission_face_;
};

struct variant {
  int observers;
  bool admission_face;
};

struct rates {
  double calls = 0;      // pairs per second, the deciding thread's loop
  double delivered = 0;  // pairs per second until every observer had both notifications
  double worker = 0;     // notifications per second through the held, then released, worker
};

bool wait_for(const std::function<bool()>& done, std::chrono::seconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (!done()) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    ::SwitchToThread();
  }
  return true;
}

// One measurement of `pairs` connect + disconnect pairs; false when the
// notifications did not all arrive.
bool measure(const variant& v, int pairs, HANDLE pipe, const std::string& pipe_path, rates& out) {
  gateway_observer_list observers;
  gateway_observer sink(&observers);
  sink.set_pipe_security_map(make_pipe_security_map({{pipe_path, 0}}));
  std::vector<std::unique_ptr<counting_gateway_observer>> counting;
  for (int i = 0; i < v.observers; ++i) {
    counting.push_back(std::make_unique<counting_gateway_observer>(v.admission_face));
    observers.add(counting.back().get(), 0);
  }
  counting_gateway_observer& last = *counting.back();  // called last
  const std::uint32_t pid = ::GetCurrentProcessId();
  // The first decision classifies this process; the rest come from the cache.
  if (!sink.on_local_connect(pipe, pid)) {
    std::fprintf(stderr, "vorbel_bench: this process was refused on its own pipe\n");
    return false;
  }
  sink.on_local_disconnect(pipe);
  std::uint64_t expected = 2;
  if (!wait_for([&] { return last.notifications.load() >= expected; }, 30s)) return false;

  // End to end: decide, post, deliver.
  std::int64_t start = now_ticks();
  for (int i = 0; i < pairs; ++i) {
    sink.on_local_connect(pipe, pid);
    sink.on_local_disconnect(pipe);
  }
  const double loop_s = ticks_to_us(now_ticks() - start) / 1e6;
  expected += 2u * static_cast<std::uint64_t>(pairs);
  if (!wait_for([&] { return last.notifications.load() >= expected; }, 60s)) return false;
  const double delivered_s = ticks_to_us(now_ticks() - start) / 1e6;

  // The worker alone: held while the pairs are decided and posted, then
  // timed while it delivers them.
  std::atomic<bool> holding{false};
  std::atomic<bool> release{false};
  std::thread holder([&] {
    sink.run_on_worker([&](connections_cache&) {
      holding = true;
      while (!release.load()) ::Sleep(1);
    });
  });
  wait_for([&] { return holding.load(); }, 30s);
  for (int i = 0; i < pairs; ++i) {
    sink.on_local_connect(pipe, pid);
    sink.on_local_disconnect(pipe);
  }
  expected += 2u * static_cast<std::uint64_t>(pairs);
  start = now_ticks();
  release = true;
  const bool drained = wait_for([&] { return last.notifications.load() >= expected; }, 60s);
  const double worker_s = ticks_to_us(now_ticks() - start) / 1e6;
  holder.join();
  if (!drained) return false;
  if (v.admission_face && last.admitted.load() != static_cast<std::uint64_t>(2 * pairs + 1)) {
    std::fprintf(stderr, "vorbel_bench: the admission observer heard %llu decisions of %d\n",
                 static_cast<unsigned long long>(last.admitted.load()), 2 * pairs + 1);
    return false;
  }
  for (auto& observer : counting) observers.remove(observer.get(), 0);
  out.calls = pairs / loop_s;
  out.delivered = pairs / delivered_s;
  out.worker = 2.0 * pairs / worker_s;
  return true;
}

}  // namespace

int run_admission_events() {
  constexpr int pairs = 2000;
  constexpr int rounds = 7;
  const variant variants[] = {{1, false}, {1, true}, {10, false}, {10, true}};
  constexpr int variant_count = 4;

  const std::string path = pipe_name("events");
  const std::wstring wide(path.begin(), path.end());
  // WRITE_DAC: the gateway observer stamps its DACL on every admitted pipe.
  winapi::unique_handle pipe(::CreateNamedPipeW(
      wide.c_str(), /* open_mode */ PIPE_ACCESS_DUPLEX | WRITE_DAC,
      /* pipe_mode */ PIPE_TYPE_BYTE | PIPE_READMODE_BYTE | PIPE_WAIT, /* max_instances */ 1,
      /* out_buffer */ 4096, /* in_buffer */ 4096, /* default_timeout_ms */ 0, /* security */ nullptr));
  if (!pipe) {
    const DWORD error = ::GetLastError();
    std::fprintf(stderr, "vorbel_bench: CreateNamedPipe %s err=%lu\n", path.c_str(), error);
    return 1;
  }

  // Rounds go over the variants in turn, so a slow spell of the machine
  // touches all of them alike; the median round is reported.
  std::vector<std::vector<double>> calls(variant_count), delivered(variant_count), worker(variant_count);
  for (int round = 0; round < rounds; ++round) {
    for (int i = 0; i < variant_count; ++i) {
      rates r;
      if (!measure(variants[i], pairs, pipe.get(), path, r)) {
        std::fprintf(stderr, "vorbel_bench: notifications did not all arrive (%d observers)\n", variants[i].observers);
        return 1;
      }
      calls[i].push_back(r.calls);
      delivered[i].push_back(r.delivered);
      worker[i].push_back(r.worker);
    }
  }

  std::printf("## 7. Gateway notifications with an admission observer\n\n");
  std::printf("The gateway observer driven as the IPC library drives it: %d connect + disconnect pairs per "
              "measurement on one pipe of this process, by this process's own pid (admitted at level 0 from the "
              "trust cache); the median of %d rounds. Each pair is one admission decision (its line, its facts "
              "copied, an admission task), a connection insert, two notifications and a removal. \"Calls\" is the "
              "deciding thread's loop; \"delivered\" runs until the last observer has had every notification; "
              "\"worker\" holds the gateway's worker while the pairs are posted, then times how fast it delivers "
              "them. Without the face every observer is still asked for it once per decision. %s.\n\n",
              pairs, rounds, logging_setting().c_str());
  std::printf("| observers | admission face | pairs/s (calls) | pairs/s (delivered) | notifications/s (worker) | "
              "worker / without the face |\n");
  std::printf("|---:|---|---:|---:|---:|---:|\n");
  double worst = 1e9;
  for (int i = 0; i < variant_count; ++i) {
    const double base = median(worker[i & ~1]);
    const double ratio = median(worker[i]) / base;
    if (variants[i].admission_face) worst = std::min(worst, ratio);
    std::printf("| %d | %s | %.0f | %.0f | %.0f | %.2f |\n", variants[i].observers,
                variants[i].admission_face ? "yes" : "no", median(calls[i]), median(delivered[i]),
                median(worker[i]), ratio);
  }
  std::printf("\n- notification throughput with admission observers, at least 0.9 x without: %s (worst %.2f)\n\n",
              worst >= 0.9 ? "met" : format("**missed** by %.0f %%", (0.9 / worst - 1.0) * 100.0).c_str(),
              worst);
  return 0;
}

}  // namespace bench
