// A queue of tasks served by one worker thread.
//
// The owner constructs and destroys the pool; any thread may post. Tasks run
// on the worker only, one at a time, in the order in which posts took the
// lock. Stopping (or destruction) lets the running task finish and drops the
// queued ones unrun, so a task must not rely on a later one to clean up after
// it.
//
// The queue's lock and the worker's wake-up are the system's slim ones
// (platform/srw_sync.h): every listener notification is handed over here.
#pragma once

#include <windows.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <exception>
#include <functional>
#include <thread>
#include <utility>

#include "logging/logger.h"
#include "platform/srw_sync.h"

// N picks the flavour of pool; 0, the only one defined, has a single worker.
template <int N>
class task_pool {
  static_assert(N == 0, "only task_pool<0>, with one worker thread, is defined");

 public:
  task_pool() {
    running_ = true;
    // Held while the worker starts, so that the worker sees worker_ assigned
    // before it can run a task that asks on_worker_thread().
    std::lock_guard<srw_mutex> lock(lock_);
    worker_ = std::thread(&task_pool::worker, this);
  }
  task_pool(const task_pool&) = delete;
  task_pool& operator=(const task_pool&) = delete;

  ~task_pool() { stop(); }

  // Lets the running task finish and drops the queued ones; tasks posted
  // afterwards never run. The owner stops its pool before it takes apart
  // anything a task may reach. Idempotent.
  void stop() {
    if (on_worker_thread()) {
      // The worker cannot wait for itself to end.
      std::fputs("task_pool: fatal: stopped from a task on its own worker\n", stderr);
      std::abort();
    }
    {
      std::lock_guard<srw_mutex> lock(lock_);
      running_ = false;
      queue_.clear();  // the queued tasks are dropped unrun
      wake_.notify_all();
    }
    if (worker_.joinable()) worker_.join();
  }

  void post(std::function<void()> task) {
    std::lock_guard<srw_mutex> lock(lock_);
    queue_.push_back(std::move(task));
    wake_.notify_one();
  }

  // True on the worker thread; pool-only code asserts it.
  bool on_worker_thread() const { return std::this_thread::get_id() == worker_.get_id(); }

  // True once stop (or destruction) has begun: a long task may poll it to
  // give up early, since the tasks behind it will not run anyway.
  bool stopping() const { return !running_; }

 private:
  // An empty task when the pool stops, even if tasks remain.
  std::function<void()> next_task() {
    std::unique_lock<srw_mutex> lock(lock_);
    wake_.wait(lock, [this] { return !running_ || !queue_.empty(); });
    if (!running_) return {};
    std::function<void()> task = std::move(queue_.front());
    queue_.pop_front();
    return task;
  }

  void worker() {
    while (running_) {
      std::function<void()> task = next_task();
      if (!task) continue;
      // A task that throws must not take the host process down with it, nor
      // stop the tasks behind it.
      try {
        task();
      } catch (const std::exception& e) {
        logging::logger_stream(logging::level_error, L"task_pool::worker")
            << "task failed: " << e.what();
      } catch (...) {
        logging::logger_stream(logging::level_error, L"task_pool::worker")
            << "task failed: unknown exception";
      }
    }
  }

  std::deque<std::function<void()>> queue_;
  srw_mutex lock_;
  std::thread worker_;
  std::atomic<bool> running_{false};
  srw_condition_variable wake_;
};
