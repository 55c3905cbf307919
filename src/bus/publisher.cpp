#include "bus/publisher.h"

#include <windows.h>

#include <algorithm>
#include <exception>
#include <utility>

#include "logging/logger.h"

using logging::level_error;
using logging::logger_stream;
using clock_type = publication_pacer::clock;

void publication_pacer::taken(clock_type::time_point now, clock_type::time_point changed) {
  if (changed >= next_allowed_) burst_start_ = now;
  taken_ = now;
}

void publication_pacer::sent(clock_type::time_point now, std::size_t bytes) {
  using seconds = std::chrono::duration<double>;
  const auto for_pipe = std::chrono::duration_cast<clock_type::duration>(
      seconds(static_cast<double>(bytes) / pipe_bytes_per_second));
  const auto for_burst = std::min<clock_type::duration>(
      std::chrono::duration_cast<clock_type::duration>((taken_ - burst_start_) * burst_share),
      max_burst_gap);
  next_allowed_ = now + std::max(for_pipe, for_burst);
  retry_ = min_retry;
}

clock_type::duration publication_pacer::refused(clock_type::time_point now) {
  const clock_type::duration delay = retry_;
  next_allowed_ = now + delay;
  retry_ = std::min<clock_type::duration>(retry_ * 2, max_retry);
  return delay;
}

publisher::publisher(std::function<outcome()> send)
    : send_(std::move(send)), thread_(&publisher::run, this) {}

publisher::~publisher() { stop(); }

void publisher::enable() {
  std::lock_guard<srw_mutex> lock(mutex_);
  enabled_ = true;
  wake_.notify_one();
}

void publisher::mark_changed() {
  bool wake = false;
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (changed_ || stop_) return;
    changed_ = true;
    changed_at_ = clock_type::now();
    // Only a thread that waits for a mark needs waking; one that waits for
    // its next allowed time takes this change along when it wakes.
    wake = waiting_;
  }
  // Woken once the lock is free: it would wait for the lock otherwise. The
  // thread re-checks its condition, so a wake it no longer needs is harmless.
  if (wake) wake_.notify_one();
}

bool publisher::wait_idle(std::chrono::milliseconds timeout) {
  std::unique_lock<srw_mutex> lock(mutex_);
  return idle_.wait_for(lock, timeout, [this] { return stop_ || (!changed_ && !sending_); });
}

void publisher::stop() {
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    stop_ = true;
    wake_.notify_all();
    idle_.notify_all();
  }
  if (thread_.joinable()) thread_.join();
}

void publisher::sleep_until_locked(std::unique_lock<srw_mutex>& lock,
                                   clock_type::time_point until) {
  const auto left = until - clock_type::now();
  if (left <= clock_type::duration::zero()) return;
  // Rounded up: a wait cut to 0 ms would spin until the time has come.
  const auto ms = std::chrono::ceil<std::chrono::milliseconds>(left);
  wake_.wait_for(lock, ms, [this] { return stop_; });
}

publisher::outcome publisher::send_logged() {
  // This runs on the publisher's own thread: nothing may escape it.
  try {
    return send_();
  } catch (const std::exception& e) {
    logger_stream(level_error, L"publisher::run") << L"publication failed: " << e.what();
  }
  return outcome{ERROR_OUTOFMEMORY, 0};
}

void publisher::run() {
  std::unique_lock<srw_mutex> lock(mutex_);
  while (!stop_) {
    if (!changed_ || !enabled_) {
      waiting_ = true;
      wake_.wait(lock, [this] { return stop_ || (changed_ && enabled_); });
      waiting_ = false;
      continue;
    }
    if (clock_type::now() < pacer_.next_allowed()) {
      sleep_until_locked(lock, pacer_.next_allowed());
      continue;
    }
    // Changes marked from here on are not in this table: they go next.
    pacer_.taken(clock_type::now(), changed_at_);
    changed_ = false;
    sending_ = true;
    lock.unlock();
    const outcome sent = send_logged();
    const auto done = clock_type::now();
    lock.lock();
    sending_ = false;
    if (sent.result == 0) {
      pacer_.sent(done, sent.bytes);
    } else {
      // The newest table goes again: never the one refused, which may be
      // out of date by then.
      const auto delay = pacer_.refused(done);
      if (!changed_) {
        changed_ = true;
        changed_at_ = done;
      }
      lock.unlock();  // no lock is held while a line is written
      logger_stream(level_error, L"publisher::run")
          << L"publication failed err=" << sent.result << L"; the table goes again in "
          << std::chrono::duration_cast<std::chrono::milliseconds>(delay).count() << L" ms";
      lock.lock();
    }
    idle_.notify_all();
  }
  idle_.notify_all();
}
