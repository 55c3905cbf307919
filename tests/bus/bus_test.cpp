// The bus over the real messaging stand-in: its listener table, what it
// publishes on the service channel, how it merges what other processes
// publish, and the notifications its observers get.
#include <gtest/gtest.h>

#include <windows.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "bus/bus.h"
#include "bus/comm/listeners_codec.h"
#include "bus/parlo/parlo.h"
#include "platform/handles.h"
#include "support/bus_observer.h"
#include "support/log_capture.h"

using test_support::added;
using test_support::removed;
using notifications = std::vector<test_support::notification>;
using namespace std::chrono_literals;

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

  // Waits until every message posted so far was delivered, this process's
  // table was published and every notification posted so far ran, and gives
  // what was notified since the last settle (what was published is left in
  // `published`). A sentinel listener goes through the same queues last and
  // is cut off, with what it made the bus publish.
  notifications settle() {
    EXPECT_EQ(0u, messaging->flush(20000));  // a request received marks the table changed
    EXPECT_TRUE(b.wait_published(20s)) << "the publisher still had a change after 20 s";
    EXPECT_EQ(0u, messaging->flush(20000));  // and its publication reached the spy
    {
      std::lock_guard<std::mutex> lock(mutex);
      published = std::move(pubs);
      pubs.clear();
    }
    b.register_listener("~sentinel", "~");
    b.unregister_listener("~sentinel", "~");
    EXPECT_TRUE(test_support::wait_until(
        [&] { return observer.seen().size() > 0 && observer.seen().back() == removed(own, "~sentinel", "~"); }));
    EXPECT_TRUE(b.wait_published(20s));
    EXPECT_EQ(0u, messaging->flush(20000));
    std::lock_guard<std::mutex> lock(mutex);
    pubs.clear();
    notifications notes;
    for (auto& n : observer.take()) if (n.channel != "~sentinel") notes.push_back(std::move(n));
    return notes;
  }
  // The tables this process published before the last settle.
  std::vector<listener_list> own_tables() const {
    std::vector<listener_list> tables;
    for (const auto& [pid, listeners] : published) {
      if (pid == own) tables.push_back(listeners);
    }
    return tables;
  }

  // The bus goes first, and with its messaging bus the spy's subscription.
  test_support::recording_bus_observer observer;
  std::mutex mutex;
  std::vector<std::pair<std::uint32_t, listener_list>> pubs, published;
  bus b{"test_bus"};
  parlo::bus* messaging = static_cast<parlo::bus*>(b.get_messaging_bus());
  parlo::subscription* spy = nullptr;
};

// Changes that come while a publication is recent fold into the next one:
// the peers see some of the whole tables the process went through, in order,
// and always the last one.
TEST_F(bus_test, duplicates_are_kept_and_removed_one_at_a_time_and_the_last_table_is_published) {
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
  const std::vector<listener_list> states = {{}, {{"a", "x"}}, {{"a", "x"}, {"a", "x"}}, {{"a", "x"}}, {}};
  const std::vector<listener_list> tables = own_tables();
  ASSERT_FALSE(tables.empty());
  std::size_t at = 0;
  for (const listener_list& table : tables) {
    while (at < states.size() && states[at] != table) ++at;
    EXPECT_LT(at, states.size()) << "a table the process never had, or one out of order";
  }
  EXPECT_EQ(listener_list{}, tables.back());
  EXPECT_EQ(tables.size(), published.size()) << "no request was posted";
}

// A peer that asks again and again is answered at the publisher's pace, not
// once per request: a table of 10,000 listeners (520 KB) asked for every
// millisecond for half a second goes out a handful of times.
TEST_F(bus_test, requests_are_answered_at_the_publishers_pace) {
  for (int i = 0; i < 10000; ++i) b.register_listener("asked", std::to_string(100000 + i).c_str());
  settle();
  const auto start = std::chrono::steady_clock::now();
  int requests = 0;
  for (; std::chrono::steady_clock::now() - start < 500ms; ++requests) {
    post(messaging, 1, nullptr, 0, /* with_blob */ false);
    ::Sleep(1);
  }
  settle();
  const std::vector<listener_list> tables = own_tables();
  ASSERT_FALSE(tables.empty()) << "requests were not answered";
  EXPECT_LE(tables.size(), 20u) << requests << " requests";
  EXPECT_EQ(10000u, tables.back().size());
}

// A post the messaging library refuses (its queue is full) is not lost: the
// publication is logged and goes again, with the newest table.
TEST_F(bus_test, a_refused_publication_is_logged_and_the_newest_table_goes_again) {
  ASSERT_EQ(0u, messaging->create_channel("block"));
  parlo::channel* block = messaging->get_channel("block");
  winapi::unique_handle release(::CreateEventW(nullptr, /* manual_reset */ TRUE, FALSE, nullptr));
  // Holds the delivery thread, so that posts pile up in the queue.
  ASSERT_EQ(0u, block->create_subscription()->listen(
                    [](parlo::message*, void* event) { ::WaitForSingleObject(static_cast<HANDLE>(event), 30000); },
                    release.get(), 0));
  std::uint32_t posted = 0;
  for (int i = 0; i <= static_cast<int>(parlo::max_queued_messages) + 1 && posted == 0; ++i) {
    parlo::message* message = messaging->create_message(0);
    posted = block->post(message);
    message->release();
  }
  ASSERT_EQ(parlo::error_not_enough_quota, posted) << "the delivery queue never filled";
  b.register_listener("q", "1");
  EXPECT_TRUE(test_support::wait_for_line(L"publisher::run", L"publication failed err=1816; the table goes again in"))
      << test_support::dump_log();
  // Nothing changes any more: only the retry can bring the table out.
  ::SetEvent(release.get());
  settle();
  const std::vector<listener_list> tables = own_tables();
  ASSERT_FALSE(tables.empty()) << "the refused publication was never made again";
  EXPECT_EQ((listener_list{{"q", "1"}}), tables.back());
}

// A name over the documented limit, or a listener that would make the table
// larger than one message carries, is refused with 87 and a line, never
// accepted and then lost; a table up to the limit is published whole.
TEST_F(bus_test, names_and_tables_too_large_for_one_message_are_refused_with_87) {
  const std::string huge(16u << 20, 'h'), over(ibus_max_listener_name + 1, 'o');
  const struct {
    std::string channel, id;
    const wchar_t* line;
  } refused[] = {
      {"c", huge, L"id longer than 65536 bytes"},
      {"c", over, L"id longer than 65536 bytes"},
      {over, "i", L"channel longer than 65536 bytes"},
  };
  for (const auto& r : refused) {
    test_support::clear_log();
    EXPECT_EQ(87u, b.register_listener(r.channel.c_str(), r.id.c_str())) << r.id.size();
    EXPECT_TRUE(test_support::has_line(L"bus::register_listener", r.line)) << test_support::dump_log();
    EXPECT_FALSE(b.is_registered_listener(r.channel.c_str(), r.id.c_str()));
  }
  // No more listeners than a peer takes from one process: it would refuse
  // the whole table.
  for (std::size_t i = 0; i < comm::max_listeners_per_process; ++i) {
    ASSERT_EQ(0u, b.register_listener("n", std::to_string(i).c_str())) << i;
  }
  EXPECT_EQ(87u, b.register_listener("n", "one more"));
  EXPECT_TRUE(test_support::has_line(L"bus::register_listener", L"listener refused: this process has 65536 listeners"));
  for (std::size_t i = 0; i < comm::max_listeners_per_process; ++i) b.unregister_listener("n", std::to_string(i).c_str());
  // The longest ids the bus takes, until the table is full.
  std::string id(ibus_max_listener_name, 'i');
  std::size_t accepted = 0;
  for (; accepted < 300; ++accepted) {
    id.replace(0, 3, std::to_string(100 + accepted));
    if (b.register_listener("c", id.c_str()) != 0) break;
  }
  EXPECT_TRUE(test_support::has_line(L"bus::register_listener",
                                     L"listener refused: the table would take more than 16777186 bytes in one message"));
  EXPECT_GT(accepted, 250u);
  EXPECT_EQ(0u, b.register_listener("small", "1")) << "a listener that fits is still taken";
  settle();
  const std::vector<listener_list> tables = own_tables();
  ASSERT_FALSE(tables.empty());
  EXPECT_EQ(accepted + 1, tables.back().size()) << "the full table was not published whole";
  EXPECT_FALSE(test_support::has_line(L"comm::service_channel::publish_listeners", L"")) << test_support::dump_log();
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
  // Each connect asks once (no pid) and publishes the table; the bus answers
  // its own request too, folded into that publication or after it.
  for (const bool local : {true, false}) {
    local ? b.on_local_connect("\\pipe", other_pid) : b.on_remote_connect("\\other", other_pid);
    settle();
    std::vector<std::uint32_t> pids;
    for (const auto& p : published) pids.push_back(p.first);
    EXPECT_EQ(1, std::count(pids.begin(), pids.end(), 0u)) << "one request";
    const std::vector<listener_list> tables = own_tables();
    ASSERT_TRUE(!tables.empty() && tables.size() <= 2) << tables.size();
    EXPECT_EQ((listener_list{{"own", "1"}}), tables.back());
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
