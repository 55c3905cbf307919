#include "platform/sync_rw_lock.h"

#include <cstdio>
#include <cstdlib>
#include <new>
#include <string>

#include "logging/logger.h"
#include "platform/win_error.h"

namespace {

constexpr LONG semaphore_maximum = 0x7FFFFFFF;

std::uint32_t resolve(std::uint32_t thread_id) {
  return thread_id != 0 ? thread_id : ::GetCurrentThreadId();
}

winapi::unique_handle create_semaphore() {
  HANDLE semaphore = ::CreateSemaphoreW(/* attributes */ nullptr, /* initial */ 0,
                                        /* maximum */ semaphore_maximum, /* name */ nullptr);
  if (semaphore == nullptr) winapi::throw_last_error("CreateSemaphore failed");
  return winapi::unique_handle(semaphore);
}

// The lock's state can no longer be trusted (a caller broke its rules, or a
// wait or wake failed): say why on every channel a developer might watch,
// then end the process. Called with the critical section left.
[[noreturn]] void fatal(const wchar_t* function, const char* what, std::uint32_t thread) {
  const std::string note = std::string("CSyncRWLock: fatal: ") + what + " (thread " +
                           std::to_string(thread) + ")\n";
  ::OutputDebugStringA(note.c_str());
  std::fputs(note.c_str(), stderr);
  std::fflush(stderr);
  logging::logger_stream(logging::level_critical, function)
      << "fatal: " << what << " thread=" << thread;
  std::abort();
}

void wait_on(HANDLE semaphore, const wchar_t* function, std::uint32_t thread) {
  if (::WaitForSingleObject(semaphore, INFINITE) != WAIT_OBJECT_0) {
    fatal(function, "waiting for the lock failed", thread);
  }
}

void release(HANDLE semaphore, std::uint32_t count, const wchar_t* function) {
  if (!::ReleaseSemaphore(semaphore, static_cast<LONG>(count), /* previous */ nullptr)) {
    fatal(function, "releasing waiting threads failed", ::GetCurrentThreadId());
  }
}

}  // namespace

CSyncRWLock::CSyncRWLock()
    : reader_semaphore_(create_semaphore()), writer_semaphore_(create_semaphore()) {
  ::InitializeCriticalSection(&section_);
}

CSyncRWLock::~CSyncRWLock() { ::DeleteCriticalSection(&section_); }

void CSyncRWLock::LockRead(std::uint32_t thread_id) {
  const std::uint32_t t = resolve(thread_id);
  ::EnterCriticalSection(&section_);
  bool block = false;
  if (active_readers_ == 0) {
    if (active_writer_ != 0 && writer_thread_ == t) {
      ++writer_reads_;
    } else if (active_writer_ != 0 || waiting_writers_ != 0) {
      block = true;
    } else {
      add_reader_or_throw_locked(t);
      ++active_readers_;
    }
  } else {
    const auto found = readers_.find(t);
    if (found != readers_.end()) {
      ++found->second;  // even when writers wait: a nested read must not deadlock
    } else if (waiting_writers_ != 0) {
      block = true;
    } else {
      add_reader_or_throw_locked(t);
      ++active_readers_;
    }
  }
  if (!block) {
    ::LeaveCriticalSection(&section_);
    return;
  }
  ++waiting_readers_;
  ::LeaveCriticalSection(&section_);
  wait_on(reader_semaphore_.get(), L"CSyncRWLock::LockRead", t);
  ::EnterCriticalSection(&section_);
  // The releasing writer already counted us in active_readers_: without a
  // record of ours, that place is given back before the failure leaves.
  if (!add_reader_locked(t)) {
    leave_reader_locked();
    throw std::bad_alloc();
  }
  ::LeaveCriticalSection(&section_);
}

bool CSyncRWLock::add_reader_locked(std::uint32_t t) {
  try {
    readers_.emplace(t, 1);
    return true;
  } catch (const std::bad_alloc&) {
    return false;
  }
}

void CSyncRWLock::add_reader_or_throw_locked(std::uint32_t t) {
  if (add_reader_locked(t)) return;
  ::LeaveCriticalSection(&section_);
  throw std::bad_alloc();
}

void CSyncRWLock::leave_reader_locked() {
  --active_readers_;
  const bool wake_writer = active_readers_ == 0 && waiting_writers_ != 0;
  if (wake_writer) {
    --waiting_writers_;
    active_writer_ = 1;
  }
  ::LeaveCriticalSection(&section_);
  if (wake_writer) release(writer_semaphore_.get(), 1, L"CSyncRWLock::UnlockRead");
}

void CSyncRWLock::UnlockRead(std::uint32_t thread_id) {
  const std::uint32_t t = resolve(thread_id);
  ::EnterCriticalSection(&section_);
  if (active_readers_ == 0) {
    if (active_writer_ == 0 || writer_thread_ != t || writer_reads_ == 0) {
      ::LeaveCriticalSection(&section_);
      fatal(L"CSyncRWLock::UnlockRead", "read lock released but not held", t);
    }
    --writer_reads_;
    if (writer_reads_ == 0 && writer_depth_ == 0) {
      release_writer_locked();
      return;
    }
    ::LeaveCriticalSection(&section_);
    return;
  }
  const auto found = readers_.find(t);
  if (found == readers_.end()) {
    ::LeaveCriticalSection(&section_);
    fatal(L"CSyncRWLock::UnlockRead", "read lock released but not held", t);
  }
  if (found->second > 1) {
    --found->second;
    ::LeaveCriticalSection(&section_);
    return;
  }
  readers_.erase(found);
  leave_reader_locked();
}

void CSyncRWLock::LockWrite(std::uint32_t thread_id) {
  const std::uint32_t t = resolve(thread_id);
  ::EnterCriticalSection(&section_);
  if (active_readers_ == 0) {
    if (active_writer_ == 0) {
      writer_thread_ = t;
      writer_reads_ = 0;
      writer_depth_ = 1;
      active_writer_ = 1;
      ::LeaveCriticalSection(&section_);
      return;
    }
    if (writer_thread_ == t) {
      ++writer_depth_;
      ::LeaveCriticalSection(&section_);
      return;
    }
  } else if (readers_.count(t) != 0) {
    ::LeaveCriticalSection(&section_);
    fatal(L"CSyncRWLock::LockWrite", "write lock asked for while reading", t);
  }
  ++waiting_writers_;
  ::LeaveCriticalSection(&section_);
  wait_on(writer_semaphore_.get(), L"CSyncRWLock::LockWrite", t);
  ::EnterCriticalSection(&section_);
  // The releaser already set active_writer_ for us.
  writer_thread_ = t;
  writer_reads_ = 0;
  writer_depth_ = 1;
  ::LeaveCriticalSection(&section_);
}

void CSyncRWLock::UnlockWrite(std::uint32_t thread_id) {
  const std::uint32_t t = resolve(thread_id);
  ::EnterCriticalSection(&section_);
  if (active_writer_ == 0 || writer_thread_ != t || writer_depth_ == 0) {
    ::LeaveCriticalSection(&section_);
    fatal(L"CSyncRWLock::UnlockWrite", "write lock released but not held", t);
  }
  --writer_depth_;
  if (writer_reads_ == 0 && writer_depth_ == 0) {
    release_writer_locked();
    return;
  }
  ::LeaveCriticalSection(&section_);
}

void CSyncRWLock::release_writer_locked() {
  active_writer_ = 0;
  writer_thread_ = 0;
  if (waiting_writers_ != 0) {
    --waiting_writers_;
    active_writer_ = 1;
    ::LeaveCriticalSection(&section_);
    release(writer_semaphore_.get(), 1, L"CSyncRWLock::UnlockWrite");
    return;
  }
  const std::uint32_t wake = waiting_readers_;
  if (wake != 0) {
    active_readers_ = wake;
    waiting_readers_ = 0;
  }
  ::LeaveCriticalSection(&section_);
  if (wake != 0) release(reader_semaphore_.get(), wake, L"CSyncRWLock::UnlockWrite");
}

bool CSyncRWLock::IsReading(std::uint32_t thread_id) const {
  const std::uint32_t t = resolve(thread_id);
  ::EnterCriticalSection(&section_);
  const bool reading =
      readers_.count(t) != 0 || (active_writer_ != 0 && writer_thread_ == t && writer_reads_ != 0);
  ::LeaveCriticalSection(&section_);
  return reading;
}

CSyncRWLock::counters CSyncRWLock::GetCounters() const {
  ::EnterCriticalSection(&section_);
  const counters snapshot{waiting_readers_, waiting_writers_, active_readers_, active_writer_,
                          writer_thread_,   writer_reads_,    writer_depth_};
  ::LeaveCriticalSection(&section_);
  return snapshot;
}
