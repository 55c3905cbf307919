#include "bus_impl.h"

#include <windows.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <new>
#include <system_error>
#include <unordered_set>

#include "diagnostics.h"
#include "message_codec.h"
#include "message_impl.h"

namespace parlo::impl {
namespace {

// The bus whose delivery thread this is; null on every other thread.
thread_local bus_impl* t_delivering_bus = nullptr;

struct bus_registry {
  srw_mutex mutex;
  std::unordered_set<const parlo::bus*> live;
};

bus_registry& buses() {
  static bus_registry instance;
  return instance;
}

// Empty, too long or null names are refused with a line under `function`.
bool valid_name(const char* name, const char* function, const char* what) {
  if (name == nullptr) {
    log_line(level_error, function) << what << " is nullptr";
    return false;
  }
  const std::size_t length = std::strlen(name);
  if (length == 0 || length > max_name_length) {
    log_line(level_error, function)
        << what << " length " << length << " outside 1.." << max_name_length;
    return false;
  }
  return true;
}

template <typename T>
std::size_t count_present(const std::vector<T*>& list) {
  return static_cast<std::size_t>(
      std::count_if(list.begin(), list.end(), [](const T* entry) { return entry != nullptr; }));
}

template <typename T>
void compact(std::vector<T*>& list) {
  list.erase(std::remove(list.begin(), list.end(), nullptr), list.end());
}

// A reference on parlo.dll, held by each bus while its delivery thread may
// run the library's code: a host that unloads the library with a bus still
// alive leaks that bus instead of crashing in unmapped code.
const char module_anchor = 0;

winapi::unique_module reference_this_library() {
  HMODULE self = nullptr;
  if (!::GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS,
                            reinterpret_cast<LPCWSTR>(&module_anchor), &self)) {
    const DWORD error = ::GetLastError();
    log_line(level_warning, "parlo::create_bus") << "GetModuleHandleEx err=" << error;
  }
  return winapi::unique_module(self);
}

}  // namespace

// --- subscription ----------------------------------------------------------

bool subscription_impl::is_listening() { return channel_.bus_.is_listening(*this); }

std::uint64_t subscription_impl::delivered_count() { return delivered_.load(); }

std::uint32_t subscription_impl::reserved_2() { return error_not_implemented; }

parlo::channel* subscription_impl::get_subscription_channel() { return &channel_; }

std::uint32_t subscription_impl::listen(message_callback callback, void* context,
                                        std::uint32_t flags) {
  return channel_.bus_.listen(*this, callback, context, flags);
}

// --- channel -----------------------------------------------------------------

channel_impl::~channel_impl() {
  for (subscription_impl* subscription : subscriptions_) delete subscription;
  for (tap_entry* tap : taps_) delete tap;
}

std::uint32_t channel_impl::post(parlo::message* message) { return bus_.post(*this, message); }

parlo::bus* channel_impl::get_bus() { return &bus_; }

std::uint32_t channel_impl::subscription_count() { return bus_.subscription_count(*this); }

std::uint32_t channel_impl::reserved_4() { return error_not_implemented; }

parlo::subscription* channel_impl::create_subscription() { return bus_.create_subscription(*this); }

std::uint32_t channel_impl::destroy_subscription(parlo::subscription* subscription) {
  return bus_.destroy_subscription(*this, subscription);
}

// --- bus: life -----------------------------------------------------------------

bus_impl* bus_impl::create(const char* name) {
  if (!valid_name(name, "parlo::create_bus", "name")) return nullptr;
  bus_impl* bus = nullptr;
  try {
    bus = new bus_impl(name);
    bus->module_ = reference_this_library();
    bus->thread_ = std::thread(&bus_impl::run, bus);
  } catch (const std::system_error& error) {
    log_line(level_error, "parlo::create_bus") << "delivery thread failed: " << error.what();
    delete bus;
    return nullptr;
  } catch (const std::bad_alloc&) {
    log_line(level_error, "parlo::create_bus") << "out of memory";
    delete bus;
    return nullptr;
  }
  try {
    bus_registry& r = buses();
    std::lock_guard<srw_mutex> lock(r.mutex);
    r.live.insert(bus);
  } catch (const std::bad_alloc&) {
    log_line(level_error, "parlo::create_bus") << "out of memory";
    bus->shut_down();
    return nullptr;
  }
  return bus;
}

bus_impl* bus_impl::find_live(parlo::bus* candidate) {
  bus_registry& r = buses();
  std::lock_guard<srw_mutex> lock(r.mutex);
  return r.live.count(candidate) != 0 ? static_cast<bus_impl*>(candidate) : nullptr;
}

bool bus_impl::destroy(parlo::bus* candidate) {
  {
    bus_registry& r = buses();
    std::lock_guard<srw_mutex> lock(r.mutex);
    if (r.live.erase(candidate) == 0) return false;
  }
  static_cast<bus_impl*>(candidate)->shut_down();
  return true;
}

void bus_impl::shut_down() {
  // Joining from the delivery thread would wait for ourselves: run() frees
  // the bus when the callback that called us returns.
  const bool from_callback = on_delivery_thread();
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    closing_ = true;
    stop_ = true;
    teardown_on_thread_ = from_callback;
  }
  if (from_callback) return;
  work_cv_.notify_all();
  if (thread_.joinable()) thread_.join();
  delete this;
}

bus_impl::~bus_impl() {
  for (const queued_message& item : queue_) message_impl::destroy(item.message);
  // channels_ frees the channels, which free their subscriptions and taps.
}

bool bus_impl::on_delivery_thread() const { return t_delivering_bus == this; }

// --- bus: operations ---------------------------------------------------------

parlo::message* bus_impl::create_message(std::uint32_t kind) {
  if (kind != 0) {
    log_line(level_error, "parlo::bus::create_message") << "unknown kind " << kind;
    return nullptr;
  }
  try {
    return message_impl::create(codec::message_content{}, /* library_owned */ false);
  } catch (const std::bad_alloc&) {
    log_line(level_error, "parlo::bus::create_message") << "out of memory";
    return nullptr;
  }
}

std::uint32_t bus_impl::create_channel(const char* name) {
  const char* const function = "parlo::bus::create_channel";
  if (!valid_name(name, function, "name")) return error_invalid_parameter;
  try {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (!closing_) {
      if (find_channel_locked(name) == nullptr)
        channels_.emplace(name, std::make_unique<channel_impl>(*this, name));
      return success;
    }
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory";
    return error_not_enough_memory;
  }
  log_line(level_error, function) << "bus " << name_ << " is being destroyed";
  return error_invalid_state;
}

std::uint32_t bus_impl::flush(std::uint32_t timeout_ms) {
  if (on_delivery_thread()) {
    log_line(level_error, "parlo::bus::flush") << "called on the delivery thread";
    return error_possible_deadlock;
  }
  std::unique_lock<srw_mutex> lock(mutex_);
  const std::uint64_t target = posted_seq_;
  const auto done = [&] { return delivered_seq_ >= target || stop_; };
  ++progress_waiters_;
  bool reached = true;
  if (timeout_ms == INFINITE) {
    progress_cv_.wait(lock, done);
  } else {
    reached = progress_cv_.wait_for(lock, std::chrono::milliseconds(timeout_ms), done);
  }
  --progress_waiters_;
  if (!reached) return error_timeout;
  return delivered_seq_ >= target ? success : error_invalid_state;
}

parlo::channel* bus_impl::get_channel(const char* name) {
  if (name == nullptr) {
    log_line(level_error, "parlo::bus::get_channel") << "name is nullptr";
    return nullptr;
  }
  std::lock_guard<srw_mutex> lock(mutex_);
  return find_channel_locked(name);
}

std::uint32_t bus_impl::channel_count() {
  std::lock_guard<srw_mutex> lock(mutex_);
  return static_cast<std::uint32_t>(channels_.size());
}

channel_impl* bus_impl::find_channel_locked(std::string_view name) {
  const auto it = channels_.find(name);
  return it == channels_.end() ? nullptr : it->second.get();
}

std::uint32_t bus_impl::post(channel_impl& channel, parlo::message* message) {
  const char* const function = "parlo::channel::post";
  if (message == nullptr) {
    log_line(level_error, function) << "message is nullptr";
    return error_invalid_parameter;
  }
  message_impl* source = message_impl::find_live(message);
  if (source == nullptr) {
    log_line(level_error, function) << "not a live message of this library (released?)";
    return error_invalid_parameter;
  }
  if (source->incomplete()) {
    // Delivered, it would reach its receivers without the blob they expect.
    log_line(level_error, function) << "channel " << channel.name_
                                    << ": a set_blob on the message was refused; not posted";
    return error_invalid_data;
  }
  message_impl* copy = nullptr;
  try {
    copy = message_impl::create(source->content(), /* library_owned */ true);
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory";
    return error_not_enough_memory;
  }
  return enqueue(channel, copy, /* injected */ false, function);
}

std::uint32_t bus_impl::enqueue(channel_impl& channel, message_impl* copy, bool injected,
                                const char* function) {
  std::uint32_t result = success;
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (closing_) {
      result = error_invalid_state;
    } else if (queue_.size() >= max_queued_messages) {
      result = error_not_enough_quota;
    } else {
      try {
        queue_.push_back(queued_message{&channel, copy, posted_seq_ + 1, injected});
        ++posted_seq_;
      } catch (const std::bad_alloc&) {
        result = error_not_enough_memory;
      }
    }
  }
  if (result == success) {
    work_cv_.notify_one();
    return success;
  }
  message_impl::destroy(copy);
  log_line(level_error, function) << "channel " << channel.name_ << ": "
                                  << (result == error_invalid_state      ? "bus is being destroyed"
                                      : result == error_not_enough_quota ? "delivery queue is full"
                                                                         : "out of memory");
  return result;
}

parlo::subscription* bus_impl::create_subscription(channel_impl& channel) {
  const char* const function = "parlo::channel::create_subscription";
  try {
    auto created = std::make_unique<subscription_impl>(channel);
    std::lock_guard<srw_mutex> lock(mutex_);
    if (!closing_) {
      channel.subscriptions_.push_back(created.get());
      return created.release();
    }
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory";
    return nullptr;
  }
  log_line(level_error, function) << "bus " << name_ << " is being destroyed";
  return nullptr;
}

std::uint32_t bus_impl::destroy_subscription(channel_impl& channel,
                                             parlo::subscription* subscription) {
  const char* const function = "parlo::channel::destroy_subscription";
  if (subscription == nullptr) {
    log_line(level_error, function) << "subscription is nullptr";
    return error_invalid_parameter;
  }
  std::unique_lock<srw_mutex> lock(mutex_);
  auto& list = channel.subscriptions_;
  // Compared as pointers only: a stray pointer is never dereferenced.
  const auto it = std::find_if(list.begin(), list.end(), [&](const subscription_impl* entry) {
    return entry != nullptr && static_cast<const parlo::subscription*>(entry) == subscription;
  });
  if (it == list.end()) {
    lock.unlock();
    log_line(level_error, function) << "not a subscription of channel " << channel.name_;
    return error_not_found;
  }
  subscription_impl* found = *it;
  if (walking_ == &channel) {
    *it = nullptr;
  } else {
    list.erase(it);
  }
  found->listening_ = false;
  if (running_ == found && on_delivery_thread()) {
    // From inside its own callback: that call is the last one.
    found->free_after_call_ = true;
    return success;
  }
  wait_not_running_locked(lock, found);
  lock.unlock();
  delete found;
  return success;
}

std::uint32_t bus_impl::subscription_count(channel_impl& channel) {
  std::lock_guard<srw_mutex> lock(mutex_);
  return static_cast<std::uint32_t>(count_present(channel.subscriptions_));
}

std::uint32_t bus_impl::listen(subscription_impl& subscription, message_callback callback,
                               void* context, std::uint32_t flags) {
  const char* const function = "parlo::subscription::listen";
  if (callback == nullptr || flags != 0) {
    log_line(level_error, function)
        << (callback == nullptr ? "callback is nullptr" : "unknown flags");
    return error_invalid_parameter;
  }
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (!subscription.listening_ && !closing_) {
      subscription.callback_ = callback;
      subscription.context_ = context;
      subscription.start_seq_ = posted_seq_;
      subscription.listening_ = true;
      return success;
    }
  }
  log_line(level_error, function) << "already listening, or bus " << name_ << " is being destroyed";
  return error_invalid_state;
}

bool bus_impl::is_listening(subscription_impl& subscription) {
  std::lock_guard<srw_mutex> lock(mutex_);
  return subscription.listening_;
}

// --- bus: IPC extension ----------------------------------------------------------

std::uint32_t bus_impl::tap(const char* channel, ext::tap_callback callback, void* context,
                            std::uint64_t* tap_id) {
  const char* const function = "parlo_tap";
  if (tap_id != nullptr) *tap_id = 0;
  if (callback == nullptr || tap_id == nullptr) {
    log_line(level_error, function) << "callback or tap_id is nullptr";
    return error_invalid_parameter;
  }
  if (!valid_name(channel, function, "channel")) return error_invalid_parameter;
  try {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (!closing_) {
      channel_impl* target = find_channel_locked(channel);
      if (target == nullptr) {
        auto created = std::make_unique<channel_impl>(*this, channel);
        target = created.get();
        channels_.emplace(channel, std::move(created));
      }
      auto entry =
          std::make_unique<tap_entry>(tap_entry{next_tap_id_, callback, context, posted_seq_});
      tap_channels_.emplace(entry->id, target);
      try {
        target->taps_.push_back(entry.get());
      } catch (...) {
        tap_channels_.erase(entry->id);
        throw;
      }
      *tap_id = entry.release()->id;
      ++next_tap_id_;
      return success;
    }
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory";
    return error_not_enough_memory;
  }
  log_line(level_error, function) << "bus " << name_ << " is being destroyed";
  return error_invalid_state;
}

std::uint32_t bus_impl::untap(std::uint64_t tap_id) {
  std::unique_lock<srw_mutex> lock(mutex_);
  const auto where = tap_channels_.find(tap_id);
  if (where == tap_channels_.end()) {
    lock.unlock();
    log_line(level_error, "parlo_untap") << "no tap " << tap_id;
    return error_not_found;
  }
  channel_impl& channel = *where->second;
  tap_channels_.erase(where);
  auto& list = channel.taps_;
  const auto it = std::find_if(list.begin(), list.end(), [&](const tap_entry* entry) {
    return entry != nullptr && entry->id == tap_id;
  });
  if (it == list.end()) return error_not_found;  // the id table and the lists agree
  tap_entry* found = *it;
  if (walking_ == &channel) {
    *it = nullptr;
  } else {
    list.erase(it);
  }
  if (running_ == found && on_delivery_thread()) {
    found->free_after_call = true;
    return success;
  }
  wait_not_running_locked(lock, found);
  lock.unlock();
  delete found;
  return success;
}

std::uint32_t bus_impl::inject(const char* channel, const void* bytes, std::uint64_t size) {
  const char* const function = "parlo_inject";
  if (bytes == nullptr || size > ext::max_wire_size) {
    if (bytes == nullptr) {
      log_line(level_error, function) << "bytes is nullptr";
    } else {
      log_line(level_error, function) << size << " bytes, more than " << ext::max_wire_size;
    }
    return error_invalid_parameter;
  }
  if (!valid_name(channel, function, "channel")) return error_invalid_parameter;
  channel_impl* target = nullptr;
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    target = find_channel_locked(channel);
  }
  if (target == nullptr) {
    log_line(level_warning, function) << "no channel " << channel;
    return error_not_found;
  }
  message_impl* message = nullptr;
  try {
    codec::message_content content;
    const codec::status decoded = codec::decode(bytes, static_cast<std::size_t>(size), content);
    if (decoded != codec::status::ok) {
      log_line(level_error, function) << "channel " << channel << ": undecodable message ("
                                      << codec::status_text(decoded) << ", " << size << " bytes)";
      return error_invalid_data;
    }
    message = message_impl::create(std::move(content), /* library_owned */ true);
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory";
    return error_not_enough_memory;
  }
  return enqueue(*target, message, /* injected */ true, function);
}

// --- delivery thread -----------------------------------------------------------

void bus_impl::wait_not_running_locked(std::unique_lock<srw_mutex>& lock, const void* callee) {
  ++progress_waiters_;
  progress_cv_.wait(lock, [&] { return running_ != callee; });
  --progress_waiters_;
}

void bus_impl::notify_progress_locked() {
  if (progress_waiters_ != 0) progress_cv_.notify_all();
}

void bus_impl::run() {
  t_delivering_bus = this;
  std::unique_lock<srw_mutex> lock(mutex_);
  for (;;) {
    work_cv_.wait(lock, [this] { return stop_ || !queue_.empty(); });
    if (stop_) break;
    const queued_message item = queue_.front();
    queue_.pop_front();
    deliver_locked(lock, item);
    delivered_seq_ = item.seq;
    notify_progress_locked();
    message_impl::destroy(item.message);
  }
  if (teardown_on_thread_) {
    // destroy_bus was called from a callback of this bus and returned at
    // once; nobody joins this thread.
    // This thread still runs the library's code after the host's
    // destroy_bus has returned: its reference stays taken, and the library
    // stays loaded for the rest of the process.
    lock.unlock();
    static_cast<void>(module_.release());
    thread_.detach();
    delete this;
  }
}

void bus_impl::deliver_locked(std::unique_lock<srw_mutex>& lock, const queued_message& item) {
  walking_ = item.channel;
  if (!item.injected && !item.channel->taps_.empty()) run_taps_locked(lock, item);
  run_subscriptions_locked(lock, item);
  walking_ = nullptr;
  compact(item.channel->taps_);
  compact(item.channel->subscriptions_);
}

void bus_impl::run_taps_locked(std::unique_lock<srw_mutex>& lock, const queued_message& item) {
  channel_impl& channel = *item.channel;
  lock.unlock();
  std::vector<unsigned char> bytes;
  codec::status encoded = codec::status::too_large;
  try {
    encoded = codec::encode(item.message->content(), bytes);
  } catch (const std::bad_alloc&) {
  }
  if (encoded != codec::status::ok) {
    // set_blob keeps every message within the limits; only memory can fail.
    log_line(level_error, "parlo::bus::deliver")
        << "channel " << channel.name_ << ": taps skip a message: " << codec::status_text(encoded);
  }
  lock.lock();
  if (encoded != codec::status::ok) return;
  for (std::size_t i = 0; i < channel.taps_.size() && !closing_; ++i) {
    tap_entry* tap = channel.taps_[i];
    if (tap == nullptr || tap->start_seq >= item.seq) continue;
    const ext::tap_callback callback = tap->callback;
    void* const context = tap->context;
    running_ = tap;
    lock.unlock();
    try {
      callback(channel.name_.c_str(), bytes.data(), bytes.size(), context);
    } catch (...) {
      log_line(level_error, "parlo::bus::deliver")
          << "a tap of channel " << channel.name_ << " threw";
    }
    lock.lock();
    running_ = nullptr;
    if (tap->free_after_call) delete tap;
    notify_progress_locked();
  }
}

void bus_impl::run_subscriptions_locked(std::unique_lock<srw_mutex>& lock,
                                        const queued_message& item) {
  channel_impl& channel = *item.channel;
  for (std::size_t i = 0; i < channel.subscriptions_.size() && !closing_; ++i) {
    subscription_impl* subscription = channel.subscriptions_[i];
    if (subscription == nullptr || !subscription->listening_ ||
        subscription->start_seq_ >= item.seq)
      continue;
    const message_callback callback = subscription->callback_;
    void* const context = subscription->context_;
    running_ = subscription;
    lock.unlock();
    try {
      callback(item.message, context);
    } catch (...) {
      log_line(level_error, "parlo::bus::deliver")
          << "a callback of channel " << channel.name_ << " threw";
    }
    lock.lock();
    subscription->delivered_.fetch_add(1);
    running_ = nullptr;
    if (subscription->free_after_call_) delete subscription;
    notify_progress_locked();
  }
}

}  // namespace parlo::impl
