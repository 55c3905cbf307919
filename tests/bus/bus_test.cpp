// The bus over the real messaging stand-in: its listener table, what it
// publishes on the service channel, how it merges what other processes
// publish, and the notifications its observers get.
#include <gtest/gtest.h>

#include <windows.h>

#include <memory>
#include <mutex>

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
    b = std::make_unique<bus>("test_bus");
    b->subscribe();
    ASSERT_TRUE(b->add_observer(&observer, 0));
    spy = service()->create_subscription();
    spy->listen(&bus_test::on_message, this, 0);
  }
  void TearDown() override {
    service()->destroy_subscription(spy);
    b->remove_observer(&observer, 0);
    b->unsubscribe();
  }

  // A message seen on "vorbel_service", decoded as a peer process would.
  struct seen {
    std::uint32_t id, pid;
    listener_list listeners;
  };
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<bus_test*>(context);
    seen s{message->message_id(), 0, {}};
    std::uint64_t size = 0;
    const void* bytes = message->get_blob("params", &size);
    if (bytes != nullptr) comm::decode_listeners(static_cast<const std::uint8_t*>(bytes), size, s.pid, s.listeners);
    std::lock_guard<std::mutex> lock(self->mutex);
    self->pubs.push_back(std::move(s));
  }
  parlo::bus* messaging() { return static_cast<parlo::bus*>(b->get_messaging_bus()); }
  parlo::channel* service() { return messaging()->get_channel("vorbel_service"); }
  void publish_as(std::uint32_t pid, const listener_list& listeners) { publish_on(messaging(), pid, listeners); }

  // What happened since the last settle: waits until every message posted so
  // far was delivered and every notification posted so far ran. A sentinel
  // listener goes through the same queues last and is cut off.
  struct batch {
    notifications notes;
    std::vector<seen> pubs;
  };
  batch settle() {
    EXPECT_EQ(0u, messaging()->flush(5000));
    b->register_listener("~sentinel", "~");
    b->unregister_listener("~sentinel", "~");
    EXPECT_TRUE(test_support::wait_until([&] {
      const auto seen = observer.seen();
      return !seen.empty() && seen.back() == removed(own, "~sentinel", "~");
    }));
    EXPECT_EQ(0u, messaging()->flush(5000));
    batch out;
    for (auto& n : observer.take()) if (n.channel != "~sentinel") out.notes.push_back(std::move(n));
    std::lock_guard<std::mutex> lock(mutex);
    out.pubs.assign(pubs.begin(), pubs.end() - 2);
    pubs.clear();
    return out;
  }

  std::unique_ptr<bus> b;
  test_support::recording_bus_observer observer;
  parlo::subscription* spy = nullptr;
  std::mutex mutex;
  std::vector<seen> pubs;
};

TEST_F(bus_test, duplicates_are_kept_and_removed_one_at_a_time_each_change_published_whole) {
  EXPECT_EQ(0u, b->register_listener("a", "x"));
  EXPECT_EQ(0u, b->register_listener("a", "x"));
  EXPECT_EQ(0u, b->unregister_listener("a", "x"));
  EXPECT_TRUE(b->is_registered_listener("a", "x"));
  EXPECT_FALSE(b->is_registered_listener("a", "y"));
  EXPECT_EQ(0u, b->unregister_listener("a", "x"));
  EXPECT_FALSE(b->is_registered_listener("a", "x"));
  EXPECT_EQ(0u, b->unregister_listener("never", "registered"));  // nothing found: nothing told
  const auto [notes, pubs] = settle();
  EXPECT_EQ((notifications{added(own, "a", "x"), added(own, "a", "x"), removed(own, "a", "x"),
                           removed(own, "a", "x")}),
            notes);
  std::vector<listener_list> tables;
  for (const auto& p : pubs) tables.push_back(p.pid == own ? p.listeners : listener_list{{"wrong", "pid"}});
  EXPECT_EQ((std::vector<listener_list>{{{"a", "x"}}, {{"a", "x"}, {"a", "x"}}, {{"a", "x"}}, {}}), tables);
}

// Additions before removals; an empty list empties the process's entry; a
// list carrying this process's own id is ignored.
TEST_F(bus_test, remote_lists_are_merged_and_this_processs_own_ignored) {
  const std::pair<listener_list, notifications> steps[] = {
      {{{"a", "x"}, {"c", "z"}}, {added(other_pid, "a", "x"), added(other_pid, "c", "z")}},
      {{{"a", "x"}, {"b", "y"}}, {added(other_pid, "b", "y"), removed(other_pid, "c", "z")}},
      {{}, {removed(other_pid, "a", "x"), removed(other_pid, "b", "y")}},
      {{{"d", "w"}}, {added(other_pid, "d", "w")}},
  };
  for (const auto& [sent, expected] : steps) {
    publish_as(other_pid, sent);
    EXPECT_EQ(expected, settle().notes);
  }
  EXPECT_TRUE(b->is_registered_listener("d", "w")) << "a remote listener counts";
  publish_as(own, {{"a", "x"}});
  b->on_remote_listeners(own, {{"b", "y"}});
  EXPECT_TRUE(settle().notes.empty());
  EXPECT_FALSE(b->is_registered_listener("a", "x") || b->is_registered_listener("b", "y"));
}

TEST_F(bus_test, malformed_listeners_messages_are_dropped_with_the_exact_lines) {
  const char garbage[] = "not a flatbuffer at all";
  post(messaging(), 2, nullptr, 0, /* with_blob */ false);
  post(messaging(), 2, garbage, 0);
  post(messaging(), 2, garbage, sizeof garbage);  // refused by the decoder, without a line
  EXPECT_TRUE(settle().notes.empty());
  const auto lines = test_support::find_lines(L"comm::service_channel::on_message", L"");
  ASSERT_EQ(2u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob:  buf is nullptr, size=0",
            lines[0].text);
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob: size=0", lines[1].text);
  EXPECT_EQ(4u, lines[0].level);
}

// A process may be connected twice; its lists count until its last
// connection ends, and a list still on its way after that cannot bring it back.
TEST_F(bus_test, connect_publishes_and_asks_and_the_last_disconnect_drops_the_process_for_good) {
  b->register_listener("own", "1");
  settle();
  // Each connect publishes, then asks (id 1, no pid): the bus answers itself too.
  for (const bool local : {true, false}) {
    local ? b->on_local_connect("\\pipe", other_pid) : b->on_remote_connect("\\other", other_pid);
    std::vector<std::uint32_t> ids;
    for (const auto& p : settle().pubs) ids.push_back(p.id);
    EXPECT_EQ((std::vector<std::uint32_t>{2, 1, 2}), ids);
  }

  publish_as(other_pid, {{"c", "3"}, {"a", "1"}, {"b", "2"}});
  settle();
  b->on_local_disconnect("\\pipe", own);  // this process's own id is never dropped
  b->on_local_disconnect("\\pipe", other_pid);
  publish_as(other_pid, {{"a", "2"}});
  EXPECT_EQ((notifications{removed(other_pid, "a", "1"), removed(other_pid, "b", "2"), removed(other_pid, "c", "3"),
                           added(other_pid, "a", "2")}),
            settle().notes);

  b->on_remote_disconnect("\\other", other_pid);
  publish_as(other_pid, {{"a", "3"}});
  EXPECT_EQ((notifications{removed(other_pid, "a", "2")}), settle().notes);
  EXPECT_TRUE(test_support::has_line(L"bus::on_remote_listeners",
                                     L"listeners of pid=4242 dropped: the process has disconnected"));

  b->on_local_connect("\\pipe", other_pid);  // a process that got the same id
  publish_as(other_pid, {{"a", "4"}});
  EXPECT_EQ((notifications{added(other_pid, "a", "4")}), settle().notes);
}

// An observer may call the bus from inside a notification: this would
// deadlock if notifications ran under the bus's mutex or on the caller.
TEST_F(bus_test, notifications_run_on_the_notifier_thread_outside_the_bus_lock_and_are_logged) {
  test_support::recording_bus_observer silent;
  silent.answers = false;
  ASSERT_TRUE(b->add_observer(&silent, 0));
  observer.on_call = [&](const test_support::notification& n) {
    if (n.channel == "outer") b->register_listener("inner", "2");
  };
  b->register_listener("outer", "1");
  ASSERT_TRUE(observer.wait_for_count(2)) << "the nested registration was not notified";
  observer.on_call = nullptr;
  const auto seen = observer.seen();
  EXPECT_EQ(added(own, "inner", "2"), seen[1]);
  EXPECT_NE(::GetCurrentThreadId(), seen[0].thread);
  EXPECT_EQ(seen[0].thread, seen[1].thread) << "one notifier thread per bus";
  EXPECT_TRUE(silent.seen().empty());
  const auto lines = test_support::find_lines(L"notify_new_listener", L"channel=outer");
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(L"notify_new_listener pid=" + std::to_wstring(own) + L" channel=outer id=1", lines[0].text);
  EXPECT_TRUE(b->remove_observer(&silent, 0));
}

// A bus whose build failed is destroyed without unsubscribe while its
// delivery thread may still hand it listeners messages: the service channel
// must go before the mutex and the table.
TEST(bus_destruction, messages_still_arriving_while_a_bus_goes_are_harmless) {
  for (int round = 0; round < 20; ++round) {
    auto doomed = std::make_unique<bus>("doomed");
    doomed->subscribe();
    for (std::uint32_t i = 0; i < 300; ++i) {
      publish_on(static_cast<parlo::bus*>(doomed->get_messaging_bus()), 1000 + i, {{"c", std::to_string(i)}});
    }
    doomed.reset();
  }
}

