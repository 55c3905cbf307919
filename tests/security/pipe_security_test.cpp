// The pipes' security descriptor, built and applied to real named pipes.
#include <gtest/gtest.h>

#include <windows.h>
#include <aclapi.h>
#include <sddl.h>

#include <string>

#include "platform/win_error.h"
#include "security/pipe_security.h"
#include "security/pipes.h"
#include "support/log_capture.h"

namespace {

using test_support::find_lines;
using test_support::has_line;

std::wstring sid_text(PSID sid) {
  wchar_t* text = nullptr;
  if (!::ConvertSidToStringSidW(sid, &text)) return L"?";
  std::wstring result(text);
  ::LocalFree(text);
  return result;
}

// In this order, each an access-allowed entry without inheritance.
void expect_pipes_dacl(PACL acl) {
  const struct {
    const wchar_t* sid;
    DWORD mask;
  } expected[] = {
      {L"S-1-1-0", GENERIC_READ | GENERIC_WRITE}, {L"S-1-5-20", GENERIC_ALL},
      {L"S-1-5-2", GENERIC_ALL},                  {L"S-1-16-4096", GENERIC_READ | GENERIC_WRITE},
      {L"S-1-5-32-544", 0x100F0000},              {L"S-1-15-2-1", GENERIC_ALL},
  };
  ASSERT_NE(acl, nullptr);
  ASSERT_EQ(acl->AceCount, 6u);
  for (DWORD i = 0; i < 6; ++i) {
    void* raw = nullptr;
    ASSERT_TRUE(::GetAce(acl, i, &raw));
    const auto* ace = static_cast<const ACCESS_ALLOWED_ACE*>(raw);
    EXPECT_EQ(ace->Header.AceType, ACCESS_ALLOWED_ACE_TYPE) << i;
    EXPECT_EQ(ace->Header.AceFlags, 0) << i;
    EXPECT_EQ(ace->Mask, expected[i].mask) << i;
    EXPECT_EQ(sid_text(const_cast<DWORD*>(&ace->SidStart)), expected[i].sid) << i;
  }
}

class pipe_security_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
};

TEST_F(pipe_security_test, descriptor_holds_the_six_entries_in_order_and_moves_once) {
  pipes_security_descriptor first = make_pipes_security_descriptor();
  ASSERT_FALSE(first.empty()) << test_support::dump_log();
  EXPECT_EQ(first.sacl, nullptr);
  expect_pipes_dacl(first.dacl);
  // Only the DACL is ever set on a pipe; a SACL, were one there, would be too.
  EXPECT_EQ(pipe_security_information(first), static_cast<std::uint32_t>(DACL_SECURITY_INFORMATION));
  ACL sacl{};
  pipes_security_descriptor with_sacl;
  with_sacl.sacl = &sacl;
  EXPECT_EQ(pipe_security_information(with_sacl), static_cast<std::uint32_t>(SACL_SECURITY_INFORMATION));
  with_sacl.sacl = nullptr;

  // Moves leave one owner, so the block is freed once.
  const PACL dacl = first.dacl;
  pipes_security_descriptor second(std::move(first));
  EXPECT_TRUE(first.empty());
  EXPECT_EQ(first.dacl, nullptr);
  pipes_security_descriptor third = make_pipes_security_descriptor();
  third = std::move(second);
  EXPECT_TRUE(second.empty());
  EXPECT_EQ(third.dacl, dacl);
  expect_pipes_dacl(third.dacl);
}

TEST_F(pipe_security_test, applied_dacl_reads_back_from_the_pipe_and_refusals_carry_the_code) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  const winapi::unique_handle pipe = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_security_test_apply");
  ASSERT_TRUE(pipe);
  std::error_code code = winapi::make_win_error(1);
  ASSERT_TRUE(apply_pipe_security(pipe.get(), sd, code)) << test_support::dump_log();
  EXPECT_FALSE(code);
  expect_pipes_dacl(security_test::dacl_of(pipe.get()).dacl);

  const winapi::unique_handle no_write_dac =
      security_test::make_pipe(L"\\\\.\\pipe\\vorbel_security_test_no_write_dac", 0);
  ASSERT_TRUE(no_write_dac);
  EXPECT_FALSE(apply_pipe_security(no_write_dac.get(), sd, code));
  EXPECT_EQ(code.value(), static_cast<int>(ERROR_ACCESS_DENIED));
  const auto lines = find_lines(L"apply_pipe_security", L"SetSecurityInfo err=5");
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 4u);
  // An empty holder never reaches the system.
  EXPECT_FALSE(apply_pipe_security(no_write_dac.get(), pipes_security_descriptor(), code));
  EXPECT_EQ(code.value(), static_cast<int>(ERROR_INVALID_PARAMETER));
}

TEST_F(pipe_security_test, sids_from_types_and_texts) {
  std::error_code code;
  const std::vector<std::uint8_t> world = create_well_know_sid(WinWorldSid, code);
  EXPECT_FALSE(code);
  ASSERT_EQ(world.size(), ::GetLengthSid(const_cast<std::uint8_t*>(world.data())));
  EXPECT_EQ(sid_text(const_cast<std::uint8_t*>(world.data())), L"S-1-1-0");

  EXPECT_TRUE(create_well_know_sid(5000, code).empty());
  ASSERT_TRUE(code);
  const auto lines = find_lines(L"create_well_know_sid",
                                L"CreateWellKnownSid type=5000 err=" + std::to_wstring(code.value()));
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 4u);

  const unique_local_sid admins = string_to_sid(L"S-1-5-32-544", code);
  EXPECT_FALSE(code);
  EXPECT_EQ(sid_text(admins.get()), L"S-1-5-32-544");
  EXPECT_FALSE(string_to_sid(L"S-1-x", code));
  EXPECT_TRUE(code);
  EXPECT_TRUE(has_line(L"string_to_sid", L"ConvertStringSidToSid S-1-x err=" + std::to_wstring(code.value())));
  EXPECT_FALSE(string_to_sid(nullptr, code));
  EXPECT_EQ(code.value(), static_cast<int>(ERROR_INVALID_PARAMETER));
}

TEST_F(pipe_security_test, security_privilege_is_enabled) {
  std::error_code code = winapi::make_win_error(1);
  EXPECT_TRUE(adjust_process_priviledges(code)) << test_support::dump_log();
  EXPECT_FALSE(code);
  EXPECT_FALSE(has_line(L"adjust_process_priviledges", L"err="));
}

}  // namespace
