// The bus over the real messaging stand-in: its listener table, what it
// publishes on the service channel, how it merges what other processes
// publish, and the notifications its observers get.
#include <gtest/gtest.h>

#include <windows.h>

#include <atomic>
#include <memory>
#include <thread>

#include "bus/bus.h"
#include "bus/comm/listeners_codec.h"
#include "bus/parlo/parlo.h"
#include "support/bus_observer.h"
#include "support/log_capture.h"

namespace {

using test_support::added;
using test_support::has_line;
using test_support::notification;
using test_support::recording_bus_observer;
using test_support::removed;
using notifications = std::vector<notification>;

constexpr std::uint32_t other_pid = 4242;

// Watches "vorbel_service" like a peer process would: records every
// listeners message and request posted on it.
class service_spy {
 public:
  explicit service_spy(parlo::bus* messaging) {
    channel_ = messaging->get_channel("vorbel_service");
    subscription_ = channel_->create_subscription();
    subscription_->listen(&service_spy::on_message, this, 0);
  }
  ~service_spy() { channel_->destroy_subscription(subscription_); }

  struct seen {
    std::uint32_t id;
    std::uint32_t pid;
    listener_list listeners;
  };
  std::vector<seen> take() {
    std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(seen_, {});
  }

 private:
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<service_spy*>(context);
    seen s{message->message_id(), 0, {}};
    std::uint64_t size = 0;
    if (const void* bytes = message->get_blob("params", &size)) {
      comm::decode_listeners(static_cast<const std::uint8_t*>(bytes), size, s.pid, s.listeners);
    }
    std::lock_guard<std::mutex> lock(self->mutex_);
    self->seen_.push_back(std::move(s));
  }
  parlo::channel* channel_;
  parlo::subscription* subscription_;
  std::mutex mutex_;
  std::vector<seen> seen_;
};

class bus_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    b = std::make_unique<bus>("test_bus");
    b->subscribe();
    ASSERT_NE(nullptr, b->get_service_channel());
    ASSERT_TRUE(b->add_observer(&observer, 0));
    spy = std::make_unique<service_spy>(messaging());
  }
  void TearDown() override {
    spy.reset();
    b->remove_observer(&observer, 0);
    b->unsubscribe();
    b.reset();
  }

  parlo::bus* messaging() { return static_cast<parlo::bus*>(b->get_messaging_bus()); }
  std::uint32_t own() const { return ::GetCurrentProcessId(); }

  // What happened since the last settle: waits until every message posted
  // so far was delivered and every notification posted so far ran. A
  // sentinel listener goes through the same queues last and is cut off.
  struct batch {
    notifications notes;
    std::vector<service_spy::seen> pubs;
  };
  void settle() {
    batch& out = last_;
    EXPECT_EQ(0u, messaging()->flush(5000));
    b->register_listener("~sentinel", "~");
    b->unregister_listener("~sentinel", "~");
    // The sentinel's removal is the last task posted: once it ran, every
    // notification posted before it ran too.
    EXPECT_TRUE(test_support::wait_until([&] {
      const auto seen = observer.seen();
      return !seen.empty() && seen.back() == removed(own(), "~sentinel", "~");
    }));
    EXPECT_EQ(0u, messaging()->flush(5000));
    for (auto& n : observer.take()) {
      if (n.channel != "~sentinel") out.notes.push_back(std::move(n));
    }
    out.pubs = spy->take();
    out.pubs.resize(out.pubs.size() - 2);
  }
  notifications taken() { return std::exchange(last_.notes, {}); }
  std::vector<service_spy::seen> published() { return std::exchange(last_.pubs, {}); }

  // Posts a message on the service channel as another process would.
  void post_raw(std::uint32_t id, const void* params, std::uint64_t size, bool with_blob = true) {
    parlo::message* message = messaging()->create_message(0);
    message->set_message_id(id);
    if (with_blob) message->set_blob("params", params, size);
    messaging()->get_channel("vorbel_service")->post(message);
    message->release();
  }
  void publish_as(std::uint32_t pid, const listener_list& listeners) {
    const auto bytes = comm::encode_listeners(pid, listeners);
    post_raw(2, bytes.data(), bytes.size());
  }

  std::unique_ptr<bus> b;
  recording_bus_observer observer;
  std::unique_ptr<service_spy> spy;
  batch last_;
};

TEST_F(bus_test, duplicates_are_kept_and_removed_one_at_a_time) {
  EXPECT_EQ(0u, b->register_listener("a", "x"));
  EXPECT_EQ(0u, b->register_listener("a", "x"));
  settle();
  EXPECT_EQ((notifications{added(own(), "a", "x"), added(own(), "a", "x")}), taken());
  auto pubs = published();
  ASSERT_EQ(2u, pubs.size()) << "each registration publishes the whole table";
  EXPECT_EQ(own(), pubs[1].pid);
  EXPECT_EQ((listener_list{{"a", "x"}, {"a", "x"}}), pubs[1].listeners);

  EXPECT_EQ(0u, b->unregister_listener("a", "x"));
  EXPECT_TRUE(b->is_registered_listener("a", "x"));
  EXPECT_FALSE(b->is_registered_listener("a", "y"));
  EXPECT_EQ(0u, b->unregister_listener("a", "x"));
  EXPECT_FALSE(b->is_registered_listener("a", "x"));
  settle();
  EXPECT_EQ((notifications{removed(own(), "a", "x"), removed(own(), "a", "x")}), taken());
  pubs = published();
  ASSERT_EQ(2u, pubs.size());
  EXPECT_TRUE(pubs[1].listeners.empty());

  EXPECT_EQ(0u, b->unregister_listener("never", "registered"));
  settle();
  EXPECT_TRUE(taken().empty()) << "nothing found: nothing notified";
  EXPECT_TRUE(published().empty()) << "nothing found: nothing published";
}

TEST_F(bus_test, null_arguments_are_refused_with_their_lines) {
  for (const auto& [channel, id] : {std::pair<const char*, const char*>{nullptr, "x"}, {"a", nullptr}}) {
    EXPECT_EQ(87u, b->register_listener(channel, id));
    EXPECT_EQ(87u, b->unregister_listener(channel, id));
    EXPECT_FALSE(b->is_registered_listener(channel, id));
  }
  for (const auto& [function, text] : std::vector<std::pair<const wchar_t*, const wchar_t*>>{
           {L"bus::register_listener", L"channel is nullptr"},
           {L"bus::register_listener", L"id is nullptr"},
           {L"bus::unregister_listener", L"channel is nullptr"},
           {L"bus::unregister_listener", L"listener_id is nullptr"},
           {L"bus::is_registered_listener", L"channel is nullptr"},
           {L"bus::is_registered_listener", L"listener_id is nullptr"}}) {
    EXPECT_TRUE(has_line(function, text)) << function << L": " << text;
  }
  settle();
  EXPECT_TRUE(taken().empty());
  EXPECT_TRUE(published().empty());
}

TEST_F(bus_test, a_remote_list_is_merged_with_additions_before_removals) {
  publish_as(other_pid, {{"a", "x"}, {"c", "z"}});
  settle();
  EXPECT_EQ((notifications{added(other_pid, "a", "x"), added(other_pid, "c", "z")}), taken());
  EXPECT_TRUE(b->is_registered_listener("c", "z")) << "a remote listener counts";

  publish_as(other_pid, {{"a", "x"}, {"b", "y"}});
  settle();
  EXPECT_EQ((notifications{added(other_pid, "b", "y"), removed(other_pid, "c", "z")}), taken());

  // An empty list is a valid publication: it empties the process's list.
  publish_as(other_pid, {});
  settle();
  EXPECT_EQ((notifications{removed(other_pid, "a", "x"), removed(other_pid, "b", "y")}), taken());
  EXPECT_FALSE(b->is_registered_listener("a", "x"));

  publish_as(other_pid, {{"d", "w"}});
  settle();
  EXPECT_EQ((notifications{added(other_pid, "d", "w")}), taken());
}

TEST_F(bus_test, this_processs_own_publication_is_ignored) {
  publish_as(own(), {{"a", "x"}});
  b->on_remote_listeners(own(), {{"b", "y"}});
  settle();
  EXPECT_TRUE(taken().empty());
  EXPECT_FALSE(b->is_registered_listener("a", "x"));
  EXPECT_FALSE(b->is_registered_listener("b", "y"));
}

TEST_F(bus_test, malformed_listeners_messages_are_dropped) {
  post_raw(2, nullptr, 0, /* with_blob */ false);
  const char empty[1] = {};
  post_raw(2, empty, 0);
  const char garbage[] = "not a flatbuffer at all";
  post_raw(2, garbage, sizeof garbage);
  post_raw(77, garbage, sizeof garbage);  // unknown id: ignored
  settle();
  EXPECT_TRUE(taken().empty());
  const auto lines = test_support::find_lines(L"comm::service_channel::on_message", L"");
  ASSERT_EQ(2u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob:  buf is nullptr, size=0",
            lines[0].text);
  EXPECT_EQ(L"unexpected service_channel_messages_id::listeners params blob: size=0", lines[1].text);
  EXPECT_EQ(4u, lines[0].level);
}

TEST_F(bus_test, connect_publishes_then_asks_and_disconnect_drops_the_process) {
  // A request carries no pid: the bus's own subscription answers it too,
  // with its whole table.
  b->register_listener("own", "1");
  settle();
  taken();
  published();
  b->on_local_connect("\\pipe", other_pid);
  settle();
  auto pubs = published();
  ASSERT_EQ(3u, pubs.size());
  EXPECT_EQ(2u, pubs[0].id);
  EXPECT_EQ(1u, pubs[1].id);
  EXPECT_EQ(2u, pubs[2].id);
  EXPECT_EQ(own(), pubs[2].pid);
  EXPECT_EQ((listener_list{{"own", "1"}}), pubs[2].listeners);
  b->on_remote_connect("\\pipe", other_pid);
  settle();
  EXPECT_EQ(3u, published().size());

  publish_as(other_pid, {{"c", "3"}, {"a", "1"}, {"b", "2"}});
  settle();
  taken();
  b->on_local_disconnect("\\pipe", own());
  settle();
  EXPECT_TRUE(taken().empty()) << "this process's own id is never dropped";
  b->on_remote_disconnect("\\pipe", other_pid);
  settle();
  EXPECT_EQ((notifications{removed(other_pid, "a", "1"), removed(other_pid, "b", "2"),
                           removed(other_pid, "c", "3")}),
            taken());
  EXPECT_FALSE(b->is_registered_listener("a", "1"));
  b->on_local_disconnect("\\pipe", other_pid);
  settle();
  EXPECT_TRUE(taken().empty()) << "an unknown process has nothing to drop";
}

TEST_F(bus_test, a_list_arriving_after_its_process_left_is_dropped_until_it_connects_again) {
  // Two connections of one process: the first to end drops its listeners as
  // ever, and its lists count while the other lives.
  b->on_local_connect("\\pipe", other_pid);
  b->on_remote_connect("\\other", other_pid);
  publish_as(other_pid, {{"a", "1"}});
  settle();
  taken();
  b->on_local_disconnect("\\pipe", other_pid);
  publish_as(other_pid, {{"a", "2"}});
  settle();
  EXPECT_EQ((notifications{removed(other_pid, "a", "1"), added(other_pid, "a", "2")}), taken());

  // Its last connection ends: a list still on its way cannot bring it back.
  b->on_remote_disconnect("\\other", other_pid);
  publish_as(other_pid, {{"a", "3"}});
  settle();
  EXPECT_EQ((notifications{removed(other_pid, "a", "2")}), taken());
  EXPECT_FALSE(b->is_registered_listener("a", "3"));
  EXPECT_TRUE(has_line(L"bus::on_remote_listeners",
                       L"listeners of pid=4242 dropped: the process has disconnected"));

  // Connected again (a process that got the same id): its lists count.
  b->on_local_connect("\\pipe", other_pid);
  publish_as(other_pid, {{"a", "4"}});
  settle();
  EXPECT_EQ((notifications{added(other_pid, "a", "4")}), taken());
}

TEST_F(bus_test, notifications_run_on_the_notifier_thread_outside_the_bus_lock) {
  // An observer may call the bus from inside a notification: this would
  // deadlock if notifications ran under the bus's mutex or on the caller.
  std::atomic<bool> nested{false};
  observer.on_call = [&](const notification& n) {
    if (n.channel == "outer" && !nested.exchange(true)) {
      EXPECT_TRUE(b->is_registered_listener("outer", "1"));
      b->register_listener("inner", "2");
    }
  };
  b->register_listener("outer", "1");
  ASSERT_TRUE(observer.wait_for_count(2)) << "the nested registration was not notified";
  const auto seen = observer.seen();
  EXPECT_EQ(added(own(), "inner", "2"), seen[1]);
  EXPECT_NE(::GetCurrentThreadId(), seen[0].thread);
  EXPECT_EQ(seen[0].thread, seen[1].thread) << "one notifier thread per bus";
  observer.on_call = nullptr;
}

TEST_F(bus_test, every_notification_is_logged_and_silent_observers_are_skipped) {
  recording_bus_observer silent;
  silent.answers = false;
  ASSERT_TRUE(b->add_observer(&silent, 0));
  b->register_listener("a", "x");
  settle();
  EXPECT_EQ((notifications{added(own(), "a", "x")}), taken());
  EXPECT_TRUE(silent.seen().empty());
  const std::wstring expected =
      L"notify_new_listener pid=" + std::to_wstring(own()) + L" channel=a id=x";
  const auto lines = test_support::find_lines(L"notify_new_listener", expected);
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(expected, lines[0].text);
  EXPECT_EQ(16u, lines[0].level);
  EXPECT_TRUE(b->remove_observer(&silent, 0));
}

TEST_F(bus_test, answers_five_identifiers_on_two_faces) {
  void* bus_face = static_cast<ibus*>(b.get());
  void* observer_face = static_cast<igateway_observer*>(b.get());
  for (const auto& [iid, face] : {std::pair<GUID, void*>{IID_IQmBaseInterface, bus_face}, {IID_ibus_base, bus_face},
                                  {IID_ibus, bus_face}, {IID_igateway_observer, observer_face},
                                  {IID_igateway_observer_base, observer_face}, {IID_igateway, nullptr}}) {
    EXPECT_EQ(face, b->GetInterface(iid));
  }
  EXPECT_TRUE(has_line(L"bus::GetInterface", L"unknown interface "));
}

TEST(bus_construction, a_refused_library_bus_is_a_system_error_31) {
  test_support::clear_log();
  const std::string too_long(4000, 'n');  // the messaging library refuses the name
  try {
    bus refused(too_long.c_str());
    FAIL() << "the constructor must throw";
  } catch (const std::system_error& e) {
    EXPECT_EQ(31, e.code().value());
    EXPECT_EQ(0, std::string(e.what()).rfind("create_bus failed", 0)) << e.what();
  }
  const auto lines = test_support::find_lines(L"make_messaging_bus", L"create_bus fail");
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(2u, lines[0].level);
}

TEST(bus_destruction, messages_still_arriving_while_a_bus_goes_are_harmless) {
  // A bus whose build failed is destroyed without unsubscribe while its
  // delivery thread may still hand it listeners messages.
  for (int round = 0; round < 20; ++round) {
    auto doomed = std::make_unique<bus>("doomed");
    doomed->subscribe();
    recording_bus_observer watcher;
    doomed->add_observer(&watcher, 0);
    auto* messaging = static_cast<parlo::bus*>(doomed->get_messaging_bus());
    parlo::channel* service = messaging->get_channel("vorbel_service");
    for (std::uint32_t i = 0; i < 300; ++i) {
      const auto bytes = comm::encode_listeners(1000 + i, {{"c", std::to_string(i)}});
      parlo::message* message = messaging->create_message(0);
      message->set_message_id(2);
      message->set_blob("params", bytes.data(), bytes.size());
      service->post(message);
      message->release();
    }
    doomed.reset();
  }
  SUCCEED();
}

}  // namespace
