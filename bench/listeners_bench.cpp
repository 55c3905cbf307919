// Benchmarks 2, 3 and 6: how fast a listener registered in process A reaches
// process B, how long B takes to hold a whole table A builds one listener at
// a time (and how many bytes that costs on "vorbel_service"), and local
// register/unregister pairs with observers.
#include <windows.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bench_main.h"
#include "bench_support.h"
#include "bus/comm/listeners_codec.h"
#include "bus_side.h"
#include "codec_bench.h"
#include "raw_pipe.h"
#include "stats.h"

namespace bench {
namespace {

using namespace std::chrono_literals;

// The tick count that ends a peer's "+ ID TICKS" / "all N TICKS" line.
std::int64_t line_ticks(const std::string& line) {
  const std::size_t space = line.find_last_of(' ');
  return space == std::string::npos ? 0 : std::stoll(line.substr(space + 1));
}

// Starts a peer with a raw pipe in `raw_mode` and a bus joined to `side`.
bool start_peer_pair(peer_process& peer, raw_pipe_server& raw, bus_side& side, const char* raw_mode,
                     const std::string& tag) {
  if (!peer.start()) return false;
  const std::string raw_pipe = pipe_name(("raw" + tag).c_str());
  if (!raw.create(raw_pipe)) return false;
  if (peer.request("raw " + raw_pipe + " " + raw_mode, "ok raw").empty() || !raw.accept()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not open the raw pipe\n");
    return false;
  }
  const std::string bus_pipe = pipe_name(("bus" + tag).c_str());
  if (!side.serve(bus_pipe)) return false;
  if (peer.request("bus " + bus_pipe, "ok bus").empty()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not build its bus\n");
    return false;
  }
  return true;
}

// Parses "service pubs=P bytes=B empty=E removed=R".
struct service_counts {
  unsigned long long publications = 0;
  unsigned long long bytes = 0;
  unsigned long long empty = 0;
  unsigned long long removed = 0;
};
service_counts parse_service(const std::string& line) {
  service_counts c;
  std::sscanf(line.c_str(), "service pubs=%llu bytes=%llu empty=%llu removed=%llu", &c.publications, &c.bytes,
              &c.empty, &c.removed);
  return c;
}

// Waits until the peer has had A's two handshake publications (on connect,
// and in answer to its request), so none arrives in the middle of a run.
bool wait_handshake(peer_process& peer) {
  const auto deadline = std::chrono::steady_clock::now() + 20s;
  while (std::chrono::steady_clock::now() < deadline) {
    if (parse_service(peer.request("service", "service")).empty >= 2) return true;
    ::Sleep(20);
  }
  return false;
}

// One-way hand-offs between two threads through a mutex and condition
// variable, the way the libraries pass work to their delivery, connection
// and notifier threads: half of each measured ping-pong.
std::vector<double> thread_handoff_us(int count) {
  std::mutex mutex;
  std::condition_variable changed;
  int turn = 0;  // even: the pinger's, odd: the ponger's
  bool stop = false;
  std::thread ponger([&] {
    std::unique_lock<std::mutex> lock(mutex);
    for (;;) {
      changed.wait(lock, [&] { return stop || turn % 2 == 1; });
      if (stop) return;
      ++turn;
      changed.notify_all();
    }
  });
  std::vector<double> samples;
  for (int i = 0; i < count + 50; ++i) {
    std::unique_lock<std::mutex> lock(mutex);
    const std::int64_t start = now_ticks();
    ++turn;
    changed.notify_all();
    changed.wait(lock, [&] { return turn % 2 == 0; });
    if (i >= 50) samples.push_back(ticks_to_us(now_ticks() - start) / 2);
  }
  {
    std::lock_guard<std::mutex> lock(mutex);
    stop = true;
  }
  changed.notify_all();
  ponger.join();
  return samples;
}

// The same with the system's own slim lock and condition variable.
std::vector<double> win32_handoff_us(int count) {
  SRWLOCK lock = SRWLOCK_INIT;
  CONDITION_VARIABLE changed = CONDITION_VARIABLE_INIT;
  int turn = 0;
  bool stop = false;
  std::thread ponger([&] {
    ::AcquireSRWLockExclusive(&lock);
    for (;;) {
      while (!stop && turn % 2 == 0) ::SleepConditionVariableSRW(&changed, &lock, INFINITE, 0);
      if (stop) break;
      ++turn;
      ::WakeAllConditionVariable(&changed);
    }
    ::ReleaseSRWLockExclusive(&lock);
  });
  std::vector<double> samples;
  for (int i = 0; i < count + 50; ++i) {
    ::AcquireSRWLockExclusive(&lock);
    const std::int64_t start = now_ticks();
    ++turn;
    ::WakeAllConditionVariable(&changed);
    while (turn % 2 == 1) ::SleepConditionVariableSRW(&changed, &lock, INFINITE, 0);
    if (i >= 50) samples.push_back(ticks_to_us(now_ticks() - start) / 2);
    ::ReleaseSRWLockExclusive(&lock);
  }
  ::AcquireSRWLockExclusive(&lock);
  stop = true;
  ::WakeAllConditionVariable(&changed);
  ::ReleaseSRWLockExclusive(&lock);
  ponger.join();
  return samples;
}

}  // namespace

int run_propagation() {
  constexpr int blocks = 20;
  constexpr int per_block = 50;
  peer_process peer;
  raw_pipe_server raw;
  bus_side side;
  if (!start_peer_pair(peer, raw, side, "echo", "prop")) return 1;
  if (!wait_handshake(peer)) {
    std::fprintf(stderr, "vorbel_bench: the peer never heard this process's table\n");
    return 1;
  }
  if (peer.request("watch print", "ok watch").empty()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not take \"watch print\"\n");
    return 1;
  }
  const std::string payload(64, 'x');
  std::vector<double> raw_us;
  std::vector<double> propagation_us;
  ibus* bus = side.bus();
  int next = 0;
  auto propagate_once = [&]() -> double {
    const std::string id = bench_listener_id(static_cast<std::size_t>(++next));
    const std::int64_t start = now_ticks();
    bus->register_listener(bench_channel, id.c_str());
    const std::string added = peer.take_line("+ " + id + " ", 10s);
    bus->unregister_listener(bench_channel, id.c_str());
    // The removal reaches B before the next registration starts, so each
    // sample starts from the same idle, one-listener-or-none table.
    const std::string removed = peer.take_line("- " + id + " ", 10s);
    if (added.empty() || removed.empty()) return -1;
    return ticks_to_us(line_ticks(added) - start);
  };
  for (int i = 0; i < 20; ++i) {
    raw.round_trip(payload);
    if (propagate_once() < 0) {
      std::fprintf(stderr, "vorbel_bench: a registration did not reach the peer within 10 s\n");
      return 1;
    }
  }
  for (int block = 0; block < blocks; ++block) {
    for (int i = 0; i < per_block; ++i) {
      const std::int64_t start = now_ticks();
      if (!raw.round_trip(payload)) return 1;
      raw_us.push_back(ticks_to_us(now_ticks() - start));
    }
    for (int i = 0; i < per_block; ++i) {
      const double us = propagate_once();
      if (us < 0) {
        std::fprintf(stderr, "vorbel_bench: a registration did not reach the peer within 10 s\n");
        return 1;
      }
      propagation_us.push_back(us);
    }
  }
  const summary hop = summarize(thread_handoff_us(1000));
  const summary win32_hop = summarize(win32_handoff_us(1000));
  const summary r = summarize(raw_us);
  const summary p = summarize(propagation_us);
  const double one_way = r.p50 / 2;
  std::printf("## 2. Propagation: register_listener in A until on_new_listener in B\n\n");
  std::printf("%zu registrations (each unregistered, and the removal seen by B, before the next), in %d "
              "blocks alternating with %zu raw 64 B round trips on a pipe between the same two processes. "
              "Both ends are stamped with QueryPerformanceCounter. %s.\n\n",
              p.count, blocks, r.count, logging_setting().c_str());
  std::printf("| | p50 µs | p99 µs | max µs | p50 / raw one-way | p99 / raw one-way |\n");
  std::printf("|---|---:|---:|---:|---:|---:|\n");
  std::printf("| raw pipe 64 B round trip | %.0f | %.0f | %.0f | | |\n", r.p50, r.p99, r.max);
  std::printf("| raw one-way (half the round trip) | %.0f | %.0f | | 1.00 | |\n", one_way, r.p99 / 2);
  std::printf("| propagation | %.0f | %.0f | %.0f | %.2f | %.2f |\n", p.p50, p.p99, p.max, p.p50 / one_way,
              p.p99 / one_way);
  std::printf("| for scale: one hand-off between two threads of a process (std::condition_variable) | %.0f | "
              "%.0f | %.0f | %.2f | |\n",
              hop.p50, hop.p99, hop.max, hop.p50 / one_way);
  std::printf("| for scale: the same with SRWLOCK and CONDITION_VARIABLE | %.0f | %.0f | %.0f | %.2f | |\n\n",
              win32_hop.p50, win32_hop.p99, win32_hop.max, win32_hop.p50 / one_way);
  std::printf("- p50 ≤ 2 × raw one-way: %s\n", verdict_at_most(p.p50 / one_way, 2).c_str());
  std::printf("- p99 < 5 ms: %s\n\n", verdict_below(p.p99, 5000).c_str());
  return 0;
}

int run_convergence(const std::vector<std::size_t>& sizes) {
  struct row {
    std::size_t n;
    double loop_ms;
    double converge_ms;
    double raw_ms;
    service_counts service;
    unsigned long long exact_bytes;
    bool converged;
  };
  std::vector<row> rows;
  const std::uint32_t own_pid = ::GetCurrentProcessId();
  for (std::size_t n : sizes) {
    // A fresh pair per size: A's table starts empty, B's counters at zero.
    peer_process peer;
    raw_pipe_server raw;
    bus_side side;
    const std::string tag = "conv" + std::to_string(n);
    if (!start_peer_pair(peer, raw, side, "sink", tag)) return 1;
    if (!wait_handshake(peer)) {
      std::fprintf(stderr, "vorbel_bench: the peer never heard this process's table\n");
      return 1;
    }
    // The same messages, byte for byte in size, written one after another
    // on the raw pipe: what the pipe alone needs for this volume.
    const listener_list table = make_listener_table(n);
    std::vector<std::size_t> message_sizes;
    unsigned long long exact = 0;
    {
      listener_list growing;
      for (const listener& item : table) {
        growing.push_back(item);
        message_sizes.push_back(comm::encode_listeners(own_pid, growing).size());
        exact += message_sizes.back();
      }
    }
    std::string block(message_sizes.empty() ? 1 : message_sizes.back(), 'x');
    const std::int64_t raw_start = now_ticks();
    for (std::size_t size : message_sizes) {
      if (!raw.send(std::string(block.data(), size))) return 1;
    }
    if (!raw.round_trip(std::string(1, '!'))) return 1;
    const double raw_ms = ticks_to_us(now_ticks() - raw_start) / 1000;
    std::fprintf(stderr, "convergence N=%zu: raw pipe %.0f ms\n", n, raw_ms);

    if (peer.request("watch count " + std::to_string(n), "ok watch").empty()) {
      std::fprintf(stderr, "vorbel_bench: the peer did not take \"watch count\"\n");
      return 1;
    }
    std::vector<std::string> ids;
    for (const listener& item : table) ids.push_back(item.id);
    const std::int64_t start = now_ticks();
    for (const std::string& id : ids) side.bus()->register_listener(bench_channel, id.c_str());
    const double loop_ms = ticks_to_us(now_ticks() - start) / 1000;
    std::fprintf(stderr, "convergence N=%zu: A's loop %.0f ms\n", n, loop_ms);
    const std::string all = peer.take_line("all ", std::chrono::seconds(30 + n / 50));
    row r{n, loop_ms, all.empty() ? -1 : ticks_to_us(line_ticks(all) - start) / 1000, raw_ms,
          parse_service(peer.request("service", "service", 60s)), exact, !all.empty()};
    rows.push_back(r);
  }

  std::printf("## 3. Convergence and growth: A registers N listeners one by one while B watches\n\n");
  std::printf("Time from A's first register_listener until B's observer holds all N; bytes = the "
              "listeners-message blobs of A that B received on \"vorbel_service\" (a second subscription "
              "in B). Raw = the same N message sizes written one after another on a raw pipe between the "
              "same processes, until the reader has them all. The formula 26·N² assumes 52 bytes per "
              "listener (channel \"bench\", 19-byte ids, as here) summed over N whole-table publications; "
              "\"exact\" sums the encoded sizes of the N tables. %s.\n\n",
              logging_setting().c_str());
  std::printf("| N | A's loop ms | B holds all N, ms | raw pipe, same bytes, ms | time / raw | "
              "publications B got | bytes B got | bytes / 26·N² | bytes / exact | B's removals |\n");
  std::printf("|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|\n");
  std::ofstream data("convergence.dat");
  data << "# N converge_ms raw_ms bytes formula_bytes\n";
  for (const row& r : rows) {
    const double formula = 26.0 * static_cast<double>(r.n) * static_cast<double>(r.n);
    if (!r.converged) {
      std::printf("| %zu | %.0f | did not converge | %.0f | | %llu | %llu | %.3f | %.4f | %llu |\n", r.n,
                  r.loop_ms, r.raw_ms, r.service.publications, r.service.bytes,
                  static_cast<double>(r.service.bytes) / formula,
                  static_cast<double>(r.service.bytes) / static_cast<double>(r.exact_bytes), r.service.removed);
      continue;
    }
    std::printf("| %zu | %.1f | %.1f | %.1f | %.2f | %llu | %llu | %.3f | %.4f | %llu |\n", r.n, r.loop_ms,
                r.converge_ms, r.raw_ms, r.converge_ms / r.raw_ms, r.service.publications, r.service.bytes,
                static_cast<double>(r.service.bytes) / formula,
                static_cast<double>(r.service.bytes) / static_cast<double>(r.exact_bytes), r.service.removed);
    data << r.n << " " << r.converge_ms << " " << r.raw_ms << " " << r.service.bytes << " " << formula << "\n";
  }
  std::printf("\n");
  for (const row& r : rows) {
    if (r.n != 1000) continue;
    std::printf("- 1,000 listeners converge in under 2 s: %s (%s)\n",
                r.converged ? verdict_below(r.converge_ms, 2000).c_str() : "**missed**: did not converge",
                r.converged ? format("%.0f ms", r.converge_ms).c_str() : "-");
  }
  for (const row& r : rows) {
    if (r.service.publications != r.n || r.service.removed != 0) {
      std::printf("- N = %zu: B received %llu publications for %zu registrations and heard %llu listeners "
                  "of A removed%s\n",
                  r.n, r.service.publications, r.n, r.service.removed,
                  r.service.removed != 0 ? ": the gateway dropped the connection and B joined again (see the notes below)"
                                         : "");
    }
  }
  std::printf("\n");
  return 0;
}

namespace {

// Counts notifications, on the bus's notifier thread.
class counting_observer final : public ibus_observer {
 public:
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_ibus_observer) ? static_cast<ibus_observer*>(this) : nullptr;
  }
  void on_new_listener(std::uint32_t, const char*, const char*) override { ++calls; }
  void on_listener_removed(std::uint32_t, const char*, const char*) override { ++calls; }
  std::atomic<std::uint64_t> calls{0};
};

}  // namespace

int run_local() {
  constexpr int pairs = 2000;
  constexpr int rounds = 5;
  const int observer_counts[] = {0, 1, 10};
  // Per observer count: the loop's and the delivery's rates of each round.
  std::vector<std::vector<double>> call_rates(3);
  std::vector<std::vector<double>> delivered_rates(3);
  // Rounds go over the three counts in turn, so a slow spell of the machine
  // touches all of them alike; the median round is reported.
  for (int round = 0; round < rounds; ++round) {
    for (int c = 0; c < 3; ++c) {
      vorbel_impl registry;
      fixed_configuration configuration;
      configuration.local = {bench_channel};
      ibus* bus = registry.create_bus(bench_bus, &configuration);
      if (bus == nullptr) return 1;
      std::vector<std::unique_ptr<counting_observer>> observers;
      for (int i = 0; i < observer_counts[c]; ++i) {
        observers.push_back(std::make_unique<counting_observer>());
        bus->add_observer(observers.back().get(), 0);
      }
      for (int i = 0; i < 200; ++i) {
        bus->register_listener(bench_channel, "warm-up");
        bus->unregister_listener(bench_channel, "warm-up");
      }
      // The warm-up's notifications are delivered before the clock starts.
      const std::uint64_t before = 2 * 200;
      while (!observers.empty() && observers.back()->calls.load() < before) ::Sleep(1);
      const std::int64_t start = now_ticks();
      for (int i = 0; i < pairs; ++i) {
        bus->register_listener(bench_channel, "local-listener");
        bus->unregister_listener(bench_channel, "local-listener");
      }
      const double loop_s = ticks_to_us(now_ticks() - start) / 1e6;
      // Until every observer had every notification (the last one added is
      // called last).
      const std::uint64_t expected = before + 2 * pairs;
      const auto deadline = std::chrono::steady_clock::now() + 60s;
      while (!observers.empty() && observers.back()->calls.load() < expected &&
             std::chrono::steady_clock::now() < deadline) {
        ::SwitchToThread();
      }
      const double drained_s = ticks_to_us(now_ticks() - start) / 1e6;
      for (auto& observer : observers) bus->remove_observer(observer.get(), 0);
      registry.destroy_bus(bench_bus);
      call_rates[c].push_back(pairs / loop_s);
      delivered_rates[c].push_back(pairs / drained_s);
    }
  }
  std::printf("## 6. Local: register_listener + unregister_listener pairs per second\n\n");
  std::printf("One bus without a gateway (each call still encodes and posts the table on \"vorbel_service\"); "
              "%d pairs of the same listener per measurement, the median of %d rounds. \"Calls\" is the "
              "host thread's loop; \"delivered\" runs until every observer has had every notification "
              "(they run on the bus's own thread). %s.\n\n",
              pairs, rounds, logging_setting().c_str());
  std::printf("| observers | pairs/s (calls) | pairs/s (delivered) | delivered / no observers |\n");
  std::printf("|---:|---:|---:|---:|\n");
  const double base = median(delivered_rates[0]);
  for (int c = 0; c < 3; ++c) {
    std::printf("| %d | %.0f | %.0f | %.2f |\n", observer_counts[c], median(call_rates[c]),
                median(delivered_rates[c]), median(delivered_rates[c]) / base);
  }
  std::printf("\n");
  return 0;
}

}  // namespace bench
