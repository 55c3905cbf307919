// A thread of its own that runs the calls handed to it one after another, so
// that a test can make one thread take a lock and, later, release it.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <functional>
#include <future>
#include <mutex>
#include <thread>

namespace test_support {

// How long a blocked thread gets to wrongly proceed; the bound of every wait
// for something that must happen.
constexpr std::chrono::milliseconds settle_time(100);
constexpr std::chrono::milliseconds wait_bound(5000);

inline bool done(const std::shared_future<void>& call, std::chrono::milliseconds within = wait_bound) {
  return call.wait_for(within) == std::future_status::ready;
}

class thread_actor {
 public:
  thread_actor() : thread_([this] { run(); }) {}
  // A call still blocked here means a lock was never handed on: end the run
  // loudly rather than hang it.
  ~thread_actor() {
    if (!done(call([this] { stop_ = true; }), std::chrono::seconds(10))) {
      std::fputs("thread_actor: a call is still blocked\n", stderr);
      std::_Exit(3);
    }
    thread_.join();
  }

  std::shared_future<void> call(std::function<void()> fn) {
    std::packaged_task<void()> task(std::move(fn));
    std::shared_future<void> result = task.get_future().share();
    std::lock_guard<std::mutex> lock(mutex_);
    calls_.push_back(std::move(task));
    wake_.notify_one();
    return result;
  }

 private:
  void run() {
    while (!stop_) {
      std::unique_lock<std::mutex> lock(mutex_);
      wake_.wait(lock, [this] { return !calls_.empty(); });
      std::packaged_task<void()> task = std::move(calls_.front());
      calls_.pop_front();
      lock.unlock();
      task();
    }
  }

  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<std::packaged_task<void()>> calls_;
  bool stop_ = false;  // set and read on the actor's own thread
  std::thread thread_;
};

}  // namespace test_support
