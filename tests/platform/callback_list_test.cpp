// Observer lists: contexts, notification order, the walk's locking, and the
// observable face the bus and the gateway share.
#include <gtest/gtest.h>

#include <vorbel/igateway.h>

#include <future>
#include <stdexcept>
#include <string>

#include "platform/observable.h"
#include "support/log_capture.h"
#include "thread_actor.h"

namespace {

using test_support::done;
using test_support::has_line;
using test_support::thread_actor;

struct named {
  char name;
};
using list_type = CallbackList<named*>;

std::string names(list_type& list) {
  std::string seen;
  list.walk([&](named* o) { seen += o->name; });
  return seen;
}

TEST(callback_list_test, ContextsAndOrder) {
  list_type list;
  named a{'a'}, b{'b'}, c{'c'};
  EXPECT_TRUE(list.add(&a, 0));
  EXPECT_FALSE(list.add(&a, 1));  // the same observer, whatever its context
  EXPECT_EQ(list.remove(&a, 1), 1168u);
  EXPECT_TRUE(list.add(&b, 0) && list.add(&c, 0));
  EXPECT_EQ(names(list), "abc");
  EXPECT_EQ(list.remove(&a, 0), 0u);
  EXPECT_EQ(list.remove(&a, 0), 1168u);
  EXPECT_TRUE(list.add(&a, 0));
  EXPECT_EQ(names(list), "bca");  // removal kept the others' order
}

TEST(callback_list_test, NullAndReentrantCallsAreRefusedWithALogLine) {
  test_support::clear_log();
  list_type list;
  named a{'a'}, x{'x'};
  EXPECT_FALSE(list.add(nullptr, 0));
  EXPECT_TRUE(has_line(L"CallbackList::add", L"null observer refused"));
  list.add(&a, 0);
  list.walk([&](named*) {  // would end the process if it asked for the write lock
    EXPECT_FALSE(list.add(&x, 0));
    EXPECT_EQ(list.remove(&a, 0), 1168u);
  });
  EXPECT_EQ(names(list), "a");
  EXPECT_TRUE(has_line(L"CallbackList::remove", L"refused from inside a notification"));
}

TEST(callback_list_test, ThrowingNotificationReleasesTheLocks) {
  list_type list;
  named a{'a'}, b{'b'}, x{'x'};
  list.add(&a, 0), list.add(&b, 0);
  std::string seen;
  EXPECT_THROW(list.walk([&](named* o) {
    seen += o->name;
    throw std::runtime_error("observer failed");
  }),
               std::runtime_error);
  EXPECT_EQ(seen, "a");
  thread_actor other;
  EXPECT_TRUE(done(other.call([&] { EXPECT_TRUE(list.add(&x, 0)); })));
  EXPECT_EQ(list.remove(&x, 0), 0u);  // nor does this thread hold a read lock
}

TEST(callback_list_test, WalksShareTheListAndWritersWaitForThem) {
  list_type list;
  named a{'a'}, b{'b'}, x{'x'};
  list.add(&a, 0), list.add(&b, 0);
  std::promise<void> entered, gate;
  std::shared_future<void> gate_open = gate.get_future().share();
  std::string nested, other;
  thread_actor walker, other_walker, writer;
  const auto walking = walker.call([&] {
    list.walk([&](named* o) {
      if (o != &a) return;
      entered.set_value();
      gate_open.wait_for(test_support::wait_bound);
      nested = names(list);  // goes on although a writer waits
    });
  });
  ASSERT_TRUE(done(entered.get_future().share()));
  EXPECT_TRUE(done(other_walker.call([&] { other = names(list); })));
  const auto adding = writer.call([&] { EXPECT_TRUE(list.add(&x, 0)); });
  EXPECT_FALSE(done(adding, test_support::settle_time));
  gate.set_value();
  EXPECT_TRUE(done(walking) && done(adding));
  EXPECT_EQ(other + nested + names(list), "abababx");
}

struct gateway_double final : qm::observable<igateway_observer_base*, igateway> {
  void* GetInterface(GUID) override { return nullptr; }
};
struct observer_double final : igateway_observer_base {
  void* GetInterface(GUID) override { return nullptr; }
};

TEST(callback_list_test, ObservableFaceMatchesObserverAndContext) {
  gateway_double gateway;
  qm::iobservable<igateway_observer_base*>& face = gateway;
  observer_double one, two;
  EXPECT_TRUE(face.add_observer(&one, 7) && face.add_observer(&two, 0));
  EXPECT_FALSE(face.add_observer(&one, 0));
  EXPECT_FALSE(face.remove_observer(&one, 0));
  EXPECT_TRUE(face.remove_observer(&one, 7));
  std::vector<igateway_observer_base*> seen;
  gateway.observer_list().walk([&](igateway_observer_base* o) { seen.push_back(o); });
  EXPECT_EQ(seen, std::vector<igateway_observer_base*>{&two});
}

}  // namespace
