// The reader/writer lock driven from real threads.
#include <gtest/gtest.h>

#include <windows.h>

#include <cstdlib>
#include <functional>
#include <future>
#include <memory>

#include "platform/handles.h"
#include "platform/sync_rw_lock.h"
#include "support/log_capture.h"

using namespace std::chrono_literals;
using call = std::shared_future<void>;

bool done(const call& c, std::chrono::milliseconds within = 5s) {
  return c.wait_for(within) == std::future_status::ready;
}

// A thread of its own that runs the calls posted to it (as APCs, between its
// alertable waits) one after another, so that one thread can take a lock and,
// later, release it. The lock's own waits are not alertable.
class thread_actor {
 public:
  ~thread_actor() {
    if (!done(post([this] { stop_ = true; }), 10s)) std::abort();  // a lock was never handed on
    ::WaitForSingleObject(thread_.get(), INFINITE);
  }
  call post(std::function<void()> fn) {
    using task = std::packaged_task<void()>;
    auto* queued = new task(std::move(fn));
    call result = queued->get_future().share();
    ::QueueUserAPC([](ULONG_PTR p) { (*std::unique_ptr<task>(reinterpret_cast<task*>(p)))(); }, thread_.get(),
                   reinterpret_cast<ULONG_PTR>(queued));
    return result;
  }

 private:
  bool stop_ = false;  // set and read on the actor's own thread
  winapi::unique_handle thread_{::CreateThread(nullptr, 0, [](void* stop) -> DWORD {
    while (!*static_cast<bool*>(stop)) ::SleepEx(INFINITE, /* alertable */ TRUE);
    return 0;
  }, &stop_, 0, nullptr)};
};

struct rw_lock_test : ::testing::Test {
  CSyncRWLock lock;
  thread_actor a, b, c, d, e;  // destroyed before the lock

  call read(thread_actor& t) { return t.post([this] { lock.LockRead(0); }); }
  call unread(thread_actor& t) { return t.post([this] { lock.UnlockRead(0); }); }
  call write(thread_actor& t) { return t.post([this] { lock.LockWrite(0); }); }
  call unwrite(thread_actor& t) { return t.post([this] { lock.UnlockWrite(0); }); }
  // Waits until exactly these numbers of threads are blocked in the lock.
  bool blocked(std::uint32_t readers, std::uint32_t writers) {
    return test_support::wait_until([&] {
      const auto n = lock.GetCounters();
      return n.waiting_readers == readers && n.waiting_writers == writers;
    });
  }
};

// Writer preference: a waiting writer holds off new readers (but not a
// reader reading again) and, when a writer leaves, goes before them. A
// writer reads and writes again at once, and leaves after its last unlock.
TEST_F(rw_lock_test, WritersGoFirstReadersNestAndAWriterLeavesAfterItsLastUnlock) {
  ASSERT_TRUE(done(read(a)));
  const auto w1 = write(b);
  ASSERT_TRUE(blocked(0, 1));
  const auto r1 = read(c), r2 = read(d);
  ASSERT_TRUE(blocked(2, 1));
  EXPECT_TRUE(done(read(a)) && done(unread(a)));
  EXPECT_FALSE(done(w1, 100ms));  // a still reads
  EXPECT_TRUE(done(unread(a)) && done(w1));
  EXPECT_TRUE(done(b.post([this] { lock.LockRead(0), lock.LockWrite(0), lock.UnlockWrite(0), lock.UnlockWrite(0); })));
  const auto w2 = write(e);
  ASSERT_TRUE(blocked(2, 1));
  EXPECT_FALSE(done(w2, 100ms));  // the read b took while writing still holds everyone off
  EXPECT_TRUE(done(unread(b)) && done(w2));
  EXPECT_FALSE(done(r1, 0ms) || done(r2, 0ms));
  EXPECT_TRUE(done(unwrite(e)) && done(r1) && done(r2));
  EXPECT_EQ(lock.GetCounters().active_readers, 2u);
  EXPECT_TRUE(done(unread(c)) && done(unread(d)));
}

// A waiting writer is woken by the last reader to leave, not by the first:
// readers a and c hold the lock, b waits to write; a leaves and b still waits
// (the bookkeeping shows no writer yet), then c leaves and b goes in.
TEST_F(rw_lock_test, AWaitingWriterWaitsForEveryReaderToLeave) {
  ASSERT_TRUE(done(read(a)) && done(read(c)));
  const auto w = write(b);
  ASSERT_TRUE(blocked(0, 1));
  ASSERT_TRUE(done(unread(a)));
  const auto after_first = lock.GetCounters();
  EXPECT_EQ(after_first.active_writer, 0u) << "a writer was let in while c still reads";
  EXPECT_EQ(after_first.waiting_writers, 1u);
  EXPECT_EQ(after_first.active_readers, 1u);
  EXPECT_FALSE(done(w, 200ms)) << "b writes while c still reads";
  ASSERT_TRUE(done(unread(c)));
  EXPECT_TRUE(done(w)) << "b still waits after the last reader left";
  EXPECT_TRUE(done(unwrite(b)));
}
