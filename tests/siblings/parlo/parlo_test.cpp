// parlo.dll through its exports, loaded from the test's folder as the
// component loads it.
#include <gtest/gtest.h>
#include <windows.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "bus/parlo/parlo.h"
#include "platform/handles.h"
#include "platform/win_api.h"

namespace {

constexpr std::uint32_t wait_ms = 5000;

const winapi::unique_module g_parlo = winapi::load_library(
    (winapi::module_directory(winapi::current_module()) + L"parlo.dll").c_str());
const auto create_bus =
    winapi::get_proc_address_as<parlo::create_bus_fn>(g_parlo.get(), "create_bus");
const auto destroy_bus =
    winapi::get_proc_address_as<parlo::destroy_bus_fn>(g_parlo.get(), "destroy_bus");

// What a subscription received, read once the bus is flushed.
struct recorder {
  std::vector<std::pair<std::uint32_t, DWORD>> items;  // id, delivering thread
  static void on_message(parlo::message* message, void* context) {
    static_cast<recorder*>(context)->items.emplace_back(message->message_id(),
                                                        ::GetCurrentThreadId());
  }
};

std::uint32_t post(parlo::channel* channel, std::uint32_t id) {
  parlo::message* message = channel->get_bus()->create_message(0);
  message->set_message_id(id);
  const std::uint32_t result = channel->post(message);
  message->release();
  return result;
}

class parlo_test : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_NE(nullptr, bus_ = create_bus("test_bus")); }
  void TearDown() override { destroy_bus(bus_); }
  parlo::channel* subscribed(const char* name, parlo::message_callback callback, void* context) {
    EXPECT_EQ(0u, bus_->create_channel(name));
    parlo::channel* channel = bus_->get_channel(name);
    EXPECT_EQ(0u, channel->create_subscription()->listen(callback, context, 0));
    return channel;
  }
  parlo::bus* bus_ = nullptr;
};

TEST_F(parlo_test, each_channel_sees_its_posts_in_order_on_the_delivery_thread) {
  recorder got[2];
  parlo::channel* channels[2] = {subscribed("a", &recorder::on_message, &got[0]),
                                 subscribed("b", &recorder::on_message, &got[1])};
  EXPECT_EQ(0u, bus_->create_channel("a")) << "creating it again keeps the one channel";
  EXPECT_EQ(channels[0], bus_->get_channel("a"));
  EXPECT_EQ(2u, bus_->channel_count());
  for (std::uint32_t i = 0; i < 1000; ++i) ASSERT_EQ(0u, post(channels[i % 2], i));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  for (std::uint32_t k = 0; k < 2; ++k) {
    ASSERT_EQ(500u, got[k].items.size());
    for (std::uint32_t i = 0; i < 500; ++i) {
      EXPECT_EQ(2 * i + k, got[k].items[i].first);
      EXPECT_EQ(got[0].items[0].second, got[k].items[i].second) << "one delivery thread";
    }
  }
  EXPECT_NE(::GetCurrentThreadId(), got[0].items[0].second);
}

// Counts calls, and those after the test declared the subscription gone.
struct counted {
  std::atomic<std::uint64_t> calls{0}, late{0};
  std::atomic<bool> inside{false}, gone{false};
  static void on_message(parlo::message*, void* context) {
    auto* self = static_cast<counted*>(context);
    self->inside = true;
    if (self->gone) ++self->late;
    ++self->calls;
    for (volatile int spin = 0; spin < 2000; ++spin) {
    }  // widens the window in which removal meets a running call
    self->inside = false;
  }
};

TEST_F(parlo_test, no_callback_runs_after_destroy_subscription_returned_under_concurrent_posting) {
  ASSERT_EQ(0u, bus_->create_channel("busy"));
  parlo::channel* c = bus_->get_channel("busy");
  std::atomic<bool> stop{false};
  std::thread poster([&] {
    for (int sent = 1; !stop; ++sent) {
      EXPECT_EQ(0u, post(c, 1));
      EXPECT_EQ(0u, sent % 16 == 0 ? bus_->flush(wait_ms) : 0u);  // keeps the queue short
    }
  });
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  int rounds = 0;
  for (; rounds < 300 && std::chrono::steady_clock::now() < deadline && !HasFailure(); ++rounds) {
    counted on_sub;
    parlo::subscription* subscription = c->create_subscription();
    EXPECT_EQ(0u, subscription->listen(&counted::on_message, &on_sub, 0));
    const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(2);
    while (on_sub.calls < 3 && std::chrono::steady_clock::now() < until) std::this_thread::yield();
    EXPECT_EQ(0u, c->destroy_subscription(subscription));
    EXPECT_FALSE(on_sub.inside);
    on_sub.gone = true;
    EXPECT_EQ(0u, bus_->flush(wait_ms));  // whatever could still come is delivered by now
    EXPECT_EQ(0u, on_sub.late.load()) << "round " << rounds;
    EXPECT_GE(on_sub.calls.load(), 3u);
  }
  stop = true;
  poster.join();
  EXPECT_GE(rounds, 20);
}

// Posts message 1 from the delivery thread, where it cannot be delivered
// before this returns, then changes and releases it.
void post_then_change(parlo::message* message, void* context) {
  if (message->message_id() != 0) return;
  auto* bus = static_cast<parlo::bus*>(context);
  parlo::message* mine = bus->create_message(0);
  mine->set_message_id(1);
  EXPECT_EQ(0u, bus->get_channel("copy")->post(mine));
  mine->set_message_id(2);
  EXPECT_EQ(0u, mine->release());
}

TEST_F(parlo_test, a_posted_message_the_caller_changes_and_releases_is_delivered_as_posted) {
  recorder got;
  subscribed("copy", &post_then_change, bus_);
  ASSERT_EQ(0u, post(subscribed("copy", &recorder::on_message, &got), 0));
  ASSERT_EQ(0u, bus_->flush(wait_ms));  // message 0, and so the post of 1
  ASSERT_EQ(0u, bus_->flush(wait_ms));  // message 1
  ASSERT_EQ(2u, got.items.size());
  EXPECT_EQ(1u, got.items[1].first);
}

// A message whose blob was refused is not posted at all: delivered, it would
// reach its receivers without the blob they read. Its copies neither; a
// cleared message is whole again.
TEST_F(parlo_test, a_message_whose_blob_was_refused_is_not_posted) {
  recorder got;
  parlo::channel* channel = subscribed("whole", &recorder::on_message, &got);
  const std::vector<char> big(parlo::max_message_size, 'b');
  parlo::message* message = bus_->create_message(0);
  ASSERT_EQ(0u, message->set_blob("small", "s", 1));
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("big", big.data(), big.size()));
  EXPECT_EQ(0u, message->set_blob("small", "t", 1)) << "a later blob does not make it whole";
  parlo::message* copy = message->copy();
  EXPECT_EQ(parlo::error_invalid_data, channel->post(message));
  EXPECT_EQ(parlo::error_invalid_data, channel->post(copy));
  ASSERT_EQ(0u, message->clear());
  message->set_message_id(7);
  EXPECT_EQ(0u, channel->post(message));
  ASSERT_EQ(0u, bus_->flush(wait_ms));
  ASSERT_EQ(1u, got.items.size());
  EXPECT_EQ(7u, got.items[0].first);
  // A refusal on a sealed message leaves it as it was sealed.
  message->seal();
  EXPECT_EQ(parlo::error_access_denied, message->set_blob("late", "x", 1));
  EXPECT_EQ(0u, channel->post(message));
  EXPECT_EQ(0u, copy->release());
  EXPECT_EQ(0u, message->release());
}

TEST_F(parlo_test, null_arguments_are_refused_with_87) {
  EXPECT_EQ(nullptr, create_bus(nullptr));
  destroy_bus(nullptr);
  EXPECT_EQ(parlo::error_invalid_parameter, bus_->create_channel(nullptr));
  ASSERT_EQ(0u, bus_->create_channel("a"));
  parlo::channel* c = bus_->get_channel("a");
  EXPECT_EQ(parlo::error_invalid_parameter, c->post(nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, c->destroy_subscription(nullptr));
  EXPECT_EQ(parlo::error_invalid_parameter, c->create_subscription()->listen(nullptr, nullptr, 0));
  parlo::message* message = bus_->create_message(0);
  EXPECT_EQ(parlo::error_invalid_parameter, message->set_blob("x", nullptr, 1));
  EXPECT_EQ(0u, message->release());
}

}  // namespace
