// The three exports and the factory behind them, as a host calls them.
#include <gtest/gtest.h>
#include <vorbel/vorbel.h>

#include "component/factory.h"
#include "registry/vorbel_impl.h"
#include "support/log_capture.h"

extern "C" {
std::uint32_t QmCreateObject(const wchar_t* name, const GUID& iid, void** out);
void QmDestroyObject(const wchar_t* name, void* object);
void* QmGetInterface(const GUID& iid);
}

namespace {

// A second component registered in the same process, to check that names
// select the factory and that unknown identifiers never reach it.
struct other_object final : IQmBaseInterface {
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_IQmBaseInterface) ? this : nullptr;
  }
};
qmFactory<other_object> g_other_factory(L"other", L"other_alias");

class factory : public ::testing::Test {
 protected:
  void TearDown() override {
    // Every test gives back what it created; a leak would poison the next.
    EXPECT_EQ(0, vorbel_factory().use_count());
    EXPECT_EQ(0, g_other_factory.use_count());
  }
};

TEST_F(factory, creation_hands_out_one_counted_instance) {
  EXPECT_EQ(nullptr, QmGetInterface(IID_ivorbel));

  void* first = nullptr;
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &first));
  ASSERT_NE(nullptr, first);
  EXPECT_EQ(1, vorbel_factory().use_count());
  auto* registry = static_cast<ivorbel*>(first);
  EXPECT_EQ(first, registry->GetInterface(IID_ivorbel));
  EXPECT_EQ(first, QmGetInterface(IID_ivorbel));
  EXPECT_EQ(1, vorbel_factory().use_count()) << "QmGetInterface must not count";

  void* second = nullptr;
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &second));
  EXPECT_EQ(first, second);
  EXPECT_EQ(2, vorbel_factory().use_count());

  QmDestroyObject(L"vorbel", second);
  EXPECT_EQ(first, QmGetInterface(IID_ivorbel)) << "one use is still held";
  QmDestroyObject(L"vorbel", first);
  EXPECT_EQ(nullptr, QmGetInterface(IID_ivorbel));
}

TEST_F(factory, refusals_and_their_codes) {
  void* p = reinterpret_cast<void*>(1);
  EXPECT_EQ(13u, QmCreateObject(L"vorbel", IID_ivorbel, &p));
  EXPECT_EQ(nullptr, p);

  p = reinterpret_cast<void*>(1);
  EXPECT_EQ(1168u, QmCreateObject(L"VORBEL", IID_IQmBaseInterface, &p)) << "names are case-sensitive";
  EXPECT_EQ(nullptr, p);
  EXPECT_EQ(1168u, QmCreateObject(L"", IID_IQmBaseInterface, &p)) << "an empty alias never matches";

  EXPECT_EQ(13u, QmCreateObject(nullptr, IID_IQmBaseInterface, &p));
  EXPECT_EQ(13u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, nullptr));

  // The identifier check comes before the name: even a name that a factory
  // owns is refused with a foreign identifier.
  EXPECT_EQ(13u, QmCreateObject(L"other", IID_ivorbel, &p));
  EXPECT_EQ(0, vorbel_factory().use_count());
}

TEST_F(factory, alternate_identifier_yields_no_interface_but_counts_a_use) {
  void* p = reinterpret_cast<void*>(1);
  EXPECT_EQ(14u, QmCreateObject(L"vorbel", IID_IQmCreateAlternate, &p));
  EXPECT_EQ(nullptr, p);
  EXPECT_EQ(1, vorbel_factory().use_count());
  EXPECT_NE(nullptr, QmGetInterface(IID_ivorbel)) << "the counted use keeps the instance alive";
  QmDestroyObject(L"vorbel", reinterpret_cast<void*>(1));
  EXPECT_EQ(nullptr, QmGetInterface(IID_ivorbel));
}

TEST_F(factory, names_select_the_factory) {
  void* p = nullptr;
  ASSERT_EQ(0u, QmCreateObject(L"other_alias", IID_IQmBaseInterface, &p));
  EXPECT_EQ(1, g_other_factory.use_count());
  EXPECT_EQ(0, vorbel_factory().use_count());
  QmDestroyObject(L"vorbel", p);  // wrong name: not this factory's use
  EXPECT_EQ(1, g_other_factory.use_count());
  QmDestroyObject(L"other", p);
  EXPECT_EQ(0, g_other_factory.use_count());
}

TEST_F(factory, destroys_that_do_not_pair_change_nothing) {
  void* p = nullptr;
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &p));
  QmDestroyObject(L"vorbel", nullptr);
  QmDestroyObject(L"nobody", p);
  QmDestroyObject(nullptr, p);
  EXPECT_EQ(1, vorbel_factory().use_count());
  QmDestroyObject(L"vorbel", p);

  // A destroy with no use left must not drive the count below zero, or the
  // next creation would find a non-zero count and make no instance.
  QmDestroyObject(L"vorbel", p);
  EXPECT_EQ(0, vorbel_factory().use_count());
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &p));
  EXPECT_NE(nullptr, p);
  EXPECT_EQ(1, vorbel_factory().use_count());
  QmDestroyObject(L"vorbel", p);
}

}  // namespace
