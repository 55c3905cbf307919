// When the publisher lets this process's table go: the pacer's arithmetic
// run over simulated bursts, request storms and refusals, with the table's
// size growing as a registration loop would grow it.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <vector>

#include "bus/publisher.h"

namespace {

using clock_type = publication_pacer::clock;
using std::chrono::microseconds;
using std::chrono::milliseconds;

struct run_result {
  std::uint64_t bytes = 0;           // of every table sent
  std::size_t publications = 0;
  std::size_t last_changes = 0;      // changes the last table sent holds
  clock_type::duration last_delay{};  // from the last change until the last table was posted
};

// `changes` changes, one every `every`; the table holds `base` bytes plus
// `per_change` for each change so far (0: every change replaces one
// listener). The publisher takes the table whenever the pacer lets it, and
// posting takes `post`.
run_result simulate(std::size_t changes, clock_type::duration every, std::uint64_t base,
                    std::uint64_t per_change, clock_type::duration post = microseconds(100)) {
  publication_pacer pacer;
  const clock_type::time_point start = clock_type::time_point{} + std::chrono::hours(1);
  const clock_type::time_point never = clock_type::time_point::max();
  run_result r;
  std::size_t made = 0;
  bool pending = false;
  clock_type::time_point changed_at{}, free_at = start, last_change{}, now = start;
  for (;;) {
    const clock_type::time_point next_change =
        made < changes ? start + every * static_cast<long long>(made) : never;
    const clock_type::time_point next_take = pending ? std::max({pacer.next_allowed(), free_at, now}) : never;
    if (next_change == never && next_take == never) break;
    if (next_change <= next_take) {
      now = last_change = next_change;
      ++made;
      if (!pending) changed_at = next_change;
      pending = true;
      continue;
    }
    now = next_take;
    pacer.taken(next_take, changed_at);
    pending = false;
    const std::uint64_t size = base + per_change * made;
    free_at = next_take + post;
    pacer.sent(free_at, static_cast<std::size_t>(size));
    r.bytes += size;
    ++r.publications;
    r.last_changes = made;
    r.last_delay = free_at - last_change;
  }
  return r;
}

// Bursts that fill a table at any pace: the last table always goes, the
// bytes stay within a few times it, and it leaves soon after the last change.
TEST(publication_pacer, bursts_send_a_few_times_their_last_table_and_it_last) {
  const struct {
    std::size_t n;
    clock_type::duration every;
  } bursts[] = {{1000, microseconds(1)},   {1000, microseconds(200)}, {10000, microseconds(10)},
                {10000, microseconds(100)}, {20000, microseconds(50)}, {20000, microseconds(200)}};
  for (const auto& b : bursts) {
    const std::uint64_t per_listener = 56;  // a 5-byte channel and a 19-byte id
    const run_result r = simulate(b.n, b.every, 64, per_listener);
    const std::uint64_t last = 64 + per_listener * b.n;
    const auto length = b.every * static_cast<long long>(b.n - 1);
    const auto allowed = std::max<clock_type::duration>(
        std::chrono::duration_cast<clock_type::duration>(length * publication_pacer::burst_share),
        std::chrono::duration_cast<clock_type::duration>(
            std::chrono::duration<double>(last / publication_pacer::pipe_bytes_per_second)));
    SCOPED_TRACE(testing::Message() << b.n << " changes, one every " << b.every.count() << " ticks: "
                                    << r.publications << " publications");
    EXPECT_EQ(b.n, r.last_changes) << "the last table was not sent";
    EXPECT_LE(r.bytes, 6 * last);
    EXPECT_LE(r.last_delay, allowed + milliseconds(1));
  }
}

// A change after a quiet spell leaves at once: single registrations that
// follow each other as fast as a peer can see them are never held back.
TEST(publication_pacer, changes_spaced_beyond_the_wait_each_leave_at_once) {
  for (const clock_type::duration every : {clock_type::duration(microseconds(500)), clock_type::duration(milliseconds(5)),
                                           clock_type::duration(milliseconds(2000))}) {
    const run_result r = simulate(1000, every, 80, 0);
    EXPECT_EQ(1000u, r.publications) << every.count() << " ticks apart";
    EXPECT_EQ(microseconds(100), r.last_delay) << "the last change waited";
  }
}

// A table of 1 MB asked for (or changed) again and again for 10 s, at
// spacings below and around the time the pipe needs for it: what leaves stays
// within the pipe's budget, and the newest table goes last.
TEST(publication_pacer, a_stream_of_requests_is_held_to_the_pipe_budget) {
  const std::uint64_t table = 1u << 20;
  for (const auto every : {milliseconds(1), milliseconds(100), milliseconds(140)}) {
    const std::size_t changes = static_cast<std::size_t>(std::chrono::seconds(10) / every);
    const run_result r = simulate(changes, every, table, 0);
    const double budget = publication_pacer::pipe_bytes_per_second * 10;
    EXPECT_LE(static_cast<double>(r.bytes), budget + table) << every.count() << " ms: " << r.publications;
    EXPECT_EQ(changes, r.last_changes) << every.count() << " ms";
  }
}

TEST(publication_pacer, refusals_back_off_doubling_to_a_second_and_a_success_resets) {
  publication_pacer pacer;
  clock_type::time_point now = clock_type::time_point{} + std::chrono::hours(1);
  std::vector<long long> delays;
  for (int i = 0; i < 9; ++i) {
    pacer.taken(now, now);
    const auto delay = pacer.refused(now);
    EXPECT_EQ(now + delay, pacer.next_allowed());
    delays.push_back(std::chrono::duration_cast<milliseconds>(delay).count());
    now += delay;
  }
  EXPECT_EQ((std::vector<long long>{10, 20, 40, 80, 160, 320, 640, 1000, 1000}), delays);
  pacer.taken(now, now);
  pacer.sent(now, 100);
  pacer.taken(now + std::chrono::seconds(5), now + std::chrono::seconds(5));
  EXPECT_EQ(milliseconds(10), pacer.refused(now));
}

}  // namespace
