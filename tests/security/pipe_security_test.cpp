// The pipes' security descriptor, applied to a real named pipe and read back.
#include <gtest/gtest.h>

#include <windows.h>
#include <sddl.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

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

// The user this process runs as, "S-1-...".
std::wstring own_user() {
  HANDLE token = nullptr;
  ::OpenProcessToken(::GetCurrentProcess(), TOKEN_QUERY, &token);
  unsigned char buffer[256] = {};
  DWORD size = 0;
  ::GetTokenInformation(token, TokenUser, buffer, sizeof(buffer), &size);
  ::CloseHandle(token);
  return sid_text(reinterpret_cast<TOKEN_USER*>(buffer)->User.Sid);
}

// Everyone may talk on the pipe; only administrators, LocalSystem and this
// process's user may add instances of it (FILE_CREATE_PIPE_INSTANCE) or
// change its security. Read back from the pipe: Wine does not enforce the
// instance right, so no refusal could show it.
TEST(pipe_security_test, the_entries_read_back_in_order_from_a_real_pipe) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  ASSERT_FALSE(sd.empty()) << test_support::dump_log();
  EXPECT_EQ(pipe_security_information(sd), static_cast<std::uint32_t>(DACL_SECURITY_INFORMATION));
  const winapi::unique_handle pipe = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_security_test_apply");
  std::error_code code = winapi::make_win_error(1);
  ASSERT_TRUE(apply_pipe_security(pipe.get(), sd, code)) << test_support::dump_log();
  EXPECT_FALSE(code);

  // Read and write data, read and write attributes and extended attributes,
  // read control, synchronize: no FILE_CREATE_PIPE_INSTANCE (4), WRITE_DAC,
  // WRITE_OWNER or DELETE.
  constexpr DWORD talk = 0x0012019B;
  const std::wstring user = own_user();
  const struct {
    const wchar_t* sid;
    DWORD mask;
  } expected[] = {
      {L"S-1-1-0", talk},          {L"S-1-5-20", talk},    {L"S-1-5-2", talk},
      {L"S-1-16-4096", talk},      {L"S-1-5-32-544", 0x100F0000}, {L"S-1-15-2-1", talk},
      {L"S-1-5-18", GENERIC_ALL},  {user.c_str(), GENERIC_ALL},
  };
  unique_local_sid holder;
  const PACL applied = security_test::dacl_of(pipe.get(), holder);
  ASSERT_NE(applied, nullptr);
  ASSERT_EQ(applied->AceCount, 8u);
  for (DWORD i = 0; i < 8; ++i) {
    void* raw = nullptr;
    ASSERT_TRUE(::GetAce(applied, i, &raw));
    const auto* ace = static_cast<const ACCESS_ALLOWED_ACE*>(raw);
    EXPECT_EQ(ace->Header.AceType, ACCESS_ALLOWED_ACE_TYPE) << i;
    EXPECT_EQ(ace->Header.AceFlags, 0) << i;  // no inheritance
    EXPECT_EQ(ace->Mask, expected[i].mask) << i;
    EXPECT_EQ(sid_text(const_cast<DWORD*>(&ace->SidStart)), expected[i].sid) << i;
  }
}

// Admissions run at once, and so do their stamps: instances of one name
// (which share one descriptor under Wine) stamped again and again from
// several threads, with nobody re-protecting the DACL in between.
TEST(pipe_security_test, stamps_on_one_pipe_name_from_several_threads_at_once_all_apply) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  ASSERT_FALSE(sd.empty());
  std::vector<winapi::unique_handle> instances;
  for (int i = 0; i < 4; ++i) instances.push_back(security_test::make_pipe(L"\\\\.\\pipe\\vorbel_security_test_stamps"));
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (const auto& instance : instances) {
    threads.emplace_back([&, pipe = instance.get()] {
      for (int round = 0; round < 50; ++round) {
        std::error_code ignored;
        failures += apply_pipe_security(pipe, sd, ignored) ? 0 : 1;
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(0, failures.load()) << test_support::dump_log();
}

}  // namespace
