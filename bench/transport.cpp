// Benchmark 1: round trips over a raw named pipe against round trips over
// two buses joined by the component's gateway, in alternating blocks so both
// see the same machine load.
#include <windows.h>

#include <atomic>
#include <cstdio>
#include <string>
#include <vector>

#include "bench_main.h"
#include "bench_support.h"
#include "bus_side.h"
#include "raw_pipe.h"
#include "stats.h"

namespace bench {
namespace {

constexpr int blocks = 20;
constexpr int per_block = 50;
constexpr int warm_up = 20;

// A's end of the bus echo: the delivery thread stamps each echo (id 2) and
// wakes the benchmark thread.
struct echo_receiver {
  std::atomic<std::uint64_t> sequence{0};
  std::atomic<std::int64_t> ticks{0};
  winapi::unique_handle arrived{::CreateEventW(nullptr, /* manual_reset */ FALSE, FALSE, nullptr)};

  static void on_message(parlo::message* message, void* context) {
    if (message->message_id() != 2) return;
    const std::int64_t at = now_ticks();
    auto* self = static_cast<echo_receiver*>(context);
    self->ticks = at;
    self->sequence = payload_sequence(message);
    ::SetEvent(self->arrived.get());
  }

  // Waits (bounded) for the echo of `expected`; its arrival time or 0.
  std::int64_t wait_for(std::uint64_t expected, DWORD timeout_ms) {
    const ULONGLONG deadline = ::GetTickCount64() + timeout_ms;
    for (;;) {
      if (sequence.load() == expected) return ticks.load();
      const ULONGLONG now = ::GetTickCount64();
      if (now >= deadline) return 0;
      ::WaitForSingleObject(arrived.get(), static_cast<DWORD>(deadline - now));
    }
  }
};

struct transport_samples {
  std::vector<double> raw_us;
  std::vector<double> bus_us;
  double raw_total_us = 0;
  double bus_total_us = 0;
};

}  // namespace

int run_transport() {
  peer_process peer;
  if (!peer.start()) return 1;

  raw_pipe_server raw;
  const std::string raw_pipe = pipe_name("raw");
  if (!raw.create(raw_pipe)) return 1;
  if (peer.request("raw " + raw_pipe + " echo", "ok raw").empty() || !raw.accept()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not open the raw pipe\n");
    return 1;
  }

  bus_side side;
  echo_receiver receiver;
  const std::string bus_pipe = pipe_name("bus");
  if (!side.serve(bus_pipe) || !side.subscribe(bench_channel, &echo_receiver::on_message, &receiver)) {
    return 1;
  }
  if (peer.request("bus " + bus_pipe, "ok bus").empty()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not build its bus\n");
    return 1;
  }
  std::uint64_t sequence = 0;
  // The first echo proves the connection is up and admitted.
  bool joined = false;
  for (int attempt = 0; attempt < 200 && !joined; ++attempt) {
    side.post(1, make_payload(64, ++sequence));
    joined = receiver.wait_for(sequence, 100) != 0;
  }
  if (!joined) {
    std::fprintf(stderr, "vorbel_bench: no echo over the gateway within 20 s\n");
    return 1;
  }

  auto bus_round_trip = [&](std::size_t size) -> double {
    const std::string payload = make_payload(size, ++sequence);
    const std::int64_t start = now_ticks();
    side.post(1, payload);
    const std::int64_t end = receiver.wait_for(sequence, 5000);
    return end == 0 ? -1 : ticks_to_us(end - start);
  };
  auto raw_round_trip = [&](std::size_t size) -> double {
    const std::string payload = make_payload(size, 0);
    const std::int64_t start = now_ticks();
    if (!raw.round_trip(payload)) return -1;
    return ticks_to_us(now_ticks() - start);
  };

  std::printf("## 1. Transport: round trip, raw named pipe against two buses joined by the gateway\n\n");
  std::printf("Each round trip: process A writes (raw) or posts on channel \"bench\" (bus), process B "
              "echoes it back. %d blocks of %d round trips per size, raw and bus blocks alternating; "
              "messages per second = round trips completed per second, one at a time. %s.\n\n",
              blocks, per_block, logging_setting().c_str());
  std::printf("| size | raw p50 µs | raw p99 µs | raw msg/s | bus p50 µs | bus p99 µs | bus msg/s | "
              "bus/raw p50 | bus/raw p99 | p50 ≤ 1.5 × raw | p99 < 2 ms |\n");
  std::printf("|---:|---:|---:|---:|---:|---:|---:|---:|---:|---|---|\n");
  for (std::size_t size : {std::size_t{64}, std::size_t{1024}, std::size_t{16384}, std::size_t{65536}}) {
    for (int i = 0; i < warm_up; ++i) {
      raw_round_trip(size);
      bus_round_trip(size);
    }
    transport_samples samples;
    for (int block = 0; block < blocks; ++block) {
      for (int order = 0; order < 2; ++order) {
        const bool raw_first = (block % 2) == 0;
        const bool do_raw = (order == 0) == raw_first;
        for (int i = 0; i < per_block; ++i) {
          const double us = do_raw ? raw_round_trip(size) : bus_round_trip(size);
          if (us < 0) {
            std::fprintf(stderr, "vorbel_bench: a %s round trip of %zu bytes failed\n", do_raw ? "raw" : "bus",
                         size);
            return 1;
          }
          (do_raw ? samples.raw_us : samples.bus_us).push_back(us);
          (do_raw ? samples.raw_total_us : samples.bus_total_us) += us;
        }
      }
    }
    const summary r = summarize(samples.raw_us);
    const summary b = summarize(samples.bus_us);
    const double raw_rate = 1e6 * static_cast<double>(r.count) / samples.raw_total_us;
    const double bus_rate = 1e6 * static_cast<double>(b.count) / samples.bus_total_us;
    std::printf("| %zu B | %.0f | %.0f | %.0f | %.0f | %.0f | %.0f | %.2f | %.2f | %s | %s |\n", size, r.p50,
                r.p99, raw_rate, b.p50, b.p99, bus_rate, b.p50 / r.p50, b.p99 / r.p99,
                verdict_at_most(b.p50 / r.p50, 1.5).c_str(), verdict_below(b.p99, 2000).c_str());
    std::fflush(stdout);
  }
  std::printf("\n");
  return 0;
}

}  // namespace bench
