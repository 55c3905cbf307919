// Teardown while notifications run: a bus or a registry goes while an
// observer is inside one of its notifications and calls back into it, and an
// observer is removed while a notification uses it. Freed memory is poisoned
// in this program (test_heap.cpp), so a call that reaches a freed table faults.
#include <gtest/gtest.h>

#include <atomic>
#include <string>

#include "bus/bus.h"
#include "lifetimes.h"
#include "registry/vorbel_impl.h"
#include "support/bus_observer.h"
#include "support/config_provider.h"

namespace {

using namespace lifetimes_test;
using test_support::has_line;
using test_support::wait_until;

// The first notification is held; the bus is destroyed on another thread
// meanwhile, and the notification then calls the bus for a second.
TEST(teardown, a_notification_that_calls_its_bus_while_the_bus_is_destroyed_finds_it_whole) {
  auto* doomed = new bus("lifetimes_doomed");
  gate_observer observer;
  std::atomic<int> wrong{0};
  observer.inside = [&] {
    for (int i = 0; i < 100; ++i, ::Sleep(10)) {
      wrong += !doomed->is_registered_listener("held", "1");
      wrong += doomed->register_listener("late", std::to_string(i).c_str()) != 0;
    }
  };
  ASSERT_TRUE(doomed->add_observer(observer.bus_face(), 0));
  observer.armed = true;
  doomed->register_listener("held", "1");
  ASSERT_TRUE(observer.entered.wait());
  bounded_thread destroyer([&] { delete doomed; });
  observer.released.set();
  destroyer.join_or_die(60s, "destroying a bus whose observer calls it");
  EXPECT_EQ(0, wrong.load()) << "calls from the notification found the bus half gone";
  EXPECT_EQ(1, observer.calls.load()) << "notifications queued behind the running one must be dropped";
}

TEST(teardown, a_long_notification_task_stops_when_its_bus_is_destroyed) {
  auto* doomed = new bus("lifetimes_long");
  gate_observer observer;
  observer.after = [] { ::Sleep(1); };
  ASSERT_TRUE(doomed->add_observer(observer.bus_face(), 0));
  listener_list received;
  for (int i = 0; i < 5000; ++i) received.push_back({"alerts", std::to_string(100000 + i)});
  observer.armed = true;
  doomed->on_remote_listeners(4242, std::move(received), /* origin */ 4242);
  ASSERT_TRUE(observer.entered.wait());
  bounded_thread destroyer([&] { delete doomed; });
  ::Sleep(100);
  observer.released.set();
  destroyer.join_or_die(120s, "destroying a bus in the middle of a long notification task");
  EXPECT_LT(observer.calls.load(), 5000) << "the task ran to its end although its bus was going";
}

// A notification of the bus or of its gateway is held while destroy_bus, or
// the registry's destruction, tears the bus down on another thread; the
// notification asks the registry for the bus (and for a new one of that
// name). The teardown waits for the notification: the calls must not wait
// for the teardown, and the name must be gone for them.
TEST(teardown, registry_calls_from_a_notification_during_a_teardown_neither_wait_nor_find_the_name) {
  const struct {
    bool gateway_event, final_release, create;
  } cases[] = {{false, false, false}, {false, false, true}, {true, false, false},
               {true, false, true},   {false, true, false}, {true, true, true}};
  const char* const name = "lifetimes_registry";
  const wchar_t* const pipe = L"\\\\.\\pipe\\vorbel_lifetimes_registry";
  test_support::config_provider provider;
  provider.local = {"alerts"};
  provider.exports = {{"alerts", "\\\\.\\pipe\\vorbel_lifetimes_registry", true, 3, 1}};
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::Message() << (c.gateway_event ? "gateway" : "bus") << " notification, "
                                    << (c.final_release ? "final release" : "destroy_bus")
                                    << (c.create ? ", create_bus" : ""));
    test_support::clear_log();
    auto* registry = new vorbel_impl();
    ibus* b = registry->create_bus(name, &provider);
    igateway* g = registry->get_gateway(name);
    ASSERT_TRUE(b != nullptr && g != nullptr) << test_support::dump_log();
    gate_observer observer;
    std::atomic<bool> gone{false}, created{false};
    observer.inside = [&] {
      gone = wait_until([&] {
        return c.gateway_event ? registry->get_gateway(name) == nullptr : registry->get_bus(name) == nullptr;
      }, 15s);
      created = c.create && registry->create_bus(name, &provider) != nullptr;
    };
    ASSERT_TRUE(c.gateway_event ? g->add_observer(observer.gateway_face(), 0)
                                : b->add_observer(observer.bus_face(), 0));
    observer.armed = true;
    winapi::unique_handle client;
    if (c.gateway_event) {
      // This program is signed like every program of the build: admitted.
      ASSERT_TRUE(wait_until([&] { return bool(client = open_client(pipe)); }, 10s));
    } else {
      b->register_listener("held", "1");
    }
    ASSERT_TRUE(observer.entered.wait()) << test_support::dump_log();
    bounded_thread destroyer([&] { c.final_release ? delete registry : registry->destroy_bus(name); });
    observer.released.set();
    destroyer.join_or_die(60s, "the teardown");
    EXPECT_TRUE(gone.load()) << "the name was still found while its bus was torn down";
    EXPECT_FALSE(created.load()) << "a second bus was built while the first was torn down";
    EXPECT_EQ(c.create, has_line(L"vorbel_impl::create_bus", L"is being torn down"));
    if (c.final_release) continue;
    EXPECT_NE(nullptr, registry->create_bus(name, &provider)) << "the name stays taken after its teardown";
    registry->destroy_bus(name);
    delete registry;
  }
}

// Hosts free an observer once remove_observer has returned: it must wait for
// the notification that uses the observer.
TEST(teardown, remove_observer_waits_for_the_notification_that_uses_the_observer) {
  bus notifying("lifetimes_removal");
  gate_observer observer;
  ASSERT_TRUE(notifying.add_observer(observer.bus_face(), 7));
  observer.inside = [] { ::Sleep(300); };
  observer.armed = true;
  notifying.register_listener("alerts", "1");
  ASSERT_TRUE(observer.entered.wait());
  std::atomic<bool> removed{false}, left_first{false};
  bounded_thread remover([&] {
    removed = notifying.remove_observer(observer.bus_face(), 7);
    left_first = observer.left.load();
  });
  ::Sleep(200);
  EXPECT_FALSE(remover.done()) << "remove_observer returned while the observer was still notified";
  observer.released.set();
  remover.join_or_die(30s, "remove_observer");
  EXPECT_TRUE(removed && left_first) << "remove_observer returned before the notification did";
  test_support::recording_bus_observer later;
  notifying.add_observer(&later, 0);
  notifying.register_listener("alerts", "2");
  EXPECT_TRUE(later.wait_for_count(1));
  notifying.remove_observer(&later, 0);
  EXPECT_EQ(1, observer.calls.load()) << "a removed observer was called";
}

}  // namespace
