// The reader/writer lock driven from real threads.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/sync_rw_lock.h"
#include "support/log_capture.h"
#include "thread_actor.h"

namespace {

using test_support::done;
using test_support::settle_time;
using test_support::thread_actor;

bool ready(const std::shared_future<void>& call) { return done(call, std::chrono::milliseconds(0)); }

struct rw_lock_test : ::testing::Test {
  CSyncRWLock lock;
  thread_actor a, b, c, d, e, f;  // destroyed before the lock

  std::shared_future<void> read(thread_actor& t) { return t.call([this] { lock.LockRead(0); }); }
  std::shared_future<void> unread(thread_actor& t) { return t.call([this] { lock.UnlockRead(0); }); }
  std::shared_future<void> write(thread_actor& t) { return t.call([this] { lock.LockWrite(0); }); }
  std::shared_future<void> unwrite(thread_actor& t) { return t.call([this] { lock.UnlockWrite(0); }); }
  // Waits until exactly these numbers of threads are blocked in the lock.
  bool blocked(std::uint32_t readers, std::uint32_t writers) {
    return test_support::wait_until([&] {
      const auto n = lock.GetCounters();
      return n.waiting_readers == readers && n.waiting_writers == writers;
    });
  }
};

TEST_F(rw_lock_test, WriterWaitsUntilBothReadersUnlock) {
  ASSERT_TRUE(done(read(a)) && done(read(b)));
  const auto w = write(c);
  EXPECT_FALSE(done(w, settle_time));
  EXPECT_TRUE(done(unread(a)));
  EXPECT_FALSE(done(w, settle_time));
  EXPECT_TRUE(done(unread(b)));
  EXPECT_TRUE(done(w) && done(unwrite(c)));
}

TEST_F(rw_lock_test, WaitingWriterHoldsOffNewReadersButNotNestedReads) {
  ASSERT_TRUE(done(read(a)));
  const auto w = write(b);
  ASSERT_TRUE(blocked(0, 1));
  const auto r = read(c);
  EXPECT_TRUE(blocked(1, 1));
  EXPECT_TRUE(done(read(a)) && done(unread(a)));  // a reading thread reads again at once
  EXPECT_FALSE(done(w, settle_time));
  EXPECT_TRUE(done(unread(a)) && done(w));
  EXPECT_FALSE(done(r, settle_time));  // the writer went first
  EXPECT_TRUE(done(unwrite(b)) && done(r) && done(unread(c)));
}

TEST_F(rw_lock_test, WriterReadsAndWritesRecursivelyAndLeavesAfterTheLastUnlock) {
  ASSERT_TRUE(done(a.call([this] {
    for (int i = 0; i < 2; ++i) lock.LockWrite(0), lock.LockRead(0);
  })));
  const auto r = read(b);
  ASSERT_TRUE(blocked(1, 0));
  EXPECT_TRUE(done(a.call([this] { lock.UnlockWrite(0), lock.UnlockRead(0), lock.UnlockWrite(0); })));
  EXPECT_FALSE(done(r, settle_time));  // one read is still held
  EXPECT_TRUE(done(unread(a)) && done(r) && done(unread(b)));
}

TEST_F(rw_lock_test, LeavingWriterHandsOverToWritersThenToAllReaders) {
  ASSERT_TRUE(done(write(a)));
  const auto w1 = write(b), w2 = write(c);
  ASSERT_TRUE(blocked(0, 2));
  const std::shared_future<void> reads[] = {read(d), read(e), read(f)};
  ASSERT_TRUE(blocked(3, 2));
  EXPECT_TRUE(done(unwrite(a)));
  ASSERT_TRUE(test_support::wait_until([&] { return ready(w1) || ready(w2); }));
  const bool b_first = ready(w1);
  EXPECT_FALSE(done(b_first ? w2 : w1, settle_time));
  EXPECT_TRUE(done(unwrite(b_first ? b : c)) && done(b_first ? w2 : w1));
  for (const auto& r : reads) EXPECT_FALSE(ready(r));
  EXPECT_TRUE(done(unwrite(b_first ? c : b)));
  for (const auto& r : reads) EXPECT_TRUE(done(r));
  EXPECT_EQ(lock.GetCounters().active_readers, 3u);  // all three in at once
  for (thread_actor* t : {&d, &e, &f}) EXPECT_TRUE(done(unread(*t)));
}

TEST_F(rw_lock_test, WritersExcludeEveryoneUnderContention) {
  std::atomic<int> writers{0}, readers{0}, violations{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 500; ++i) {
        if ((i + t) % 3 == 0) {
          rw_write_guard guard(lock);
          violations += writers.fetch_add(1) != 0 || readers.load() != 0;
          std::this_thread::yield();
          writers.fetch_sub(1);
        } else {
          rw_read_guard guard(lock), nested(lock);
          readers.fetch_add(1);
          violations += writers.load() != 0;
          readers.fetch_sub(1);
        }
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(violations.load(), 0);
  const auto n = lock.GetCounters();
  EXPECT_EQ(n.active_readers + n.active_writer + n.waiting_readers + n.waiting_writers, 0u);
}

TEST(rw_lock_DeathTest, BrokenRulesEndTheProcess) {
  EXPECT_DEATH({ CSyncRWLock l; l.UnlockRead(0); }, "read lock released but not held");
  EXPECT_DEATH({ CSyncRWLock l; l.LockWrite(0); l.UnlockRead(0); }, "read lock released but not held");
  EXPECT_DEATH({ CSyncRWLock l; l.LockRead(0); l.LockWrite(0); }, "write lock asked for while reading");
  EXPECT_DEATH({ CSyncRWLock l; std::thread([&] { l.LockWrite(0); }).join(); l.UnlockWrite(0); },
               "write lock released but not held");
}

}  // namespace
