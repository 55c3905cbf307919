// The pipes' security descriptor, applied to a real named pipe and read back.
#include <gtest/gtest.h>

#include <windows.h>
#include <sddl.h>

#include <string>

#include "platform/win_error.h"
#include "security/pipe_security.h"
#include "security/pipes.h"
#include "support/log_capture.h"

namespace {

std::wstring sid_text(PSID sid) {
  wchar_t* text = nullptr;
  if (!::ConvertSidToStringSidW(sid, &text)) return L"?";
  std::wstring result(text);
  ::LocalFree(text);
  return result;
}

TEST(pipe_security_test, the_six_entries_read_back_in_order_from_a_real_pipe) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  ASSERT_FALSE(sd.empty()) << test_support::dump_log();
  EXPECT_EQ(pipe_security_information(sd), static_cast<std::uint32_t>(DACL_SECURITY_INFORMATION));
  const winapi::unique_handle pipe = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_security_test_apply");
  std::error_code code = winapi::make_win_error(1);
  ASSERT_TRUE(apply_pipe_security(pipe.get(), sd, code)) << test_support::dump_log();
  EXPECT_FALSE(code);

  const struct {
    const wchar_t* sid;
    DWORD mask;
  } expected[] = {
      {L"S-1-1-0", GENERIC_READ | GENERIC_WRITE}, {L"S-1-5-20", GENERIC_ALL},
      {L"S-1-5-2", GENERIC_ALL},                  {L"S-1-16-4096", GENERIC_READ | GENERIC_WRITE},
      {L"S-1-5-32-544", 0x100F0000},              {L"S-1-15-2-1", GENERIC_ALL},
  };
  unique_local_sid holder;
  const PACL applied = security_test::dacl_of(pipe.get(), holder);
  ASSERT_NE(applied, nullptr);
  ASSERT_EQ(applied->AceCount, 6u);
  for (DWORD i = 0; i < 6; ++i) {
    void* raw = nullptr;
    ASSERT_TRUE(::GetAce(applied, i, &raw));
    const auto* ace = static_cast<const ACCESS_ALLOWED_ACE*>(raw);
    EXPECT_EQ(ace->Header.AceType, ACCESS_ALLOWED_ACE_TYPE) << i;
    EXPECT_EQ(ace->Header.AceFlags, 0) << i;  // no inheritance
    EXPECT_EQ(ace->Mask, expected[i].mask) << i;
    EXPECT_EQ(sid_text(const_cast<DWORD*>(&ace->SidStart)), expected[i].sid) << i;
  }
}

}  // namespace
