// parlo.dll through its exports and slots, loaded from the test's folder the
// way the component loads it.
#include <gtest/gtest.h>
#include <windows.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
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

struct library {
  winapi::unique_module module = winapi::load_library(
      (winapi::module_directory(winapi::current_module()) + L"parlo.dll").c_str());
  template <typename Fn>
  Fn get(const char* name) {
    return winapi::get_proc_address_as<Fn>(module.get(), name);
  }
  parlo::create_bus_fn create_bus = get<parlo::create_bus_fn>("create_bus");
  parlo::destroy_bus_fn destroy_bus = get<parlo::destroy_bus_fn>("destroy_bus");
  parlo::ext::tap_fn tap = get<parlo::ext::tap_fn>("parlo_tap");
  parlo::ext::untap_fn untap = get<parlo::ext::untap_fn>("parlo_untap");
  parlo::ext::inject_fn inject = get<parlo::ext::inject_fn>("parlo_inject");
  parlo::ext::set_log_fn set_log = get<parlo::ext::set_log_fn>("parlo_set_log");
};

library& lib() {
  static library instance;
  return instance;
}

// The library's lines, as "function: text".
struct log_record {
  std::mutex mutex;
  std::vector<std::string> lines;
  static void write(std::uint32_t, const char* function, const char* text, void* context) {
    auto* self = static_cast<log_record*>(context);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->lines.push_back(std::string(function) + ": " + text);
  }
  void clear() {
    std::lock_guard<std::mutex> lock(mutex);
    lines.clear();
  }
  bool has(const std::string& part) {
    std::lock_guard<std::mutex> lock(mutex);
    return std::any_of(lines.begin(), lines.end(), [&](const std::string& line) {
      return line.find(part) != std::string::npos;
    });
  }
} g_log;

struct received {
  std::uint32_t id;
  std::string params;  // blob "params"
  DWORD thread;
};

std::string blob_text(parlo::message* message, const char* name) {
  std::uint64_t size = 0;
  const void* bytes = message->get_blob(name, &size);
  return bytes == nullptr ? "<absent>" : std::string(static_cast<const char*>(bytes), size);
}

struct recorder {
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<received> items;
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<recorder*>(context);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->items.push_back(
        {message->message_id(), blob_text(message, "params"), ::GetCurrentThreadId()});
    self->changed.notify_all();
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
};

parlo::message* make_message(parlo::bus* bus, std::uint32_t id, const char* params = nullptr) {
  parlo::message* message = bus->create_message(0);
  message->set_message_id(id);
  if (params != nullptr) message->set_blob("params", params, std::strlen(params));
  message->seal();
  return message;
}

std::uint32_t post(parlo::channel* channel, std::uint32_t id, const char* params = nullptr) {
  parlo::message* message = make_message(channel->get_bus(), id, params);
  const std::uint32_t result = channel->post(message);
  message->release();
  return result;
}

std::vector<unsigned char> wire(parlo::message* message) {
  std::vector<unsigned char> bytes(static_cast<std::size_t>(message->encoded_size()));
  std::uint64_t written = 0;
  EXPECT_EQ(0u, message->encode(bytes.data(), bytes.size(), &written));
  return bytes;
}

// Holds the delivery thread in a callback until opened, so that a test
// controls what queues behind it.
struct gate {
  winapi::unique_handle entered{::CreateEventW(nullptr, TRUE, FALSE, nullptr)};
  winapi::unique_handle open{::CreateEventW(nullptr, TRUE, FALSE, nullptr)};
  static void hold(parlo::message*, void* context) {
    auto* self = static_cast<gate*>(context);
    ::SetEvent(self->entered.get());
    ::WaitForSingleObject(self->open.get(), 20000);  // bounded if a test fails
  }
};

class parlo_test : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { lib().set_log(&log_record::write, &g_log); }
  static void TearDownTestSuite() { lib().set_log(nullptr, nullptr); }
  void SetUp() override {
    g_log.clear();
    ASSERT_NE(nullptr, bus_ = lib().create_bus("test_bus"));
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
    EXPECT_EQ(0u, subscription->listen(callback, context, 0));
    return subscription;
  }
  // Holds the delivery thread in `held` until released.
  void block(gate& held) {
    subscribe(channel("block"), &gate::hold, &held);
    ASSERT_EQ(0u, post(bus_->get_channel("block"), 0));
    ASSERT_EQ(WAIT_OBJECT_0, ::WaitForSingleObject(held.entered.get(), wait_ms));
  }
  parlo::bus* bus_ = nullptr;
};

// Calls slot `index` of `object` through its raw table, as code built against
// another copy of the interface does.
template <typename R, typename... Args, typename T>
R slot(T* object, std::size_t index, Args... args) {
  void** table = *reinterpret_cast<void***>(object);
  return reinterpret_cast<R (*)(T*, Args...)>(table[index])(object, args...);
}

// The component's sequence through the slot numbers it relies on.
TEST_F(parlo_test, fixed_slots_answer_at_their_indices_and_the_components_sequence_is_clean) {
  EXPECT_EQ(0u, (slot<std::uint32_t, const char*>(bus_, 2, "raw")));
  EXPECT_EQ(0u, (slot<std::uint32_t, const char*>(bus_, 2, "raw"))) << "again: same channel";
  auto* raw = slot<parlo::channel*, const char*>(bus_, 4, "raw");
  ASSERT_EQ(bus_->get_channel("raw"), raw);
  EXPECT_EQ(1u, bus_->channel_count());
  auto* message = slot<parlo::message*, std::uint32_t>(bus_, 1, 0u);
  slot<std::uint32_t, std::uint32_t>(message, 5, 42u);
  EXPECT_EQ(42u, (slot<std::uint32_t>(message, 4)));
  slot<std::uint32_t, const char*, const void*, std::uint64_t>(message, 15, "params", "abc", 3);
  std::uint64_t size = 0;
  EXPECT_EQ(
      0, std::memcmp("abc",
                     (slot<const void*, const char*, std::uint64_t*>(message, 14, "params", &size)),
                     3));
  EXPECT_EQ(3u, size);
  slot<std::uint32_t>(message, 19);
  EXPECT_TRUE(message->is_sealed());

  recorder got;
  auto* subscription = slot<parlo::subscription*>(raw, 5);
  EXPECT_EQ(raw, (slot<parlo::channel*>(subscription, 3)));
  slot<std::uint32_t, parlo::message_callback, void*, std::uint32_t>(
      subscription, 4, &recorder::on_message, &got, 0u);
  EXPECT_EQ(0u, (slot<std::uint32_t, parlo::message*>(raw, 1, message)));
  ASSERT_TRUE(got.wait_for(1));
  EXPECT_EQ("abc", got.snapshot()[0].params);
  EXPECT_EQ(42u, got.snapshot()[0].id);
  slot<std::uint32_t, parlo::subscription*>(raw, 6, subscription);
  EXPECT_EQ(0u, raw->subscription_count());
  EXPECT_EQ(0u, (slot<std::uint32_t>(message, 22)));
  lib().destroy_bus(bus_);
  bus_ = nullptr;
  EXPECT_FALSE(g_log.has("")) << "a clean run writes no line";
}

TEST_F(parlo_test, each_channel_sees_its_posts_in_order_on_the_bus_thread) {
  parlo::channel* channels[2] = {channel("a"), channel("b")};
  recorder got[2];
  for (int i = 0; i < 2; ++i) subscribe(channels[i], &recorder::on_message, &got[i]);
  constexpr std::uint32_t per_poster = 500;
  DWORD posters[2] = {};
  std::vector<std::thread> threads;
  for (std::uint32_t poster = 0; poster < 2; ++poster) {
    threads.emplace_back([&, poster] {
      posters[poster] = ::GetCurrentThreadId();
      for (std::uint32_t i = 0; i < per_poster; ++i)
        EXPECT_EQ(0u, post(channels[i % 2], poster << 16 | i));
    });
  }
  for (std::thread& thread : threads) thread.join();
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  const DWORD delivery = got[0].snapshot().at(0).thread;
  for (recorder& list : got) {
    std::uint32_t next[2] = {0, 0};
    const std::vector<received> items = list.snapshot();
    ASSERT_EQ(per_poster, items.size());
    for (const received& item : items) {
      const std::uint32_t poster = item.id >> 16;
      EXPECT_GE(item.id & 0xFFFF, next[poster]) << "poster " << poster << " out of order";
      next[poster] = (item.id & 0xFFFF) + 1;
      EXPECT_EQ(delivery, item.thread) << "one delivery thread per bus";
    }
  }
  EXPECT_NE(posters[0], delivery);
  EXPECT_NE(posters[1], delivery);
}

// The delivered message is the library's sealed copy.
struct delivered_checks {
  std::uint32_t release = 0, set_blob = 0;
  parlo::message* kept = nullptr;
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<delivered_checks*>(context);
    self->release = message->release();
    self->set_blob = message->set_blob("params", "x", 1);
    if (self->kept == nullptr) self->kept = message->copy();
  }
};

TEST_F(parlo_test, post_delivers_a_sealed_copy_to_those_listening_when_posted) {
  parlo::channel* c = channel("copy");
  gate held;
  block(held);
  ASSERT_EQ(0u, post(c, 99));  // before listen: not for the subscription below
  recorder got;
  delivered_checks checks;
  subscribe(c, &recorder::on_message, &got);
  subscribe(c, &delivered_checks::on_message, &checks);
  parlo::message* message = bus_->create_message(0);
  message->set_message_id(1);
  message->set_blob("params", "first", 5);
  ASSERT_EQ(0u, c->post(message));  // unsealed: post needs no seal
  message->set_message_id(2);
  message->set_blob("params", "second", 6);
  ASSERT_EQ(0u, c->post(message));
  message->set_blob("params", "changed after posting", 21);
  EXPECT_EQ(0u, message->release());
  ::SetEvent(held.open.get());
  ASSERT_EQ(0u, bus_->flush(wait_ms));

  const std::vector<received> all = got.snapshot();
  ASSERT_EQ(2u, all.size());
  EXPECT_EQ(1u, all[0].id);
  EXPECT_EQ("first", all[0].params);
  EXPECT_EQ("second", all[1].params);
  EXPECT_EQ(parlo::error_access_denied, checks.release);
  EXPECT_EQ(parlo::error_access_denied, checks.set_blob);
  ASSERT_NE(nullptr, checks.kept);
  EXPECT_FALSE(checks.kept->is_sealed());
  EXPECT_EQ("first", blob_text(checks.kept, "params"));
  EXPECT_EQ(0u, checks.kept->release());
}

// Counts calls, and calls after the test declared its subscription or tap gone.
struct counted {
  std::atomic<std::uint64_t> calls{0}, late{0};
  std::atomic<bool> inside{false}, gone{false};
  void call() {
    inside = true;
    if (gone) ++late;
    ++calls;
    for (volatile int spin = 0; spin < 2000; ++spin) {
    }  // widens the window in which removal meets a running call
    inside = false;
  }
  static void on_message(parlo::message*, void* context) { static_cast<counted*>(context)->call(); }
  static void on_tap(const char*, const void*, std::uint64_t, void* context) {
    static_cast<counted*>(context)->call();
  }
};

TEST_F(parlo_test, no_callback_runs_after_its_removal_returned_under_concurrent_posting) {
  parlo::channel* c = channel("busy");
  std::atomic<bool> stop{false};
  std::vector<std::thread> posters;
  for (int i = 0; i < 2; ++i) {
    posters.emplace_back([&] {
      for (int sent = 1; !stop; ++sent) {
        EXPECT_EQ(0u, post(c, 1));
        if (sent % 16 == 0) {
          EXPECT_EQ(0u, bus_->flush(wait_ms));  // keeps the queue short
        }
      }
    });
  }
  const auto deadline = std::chrono::steady_clock::now() + 20s;
  int rounds = 0;
  for (; rounds < 300 && std::chrono::steady_clock::now() < deadline; ++rounds) {
    counted on_sub, on_tap;
    parlo::subscription* subscription = subscribe(c, &counted::on_message, &on_sub);
    std::uint64_t tap = 0;
    ASSERT_EQ(0u, lib().tap(bus_, "busy", &counted::on_tap, &on_tap, &tap));
    const auto until = std::chrono::steady_clock::now() + 2s;
    while ((on_sub.calls < 3 || on_tap.calls < 3) && std::chrono::steady_clock::now() < until)
      std::this_thread::yield();
    ASSERT_EQ(0u, c->destroy_subscription(subscription));
    EXPECT_FALSE(on_sub.inside);
    on_sub.gone = true;
    ASSERT_EQ(0u, lib().untap(bus_, tap));
    EXPECT_FALSE(on_tap.inside);
    on_tap.gone = true;
    ASSERT_EQ(0u, bus_->flush(wait_ms));  // whatever could still come is delivered by now
    ASSERT_EQ(0u, on_sub.late + on_tap.late) << "round " << rounds;
    ASSERT_GE(on_sub.calls.load(), 3u);
  }
  stop = true;
  for (std::thread& poster : posters) poster.join();
  EXPECT_EQ(0u, c->subscription_count());
  EXPECT_GE(rounds, 20);
}

// On its first call, ends its own subscription and tap, posts once more on
// the channel and tries to flush.
struct self_ending {
  parlo::channel* channel = nullptr;
  parlo::subscription* subscription = nullptr;
  std::uint64_t tap = 0;
  std::atomic<int> calls{0}, tap_calls{0};
  std::uint32_t destroyed = 99, untapped = 99, posted = 99, flushed = 0;
  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<self_ending*>(context);
    if (self->calls++ != 0) return;
    self->flushed = self->channel->get_bus()->flush(wait_ms);
    self->posted = post(self->channel, 7);
    self->destroyed = self->channel->destroy_subscription(self->subscription);
  }
  static void on_tap(const char*, const void*, std::uint64_t, void* context) {
    auto* self = static_cast<self_ending*>(context);
    if (self->tap_calls++ == 0) self->untapped = lib().untap(self->channel->get_bus(), self->tap);
  }
};

TEST_F(parlo_test, callbacks_may_end_themselves_and_post_but_not_flush) {
  self_ending state;
  state.channel = channel("self");
  ASSERT_EQ(0u, lib().tap(bus_, "self", &self_ending::on_tap, &state, &state.tap));
  state.subscription = subscribe(state.channel, &self_ending::on_message, &state);
  recorder other;
  subscribe(state.channel, &recorder::on_message, &other);
  ASSERT_EQ(0u, post(state.channel, 1));
  ASSERT_EQ(0u, post(state.channel, 2));
  ASSERT_TRUE(other.wait_for(3));
  EXPECT_EQ(1, state.calls.load());
  EXPECT_EQ(1, state.tap_calls.load());
  EXPECT_EQ(0u, state.destroyed + state.untapped + state.posted);
  EXPECT_EQ(parlo::error_possible_deadlock, state.flushed);
  EXPECT_EQ(1u, state.channel->subscription_count());
  EXPECT_EQ(7u, other.snapshot()[2].id)
      << "posted from the callback, delivered after the earlier posts";
}

struct bus_ender {
  parlo::bus* bus = nullptr;
  std::atomic<int> calls{0};
  std::atomic<DWORD> thread{0};
  std::uint32_t post_after = 99;
  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<bus_ender*>(context);
    ++self->calls;
    lib().destroy_bus(self->bus);
    self->post_after = post(self->bus->get_channel("end"), 2);  // closing, not yet gone
    self->thread = ::GetCurrentThreadId();
  }
};

TEST_F(parlo_test, destroy_bus_from_a_callback_returns_and_the_thread_tears_down_after) {
  bus_ender ender;
  ender.bus = bus_;
  parlo::channel* c = channel("end");
  subscribe(c, &bus_ender::on_message, &ender);
  recorder second;
  subscribe(c, &recorder::on_message, &second);
  ASSERT_EQ(0u, post(c, 1));
  ASSERT_EQ(0u, post(c, 1));
  bus_ = nullptr;
  const auto until = std::chrono::steady_clock::now() + 5s;
  while (ender.thread == 0 && std::chrono::steady_clock::now() < until) std::this_thread::yield();
  winapi::unique_handle thread(::OpenThread(SYNCHRONIZE, FALSE, ender.thread));
  if (thread) {
    EXPECT_EQ(WAIT_OBJECT_0, ::WaitForSingleObject(thread.get(), wait_ms));  // the thread ends
  }
  EXPECT_EQ(1, ender.calls.load());
  EXPECT_EQ(parlo::error_invalid_state, ender.post_after);
  EXPECT_TRUE(second.snapshot().empty()) << "the rest of the delivery is skipped";
  lib().destroy_bus(ender.bus);
  EXPECT_TRUE(g_log.has("parlo::destroy_bus: not a live bus"));
}

TEST_F(parlo_test, destroy_bus_drops_queued_messages_and_a_full_queue_refuses_posts) {
  parlo::channel* c = channel("pending");
  counted target;
  subscribe(c, &counted::on_message, &target);
  gate held;
  block(held);
  std::uint32_t result = 0, accepted = 0;
  parlo::message* message = make_message(bus_, 1);
  while (accepted <= parlo::max_queued_messages && (result = c->post(message)) == 0) ++accepted;
  EXPECT_EQ(parlo::error_not_enough_quota, result);
  EXPECT_EQ(parlo::max_queued_messages, accepted);
  EXPECT_TRUE(g_log.has("parlo::channel::post: channel pending: delivery queue is full"));
  EXPECT_EQ(0u, message->release());

  std::thread opener([&] {  // opens the gate once destroy_bus refuses posts
    const auto until = std::chrono::steady_clock::now() + 5s;
    while (post(c, 1) != parlo::error_invalid_state && std::chrono::steady_clock::now() < until)
      std::this_thread::yield();
    ::SetEvent(held.open.get());
  });
  lib().destroy_bus(bus_);  // waits for the gate's callback
  bus_ = nullptr;
  opener.join();
  EXPECT_EQ(0u, target.calls.load()) << "queued messages are dropped, not delivered";
}

TEST_F(parlo_test, bad_arguments_are_refused_with_a_code_and_a_line) {
  const std::string too_long(parlo::max_name_length + 1, 'n');
  int stray = 0;
  auto* stray_bus = reinterpret_cast<parlo::bus*>(&stray);
  EXPECT_EQ(nullptr, lib().create_bus(nullptr));
  EXPECT_EQ(nullptr, lib().create_bus(too_long.c_str()));
  lib().destroy_bus(nullptr);
  lib().destroy_bus(stray_bus);
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(too_long.c_str()));
  EXPECT_EQ(nullptr, bus_->get_channel(nullptr));
  EXPECT_EQ(nullptr, bus_->create_message(1));
  EXPECT_EQ(0u, bus_->channel_count());

  parlo::channel* a = channel("a");
  parlo::channel* b = channel("b");
  EXPECT_EQ(parlo::error_invalid_parameter, a->post(nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, a->post(reinterpret_cast<parlo::message*>(&stray)));
  parlo::subscription* subscription = a->create_subscription();
  recorder got;
  EXPECT_EQ(parlo::error_invalid_parameter, subscription->listen(nullptr, nullptr, 0));
  EXPECT_EQ(parlo::error_invalid_parameter, subscription->listen(&recorder::on_message, &got, 1));
  EXPECT_FALSE(subscription->is_listening());
  EXPECT_EQ(0u, subscription->listen(&recorder::on_message, &got, 0));
  EXPECT_EQ(parlo::error_invalid_state, subscription->listen(&recorder::on_message, &got, 0));
  EXPECT_EQ(parlo::error_invalid_parameter, a->destroy_subscription(nullptr));
  EXPECT_EQ(parlo::error_not_found, b->destroy_subscription(subscription));
  EXPECT_EQ(parlo::error_not_found,
            a->destroy_subscription(reinterpret_cast<parlo::subscription*>(&stray)));
  ASSERT_EQ(0u, post(a, 5));
  EXPECT_TRUE(got.wait_for(1)) << "refused calls leave the subscription alone";

  parlo::message* good = make_message(bus_, 4);
  const std::vector<unsigned char> bytes = wire(good);
  good->release();
  std::uint64_t id = 1;
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(stray_bus, "a", &counted::on_tap, &got, &id));
  EXPECT_EQ(0u, id);
  EXPECT_EQ(parlo::error_invalid_parameter, lib().tap(bus_, "a", nullptr, nullptr, &id));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().untap(nullptr, 1));
  EXPECT_EQ(parlo::error_not_found, lib().untap(bus_, 12345));
  EXPECT_EQ(parlo::error_invalid_parameter,
            lib().inject(stray_bus, "a", bytes.data(), bytes.size()));
  EXPECT_EQ(parlo::error_invalid_parameter, lib().inject(bus_, "a", nullptr, 0));
  EXPECT_EQ(parlo::error_invalid_parameter,
            lib().inject(bus_, "a", bytes.data(), parlo::ext::max_wire_size + 1));
  EXPECT_EQ(parlo::error_not_found,
            lib().inject(bus_, "no such channel", bytes.data(), bytes.size()));
  EXPECT_EQ(nullptr, bus_->get_channel("no such channel")) << "a peer cannot create channels";
  EXPECT_EQ(parlo::error_invalid_data, lib().inject(bus_, "a", bytes.data(), bytes.size() - 1));
  std::vector<unsigned char> garbage(bytes.size(), 0xEE);
  EXPECT_EQ(parlo::error_invalid_data, lib().inject(bus_, "a", garbage.data(), garbage.size()));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  EXPECT_EQ(1u, got.snapshot().size()) << "nothing undecodable was delivered";

  for (const char* line :
       {"parlo::create_bus: name is nullptr", "parlo::destroy_bus: not a live bus",
        "parlo::bus::create_channel: name length 256 outside 1..255",
        "parlo::bus::create_message: unknown kind 1",
        "parlo::channel::post: not a live message of this library",
        "parlo::channel::destroy_subscription: not a subscription of channel b",
        "parlo::subscription::listen: unknown flags", "parlo_untap: no tap 12345",
        "parlo_inject: no channel", "parlo_inject: channel a: undecodable message (truncated"}) {
    EXPECT_TRUE(g_log.has(line)) << line;
  }
}

TEST_F(parlo_test, message_fields_obey_their_limits_and_can_be_listed_copied_and_removed) {
  parlo::message* message = bus_->create_message(0);
  const std::string too_long(parlo::max_name_length + 1, 'n');
  const char data[4] = {'\0', '\x01', '\xFF', 'z'};
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob(nullptr, data, 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", nullptr, 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob(too_long.c_str(), data, 1));
  // Sizes the four bytes behind `data` cannot hold: refused before any copy.
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", data, parlo::max_message_size));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", data, ~std::uint64_t{0}));
  std::uint64_t size = 9;
  EXPECT_EQ(nullptr, message->get_blob(nullptr, &size));
  EXPECT_EQ(0u, size);
  char small[4];
  std::uint64_t written = 0;
  EXPECT_EQ(parlo::error_invalid_parameter, message->encode(small, sizeof small, &written));

  ASSERT_EQ(0u, message->set_blob("bin", data, 3));
  ASSERT_EQ(0u, message->set_blob("empty", nullptr, 0));
  ASSERT_EQ(0u, message->set_blob("bin", data, 4));  // replaces, keeps its place
  EXPECT_STREQ("bin", message->blob_name(0));
  EXPECT_STREQ("empty", message->blob_name(1));
  EXPECT_EQ(nullptr, message->blob_name(2));
  EXPECT_EQ(std::string(data, 4), blob_text(message, "bin"));
  EXPECT_NE(nullptr, message->get_blob("empty", &size)) << "present, without bytes";
  EXPECT_EQ(0u, size);
  EXPECT_EQ(nullptr, message->get_blob("absent", &size));

  parlo::message* copy = message->copy();
  EXPECT_EQ(0u, copy->remove_blob("bin"));
  EXPECT_EQ(parlo::error_not_found, copy->remove_blob("bin"));
  EXPECT_EQ(2u, message->blob_count()) << "the copy is independent";
  for (std::uint32_t i = 1; i < parlo::max_blob_fields; ++i)
    ASSERT_EQ(0u, copy->set_blob(("f" + std::to_string(i)).c_str(), nullptr, 0));
  EXPECT_EQ(parlo::error_invalid_parameter, copy->set_blob("one too many", nullptr, 0));
  EXPECT_EQ(0u, copy->clear());
  EXPECT_EQ(0u, copy->blob_count());
  EXPECT_EQ(0u, copy->release());

  message->seal();
  EXPECT_EQ(parlo::error_access_denied, message->set_message_id(3));
  EXPECT_EQ(parlo::error_access_denied, message->remove_blob("bin"));
  EXPECT_EQ(parlo::error_access_denied, message->clear());
  EXPECT_EQ(0u, message->release());
}

struct tap_recorder {
  std::mutex mutex;
  std::vector<std::pair<std::string, std::vector<unsigned char>>> items;
  static void on_tap(const char* channel, const void* bytes, std::uint64_t size, void* context) {
    auto* self = static_cast<tap_recorder*>(context);
    const auto* begin = static_cast<const unsigned char*>(bytes);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->items.emplace_back(channel, std::vector<unsigned char>(begin, begin + size));
  }
};

TEST_F(parlo_test, taps_see_local_posts_only_and_injected_messages_reach_local_subscriptions) {
  tap_recorder taps;
  std::uint64_t tap = 0;
  ASSERT_EQ(0u, lib().tap(bus_, "joined", &tap_recorder::on_tap, &taps, &tap));
  parlo::channel* c = bus_->get_channel("joined");
  ASSERT_NE(nullptr, c) << "tapping creates the channel";
  EXPECT_EQ(0u, bus_->create_channel("joined"));
  EXPECT_EQ(c, bus_->get_channel("joined"));
  recorder local;
  subscribe(c, &recorder::on_message, &local);

  parlo::message* one = make_message(bus_, 1, "one");
  parlo::message* from_pipe = make_message(bus_, 50, "from the pipe");
  parlo::message* two = make_message(bus_, 2, "two");
  ASSERT_EQ(0u, c->post(one));
  const std::vector<unsigned char> injected = wire(from_pipe);
  ASSERT_EQ(0u, lib().inject(bus_, "joined", injected.data(), injected.size()));
  ASSERT_EQ(0u, c->post(two));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(2u, taps.items.size()) << "the injected message is not tapped";
  EXPECT_EQ("joined", taps.items[0].first);
  EXPECT_EQ(wire(one), taps.items[0].second);
  EXPECT_EQ(wire(two), taps.items[1].second);
  const std::vector<received> delivered = local.snapshot();
  ASSERT_EQ(3u, delivered.size());
  EXPECT_EQ(50u, delivered[1].id) << "injected in queue order with local posts";
  EXPECT_EQ("from the pipe", delivered[1].params);
  for (parlo::message* message : {one, from_pipe, two}) message->release();

  // The tapped bytes are what a peer injects: the round trip is exact.
  parlo::bus* peer = lib().create_bus("peer");
  ASSERT_EQ(0u, peer->create_channel("joined"));
  recorder remote;
  subscribe(peer->get_channel("joined"), &recorder::on_message, &remote);
  ASSERT_EQ(0u,
            lib().inject(peer, "joined", taps.items[1].second.data(), taps.items[1].second.size()));
  ASSERT_TRUE(remote.wait_for(1));
  EXPECT_EQ("two", remote.snapshot()[0].params);
  lib().destroy_bus(peer);

  EXPECT_EQ(0u, lib().untap(bus_, tap));
  EXPECT_EQ(parlo::error_not_found, lib().untap(bus_, tap));
  ASSERT_EQ(0u, post(c, 3));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  EXPECT_EQ(2u, taps.items.size()) << "nothing after untap";
}

void answer_ping(parlo::message* message, void* context) {
  post(static_cast<parlo::channel*>(context), message->message_id());
}

TEST_F(parlo_test, round_trips_wake_threads_without_polling) {
  parlo::channel* ping = channel("ping");
  parlo::channel* pong = channel("pong");
  subscribe(ping, &answer_ping, pong);
  recorder answers;
  subscribe(pong, &recorder::on_message, &answers);
  constexpr int rounds = 2000;
  std::vector<double> micros;
  for (int i = 0; i < rounds; ++i) {
    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(0u, post(ping, static_cast<std::uint32_t>(i)));
    ASSERT_TRUE(answers.wait_for(static_cast<std::size_t>(i) + 1));
    micros.push_back(
        std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start)
            .count());
  }
  std::sort(micros.begin(), micros.end());
  EXPECT_LT(micros[rounds / 2], 1000.0)
      << "a delivery loop that sleeps between polls takes a millisecond or more; p99 "
      << micros[rounds * 99 / 100] << " us";
}

}  // namespace
