// The bus over the real messaging stand-in: its listener table, what it
// publishes on the service channel, how it merges what other processes
// publish, and the notifications its observers get.
#include <gtest/gtest.h>

#include <windows.h>

#include <memory>
#include <mutex>
#include <vector>

#include "bus/bus.h"
#include "bus/comm/listeners_codec.h"
#include "bus/parlo/parlo.h"
#include "support/bus_observer.h"
#include "support/log_capture.h"

using test_support::added;
using test_support::removed;
using notifications = std::vector<test_support::notification>;

constexpr std::uint32_t other_pid = 4242;
const std::uint32_t own = ::GetCurrentProcessId();

// Posts a message on the service channel as another process would.
void post(parlo::bus* messaging, std::uint32_t id, const void* params, std::uint64_t size, bool with_blob = true) {
  parlo::message* message = messaging->create_message(0);
  message->set_message_id(id);
  if (with_blob) message->set_blob("params", params, size);
  messaging->get_channel("vorbel_service")->post(message);
  message->release();
}
void publish_on(parlo::bus* messaging, std::uint32_t pid, const listener_list& listeners) {
  const auto bytes = comm::encode_listeners(pid, listeners);
  post(messaging, 2, bytes.data(), bytes.size());
}

class bus_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    b.subscribe();
    ASSERT_TRUE(b.add_observer(&observer, 0));
    spy = messaging->get_channel("vorbel_service")->create_subscription();  // made by subscribe
    spy->listen(&bus_test::on_message, this, 0);
  }
  // Records each message on "vorbel_service" as a peer process would read
  // it: (pid, listeners), where a request carries no pid.
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<bus_test*>(context);
    std::pair<std::uint32_t, listener_list> s{0, {}};
    std::uint64_t size = 0;
    const void* bytes = message->get_blob("params", &size);
    if (bytes != nullptr) comm::decode_listeners(static_cast<const std::uint8_t*>(bytes), size, s.first, s.second);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->pubs.push_back(std::move(s));
  }
  void publish_as(std::uint32_t pid, const listener_list& listeners) { publish_on(messaging, pid, listeners); }

  // Waits until every message posted so far was delivered and every
  // notification posted so far ran, and gives what was notified since the
  // last settle (what was published is left in `published`). A sentinel
  // listener goes through the same queues last and is cut off.
  notifications settle() {
    EXPECT_EQ(0u, messaging->flush(5000));
    b.register_listener("~sentinel", "~");
    b.unregister_listener("~sentinel", "~");
    EXPECT_TRUE(test_support::wait_until(
        [&] { return observer.seen().size() > 0 && observer.seen().back() == removed(own, "~sentinel", "~"); }));
    EXPECT_EQ(0u, messaging->flush(5000));
    std::lock_guard<std::mutex> lock(mutex);
    published.assign(pubs.begin(), pubs.end() - 2);
    pubs.clear();
    notifications notes;
    for (auto& n : observer.take()) if (n.channel != "~sentinel") notes.push_back(std::move(n));
    return notes;
  }

  // The bus goes first, and with its messaging bus the spy's subscription.
  test_support::recording_bus_observer observer;
  std::mutex mutex;
  std::vector<std::pair<std::uint32_t, listener_list>> pubs, published;
  bus b{"test_bus"};
  parlo::bus* messaging = static_cast<parlo::bus*>(b.get_messaging_bus());
  parlo::subscription* spy = nullptr;
};

TEST_F(bus_test, duplicates_are_kept_and_removed_one_at_a_time_each_change_published_whole) {
  EXPECT_EQ(0u, b.register_listener("a", "x"));
  EXPECT_EQ(0u, b.register_listener("a", "x"));
  EXPECT_EQ(0u, b.unregister_listener("a", "x"));
  EXPECT_TRUE(b.is_registered_listener("a", "x"));
  EXPECT_FALSE(b.is_registered_listener("a", "y"));
  EXPECT_EQ(0u, b.unregister_listener("a", "x"));
  EXPECT_FALSE(b.is_registered_listener("a", "x"));
  EXPECT_EQ(0u, b.unregister_listener("never", "registered"));  // nothing found: nothing told
  EXPECT_EQ((notifications{added(own, "a", "x"), added(own, "a", "x"), removed(own, "a", "x"), removed(own, "a", "x")}),
            settle());
  std::vector<listener_list> tables;
  for (const auto& [pid, listeners] : published) tables.push_back(pid == own ? listeners : listener_list{{"?", "?"}});
  EXPECT_EQ((std::vector<listener_list>{{{"a", "x"}}, {{"a", "x"}, {"a", "x"}}, {{"a", "x"}}, {}}), tables);
}

// Additions before removals; an empty list empties the process's entry; a
// list carrying this process's own id is ignored, and so is one of a process
// that no connection carries.
TEST_F(bus_test, remote_lists_are_merged_and_this_processs_own_ignored) {
  publish_as(other_pid + 4, {{"a", "x"}});
  EXPECT_TRUE(settle().empty());
  EXPECT_TRUE(test_support::has_line(L"bus::on_remote_listeners", L"pid=4246 dropped: no connection from that process"));
  b.on_local_connect("\\pipe", other_pid);
  settle();
  const std::pair<listener_list, notifications> steps[] = {
      {{{"a", "x"}, {"c", "z"}}, {added(other_pid, "a", "x"), added(other_pid, "c", "z")}},
      {{{"a", "x"}, {"b", "y"}}, {added(other_pid, "b", "y"), removed(other_pid, "c", "z")}},
      {{}, {removed(other_pid, "a", "x"), removed(other_pid, "b", "y")}},
      {{{"d", "w"}}, {added(other_pid, "d", "w")}},
  };
  for (const auto& [sent, expected] : steps) {
    publish_as(other_pid, sent);
    EXPECT_EQ(expected, settle());
  }
  EXPECT_TRUE(b.is_registered_listener("d", "w")) << "a remote listener counts";
  publish_as(own, {{"a", "x"}});
  b.on_remote_listeners(own, {{"b", "y"}}, own);
  EXPECT_TRUE(settle().empty());
  EXPECT_FALSE(b.is_registered_listener("a", "x") || b.is_registered_listener("b", "y"));
}

TEST_F(bus_test, malformed_listeners_messages_are_dropped_with_the_exact_lines) {
  const char garbage[] = "not a flatbuffer at all";
  post(messaging, 2, nullptr, 0, /* with_blob */ false);
  post(messaging, 2, garbage, 0);
  post(messaging, 2, garbage, sizeof garbage);  // refused by the decoder, without a line
  EXPECT_TRUE(settle().empty());
  const auto lines = test_support::find_lines(L"comm::service_channel::on_message", L"");
  ASSERT_EQ(2u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob:  buf is nullptr, size=0",
            lines[0].text);
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob: size=0", lines[1].text);
  EXPECT_EQ(4u, lines[0].level);
}

// A process may be connected twice; it keeps its listeners, and its lists
// count, until its last connection ends, and a list still on its way after
// that cannot bring it back.
TEST_F(bus_test, connect_publishes_and_asks_and_the_last_disconnect_drops_the_process_for_good) {
  b.register_listener("own", "1");
  settle();
  // Each connect publishes, then asks (no pid): the bus answers itself too.
  for (const bool local : {true, false}) {
    local ? b.on_local_connect("\\pipe", other_pid) : b.on_remote_connect("\\other", other_pid);
    settle();
    std::vector<std::uint32_t> pids;
    for (const auto& p : published) pids.push_back(p.first);
    EXPECT_EQ((std::vector<std::uint32_t>{own, 0, own}), pids);
  }

  publish_as(other_pid, {{"c", "3"}, {"a", "1"}, {"b", "2"}});
  settle();
  b.on_local_disconnect("\\pipe", own);  // this process's own id is never dropped
  b.on_local_disconnect("\\pipe", other_pid);
  EXPECT_TRUE(settle().empty()) << "the process is still connected once: its listeners stay";
  publish_as(other_pid, {{"a", "2"}});
  EXPECT_EQ((notifications{added(other_pid, "a", "2"), removed(other_pid, "a", "1"), removed(other_pid, "b", "2"),
                           removed(other_pid, "c", "3")}), settle());

  b.on_remote_disconnect("\\other", other_pid);
  publish_as(other_pid, {{"a", "3"}});
  EXPECT_EQ((notifications{removed(other_pid, "a", "2")}), settle());
  EXPECT_TRUE(test_support::has_line(L"bus::on_remote_listeners", L"pid=4242 dropped: the process has disconnected"));

  b.on_local_connect("\\pipe", other_pid);  // a process that got the same id
  publish_as(other_pid, {{"a", "4"}});
  EXPECT_EQ((notifications{added(other_pid, "a", "4")}), settle());
}

// An observer may call the bus from inside a notification: this would
// deadlock if notifications ran under the bus's mutex or on the caller.
TEST_F(bus_test, notifications_run_on_the_notifier_thread_outside_the_bus_lock) {
  observer.on_call = [&](const test_support::notification& n) {
    if (n.channel == "outer") b.register_listener("inner", "2");
  };
  b.register_listener("outer", "1");
  ASSERT_TRUE(observer.wait_for_count(2)) << "the nested registration was not notified";
  observer.on_call = nullptr;
  const auto seen = observer.seen();
  EXPECT_EQ(added(own, "inner", "2"), seen[1]);
  EXPECT_NE(::GetCurrentThreadId(), seen[0].thread);
  EXPECT_EQ(seen[0].thread, seen[1].thread) << "one notifier thread per bus";
}

// A bus whose build failed is destroyed without unsubscribe while its
// delivery thread may still hand it listeners messages: the service channel
// must go before the mutex and the table.
TEST(bus_destruction, messages_still_arriving_while_a_bus_goes_are_harmless) {
  for (int round = 0; round < 20; ++round) {
    bus doomed("doomed");
    doomed.subscribe();
    auto* messaging = static_cast<parlo::bus*>(doomed.get_messaging_bus());
    for (std::uint32_t i = 0; i < 300; ++i) publish_on(messaging, 1000 + i, {{"c", std::to_string(i)}});
  }
}
