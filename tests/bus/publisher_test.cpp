// When the publisher lets this process's table go: the pacer's arithmetic
// run over simulated bursts, spaced changes and request storms.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>

#include "bus/publisher.h"

namespace {

using clock_type = publication_pacer::clock;
using std::chrono::microseconds;
using std::chrono::milliseconds;

struct run_result {
  std::uint64_t bytes = 0;  // of every table sent
  std::size_t publications = 0;
  std::size_t last_changes = 0;  // changes the last table sent holds
  clock_type::duration last_delay{};  // from the last change until the last table was posted
};

// `changes` changes, one every `every`; the table holds `base` bytes plus
// `per_change` for each change so far. The publisher takes the table whenever
// the pacer lets it, and posting takes 100 µs.
run_result simulate(std::size_t changes, clock_type::duration every, std::uint64_t base,
                    std::uint64_t per_change) {
  publication_pacer pacer;
  const clock_type::time_point start = clock_type::time_point{} + std::chrono::hours(1);
  const clock_type::time_point never = clock_type::time_point::max();
  run_result r;
  std::size_t made = 0;
  bool pending = false;
  clock_type::time_point changed_at{}, free_at = start, last_change{}, now = start;
  for (;;) {
    const auto next_change = made < changes ? start + every * static_cast<long long>(made) : never;
    const auto next_take = pending ? std::max({pacer.next_allowed(), free_at, now}) : never;
    if (next_change == never && next_take == never) return r;
    if (next_change <= next_take) {
      now = last_change = next_change;
      if (!pending) changed_at = now;
      pending = true;
      ++made;
      continue;
    }
    pacer.taken(now = next_take, changed_at);
    pending = false;
    free_at = now + microseconds(100);
    pacer.sent(free_at, static_cast<std::size_t>(base + per_change * made));
    r.bytes += base + per_change * made;
    ++r.publications;
    r.last_changes = made;
    r.last_delay = free_at - last_change;
  }
}

clock_type::duration seconds_of(double s) {
  return std::chrono::duration_cast<clock_type::duration>(std::chrono::duration<double>(s));
}

// Bursts that fill a table (56 bytes a listener) at any pace send a few times
// the last table, the last table always, and soon after the last change.
// Changes spaced beyond the wait each leave at once. A 1 MB table asked for
// again and again for 10 s, at spacings below and around what the pipe needs
// for it, stays within the pipe's budget.
TEST(publication_pacer, bursts_spaced_changes_and_request_storms) {
  enum kind { burst, spaced, storm };
  const struct {
    kind what;
    std::size_t n;
    clock_type::duration every;
  } runs[] = {{burst, 1000, microseconds(1)},     {burst, 1000, microseconds(200)},  {burst, 10000, microseconds(10)},
              {burst, 10000, microseconds(100)},  {burst, 20000, microseconds(50)},  {burst, 20000, microseconds(200)},
              {spaced, 1000, microseconds(500)},  {spaced, 1000, milliseconds(5)},   {spaced, 100, milliseconds(2000)},
              {storm, 10000, milliseconds(1)},    {storm, 500, milliseconds(20)},    {storm, 71, milliseconds(140)}};
  for (const auto& run : runs) {
    const std::uint64_t base = run.what == storm ? 1u << 20 : 64, per_change = run.what == burst ? 56 : 0;
    const run_result r = simulate(run.n, run.every, base, per_change);
    const std::uint64_t last = base + per_change * run.n;
    SCOPED_TRACE(testing::Message() << run.n << " changes, " << run.every.count() << " ticks apart: " << r.publications
                                    << " publications, " << r.bytes << " bytes");
    EXPECT_EQ(run.n, r.last_changes) << "the last table was not sent";
    if (run.what == burst) {
      EXPECT_LE(r.bytes, 6 * last);
      const clock_type::duration third = run.every * static_cast<long long>(run.n) / 3;
      EXPECT_LE(r.last_delay, std::max(seconds_of(last / publication_pacer::pipe_bytes_per_second), third) +
                                  milliseconds(1));
    } else if (run.what == spaced) {
      EXPECT_EQ(run.n, r.publications);
      EXPECT_EQ(microseconds(100), r.last_delay) << "the last change waited";
    } else {
      EXPECT_LE(static_cast<double>(r.bytes), publication_pacer::pipe_bytes_per_second * 10 + last);
    }
  }
}

}  // namespace
