// The library's bus, channel and subscription objects and the bus's delivery
// thread.
//
// A bus owns its channels (kept until the bus goes), each channel its
// subscriptions and taps, and the queue of sealed message copies waiting for
// delivery. One mutex per bus guards all of it. Host threads post, inject,
// subscribe and tap; the bus's single delivery thread takes the queue in
// order and runs the taps and subscription callbacks without the mutex held,
// one at a time. `running_` names the tap or subscription whose callback is
// running, so that removing one waits for its call to end - except on the
// delivery thread itself, where the call being waited for would be the
// caller's own: there the object is freed when its call returns.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "platform/srw_sync.h"
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

#include "bus/parlo/parlo.h"
#include "bus/parlo/parlo_ext.h"
#include "platform/handles.h"

namespace parlo::impl {

class bus_impl;
class channel_impl;
class message_impl;

// Created by channel_impl::create_subscription, freed by
// destroy_subscription or with its bus. State guarded by the bus mutex,
// except the delivered count.
class subscription_impl final : public parlo::subscription {
 public:
  explicit subscription_impl(channel_impl& channel) : channel_(channel) {}

  bool is_listening() override;
  std::uint64_t delivered_count() override;
  std::uint32_t reserved_2() override;
  parlo::channel* get_subscription_channel() override;
  std::uint32_t listen(message_callback callback, void* context, std::uint32_t flags) override;

 private:
  friend class bus_impl;

  channel_impl& channel_;
  message_callback callback_ = nullptr;
  void* context_ = nullptr;
  // Messages with a higher sequence number are delivered.
  std::uint64_t start_seq_ = 0;
  bool listening_ = false;
  // Destroyed from inside its own callback: freed when that returns.
  bool free_after_call_ = false;
  std::atomic<std::uint64_t> delivered_{0};
};

// A tap of the IPC library (parlo_ext.h); the bus mutex guards it.
struct tap_entry {
  std::uint64_t id;
  ext::tap_callback callback;
  void* context;
  std::uint64_t start_seq;
  bool free_after_call = false;
};

// Owned by its bus; every operation goes to the bus under its mutex.
class channel_impl final : public parlo::channel {
 public:
  channel_impl(bus_impl& bus, std::string name) : bus_(bus), name_(std::move(name)) {}
  channel_impl(const channel_impl&) = delete;
  channel_impl& operator=(const channel_impl&) = delete;
  ~channel_impl();

  const char* name() override { return name_.c_str(); }
  std::uint32_t post(parlo::message* message) override;
  parlo::bus* get_bus() override;
  std::uint32_t subscription_count() override;
  std::uint32_t reserved_4() override;
  parlo::subscription* create_subscription() override;
  std::uint32_t destroy_subscription(parlo::subscription* subscription) override;

 private:
  friend class bus_impl;
  friend class subscription_impl;

  bus_impl& bus_;
  const std::string name_;
  // In creation order. While the delivery thread walks a list, removals
  // leave null in place (walking by index stays valid); the list is
  // compacted when the walk ends.
  std::vector<subscription_impl*> subscriptions_;
  std::vector<tap_entry*> taps_;
};

class bus_impl final : public parlo::bus {
 public:
  // A running bus, registered as live; null (with a line) on failure.
  static bus_impl* create(const char* name);
  // The live bus `candidate` points to, or null. Reads only the pointer value.
  static bus_impl* find_live(parlo::bus* candidate);
  // Unregisters and destroys a live bus (destroy_bus); false when
  // `candidate` is not one.
  static bool destroy(parlo::bus* candidate);

  const char* name() override { return name_.c_str(); }
  parlo::message* create_message(std::uint32_t kind) override;
  std::uint32_t create_channel(const char* name) override;
  std::uint32_t flush(std::uint32_t timeout_ms) override;
  parlo::channel* get_channel(const char* name) override;
  std::uint32_t channel_count() override;

  // parlo_ext.h
  std::uint32_t tap(const char* channel, ext::tap_callback callback, void* context,
                    std::uint64_t* tap_id);
  std::uint32_t untap(std::uint64_t tap_id);
  std::uint32_t inject(const char* channel, const void* bytes, std::uint64_t size);

 private:
  friend class channel_impl;
  friend class subscription_impl;

  struct queued_message {
    channel_impl* channel;
    message_impl* message;  // library-owned sealed copy
    std::uint64_t seq;
    bool injected;  // from parlo_inject: no tap sees it
  };

  explicit bus_impl(std::string name) : name_(std::move(name)) {}
  ~bus_impl();

  bool on_delivery_thread() const;
  // Stops delivery; from the delivery thread itself, the thread finishes the
  // teardown once the running callback returns.
  void shut_down();

  // Channel operations.
  std::uint32_t post(channel_impl& channel, parlo::message* message);
  std::uint32_t enqueue(channel_impl& channel, message_impl* copy, bool injected,
                        const char* function);
  parlo::subscription* create_subscription(channel_impl& channel);
  std::uint32_t destroy_subscription(channel_impl& channel, parlo::subscription* subscription);
  std::uint32_t subscription_count(channel_impl& channel);
  std::uint32_t listen(subscription_impl& subscription, message_callback callback, void* context,
                       std::uint32_t flags);
  bool is_listening(subscription_impl& subscription);

  channel_impl* find_channel_locked(std::string_view name);
  // Waits until `callee` is no longer running its callback.
  void wait_not_running_locked(std::unique_lock<srw_mutex>& lock, const void* callee);
  void notify_progress_locked();

  // The delivery thread.
  void run();
  void deliver_locked(std::unique_lock<srw_mutex>& lock, const queued_message& item);
  void run_taps_locked(std::unique_lock<srw_mutex>& lock, const queued_message& item);
  void run_subscriptions_locked(std::unique_lock<srw_mutex>& lock, const queued_message& item);

  const std::string name_;
  winapi::unique_module module_;  // released after thread_ has ended
  std::thread thread_;

  srw_mutex mutex_;
  srw_condition_variable work_cv_;      // the delivery thread waits for work
  srw_condition_variable progress_cv_;  // flush and removals wait for the delivery thread
  unsigned progress_waiters_ = 0;
  std::map<std::string, std::unique_ptr<channel_impl>, std::less<>> channels_;
  std::unordered_map<std::uint64_t, channel_impl*> tap_channels_;
  std::uint64_t next_tap_id_ = 1;
  std::deque<queued_message> queue_;
  std::uint64_t posted_seq_ = 0;     // sequence number of the last queued message
  std::uint64_t delivered_seq_ = 0;  // of the last message whose delivery ended
  const void* running_ = nullptr;    // subscription_impl or tap_entry in its callback
  channel_impl* walking_ = nullptr;  // channel whose lists the delivery thread walks
  bool closing_ = false;             // destroy_bus began: refuse new work
  bool stop_ = false;                // the delivery thread leaves
  bool teardown_on_thread_ = false;  // destroy_bus came from a callback
};

}  // namespace parlo::impl
