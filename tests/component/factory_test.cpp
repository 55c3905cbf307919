#include <gtest/gtest.h>
#include <vorbel/vorbel.h>

#include "support/log_capture.h"

extern "C" std::uint32_t QmCreateObject(const wchar_t*, const GUID&, void**);
extern "C" void* QmGetInterface(const GUID&);
extern "C" void QmDestroyObject(const wchar_t*, void*);

TEST(factory, smoke) {
  void* p = nullptr;
  EXPECT_EQ(13u, QmCreateObject(L"vorbel", IID_ivorbel, &p));
  EXPECT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &p));
  auto* v = static_cast<ivorbel*>(p);
  EXPECT_EQ(nullptr, v->GetInterface(IID_ibus));
  EXPECT_TRUE(test_support::has_line(L"vorbel_impl::GetInterface", L"unknown interface ")) << test_support::dump_log();
  EXPECT_EQ(nullptr, v->create_bus("x", nullptr));
  std::wcout << test_support::dump_log();
  QmDestroyObject(L"vorbel", p);
}
