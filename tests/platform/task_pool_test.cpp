// The one-thread task pool: order, exclusivity, shutdown, failing tasks.
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/task_pool.h"
#include "support/log_capture.h"

namespace {

using test_support::wait_until;

bool ready_soon(std::promise<void>& p) {
  return p.get_future().wait_for(std::chrono::seconds(5)) == std::future_status::ready;
}

TEST(task_pool_test, TasksFromSeveralThreadsRunOneAtATimeInEachPostersOrder) {
  task_pool<0> pool;
  std::vector<int> seen[4];  // per poster, touched only by the worker
  std::vector<std::thread::id> runners;
  std::atomic<int> inside{0}, overlaps{0}, ran{0};
  std::vector<std::thread> posters;
  for (int p = 0; p < 4; ++p) {
    posters.emplace_back([&, p] {
      for (int i = 0; i < 100; ++i) {
        pool.post([&, p, i] {
          overlaps += inside.fetch_add(1) != 0 || !pool.on_worker_thread();
          std::this_thread::yield();
          seen[p].push_back(i);
          runners.push_back(std::this_thread::get_id());
          inside.fetch_sub(1);
          ++ran;
        });
      }
    });
  }
  for (auto& t : posters) t.join();
  ASSERT_TRUE(wait_until([&] { return ran.load() == 400; }));
  EXPECT_EQ(overlaps.load(), 0);
  EXPECT_FALSE(pool.on_worker_thread());
  for (const auto& id : runners) ASSERT_EQ(id, runners.front());
  for (const auto& sequence : seen) {
    ASSERT_EQ(sequence.size(), 100u);
    for (int i = 0; i < 100; ++i) EXPECT_EQ(sequence[i], i);
  }
}

TEST(task_pool_test, DestructionFinishesTheRunningTaskAndDropsTheQueued) {
  auto pool = std::make_unique<task_pool<0>>();
  std::promise<void> started;
  std::atomic<bool> saw_stop{false};
  std::atomic<int> queued_ran{0};
  auto token = std::make_shared<int>(0);  // held by every queued task
  pool->post([&, p = pool.get()] {
    started.set_value();
    saw_stop = wait_until([p] { return p->stopping(); });
  });
  for (int i = 0; i < 10; ++i) pool->post([&, token] { ++queued_ran; });
  ASSERT_TRUE(ready_soon(started));
  pool.reset();  // returns once the running task has seen the stop and ended
  EXPECT_TRUE(saw_stop.load());
  EXPECT_EQ(queued_ran.load(), 0);
  EXPECT_EQ(token.use_count(), 1);  // the queued tasks were destroyed
}

TEST(task_pool_test, FailingTaskIsLoggedAndLaterTasksRun) {
  test_support::clear_log();
  task_pool<0> pool;
  std::promise<void> later;
  pool.post([] { throw std::runtime_error("disk on fire"); });
  pool.post([] { throw 42; });
  pool.post([&] { pool.post([&] { later.set_value(); }); });  // a task may post
  ASSERT_TRUE(ready_soon(later));
  ASSERT_TRUE(test_support::log_capture_available());
  EXPECT_TRUE(test_support::has_line(L"task_pool::worker", L"task failed: disk on fire"));
  EXPECT_TRUE(test_support::has_line(L"task_pool::worker", L"task failed: unknown exception"));
}

}  // namespace
