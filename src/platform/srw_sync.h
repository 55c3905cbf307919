// A mutex and a condition variable over the system's slim reader/writer lock
// and condition variable, usable with std::lock_guard and std::unique_lock.
//
// With the mingw-w64 runtime, std::mutex and std::condition_variable go
// through kernel objects: a hand-off to a waiting thread cost about 15 times
// as much under Wine (144 against 10 microseconds), and a mutex makes an
// event the first time it is contended and keeps it, so a long-lived lock
// adds a handle at some unforeseeable moment. Every lock of the component
// and of the sibling stand-ins is one of these instead.
#pragma once

#include <windows.h>

#include <chrono>
#include <mutex>

class srw_mutex {
 public:
  srw_mutex() = default;
  srw_mutex(const srw_mutex&) = delete;
  srw_mutex& operator=(const srw_mutex&) = delete;

  void lock() { ::AcquireSRWLockExclusive(&lock_); }
  bool try_lock() { return ::TryAcquireSRWLockExclusive(&lock_) != FALSE; }
  void unlock() { ::ReleaseSRWLockExclusive(&lock_); }
  SRWLOCK* native_handle() { return &lock_; }

 private:
  SRWLOCK lock_ = SRWLOCK_INIT;
};

class srw_condition_variable {
 public:
  srw_condition_variable() = default;
  srw_condition_variable(const srw_condition_variable&) = delete;
  srw_condition_variable& operator=(const srw_condition_variable&) = delete;

  void notify_one() { ::WakeConditionVariable(&condition_); }
  void notify_all() { ::WakeAllConditionVariable(&condition_); }

  template <typename Predicate>
  void wait(std::unique_lock<srw_mutex>& lock, Predicate done) {
    while (!done()) sleep(lock, INFINITE);
  }

  // False when `done` still does not hold after `timeout`.
  template <typename Rep, typename Period, typename Predicate>
  bool wait_for(std::unique_lock<srw_mutex>& lock, std::chrono::duration<Rep, Period> timeout,
                Predicate done) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!done()) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) return done();
      sleep(lock, static_cast<DWORD>(left.count()));
    }
    return true;
  }

 private:
  void sleep(std::unique_lock<srw_mutex>& lock, DWORD milliseconds) {
    ::SleepConditionVariableSRW(&condition_, lock.mutex()->native_handle(), milliseconds,
                                /* flags: exclusive */ 0);
  }

  CONDITION_VARIABLE condition_ = CONDITION_VARIABLE_INIT;
};
