// Observer lists: contexts, notification order and the walk's locking. The
// observable face over it is exercised through the gateway and the bus.
#include <gtest/gtest.h>

#include <stdexcept>
#include <string>

#include "platform/observable.h"
#include "support/log_capture.h"

using list_type = CallbackList<char*>;

std::string names(list_type& list) {
  std::string seen;
  list.walk([&](char* o) { seen += *o; });
  return seen;
}

TEST(callback_list_test, ContextsAndOrder) {
  list_type list;
  char a = 'a', b = 'b', c = 'c';
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

// Add and remove from inside a notification would wait for the walk's own
// read lock: they are refused. A throwing observer leaves no lock held, or
// the add and remove after it would be refused too.
TEST(callback_list_test, NullReentrantAndThrowingCallsLeaveTheListUsable) {
  test_support::clear_log();
  list_type list;
  char a = 'a', x = 'x';
  EXPECT_FALSE(list.add(nullptr, 0));
  list.add(&a, 0);
  EXPECT_THROW(list.walk([&](char*) {
    EXPECT_FALSE(list.add(&x, 0));
    EXPECT_EQ(list.remove(&a, 0), 1168u);
    throw std::runtime_error("observer failed");
  }),
               std::runtime_error);
  EXPECT_TRUE(test_support::has_line(L"CallbackList::add", L"null observer refused"));
  EXPECT_TRUE(test_support::has_line(L"CallbackList::remove", L"refused from inside a notification"));
  EXPECT_TRUE(list.add(&x, 0) && list.remove(&x, 0) == 0);
  EXPECT_EQ(names(list), "a");
}
