// A bus observer for tests: records every notification with the thread it
// ran on, and lets a test wait for them with a bound.
#pragma once

#include <vorbel/ibus.h>

#include <windows.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/srw_sync.h"

namespace test_support {

struct notification {
  bool added;
  std::uint32_t pid;
  std::string channel;
  std::string id;
  DWORD thread;

  bool operator==(const notification& o) const {
    return added == o.added && pid == o.pid && channel == o.channel && id == o.id;
  }
};

inline notification added(std::uint32_t pid, std::string channel, std::string id) {
  return {true, pid, std::move(channel), std::move(id), 0};
}
inline notification removed(std::uint32_t pid, std::string channel, std::string id) {
  return {false, pid, std::move(channel), std::move(id), 0};
}

class recording_bus_observer final : public ibus_observer {
 public:
  // When false, GetInterface answers null for the observer identifier.
  bool answers = true;
  // Runs inside each notification, on the notifier thread.
  std::function<void(const notification&)> on_call;

  void* GetInterface(GUID iid) override {
    if (answers && qm::same_iid(iid, IID_ibus_observer)) return static_cast<ibus_observer*>(this);
    return nullptr;
  }
  void on_new_listener(std::uint32_t pid, const char* channel, const char* id) override {
    record({true, pid, channel, id, ::GetCurrentThreadId()});
  }
  void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) override {
    record({false, pid, channel, id, ::GetCurrentThreadId()});
  }

  std::vector<notification> seen() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return seen_;
  }
  std::vector<notification> take() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return std::exchange(seen_, {});
  }
  bool wait_for_count(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
    std::unique_lock<srw_mutex> lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return seen_.size() >= count; });
  }

 private:
  void record(notification n) {
    if (on_call) on_call(n);
    std::lock_guard<srw_mutex> lock(mutex_);
    seen_.push_back(std::move(n));
    changed_.notify_all();
  }
  srw_mutex mutex_;
  srw_condition_variable changed_;
  std::vector<notification> seen_;
};

}  // namespace test_support
