// Publication of this process's listener table: when the next one may leave
// (publication_pacer) and the thread that sends it (publisher).
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <thread>

#include "platform/srw_sync.h"

// When the next publication of the table may leave. Pure arithmetic over the
// times its owner passes in; one thread owns it, so it takes no lock.
//
// A change after a quiet spell leaves at once. Changes that come while the
// last publication is recent wait and fold into the next one. The wait after
// a publication taken at age `a` of its burst, of `b` bytes, is
//
//   max(b / pipe_bytes_per_second, min(a * burst_share, max_burst_gap))
//
// The first term keeps a stream of whole tables within what the pipe and the
// peers carry, however often the table changes or peers ask for it. The
// second makes the tables of one burst leave at ages that grow by a factor
// of 1 + burst_share: when a burst fills a table at any steady pace (so the
// table grows linearly with the burst's age), the tables sent during it add
// up to at most (1 + burst_share) / burst_share = 4 times the last of them,
// and with the final table after it to about 5 times the final table. That
// final table leaves at most a third of the burst's length, and at most
// max_burst_gap, after the last change. A burst ends when a change comes
// after the wait has passed. A refused publication is tried again after a
// delay that doubles from min_retry to max_retry.
class publication_pacer {
 public:
  using clock = std::chrono::steady_clock;

  static constexpr double burst_share = 1.0 / 3;
  static constexpr std::chrono::milliseconds max_burst_gap{1000};
  // A quarter to a third of what whole tables sent back to back moved
  // through the gateway into a peer's table on a loaded 2-core machine
  // (23-31 MB/s, bench/analysis.md): room for the peer's other traffic and
  // for a slower moment.
  static constexpr double pipe_bytes_per_second = 8e6;
  static constexpr std::chrono::milliseconds min_retry{10};
  static constexpr std::chrono::milliseconds max_retry{1000};

  // The earliest time the next table may be taken.
  clock::time_point next_allowed() const { return next_allowed_; }
  // A table is taken at `now` for changes the first of which came at
  // `changed`. One that came once the last wait had passed begins a burst.
  void taken(clock::time_point now, clock::time_point changed);
  // The table taken last, `bytes` long, was posted at `now`.
  void sent(clock::time_point now, std::size_t bytes);
  // The table taken last was refused at `now`; gives the delay before it
  // goes again.
  clock::duration refused(clock::time_point now);

 private:
  clock::time_point next_allowed_{};  // the clock's epoch: the first change leaves at once
  clock::time_point burst_start_{};
  clock::time_point taken_{};
  clock::duration retry_{min_retry};
};

// Sends this process's table from a thread of its own whenever it changed.
//
// Owned by the bus. Any thread may mark the table changed; its lock is held
// only for its own bookkeeping, and no other lock is taken under it (the bus
// marks after releasing its mutex). The thread calls `send` without holding
// it; `send` takes the bus's mutex to hand over the changes and encodes and
// posts outside it. Nothing is sent before enable() (marks are kept);
// stop(), which the destructor also runs, ends and joins the thread, and
// `send` is not called after it returns. A mark after stop() is ignored.
class publisher {
 public:
  // What `send` did: the post's result (0 when posted) and the bytes sent.
  struct outcome {
    std::uint32_t result;
    std::size_t bytes;
  };

  // Starts the thread; throws std::system_error when it cannot.
  explicit publisher(std::function<outcome()> send);
  publisher(const publisher&) = delete;
  publisher& operator=(const publisher&) = delete;
  ~publisher();

  void enable();
  void mark_changed();
  // True once every change marked so far has been published, or the
  // publisher has stopped; false when `timeout` passed first.
  bool wait_idle(std::chrono::milliseconds timeout);
  void stop();

 private:
  void run();
  // Sleeps until `until`, stop() or (when `until` is far) a mark.
  void sleep_until_locked(std::unique_lock<srw_mutex>& lock, publication_pacer::clock::time_point until);
  outcome send_logged();

  const std::function<outcome()> send_;
  srw_mutex mutex_;
  srw_condition_variable wake_;  // the thread: a mark, enable or stop
  srw_condition_variable idle_;  // wait_idle: a publication ended
  publication_pacer pacer_;
  publication_pacer::clock::time_point changed_at_{};  // the first change not taken yet
  bool changed_ = false;
  bool enabled_ = false;
  bool sending_ = false;
  bool waiting_ = false;  // the thread waits for a mark
  bool stop_ = false;
  std::thread thread_;  // last: it starts once everything above is set up
};
