// The one-thread task pool: order, one worker, failing tasks, shutdown.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/task_pool.h"
#include "support/log_capture.h"

using test_support::wait_until;

TEST(task_pool_test, TasksFromTwoPostersRunOnOneThreadInPostingOrderPastFailingOnes) {
  test_support::clear_log();
  task_pool<0> pool;
  std::vector<int> seen[2];  // touched only by the worker
  std::atomic<int> faults{0}, ran{0};
  std::thread::id runner;
  auto poster = [&](int p) {
    for (int i = 0; i < 200; ++i) {
      if (i == 100) pool.post([] { throw std::runtime_error("disk on fire"); }), pool.post([] { throw 42; });
      pool.post([&, p, i] {
        if (runner == std::thread::id()) runner = std::this_thread::get_id();
        faults += runner != std::this_thread::get_id() || !pool.on_worker_thread();
        seen[p].push_back(i), ++ran;
      });
    }
  };
  std::thread other(poster, 1);
  poster(0);
  other.join();
  ASSERT_TRUE(wait_until([&] { return ran.load() == 400; }));
  EXPECT_EQ(faults.load(), 0);
  for (int i = 0; i < 200; ++i) ASSERT_TRUE(seen[0].at(i) == i && seen[1].at(i) == i) << i;
  EXPECT_EQ(2u, test_support::find_lines(L"task_pool::worker", L"task failed: disk on fire").size());
  EXPECT_EQ(2u, test_support::find_lines(L"task_pool::worker", L"task failed: unknown exception").size());
}

TEST(task_pool_test, DestructionFinishesTheRunningTaskAndDropsTheQueued) {
  auto pool = std::make_unique<task_pool<0>>();
  std::atomic<bool> started{false}, saw_stop{false};
  auto token = std::make_shared<int>(0);  // held by every queued task
  pool->post([&, p = pool.get()] { started = true, saw_stop = wait_until([p] { return p->stopping(); }); });
  for (int i = 0; i < 10; ++i) pool->post([token] { ADD_FAILURE() << "a queued task ran"; });
  ASSERT_TRUE(wait_until([&] { return started.load(); }));
  pool.reset();  // returns once the running task has seen the stop and ended
  EXPECT_TRUE(saw_stop.load());
  EXPECT_EQ(token.use_count(), 1);  // the queued tasks were destroyed
}
