// parlo.dll through its exports and slots, loaded from the test's folder the
// way the component loads it.
#include <gtest/gtest.h>
#include <windows.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bus/parlo/parlo.h"
#include "bus/parlo/parlo_ext.h"
#include "platform/handles.h"
#include "platform/win_api.h"

namespace {

using namespace std::chrono_literals;

constexpr std::uint32_t wait_ms = 5000;

// The library, loaded once for the program.
struct library {
  winapi::unique_module module;
  parlo::create_bus_fn create_bus;
  parlo::destroy_bus_fn destroy_bus;
  parlo::ext::tap_fn tap;
  parlo::ext::untap_fn untap;
  parlo::ext::inject_fn inject;
  parlo::ext::set_log_fn set_log;

  library()
      : module(winapi::load_library(
            (winapi::module_directory(winapi::current_module()) + L"parlo.dll").c_str())),
        create_bus(resolve<parlo::create_bus_fn>("create_bus")),
        destroy_bus(resolve<parlo::destroy_bus_fn>("destroy_bus")),
        tap(resolve<parlo::ext::tap_fn>("parlo_tap")),
        untap(resolve<parlo::ext::untap_fn>("parlo_untap")),
        inject(resolve<parlo::ext::inject_fn>("parlo_inject")),
        set_log(resolve<parlo::ext::set_log_fn>("parlo_set_log")) {}

  template <typename Fn>
  Fn resolve(const char* name) {
    return winapi::get_proc_address_as<Fn>(module.get(), name);
  }
};

library& lib() {
  static library instance;
  return instance;
}

// The library's diagnostic lines, "function: text".
struct log_record {
  std::mutex mutex;
  std::vector<std::string> lines;

  static void write(std::uint32_t, const char* function, const char* text, void* context) {
    auto* self = static_cast<log_record*>(context);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->lines.push_back(std::string(function) + ": " + text);
  }
  bool has(const std::string& part) {
    std::lock_guard<std::mutex> lock(mutex);
    for (const std::string& line : lines)
      if (line.find(part) != std::string::npos) return true;
    return false;
  }
  void clear() {
    std::lock_guard<std::mutex> lock(mutex);
    lines.clear();
  }
};

log_record g_log;

// What a subscription or tap received.
struct received {
  std::uint32_t id;
  std::string params;  // blob "params"
  DWORD thread;
};

struct recorder {
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<received> items;

  void add(received item) {
    {
      std::lock_guard<std::mutex> lock(mutex);
      items.push_back(std::move(item));
    }
    changed.notify_all();
  }
  bool wait_for(std::size_t count) {
    std::unique_lock<std::mutex> lock(mutex);
    return changed.wait_for(lock, std::chrono::milliseconds(wait_ms),
                            [&] { return items.size() >= count; });
  }
  std::vector<received> snapshot() {
    std::lock_guard<std::mutex> lock(mutex);
    return items;
  }
  std::size_t size() {
    std::lock_guard<std::mutex> lock(mutex);
    return items.size();
  }
};

std::string blob_text(parlo::message* message, const char* name) {
  std::uint64_t size = 0;
  const void* bytes = message->get_blob(name, &size);
  return bytes == nullptr ? std::string("<absent>")
                          : std::string(static_cast<const char*>(bytes), size);
}

void record_message(parlo::message* message, void* context) {
  static_cast<recorder*>(context)->add(
      received{message->message_id(), blob_text(message, "params"), ::GetCurrentThreadId()});
}

// A message with `id` and, unless null, blob "params".
parlo::message* make_message(parlo::bus* bus, std::uint32_t id, const char* params = nullptr) {
  parlo::message* message = bus->create_message(0);
  if (message == nullptr) return nullptr;
  message->set_message_id(id);
  if (params != nullptr) message->set_blob("params", params, std::strlen(params));
  message->seal();
  return message;
}

std::uint32_t post(parlo::channel* channel, std::uint32_t id, const char* params = nullptr) {
  parlo::message* message = make_message(channel->get_bus(), id, params);
  if (message == nullptr) return parlo::error_not_enough_memory;
  const std::uint32_t result = channel->post(message);
  message->release();
  return result;
}

// Holds the delivery thread of a bus inside a callback until opened, so that
// a test controls what is queued behind it.
struct gate {
  std::mutex mutex;
  std::condition_variable cv;
  bool entered = false;
  bool open = false;

  static void hold(parlo::message*, void* context) {
    auto* self = static_cast<gate*>(context);
    std::unique_lock<std::mutex> lock(self->mutex);
    self->entered = true;
    self->cv.notify_all();
    // Bounded, so that a failing test cannot hold the bus for ever.
    self->cv.wait_for(lock, 20s, [&] { return self->open; });
  }
  bool wait_entered() {
    std::unique_lock<std::mutex> lock(mutex);
    return cv.wait_for(lock, std::chrono::milliseconds(wait_ms), [&] { return entered; });
  }
  void release() {
    {
      std::lock_guard<std::mutex> lock(mutex);
      open = true;
    }
    cv.notify_all();
  }
};

class parlo_test : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { lib().set_log(&log_record::write, &g_log); }
  static void TearDownTestSuite() { lib().set_log(nullptr, nullptr); }

  void SetUp() override {
    g_log.clear();
    bus_ = lib().create_bus("test_bus");
    ASSERT_NE(nullptr, bus_);
  }
  void TearDown() override {
    if (bus_ != nullptr) lib().destroy_bus(bus_);
  }

  parlo::channel* channel(const char* name) {
    EXPECT_EQ(0u, bus_->create_channel(name));
    return bus_->get_channel(name);
  }
  parlo::subscription* subscribe(parlo::channel* on, parlo::message_callback callback,
                                 void* context) {
    parlo::subscription* subscription = on->create_subscription();
    EXPECT_NE(nullptr, subscription);
    if (subscription != nullptr) {
      EXPECT_EQ(0u, subscription->listen(callback, context, 0));
    }
    return subscription;
  }

  parlo::bus* bus_ = nullptr;
};

// --- the binary contract -----------------------------------------------------------

// Calls slot `index` of `object`'s table directly, as code built against
// another copy of the interface would.
template <typename R, typename... Args, typename T>
R call_slot(T* object, std::size_t index, Args... args) {
  void** table = *reinterpret_cast<void***>(object);
  return reinterpret_cast<R (*)(T*, Args...)>(table[index])(object, args...);
}

TEST_F(parlo_test, fixed_slots_answer_at_their_indices) {
  EXPECT_EQ(0u, (call_slot<std::uint32_t, const char*>(bus_, 2, "raw")));
  auto* raw = call_slot<parlo::channel*, const char*>(bus_, 4, "raw");
  ASSERT_NE(nullptr, raw);
  EXPECT_EQ(bus_->get_channel("raw"), raw);

  auto* message = call_slot<parlo::message*, std::uint32_t>(bus_, 1, 0u);
  ASSERT_NE(nullptr, message);
  call_slot<std::uint32_t, std::uint32_t>(message, 5, 42u);
  EXPECT_EQ(42u, (call_slot<std::uint32_t>(message, 4)));
  EXPECT_EQ(0u, (call_slot<std::uint32_t, const char*, const void*, std::uint64_t>(
                    message, 15, "params", "abc", 3)));
  std::uint64_t size = 0;
  const void* bytes = call_slot<const void*, const char*, std::uint64_t*>(message, 14, "params", &size);
  ASSERT_EQ(3u, size);
  EXPECT_EQ(0, std::memcmp(bytes, "abc", 3));
  call_slot<std::uint32_t>(message, 19);
  EXPECT_TRUE(message->is_sealed());

  recorder got;
  auto* subscription = call_slot<parlo::subscription*>(raw, 5);
  ASSERT_NE(nullptr, subscription);
  EXPECT_EQ(raw, (call_slot<parlo::channel*>(subscription, 3)));
  EXPECT_EQ(0u, (call_slot<std::uint32_t, parlo::message_callback, void*, std::uint32_t>(
                    subscription, 4, &record_message, &got, 0u)));
  EXPECT_EQ(0u, (call_slot<std::uint32_t, parlo::message*>(raw, 1, message)));
  ASSERT_TRUE(got.wait_for(1));
  EXPECT_EQ(42u, got.snapshot()[0].id);
  EXPECT_EQ("abc", got.snapshot()[0].params);
  call_slot<std::uint32_t, parlo::subscription*>(raw, 6, subscription);
  EXPECT_EQ(0u, raw->subscription_count());
  EXPECT_EQ(0u, (call_slot<std::uint32_t>(message, 22)));
}

TEST_F(parlo_test, the_components_sequence_runs_clean) {
  // As the service channel does it: create, look up, subscribe, post and
  // release, unsubscribe, destroy the bus.
  ASSERT_EQ(0u, bus_->create_channel("vorbel_service"));
  parlo::channel* service = bus_->get_channel("vorbel_service");
  ASSERT_NE(nullptr, service);
  recorder got;
  parlo::subscription* subscription = subscribe(service, &record_message, &got);
  ASSERT_EQ(0u, post(service, 2, "listeners"));
  ASSERT_TRUE(got.wait_for(1));
  EXPECT_EQ(2u, got.snapshot()[0].id);
  EXPECT_EQ("listeners", got.snapshot()[0].params);
  ASSERT_EQ(service, subscription->get_subscription_channel());
  EXPECT_EQ(0u, service->destroy_subscription(subscription));
  lib().destroy_bus(bus_);
  bus_ = nullptr;
  EXPECT_FALSE(g_log.has("")) << "a clean run writes no line";
}

// --- channels and delivery ---------------------------------------------------------

TEST_F(parlo_test, creating_a_channel_again_keeps_the_one_channel) {
  parlo::channel* first = channel("twice");
  recorder got;
  parlo::subscription* subscription = subscribe(first, &record_message, &got);
  EXPECT_EQ(0u, bus_->create_channel("twice"));
  EXPECT_EQ(first, bus_->get_channel("twice"));
  EXPECT_EQ(1u, bus_->channel_count());
  EXPECT_STREQ("twice", first->name());
  EXPECT_EQ(1u, first->subscription_count());
  ASSERT_EQ(0u, post(bus_->get_channel("twice"), 1));
  EXPECT_TRUE(got.wait_for(1));
  EXPECT_EQ(0u, first->destroy_subscription(subscription));
}

TEST_F(parlo_test, each_channel_sees_its_posts_in_order_on_the_bus_thread) {
  parlo::channel* a = channel("a");
  parlo::channel* b = channel("b");
  recorder got_a;
  recorder got_b;
  parlo::subscription* on_a = subscribe(a, &record_message, &got_a);
  parlo::subscription* on_b = subscribe(b, &record_message, &got_b);

  // Two posters interleave on both channels; ids carry (poster, sequence).
  constexpr std::uint32_t per_poster = 500;
  std::vector<DWORD> posters(2);
  std::vector<std::thread> threads;
  for (std::uint32_t poster = 0; poster < 2; ++poster) {
    threads.emplace_back([&, poster] {
      posters[poster] = ::GetCurrentThreadId();
      for (std::uint32_t i = 0; i < per_poster; ++i) {
        EXPECT_EQ(0u, post((i % 2) != 0 ? a : b, poster << 16 | i));
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  ASSERT_EQ(0u, bus_->flush(wait_ms));

  const std::vector<received> all_a = got_a.snapshot();
  const std::vector<received> all_b = got_b.snapshot();
  ASSERT_EQ(per_poster, all_a.size());
  ASSERT_EQ(per_poster, all_b.size());
  const DWORD delivery_thread = all_a.front().thread;
  for (const std::vector<received>* list : {&all_a, &all_b}) {
    std::uint32_t next[2] = {0, 0};
    for (const received& item : *list) {
      const std::uint32_t poster = item.id >> 16;
      const std::uint32_t sequence = item.id & 0xFFFF;
      EXPECT_GE(sequence, next[poster]) << "poster " << poster << " out of order";
      next[poster] = sequence + 1;
      EXPECT_EQ(delivery_thread, item.thread) << "one delivery thread per bus";
      EXPECT_NE(posters[0], item.thread);
      EXPECT_NE(posters[1], item.thread);
      EXPECT_NE(::GetCurrentThreadId(), item.thread);
    }
  }
  EXPECT_EQ(per_poster, on_a->delivered_count());
  EXPECT_EQ(0u, a->destroy_subscription(on_a));
  EXPECT_EQ(0u, b->destroy_subscription(on_b));
}

TEST_F(parlo_test, a_subscription_receives_only_what_is_posted_after_listen) {
  parlo::channel* c = channel("late");
  gate held;
  parlo::subscription* blocker = subscribe(channel("block"), &gate::hold, &held);
  ASSERT_EQ(0u, post(bus_->get_channel("block"), 0));
  ASSERT_TRUE(held.wait_entered());

  // Queued behind the gate, posted before listen: not for this subscriber.
  ASSERT_EQ(0u, post(c, 1));
  recorder got;
  parlo::subscription* subscription = subscribe(c, &record_message, &got);
  EXPECT_TRUE(subscription->is_listening());
  ASSERT_EQ(0u, post(c, 2));
  held.release();
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(1u, got.size());
  EXPECT_EQ(2u, got.snapshot()[0].id);
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
  EXPECT_EQ(0u, bus_->get_channel("block")->destroy_subscription(blocker));
}

TEST_F(parlo_test, post_queues_a_copy_that_the_caller_may_change_or_release) {
  parlo::channel* c = channel("copy");
  gate held;
  parlo::subscription* blocker = subscribe(channel("block"), &gate::hold, &held);
  recorder got;
  parlo::subscription* subscription = subscribe(c, &record_message, &got);
  ASSERT_EQ(0u, post(bus_->get_channel("block"), 0));
  ASSERT_TRUE(held.wait_entered());

  parlo::message* message = bus_->create_message(0);
  message->set_message_id(1);
  message->set_blob("params", "first", 5);
  ASSERT_EQ(0u, c->post(message));  // unsealed: post needs no seal
  message->set_message_id(2);
  message->set_blob("params", "second", 6);
  ASSERT_EQ(0u, c->post(message));
  message->set_blob("params", "changed after the last post", 27);
  EXPECT_EQ(0u, message->release());
  held.release();

  ASSERT_EQ(0u, bus_->flush(wait_ms));
  const std::vector<received> all = got.snapshot();
  ASSERT_EQ(2u, all.size());
  EXPECT_EQ(1u, all[0].id);
  EXPECT_EQ("first", all[0].params);
  EXPECT_EQ(2u, all[1].id);
  EXPECT_EQ("second", all[1].params);
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
  EXPECT_EQ(0u, bus_->get_channel("block")->destroy_subscription(blocker));
}

// The delivered message is the library's: read-only, not releasable, copyable.
struct delivered_checks {
  std::atomic<int> done{0};
  std::uint32_t release_result = 0;
  std::uint32_t set_result = 0;
  bool sealed = false;
  parlo::message* kept = nullptr;
};

void check_delivered(parlo::message* message, void* context) {
  auto* checks = static_cast<delivered_checks*>(context);
  checks->release_result = message->release();
  checks->set_result = message->set_blob("params", "x", 1);
  checks->sealed = message->is_sealed();
  checks->kept = message->copy();
  checks->done = 1;
}

TEST_F(parlo_test, a_delivered_message_is_read_only_and_can_be_copied) {
  parlo::channel* c = channel("delivered");
  delivered_checks checks;
  parlo::subscription* subscription = subscribe(c, &check_delivered, &checks);
  ASSERT_EQ(0u, post(c, 9, "payload"));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(1, checks.done.load());
  EXPECT_EQ(parlo::error_access_denied, checks.release_result);
  EXPECT_EQ(parlo::error_access_denied, checks.set_result);
  EXPECT_TRUE(checks.sealed);
  ASSERT_NE(nullptr, checks.kept);
  EXPECT_FALSE(checks.kept->is_sealed());
  EXPECT_EQ(9u, checks.kept->message_id());
  EXPECT_EQ("payload", blob_text(checks.kept, "params"));
  EXPECT_EQ(0u, checks.kept->release());
  EXPECT_TRUE(g_log.has("parlo::message::release: a delivered message belongs to the library"));
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
}

// --- ending subscriptions ------------------------------------------------------------

// Counts calls, and calls that came after the test declared the subscription
// gone.
struct counted {
  std::atomic<std::uint64_t> calls{0};
  std::atomic<std::uint64_t> late{0};
  std::atomic<bool> inside{false};
  std::atomic<bool> gone{false};

  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<counted*>(context);
    self->inside = true;
    if (self->gone) ++self->late;
    ++self->calls;
    // Widen the window in which destroy_subscription meets a running call.
    for (volatile int spin = 0; spin < 2000; ++spin) {
    }
    self->inside = false;
  }
};

TEST_F(parlo_test, no_callback_runs_after_destroy_subscription_under_concurrent_posting) {
  parlo::channel* c = channel("busy");
  std::atomic<bool> stop{false};
  std::vector<std::thread> posters;
  for (int i = 0; i < 2; ++i) {
    posters.emplace_back([&] {
      // Short bursts keep the queue short, so that each round's flush is quick.
      for (int sent = 1; !stop; ++sent) {
        EXPECT_EQ(0u, post(c, 1));
        if (sent % 16 == 0) {
          EXPECT_EQ(0u, bus_->flush(wait_ms));
        }
      }
    });
  }
  const auto deadline = std::chrono::steady_clock::now() + 20s;
  int rounds = 0;
  std::uint64_t total_late = 0;
  for (; rounds < 300 && std::chrono::steady_clock::now() < deadline; ++rounds) {
    auto target = std::make_unique<counted>();
    parlo::subscription* subscription = subscribe(c, &counted::on_message, target.get());
    // Let it receive a few, then end it while posts keep coming.
    const auto until = std::chrono::steady_clock::now() + 2s;
    while (target->calls < 3 && std::chrono::steady_clock::now() < until) std::this_thread::yield();
    ASSERT_GE(target->calls.load(), 3u) << "round " << rounds;
    ASSERT_EQ(0u, c->destroy_subscription(subscription));
    EXPECT_FALSE(target->inside.load()) << "round " << rounds;
    target->gone = true;
    const std::uint64_t at_return = target->calls;
    // Any call still to come would follow messages already queued.
    ASSERT_EQ(0u, bus_->flush(wait_ms));
    total_late += target->late;
    EXPECT_EQ(at_return, target->calls.load()) << "round " << rounds;
  }
  stop = true;
  for (std::thread& poster : posters) poster.join();
  EXPECT_EQ(0u, total_late);
  EXPECT_EQ(0u, c->subscription_count());
  EXPECT_GE(rounds, 20);
}

// Destroys its own subscription from inside its callback on the first
// message, and posts one more message on the same channel.
struct self_ending {
  parlo::channel* channel = nullptr;
  parlo::subscription* subscription = nullptr;
  std::atomic<int> calls{0};
  std::uint32_t destroy_result = 99;
  std::uint32_t post_result = 99;
  std::uint32_t flush_result = 0;

  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<self_ending*>(context);
    if (self->calls++ != 0) return;
    self->flush_result = self->channel->get_bus()->flush(wait_ms);
    self->post_result = post(self->channel, 7);
    self->destroy_result = self->channel->destroy_subscription(self->subscription);
  }
};

TEST_F(parlo_test, a_callback_may_end_its_own_subscription_and_post) {
  self_ending state;
  state.channel = channel("self");
  recorder other;
  state.subscription = subscribe(state.channel, &self_ending::on_message, &state);
  parlo::subscription* watcher = subscribe(state.channel, &record_message, &other);
  ASSERT_EQ(0u, post(state.channel, 1));
  ASSERT_EQ(0u, post(state.channel, 2));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(0u, bus_->flush(wait_ms));  // the post from inside the callback
  EXPECT_EQ(1, state.calls.load());
  EXPECT_EQ(0u, state.destroy_result);
  EXPECT_EQ(0u, state.post_result);
  EXPECT_EQ(parlo::error_possible_deadlock, state.flush_result);
  EXPECT_EQ(1u, state.channel->subscription_count());
  const std::vector<received> seen = other.snapshot();
  ASSERT_EQ(3u, seen.size());
  EXPECT_EQ(7u, seen[2].id) << "posted from the callback, delivered after the earlier posts";
  EXPECT_EQ(0u, state.channel->destroy_subscription(watcher));
}

TEST_F(parlo_test, destroy_subscription_refuses_what_is_not_its_own) {
  parlo::channel* a = channel("a");
  parlo::channel* b = channel("b");
  recorder got;
  parlo::subscription* on_a = subscribe(a, &record_message, &got);
  EXPECT_EQ(parlo::error_not_found, b->destroy_subscription(on_a));
  EXPECT_TRUE(g_log.has("parlo::channel::destroy_subscription: not a subscription of channel b"));
  int not_a_subscription = 0;
  EXPECT_EQ(parlo::error_not_found,
            a->destroy_subscription(reinterpret_cast<parlo::subscription*>(&not_a_subscription)));
  EXPECT_EQ(parlo::error_invalid_parameter, a->destroy_subscription(nullptr));
  ASSERT_EQ(0u, post(a, 5));
  EXPECT_TRUE(got.wait_for(1)) << "the refused calls left the subscription alone";
  EXPECT_EQ(0u, a->destroy_subscription(on_a));
}

// --- ending buses ----------------------------------------------------------------------

// Destroys the bus from inside a callback of that bus.
struct bus_ender {
  parlo::bus* bus = nullptr;
  std::atomic<int> calls{0};
  std::atomic<DWORD> thread{0};
  std::uint32_t post_after = 99;

  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<bus_ender*>(context);
    ++self->calls;
    self->thread = ::GetCurrentThreadId();
    lib().destroy_bus(self->bus);
    // The bus is closing but still there until this callback returns.
    self->post_after = post(self->bus->get_channel("end"), 2);
  }
};

TEST_F(parlo_test, destroy_bus_from_a_callback_returns_and_tears_down_afterwards) {
  bus_ender ender;
  ender.bus = bus_;
  parlo::channel* c = channel("end");
  subscribe(c, &bus_ender::on_message, &ender);
  recorder second;
  subscribe(c, &record_message, &second);
  ASSERT_EQ(0u, post(c, 1));
  ASSERT_EQ(0u, post(c, 1));
  bus_ = nullptr;  // the callback owns its end

  // The delivery thread leaves once the callback has returned.
  const auto until = std::chrono::steady_clock::now() + 5s;
  while (ender.thread == 0 && std::chrono::steady_clock::now() < until) std::this_thread::yield();
  ASSERT_NE(0u, ender.thread.load());
  winapi::unique_handle thread(::OpenThread(SYNCHRONIZE, FALSE, ender.thread));
  if (thread) {
    EXPECT_EQ(WAIT_OBJECT_0, ::WaitForSingleObject(thread.get(), wait_ms));
  }
  EXPECT_EQ(1, ender.calls.load());
  EXPECT_EQ(parlo::error_invalid_state, ender.post_after);
  EXPECT_EQ(0u, second.size()) << "later subscriptions of the message are skipped";

  g_log.clear();
  lib().destroy_bus(ender.bus);
  EXPECT_TRUE(g_log.has("parlo::destroy_bus: not a live bus"));
}

TEST_F(parlo_test, destroy_bus_stops_callbacks_and_drops_queued_messages) {
  parlo::channel* c = channel("pending");
  counted target;
  subscribe(c, &counted::on_message, &target);
  gate held;
  subscribe(channel("block"), &gate::hold, &held);
  ASSERT_EQ(0u, post(bus_->get_channel("block"), 0));
  ASSERT_TRUE(held.wait_entered());
  for (int i = 0; i < 100; ++i) ASSERT_EQ(0u, post(c, 1));

  // Opens the gate once destroy_bus has begun, which refuses posts.
  std::thread opener([&] {
    const auto until = std::chrono::steady_clock::now() + 5s;
    while (post(c, 1) != parlo::error_invalid_state && std::chrono::steady_clock::now() < until)
      std::this_thread::yield();
    held.release();
  });
  lib().destroy_bus(bus_);  // waits for the gate's callback to return
  bus_ = nullptr;
  target.gone = true;
  opener.join();
  EXPECT_EQ(0u, target.late.load());
  EXPECT_EQ(0u, target.calls.load()) << "queued messages are dropped, not delivered";
}

TEST_F(parlo_test, a_full_queue_refuses_posts_until_it_drains) {
  parlo::channel* c = channel("full");
  gate held;
  subscribe(channel("block"), &gate::hold, &held);
  ASSERT_EQ(0u, post(bus_->get_channel("block"), 0));
  ASSERT_TRUE(held.wait_entered());
  parlo::message* message = make_message(bus_, 1);
  std::uint32_t result = 0;
  std::uint32_t accepted = 0;
  while (accepted <= parlo::max_queued_messages && (result = c->post(message)) == 0) ++accepted;
  EXPECT_EQ(parlo::error_not_enough_quota, result);
  EXPECT_EQ(parlo::max_queued_messages, accepted);
  EXPECT_TRUE(g_log.has("parlo::channel::post: channel full: delivery queue is full"));
  held.release();
  ASSERT_EQ(0u, bus_->flush(wait_ms * 4));
  EXPECT_EQ(0u, c->post(message));
  EXPECT_EQ(0u, message->release());
}

// --- refusals -----------------------------------------------------------------------

TEST_F(parlo_test, bad_bus_and_channel_arguments_are_refused) {
  const std::string too_long(parlo::max_name_length + 1, 'n');
  const std::string longest(parlo::max_name_length, 'n');
  EXPECT_EQ(nullptr, lib().create_bus(nullptr));
  EXPECT_EQ(nullptr, lib().create_bus(""));
  EXPECT_EQ(nullptr, lib().create_bus(too_long.c_str()));
  EXPECT_TRUE(g_log.has("parlo::create_bus: name is nullptr"));
  lib().destroy_bus(nullptr);
  int not_a_bus = 0;
  lib().destroy_bus(reinterpret_cast<parlo::bus*>(&not_a_bus));
  EXPECT_TRUE(g_log.has("parlo::destroy_bus: not a live bus"));

  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(""));
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(too_long.c_str()));
  EXPECT_EQ(0u, bus_->create_channel(longest.c_str()));
  EXPECT_EQ(nullptr, bus_->get_channel(nullptr));
  EXPECT_EQ(nullptr, bus_->get_channel("never created"));
  EXPECT_EQ(nullptr, bus_->create_message(1));
  EXPECT_EQ(1u, bus_->channel_count());

  parlo::channel* c = bus_->get_channel(longest.c_str());
  ASSERT_NE(nullptr, c);
  EXPECT_EQ(parlo::error_invalid_parameter, c->post(nullptr));
  EXPECT_TRUE(g_log.has("parlo::channel::post: message is nullptr"));
  int not_a_message = 0;
  EXPECT_EQ(parlo::error_invalid_parameter,
            c->post(reinterpret_cast<parlo::message*>(&not_a_message)));
  EXPECT_TRUE(g_log.has("not a live message of this library"));
  EXPECT_EQ(parlo::error_not_implemented, c->reserved_4());

  parlo::subscription* subscription = c->create_subscription();
  ASSERT_NE(nullptr, subscription);
  EXPECT_FALSE(subscription->is_listening());
  EXPECT_EQ(parlo::error_invalid_parameter, subscription->listen(nullptr, nullptr, 0));
  recorder got;
  EXPECT_EQ(parlo::error_invalid_parameter, subscription->listen(&record_message, &got, 1));
  EXPECT_EQ(0u, subscription->listen(&record_message, &got, 0));
  EXPECT_EQ(parlo::error_invalid_state, subscription->listen(&record_message, &got, 0));
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
}

TEST_F(parlo_test, bad_message_arguments_are_refused_without_reading_past_them) {
  parlo::message* message = bus_->create_message(0);
  ASSERT_NE(nullptr, message);
  const std::string too_long(parlo::max_name_length + 1, 'n');
  std::uint64_t size = 77;
  EXPECT_EQ(nullptr, message->get_blob(nullptr, &size));
  EXPECT_EQ(0u, size);
  EXPECT_EQ(nullptr, message->get_blob("x", nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob(nullptr, "a", 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", nullptr, 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("", "a", 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob(too_long.c_str(), "a", 1));
  // Sizes the four bytes behind `data` cannot hold: refused before any copy.
  const char data[4] = {};
  EXPECT_EQ(parlo::error_invalid_parameter,
            message->set_blob("x", data, parlo::max_message_size));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", data, ~std::uint64_t{0}));
  EXPECT_TRUE(g_log.has("parlo::message::set_blob: message would exceed"));
  EXPECT_EQ(parlo::error_invalid_parameter, message->remove_blob(nullptr));
  EXPECT_EQ(parlo::error_not_found, message->remove_blob("x"));
  std::uint64_t written = 5;
  EXPECT_EQ(parlo::error_invalid_parameter, message->encode(nullptr, 0, &written));
  EXPECT_EQ(0u, written);
  char small[4];
  EXPECT_EQ(parlo::error_invalid_parameter, message->encode(small, sizeof small, &written));
  EXPECT_EQ(0u, message->blob_count());

  for (std::uint32_t i = 0; i < parlo::max_blob_fields; ++i)
    ASSERT_EQ(0u, message->set_blob(("f" + std::to_string(i)).c_str(), nullptr, 0));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("one more", nullptr, 0));
  EXPECT_EQ(0u, message->set_blob("f0", "replaces", 8)) << "replacing adds no field";
  EXPECT_EQ(parlo::max_blob_fields, message->blob_count());

  message->seal();
  EXPECT_EQ(parlo::error_access_denied, message->set_message_id(3));
  EXPECT_EQ(parlo::error_access_denied, message->set_blob("f0", "a", 1));
  EXPECT_EQ(parlo::error_access_denied, message->remove_blob("f0"));
  EXPECT_EQ(parlo::error_access_denied, message->clear());
  EXPECT_EQ(0u, message->message_id());
  EXPECT_EQ(0u, message->release());
}

TEST_F(parlo_test, message_fields_can_be_listed_copied_removed_and_encoded) {
  parlo::message* message = bus_->create_message(0);
  ASSERT_NE(nullptr, message);
  message->set_message_id(0xA1B2C3D4u);
  const char binary[3] = {'\0', '\x01', '\xFF'};
  ASSERT_EQ(0u, message->set_blob("bin", binary, sizeof binary));
  ASSERT_EQ(0u, message->set_blob("empty", nullptr, 0));
  ASSERT_EQ(0u, message->set_blob("text", "hello", 5));
  ASSERT_EQ(3u, message->blob_count());
  EXPECT_STREQ("bin", message->blob_name(0));
  EXPECT_STREQ("empty", message->blob_name(1));
  EXPECT_STREQ("text", message->blob_name(2));
  EXPECT_EQ(nullptr, message->blob_name(3));

  std::uint64_t size = 9;
  EXPECT_NE(nullptr, message->get_blob("empty", &size)) << "present, without bytes";
  EXPECT_EQ(0u, size);
  size = 9;
  EXPECT_EQ(nullptr, message->get_blob("absent", &size));
  EXPECT_EQ(0u, size);
  EXPECT_EQ(std::string(binary, sizeof binary), blob_text(message, "bin"));

  std::vector<unsigned char> bytes(static_cast<std::size_t>(message->encoded_size()));
  std::uint64_t written = 0;
  ASSERT_EQ(0u, message->encode(bytes.data(), bytes.size(), &written));
  EXPECT_EQ(bytes.size(), written);
  EXPECT_EQ(12u + 3 * 6 + (3 + 3) + (5 + 0) + (4 + 5), written);

  parlo::message* copy = message->copy();
  ASSERT_NE(nullptr, copy);
  EXPECT_EQ(0u, copy->remove_blob("bin"));
  EXPECT_EQ(2u, copy->blob_count());
  EXPECT_STREQ("empty", copy->blob_name(0));
  EXPECT_EQ(3u, message->blob_count()) << "the copy is independent";
  EXPECT_EQ(0u, copy->clear());
  EXPECT_EQ(0u, copy->blob_count());
  EXPECT_EQ(0u, copy->message_id());
  EXPECT_EQ(parlo::error_not_implemented, copy->reserved_10());
  EXPECT_EQ(parlo::error_not_implemented, copy->reserved_21());
  EXPECT_EQ(0u, copy->release());
  EXPECT_EQ(0u, message->release());
}

// --- the IPC extension ------------------------------------------------------------

struct tapped {
  std::string channel;
  std::vector<unsigned char> bytes;
  DWORD thread;
};

struct tap_recorder {
  std::mutex mutex;
  std::vector<tapped> items;

  static void on_tap(const char* channel, const void* bytes, std::uint64_t size, void* context) {
    auto* self = static_cast<tap_recorder*>(context);
    const auto* begin = static_cast<const unsigned char*>(bytes);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->items.push_back(tapped{channel, {begin, begin + size}, ::GetCurrentThreadId()});
  }
  std::vector<tapped> snapshot() {
    std::lock_guard<std::mutex> lock(mutex);
    return items;
  }
};

// The wire form of a message with `id` and blob "params".
std::vector<unsigned char> wire(parlo::bus* bus, std::uint32_t id, const char* params) {
  parlo::message* message = make_message(bus, id, params);
  std::vector<unsigned char> bytes(static_cast<std::size_t>(message->encoded_size()));
  std::uint64_t written = 0;
  EXPECT_EQ(0u, message->encode(bytes.data(), bytes.size(), &written));
  message->release();
  return bytes;
}

TEST_F(parlo_test, taps_see_local_posts_in_order_and_never_injected_messages) {
  tap_recorder taps;
  std::uint64_t tap_id = 0;
  // Tapping creates the channel; the component's create_channel finds it.
  ASSERT_EQ(0u, lib().tap(bus_, "joined", &tap_recorder::on_tap, &taps, &tap_id));
  EXPECT_NE(0u, tap_id);
  parlo::channel* c = bus_->get_channel("joined");
  ASSERT_NE(nullptr, c);
  EXPECT_EQ(0u, bus_->create_channel("joined"));
  EXPECT_EQ(c, bus_->get_channel("joined"));
  recorder local;
  parlo::subscription* subscription = subscribe(c, &record_message, &local);

  ASSERT_EQ(0u, post(c, 1, "one"));
  const std::vector<unsigned char> from_peer = wire(bus_, 50, "from the pipe");
  ASSERT_EQ(0u, lib().inject(bus_, "joined", from_peer.data(), from_peer.size()));
  ASSERT_EQ(0u, post(c, 2, "two"));
  ASSERT_EQ(0u, bus_->flush(wait_ms));

  const std::vector<tapped> seen = taps.snapshot();
  ASSERT_EQ(2u, seen.size()) << "the injected message is not tapped";
  EXPECT_EQ("joined", seen[0].channel);
  EXPECT_EQ(wire(bus_, 1, "one"), seen[0].bytes);
  EXPECT_EQ(wire(bus_, 2, "two"), seen[1].bytes);
  EXPECT_NE(::GetCurrentThreadId(), seen[0].thread);

  const std::vector<received> delivered = local.snapshot();
  ASSERT_EQ(3u, delivered.size()) << "local subscriptions get both kinds, in queue order";
  EXPECT_EQ(1u, delivered[0].id);
  EXPECT_EQ(50u, delivered[1].id);
  EXPECT_EQ("from the pipe", delivered[1].params);
  EXPECT_EQ(2u, delivered[2].id);
  EXPECT_EQ(seen[0].thread, delivered[0].thread) << "taps run on the delivery thread";

  // Bytes the tap gave are what a peer injects: the round trip is exact.
  recorder peer_side;
  parlo::bus* peer = lib().create_bus("peer");
  ASSERT_NE(nullptr, peer);
  ASSERT_EQ(0u, peer->create_channel("joined"));
  parlo::subscription* peer_subscription =
      subscribe(peer->get_channel("joined"), &record_message, &peer_side);
  ASSERT_EQ(0u, lib().inject(peer, "joined", seen[1].bytes.data(), seen[1].bytes.size()));
  ASSERT_TRUE(peer_side.wait_for(1));
  EXPECT_EQ(2u, peer_side.snapshot()[0].id);
  EXPECT_EQ("two", peer_side.snapshot()[0].params);
  EXPECT_EQ(0u, peer->get_channel("joined")->destroy_subscription(peer_subscription));
  lib().destroy_bus(peer);

  EXPECT_EQ(0u, lib().untap(bus_, tap_id));
  ASSERT_EQ(0u, post(c, 3));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  EXPECT_EQ(2u, taps.snapshot().size()) << "nothing after untap";
  EXPECT_EQ(parlo::error_not_found, lib().untap(bus_, tap_id));
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
}

TEST_F(parlo_test, inject_refuses_bad_bytes_unknown_channels_and_dead_buses) {
  parlo::channel* c = channel("in");
  recorder got;
  parlo::subscription* subscription = subscribe(c, &record_message, &got);
  std::vector<unsigned char> bytes = wire(bus_, 4, "ok");

  EXPECT_EQ(parlo::error_not_found, lib().inject(bus_, "no such channel", bytes.data(), bytes.size()));
  EXPECT_EQ(nullptr, bus_->get_channel("no such channel")) << "a peer cannot create channels";
  EXPECT_EQ(parlo::error_invalid_data, lib().inject(bus_, "in", bytes.data(), bytes.size() - 1));
  EXPECT_TRUE(g_log.has("parlo_inject: channel in: undecodable message (truncated"));
  std::vector<unsigned char> garbage(bytes.size(), 0xEE);
  EXPECT_EQ(parlo::error_invalid_data, lib().inject(bus_, "in", garbage.data(), garbage.size()));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().inject(bus_, "in", nullptr, 0));
  EXPECT_EQ(parlo::error_invalid_parameter,
            lib().inject(bus_, "in", bytes.data(), parlo::ext::max_wire_size + 1));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().inject(bus_, nullptr, bytes.data(), bytes.size()));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().inject(nullptr, "in", bytes.data(), bytes.size()));
  int not_a_bus = 0;
  auto* stray = reinterpret_cast<parlo::bus*>(&not_a_bus);
  EXPECT_EQ(parlo::error_invalid_parameter, lib().inject(stray, "in", bytes.data(), bytes.size()));

  tap_recorder taps;
  std::uint64_t id = 1;
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(stray, "in", &tap_recorder::on_tap, &taps, &id));
  EXPECT_EQ(0u, id);
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(bus_, "in", nullptr, &taps, &id));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(bus_, "in", &tap_recorder::on_tap, &taps, nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(bus_, "", &tap_recorder::on_tap, &taps, &id));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().untap(stray, 1));
  EXPECT_EQ(parlo::error_not_found, lib().untap(bus_, 12345));
  EXPECT_TRUE(g_log.has("parlo_untap: not a live bus"));

  ASSERT_EQ(0u, lib().inject(bus_, "in", bytes.data(), bytes.size()));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(1u, got.size()) << "only the good message arrived";
  EXPECT_EQ(4u, got.snapshot()[0].id);
  EXPECT_EQ(0u, c->destroy_subscription(subscription));
}

// A tap that removes itself on its first call; counts calls.
struct self_untap {
  parlo::bus* bus = nullptr;
  std::uint64_t id = 0;
  std::atomic<int> calls{0};
  std::uint32_t result = 99;

  static void on_tap(const char*, const void*, std::uint64_t, void* context) {
    auto* self = static_cast<self_untap*>(context);
    if (self->calls++ == 0) self->result = lib().untap(self->bus, self->id);
  }
};

struct counted_tap {
  std::atomic<std::uint64_t> calls{0};
  std::atomic<std::uint64_t> late{0};
  std::atomic<bool> gone{false};

  static void on_tap(const char*, const void*, std::uint64_t, void* context) {
    auto* self = static_cast<counted_tap*>(context);
    if (self->gone) ++self->late;
    ++self->calls;
  }
};

TEST_F(parlo_test, untap_ends_a_tap_also_from_its_own_call_and_under_posting) {
  self_untap self;
  self.bus = bus_;
  ASSERT_EQ(0u, lib().tap(bus_, "t", &self_untap::on_tap, &self, &self.id));
  parlo::channel* c = bus_->get_channel("t");
  ASSERT_EQ(0u, post(c, 1));
  ASSERT_EQ(0u, post(c, 2));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  EXPECT_EQ(1, self.calls.load());
  EXPECT_EQ(0u, self.result);

  std::atomic<bool> stop{false};
  std::thread poster([&] {
    for (int sent = 1; !stop; ++sent) {
      EXPECT_EQ(0u, post(c, 1));
      if (sent % 16 == 0) {
          EXPECT_EQ(0u, bus_->flush(wait_ms));
        }
    }
  });
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  std::uint64_t late = 0;
  int rounds = 0;
  for (; rounds < 200 && std::chrono::steady_clock::now() < deadline; ++rounds) {
    counted_tap tap;
    std::uint64_t id = 0;
    ASSERT_EQ(0u, lib().tap(bus_, "t", &counted_tap::on_tap, &tap, &id));
    const auto until = std::chrono::steady_clock::now() + 2s;
    while (tap.calls < 2 && std::chrono::steady_clock::now() < until) std::this_thread::yield();
    ASSERT_EQ(0u, lib().untap(bus_, id));
    tap.gone = true;
    ASSERT_EQ(0u, bus_->flush(wait_ms));
    late += tap.late;
  }
  stop = true;
  poster.join();
  EXPECT_EQ(0u, late);
  EXPECT_GE(rounds, 20);
}

TEST_F(parlo_test, the_log_hook_can_be_replaced_and_removed) {
  log_record other;
  lib().set_log(&log_record::write, &other);
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(nullptr));
  lib().set_log(&log_record::write, &g_log);
  EXPECT_TRUE(other.has("parlo::bus::create_channel: name is nullptr"));
  EXPECT_FALSE(g_log.has("create_channel"));
  lib().set_log(nullptr, nullptr);
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(nullptr));  // to the debugger
  lib().set_log(&log_record::write, &g_log);
  EXPECT_FALSE(g_log.has("create_channel"));
}

// --- speed -----------------------------------------------------------------------

// Answers each message on "ping" with one on "pong".
void answer_ping(parlo::message* message, void* context) {
  post(static_cast<parlo::channel*>(context), message->message_id());
}

TEST_F(parlo_test, round_trips_wake_threads_without_polling) {
  parlo::channel* ping = channel("ping");
  parlo::channel* pong = channel("pong");
  parlo::subscription* answerer = subscribe(ping, &answer_ping, pong);
  recorder answers;
  parlo::subscription* listener = subscribe(pong, &record_message, &answers);

  constexpr int rounds = 2000;
  std::vector<double> micros;
  micros.reserve(rounds);
  for (int i = 0; i < rounds; ++i) {
    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(0u, post(ping, static_cast<std::uint32_t>(i)));
    ASSERT_TRUE(answers.wait_for(static_cast<std::size_t>(i) + 1));
    micros.push_back(std::chrono::duration<double, std::micro>(
                         std::chrono::steady_clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  const double p50 = micros[rounds / 2];
  const double p99 = micros[rounds * 99 / 100];

  constexpr int burst = 20000;
  const auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < burst; ++i) ASSERT_EQ(0u, post(ping, 0));
  ASSERT_EQ(0u, bus_->flush(wait_ms * 4));
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  std::printf("round trip (post, callback posts back, wake): p50 %.1f us, p99 %.1f us; "
              "%d ping-pongs in %.3f s (%.0f per second)\n",
              p50, p99, burst, seconds, burst / seconds);
  // A delivery loop that sleeps between polls takes a millisecond or more.
  EXPECT_LT(p50, 1000.0);
  EXPECT_EQ(0u, ping->destroy_subscription(answerer));
  EXPECT_EQ(0u, pong->destroy_subscription(listener));
}

}  // namespace
