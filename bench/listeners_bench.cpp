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
#include "bus/bus.h"
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

// Parses "service pubs=P bytes=B empty=E removed=R drops=D".
struct service_counts {
  unsigned long long publications = 0;
  unsigned long long bytes = 0;
  unsigned long long empty = 0;
  unsigned long long removed = 0;
  unsigned long long drops = 0;
};
service_counts parse_service(const std::string& line) {
  service_counts c;
  std::sscanf(line.c_str(), "service pubs=%llu bytes=%llu empty=%llu removed=%llu drops=%llu", &c.publications,
              &c.bytes, &c.empty, &c.removed, &c.drops);
  return c;
}

// Waits until the peer has had A's handshake publications (on connect, and
// in answer to its request; the two may fold into one), so none arrives in
// the middle of a run: at least one, then none for half a second.
bool wait_handshake(peer_process& peer) {
  const auto deadline = std::chrono::steady_clock::now() + 20s;
  unsigned long long seen = 0;
  auto since = std::chrono::steady_clock::now();
  while (std::chrono::steady_clock::now() < deadline) {
    const unsigned long long empty = parse_service(peer.request("service", "service")).empty;
    if (empty != seen) {
      seen = empty;
      since = std::chrono::steady_clock::now();
    } else if (seen >= 1 && std::chrono::steady_clock::now() - since > 500ms) {
      return true;
    }
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

int run_convergence(const std::vector<std::size_t>& sizes, const std::string& label) {
  struct row {
    std::size_t n;
    double loop_ms;
    double converge_ms;
    double after_last_ms;
    std::size_t final_bytes;
    service_counts service;
    bool converged;
    bool same_table;
    std::size_t taken;  // registrations A took; the rest were refused
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
    // A registers at most what a peer takes from one process; the rest is
    // refused with 87, and A's table is the listeners it took.
    const listener_list table = make_listener_table(std::min(n, comm::max_listeners_per_process));
    const std::size_t final_bytes = comm::encode_listeners(own_pid, table).size();
    if (peer.request("watch count " + std::to_string(table.size()), "ok watch").empty()) {
      std::fprintf(stderr, "vorbel_bench: the peer did not take \"watch count\"\n");
      return 1;
    }
    std::vector<std::string> ids;
    for (const listener& item : make_listener_table(n)) ids.push_back(item.id);
    std::size_t taken = 0;
    const std::int64_t start = now_ticks();
    for (const std::string& id : ids) taken += side.bus()->register_listener(bench_channel, id.c_str()) == 0 ? 1 : 0;
    const std::int64_t last = now_ticks();
    const double loop_ms = ticks_to_us(last - start) / 1000;
    std::fprintf(stderr, "convergence N=%zu: A's loop %.0f ms\n", n, loop_ms);
    const std::string all = peer.take_line("all ", std::chrono::seconds(30 + n / 50));
    // Whatever A still had to send is sent before B is asked what it got.
    static_cast<::bus*>(side.bus())->wait_published(30s);
    const std::string held = peer.request("table", "table ", 60s);
    unsigned long long count = 0, hash = 0;
    const bool same = std::sscanf(held.c_str(), "table count=%llu hash=%llu", &count, &hash) == 2 &&
                      count == table.size() && taken == table.size() && hash == table_hash(table);
    row r{n,
          loop_ms,
          all.empty() ? -1 : ticks_to_us(line_ticks(all) - start) / 1000,
          all.empty() ? -1 : ticks_to_us(line_ticks(all) - last) / 1000,
          final_bytes,
          parse_service(peer.request("service", "service", 60s)),
          !all.empty(),
          same,
          taken};
    rows.push_back(r);
  }

  const std::string title = label.empty() ? std::string() : " (" + label + ")";
  std::printf("## 3. Convergence%s: A registers N listeners one by one while B watches\n\n", title.c_str());
  std::printf("B holds all N = time from A's first register_listener until B's observer holds all N; after "
              "the last = the same from the return of A's last register_listener. Bytes = the listeners-message "
              "blobs of A that B received on \"vorbel_service\" (a second subscription in B), against the "
              "final table's size (channel \"bench\", 19-byte ids: 52 bytes per listener). B's table = A's: "
              "the listeners of A that B's observer holds at the end, compared by count and hash with A's "
              "own. Dropped = connections B's gateway lost. %s.\n\n",
              logging_setting().c_str());
  std::printf("| N | A's loop ms | B holds all N, ms | after the last, ms | publications B got | final table "
              "bytes | bytes B got | bytes / final table | B's table = A's | B's removals | dropped |\n");
  std::printf("|---:|---:|---:|---:|---:|---:|---:|---:|---|---:|---:|\n");
  std::ofstream data(label.empty() ? "convergence.dat" : "convergence-load.dat");
  data << "# N converge_ms after_last_ms bytes final_bytes\n";
  for (const row& r : rows) {
    const double ratio = static_cast<double>(r.service.bytes) / static_cast<double>(r.final_bytes);
    if (!r.converged) {
      std::printf("| %zu | %.1f | did not converge | | %llu | %zu | %llu | %.2f | %s | %llu | %llu |\n", r.n,
                  r.loop_ms, r.service.publications, r.final_bytes, r.service.bytes, ratio,
                  r.same_table ? "yes" : "no", r.service.removed, r.service.drops);
      continue;
    }
    std::printf("| %zu | %.1f | %.1f | %.1f | %llu | %zu | %llu | %.2f | %s | %llu | %llu |\n", r.n, r.loop_ms,
                r.converge_ms, r.after_last_ms, r.service.publications, r.final_bytes, r.service.bytes, ratio,
                r.same_table ? "yes" : "no", r.service.removed, r.service.drops);
    data << r.n << " " << r.converge_ms << " " << r.after_last_ms << " " << r.service.bytes << " "
         << r.final_bytes << "\n";
  }
  std::printf("\n");
  for (const row& r : rows) {
    if (r.taken < r.n) {
      std::printf("- N = %zu: A took %zu registrations and refused %zu with 87: its peers take at most %zu "
                  "listeners from one process\n",
                  r.n, r.taken, r.n - r.taken, comm::max_listeners_per_process);
    }
    const bool exact = r.converged && r.same_table && r.service.removed == 0 && r.service.drops == 0;
    std::printf("- N = %zu: B ends with exactly A's table, hears no removal, loses no connection: %s\n", r.n,
                exact ? "met"
                      : format("**missed** (%s, %llu removals, %llu dropped)",
                               r.same_table ? "same table" : "tables differ", r.service.removed, r.service.drops)
                            .c_str());
    if (r.n >= 1000) {
      const double ratio = static_cast<double>(r.service.bytes) / static_cast<double>(r.final_bytes);
      std::printf("- N = %zu: bytes B got ≤ 8 × the final table: %s (%.2f ×)\n", r.n,
                  verdict_at_most(ratio, 8).c_str(), ratio);
    }
    if (r.n == 1000) {
      std::printf("- N = 1,000: B holds all in under 2 s: %s (%s)\n",
                  r.converged ? verdict_below(r.converge_ms, 2000).c_str() : "**missed**: did not converge",
                  r.converged ? format("%.0f ms", r.converge_ms).c_str() : "-");
    }
    if (r.n == 10000) {
      std::printf("- N = 10,000: B holds all within 1 s of A's last registration: %s (%s)\n",
                  r.converged ? verdict_at_most(r.after_last_ms, 1000).c_str() : "**missed**: did not converge",
                  r.converged ? format("%.0f ms", r.after_last_ms).c_str() : "-");
    }
  }
  std::printf("\n");
  return 0;
}

int run_flood() {
  constexpr std::size_t n = 20000;
  constexpr int requests = 3000;
  peer_process peer;
  raw_pipe_server raw;
  bus_side side;
  if (!start_peer_pair(peer, raw, side, "sink", "flood") || !wait_handshake(peer)) {
    std::fprintf(stderr, "vorbel_bench: the peer never heard this process's table\n");
    return 1;
  }
  const listener_list table = make_listener_table(std::min(n, comm::max_listeners_per_process));
  if (peer.request("watch count " + std::to_string(table.size()), "ok watch").empty()) return 1;
  for (const listener& item : table) side.bus()->register_listener(bench_channel, item.id.c_str());
  if (peer.take_line("all ", 60s).empty()) {
    std::fprintf(stderr, "vorbel_bench: the peer never held the table\n");
    return 1;
  }
  auto* own = static_cast<::bus*>(side.bus());
  own->wait_published(30s);
  const service_counts before = parse_service(peer.request("service", "service", 60s));
  const std::string asked = peer.request("ask " + std::to_string(requests) + " 1", "ok ask", 120s);
  own->wait_published(30s);
  const service_counts after = parse_service(peer.request("service", "service", 60s));
  const std::string held = peer.request("table", "table ", 60s);
  unsigned long long count = 0, hash = 0;
  const bool same = std::sscanf(held.c_str(), "table count=%llu hash=%llu", &count, &hash) == 2 &&
                    count == table.size() && hash == table_hash(table);
  const double asked_ms = asked.empty() ? 0 : std::atof(asked.c_str() + 7);
  const unsigned long long publications = after.publications - before.publications;
  const double bytes = static_cast<double>(after.bytes - before.bytes);
  const double rate = asked_ms > 0 ? bytes / (asked_ms / 1000) / 1e6 : 0;
  std::printf("## 3b. A peer that asks without pause\n\n");
  std::printf("A holds %zu listeners (a table of %zu bytes); B posts %d requests (message id 1) on "
              "\"vorbel_service\", one every millisecond (%.0f ms in all). Each request only marks A's table "
              "changed; A's publisher sends it at its pace. %s.\n\n",
              table.size(), comm::encode_listeners(::GetCurrentProcessId(), table).size(), requests, asked_ms,
              logging_setting().c_str());
  std::printf("| requests | publications B got | bytes B got | MB/s while asked | B's table = A's | B's removals | "
              "dropped |\n");
  std::printf("|---:|---:|---:|---:|---|---:|---:|\n");
  std::printf("| %d | %llu | %.0f | %.2f | %s | %llu | %llu |\n\n", requests, publications, bytes, rate,
              same ? "yes" : "no", after.removed, after.drops);
  const bool held_up = !asked.empty() && same && after.removed == 0 && after.drops == 0;
  std::printf("- a peer asking every millisecond gets at most 8 MB/s and the connection holds: %s (%.2f MB/s)\n\n",
              held_up && rate <= 8.0 ? "met" : "**missed**", rate);
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
  // Pairs for a whole second: the publications of the bus's own table in
  // that time (each encodes it on the publisher's thread, which shares the
  // cores) count as they do over a host's lifetime, not as one in a window
  // of a few milliseconds.
  constexpr double window_s = 1.0;
  constexpr int rounds = 5;
  constexpr std::size_t big_table = 10000;
  struct setup {
    int observers;
    std::size_t registered;
  };
  const setup setups[] = {{0, 0}, {1, 0}, {10, 0}, {0, big_table}};
  constexpr std::size_t count = sizeof(setups) / sizeof(setups[0]);
  // Per setup: the loop's and the delivery's rates of each round.
  std::vector<std::vector<double>> call_rates(count);
  std::vector<std::vector<double>> delivered_rates(count);
  const listener_list table = make_listener_table(big_table);
  // Rounds go over the setups in turn, so a slow spell of the machine
  // touches all of them alike; the median round is reported.
  for (int round = 0; round < rounds; ++round) {
    for (std::size_t c = 0; c < count; ++c) {
      vorbel_impl registry;
      fixed_configuration configuration;
      configuration.local = {bench_channel};
      ibus* bus = registry.create_bus(bench_bus, &configuration);
      if (bus == nullptr) return 1;
      std::vector<std::unique_ptr<counting_observer>> observers;
      for (int i = 0; i < setups[c].observers; ++i) {
        observers.push_back(std::make_unique<counting_observer>());
        bus->add_observer(observers.back().get(), 0);
      }
      auto it = table.begin();
      for (std::size_t i = 0; i < setups[c].registered; ++i, ++it) {
        bus->register_listener(it->channel.c_str(), it->id.c_str());
      }
      for (int i = 0; i < 200; ++i) {
        bus->register_listener(bench_channel, "warm-up");
        bus->unregister_listener(bench_channel, "warm-up");
      }
      // The warm-up's notifications are delivered, and the table published,
      // before the clock starts.
      const std::uint64_t before = 2 * 200;
      while (!observers.empty() && observers.back()->calls.load() < before) ::Sleep(1);
      static_cast<::bus*>(bus)->wait_published(30s);
      const std::int64_t start = now_ticks();
      std::uint64_t pairs = 0;
      double loop_s = 0;
      while (loop_s < window_s) {
        for (int i = 0; i < 100; ++i) {
          bus->register_listener(bench_channel, "local-listener");
          bus->unregister_listener(bench_channel, "local-listener");
        }
        pairs += 100;
        loop_s = ticks_to_us(now_ticks() - start) / 1e6;
      }
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
      call_rates[c].push_back(static_cast<double>(pairs) / loop_s);
      delivered_rates[c].push_back(static_cast<double>(pairs) / drained_s);
    }
  }
  std::printf("## 6. Local: register_listener + unregister_listener pairs per second\n\n");
  std::printf("One bus without a gateway (its publisher still sends the table on \"vorbel_service\", paced, from "
              "its own thread); pairs of the same listener for %.0f s per measurement, the median of %d rounds, with "
              "observers or with %zu listeners registered beforehand. \"Calls\" is the host thread's loop; "
              "\"delivered\" runs until every observer has had every notification (they run on the bus's own "
              "thread). %s.\n\n",
              window_s, rounds, big_table, logging_setting().c_str());
  std::printf("| observers | listeners already registered | pairs/s (calls) | pairs/s (delivered) | delivered / "
              "none |\n");
  std::printf("|---:|---:|---:|---:|---:|\n");
  const double base = median(delivered_rates[0]);
  for (std::size_t c = 0; c < count; ++c) {
    std::printf("| %d | %zu | %.0f | %.0f | %.2f |\n", setups[c].observers, setups[c].registered,
                median(call_rates[c]), median(delivered_rates[c]), median(delivered_rates[c]) / base);
  }
  const double flat = median(delivered_rates[count - 1]) / base;
  std::printf("\n- pairs/s with %zu listeners registered ≥ 0.8 × with none: %s (%.2f ×)\n\n", big_table,
              flat >= 0.8 ? "met" : format("**missed** by %.0f %%", (0.8 / flat - 1.0) * 100.0).c_str(), flat);
  return 0;
}

}  // namespace bench
