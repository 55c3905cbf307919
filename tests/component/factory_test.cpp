#include <gtest/gtest.h>
#include <vorbel/vorbel.h>

extern "C" std::uint32_t QmCreateObject(const wchar_t*, const GUID&, void**);

TEST(factory, smoke) {
  void* p = nullptr;
  EXPECT_EQ(13u, QmCreateObject(L"vorbel", IID_ivorbel, &p));
}
