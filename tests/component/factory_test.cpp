// The three exports and the factory behind them, as a host calls them.
#include <gtest/gtest.h>
#include <vorbel/vorbel.h>

#include "component/factory.h"

extern "C" {
std::uint32_t QmCreateObject(const wchar_t* name, const GUID& iid, void** out);
void QmDestroyObject(const wchar_t* name, void* object);
void* QmGetInterface(const GUID& iid);
}

namespace {

TEST(factory, creation_codes_and_one_counted_instance_whose_count_never_goes_below_zero) {
  EXPECT_EQ(nullptr, QmGetInterface(IID_ivorbel));
  void* p = reinterpret_cast<void*>(1);
  EXPECT_EQ(13u, QmCreateObject(L"vorbel", IID_ivorbel, &p));
  EXPECT_EQ(nullptr, p);
  EXPECT_EQ(13u, QmCreateObject(nullptr, IID_IQmBaseInterface, &p));
  EXPECT_EQ(1168u, QmCreateObject(L"VORBEL", IID_IQmBaseInterface, &p)) << "names are case-sensitive";
  EXPECT_EQ(14u, QmCreateObject(L"vorbel", IID_IQmCreateAlternate, &p));
  EXPECT_EQ(1, vorbel_factory().use_count()) << "the alternate identifier counts a use";
  QmDestroyObject(L"vorbel", reinterpret_cast<void*>(1));

  void* first = nullptr;
  void* second = nullptr;
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &first));
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &second));
  EXPECT_EQ(first, second);
  EXPECT_EQ(first, QmGetInterface(IID_ivorbel));
  EXPECT_EQ(2, vorbel_factory().use_count()) << "QmGetInterface does not count";
  QmDestroyObject(L"vorbel", second);
  QmDestroyObject(L"vorbel", first);
  EXPECT_EQ(nullptr, QmGetInterface(IID_ivorbel));

  // A destroy with no use left: below zero, the next creation would find a
  // non-zero count and make nothing.
  QmDestroyObject(L"vorbel", first);
  EXPECT_EQ(0, vorbel_factory().use_count());
  ASSERT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &p));
  EXPECT_NE(nullptr, p);
  QmDestroyObject(L"vorbel", p);
}

}  // namespace
