// A recursive reader/writer lock that prefers writers.
//
// Any thread may call it; every caller passes 0 for "the calling thread". A
// thread may read recursively, write recursively and read while it writes,
// but never ask to write while it reads. Breaking these rules is a fatal usage
// error: the process ends, since carrying on would let two writers in.
#pragma once

#include <windows.h>

#include <cstdint>
#include <map>

#include "platform/handles.h"

// The lock's face. Owners destroy the concrete CSyncRWLock, never through
// this interface.
struct ISyncRWLock {
  virtual void LockRead(std::uint32_t thread_id) = 0;
  virtual void UnlockRead(std::uint32_t thread_id) = 0;
  virtual void LockWrite(std::uint32_t thread_id) = 0;
  virtual void UnlockWrite(std::uint32_t thread_id) = 0;

 protected:
  ~ISyncRWLock() = default;
};

// Bookkeeping is done under a critical section; waiting threads block on one
// of two semaphores outside it. A leaving writer hands over to the next
// waiting writer, else wakes every waiting reader at once; the last leaving
// reader wakes one writer. A thread that already reads may read again even
// while a writer waits, so nested reads never deadlock.
class CSyncRWLock final : public ISyncRWLock {
 public:
  // Throws std::system_error ("CreateSemaphore failed") when the system has
  // no semaphore to give: a lock without them would not exclude anybody.
  CSyncRWLock();
  CSyncRWLock(const CSyncRWLock&) = delete;
  CSyncRWLock& operator=(const CSyncRWLock&) = delete;
  ~CSyncRWLock();

  // Throws std::bad_alloc, holding nothing, when there is no memory to
  // record a new reading thread.
  void LockRead(std::uint32_t thread_id) override;
  void UnlockRead(std::uint32_t thread_id) override;
  void LockWrite(std::uint32_t thread_id) override;
  void UnlockWrite(std::uint32_t thread_id) override;

  // True when the thread (0: the calling thread) holds a read lock, also one
  // taken while writing. Lets callers refuse what would deadlock or abort.
  bool IsReading(std::uint32_t thread_id) const;

  struct counters {
    std::uint32_t waiting_readers;
    std::uint32_t waiting_writers;
    std::uint32_t active_readers;
    std::uint32_t active_writer;
    std::uint32_t writer_thread;
    std::uint32_t writer_reads;
    std::uint32_t writer_depth;
  };
  // A consistent snapshot of the bookkeeping, for diagnostics.
  counters GetCounters() const;

 private:
  // Clears the writer and hands the lock on; leaves the critical section.
  void release_writer_locked();
  // Records a new reading thread; false when there is no memory for it.
  bool add_reader_locked(std::uint32_t t);
  // The same, but leaves the critical section and throws std::bad_alloc.
  void add_reader_or_throw_locked(std::uint32_t t);
  // One reader fewer; wakes a waiting writer after the last. Leaves the
  // critical section.
  void leave_reader_locked();

  mutable CRITICAL_SECTION section_;
  winapi::unique_handle reader_semaphore_;
  winapi::unique_handle writer_semaphore_;
  std::uint32_t waiting_readers_ = 0;
  std::uint32_t waiting_writers_ = 0;
  std::uint32_t active_readers_ = 0;
  std::uint32_t active_writer_ = 0;
  std::uint32_t writer_thread_ = 0;
  // Read locks the writing thread took while writing.
  std::uint32_t writer_reads_ = 0;
  // How often the writing thread holds the write lock.
  std::uint32_t writer_depth_ = 0;
  // Reading thread id -> its read-lock count.
  std::map<std::uint32_t, std::uint32_t> readers_;
};

// Scoped read and write locks over ISyncRWLock, for the calling thread.
class rw_read_guard {
 public:
  explicit rw_read_guard(ISyncRWLock& lock) : lock_(lock) { lock_.LockRead(0); }
  rw_read_guard(const rw_read_guard&) = delete;
  rw_read_guard& operator=(const rw_read_guard&) = delete;
  ~rw_read_guard() { lock_.UnlockRead(0); }

 private:
  ISyncRWLock& lock_;
};

class rw_write_guard {
 public:
  explicit rw_write_guard(ISyncRWLock& lock) : lock_(lock) { lock_.LockWrite(0); }
  rw_write_guard(const rw_write_guard&) = delete;
  rw_write_guard& operator=(const rw_write_guard&) = delete;
  ~rw_write_guard() { lock_.UnlockWrite(0); }

 private:
  ISyncRWLock& lock_;
};
