// The pipes' security descriptor, built and applied to real named pipes.
#include <gtest/gtest.h>

#include <windows.h>
#include <aclapi.h>
#include <sddl.h>

#include <string>

#include "platform/win_error.h"
#include "security/pipe_security.h"
#include "support/log_capture.h"

namespace {

using test_support::find_lines;
using test_support::has_line;

struct expected_ace {
  const wchar_t* sid;
  DWORD mask;
};
// In this order, each an access-allowed entry without inheritance.
const expected_ace expected_dacl[] = {
    {L"S-1-1-0", GENERIC_READ | GENERIC_WRITE}, {L"S-1-5-20", GENERIC_ALL},
    {L"S-1-5-2", GENERIC_ALL},                  {L"S-1-16-4096", GENERIC_READ | GENERIC_WRITE},
    {L"S-1-5-32-544", 0x100F0000},              {L"S-1-15-2-1", GENERIC_ALL},
};

std::wstring sid_text(PSID sid) {
  wchar_t* text = nullptr;
  if (!::ConvertSidToStringSidW(sid, &text)) return L"?";
  std::wstring result(text);
  ::LocalFree(text);
  return result;
}

void expect_pipes_dacl(PACL acl) {
  ASSERT_NE(acl, nullptr);
  ASSERT_EQ(acl->AceCount, 6u);
  for (DWORD i = 0; i < 6; ++i) {
    void* raw = nullptr;
    ASSERT_TRUE(::GetAce(acl, i, &raw));
    const auto* ace = static_cast<const ACCESS_ALLOWED_ACE*>(raw);
    EXPECT_EQ(ace->Header.AceType, ACCESS_ALLOWED_ACE_TYPE) << i;
    EXPECT_EQ(ace->Header.AceFlags, 0) << i;
    EXPECT_EQ(ace->Mask, expected_dacl[i].mask) << i;
    EXPECT_EQ(sid_text(const_cast<DWORD*>(&ace->SidStart)), expected_dacl[i].sid) << i;
  }
}

// A server pipe as the IPC library makes one: WRITE_DAC and a protected
// initial DACL (SDDL "D:P(A;;GA;;;WD)": protected, full access for Everyone).
HANDLE make_pipe(const wchar_t* name, DWORD extra_open_mode) {
  PSECURITY_DESCRIPTOR initial = nullptr;
  ::ConvertStringSecurityDescriptorToSecurityDescriptorW(L"D:P(A;;GA;;;WD)", SDDL_REVISION_1, &initial, nullptr);
  SECURITY_ATTRIBUTES attributes{sizeof(attributes), initial, FALSE};
  HANDLE pipe = ::CreateNamedPipeW(name, PIPE_ACCESS_DUPLEX | extra_open_mode,
                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                   /* max_instances */ 1, /* out_buffer */ 4096, /* in_buffer */ 4096,
                                   /* default_timeout */ 0, &attributes);
  ::LocalFree(initial);
  return pipe == INVALID_HANDLE_VALUE ? nullptr : pipe;
}

class pipe_security_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
};

TEST_F(pipe_security_test, descriptor_holds_the_six_entries_in_order) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  ASSERT_FALSE(sd.empty()) << test_support::dump_log();
  EXPECT_EQ(sd.sacl, nullptr);
  expect_pipes_dacl(sd.dacl);
  // Only the DACL is ever set on a pipe.
  EXPECT_EQ(pipe_security_information(sd), static_cast<std::uint32_t>(DACL_SECURITY_INFORMATION));
  EXPECT_TRUE(has_line(L"make_pipes_security_descriptor", L"-> make_pipes_security_descriptor()"));
}

TEST_F(pipe_security_test, holder_moves_and_frees_once) {
  pipes_security_descriptor first = make_pipes_security_descriptor();
  const PACL dacl = first.dacl;
  pipes_security_descriptor second(std::move(first));
  EXPECT_TRUE(first.empty());
  EXPECT_EQ(first.dacl, nullptr);
  EXPECT_EQ(second.dacl, dacl);
  pipes_security_descriptor third = make_pipes_security_descriptor();
  third = std::move(second);
  EXPECT_EQ(third.dacl, dacl);
  EXPECT_TRUE(second.empty());
  expect_pipes_dacl(third.dacl);
  // A SACL, were one there, would be set too.
  ACL sacl{};
  pipes_security_descriptor with_sacl;
  with_sacl.sacl = &sacl;
  EXPECT_EQ(pipe_security_information(with_sacl), static_cast<std::uint32_t>(SACL_SECURITY_INFORMATION));
  with_sacl.sacl = nullptr;
}

TEST_F(pipe_security_test, applied_dacl_reads_back_from_the_pipe) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  winapi::unique_handle pipe(make_pipe(L"\\\\.\\pipe\\vorbel_security_test_apply", WRITE_DAC));
  ASSERT_TRUE(pipe);
  std::error_code code = winapi::make_win_error(1);
  ASSERT_TRUE(apply_pipe_security(pipe.get(), sd, code)) << test_support::dump_log();
  EXPECT_FALSE(code);

  PACL dacl = nullptr;
  PSECURITY_DESCRIPTOR read_back = nullptr;
  ASSERT_EQ(::GetSecurityInfo(pipe.get(), SE_FILE_OBJECT, DACL_SECURITY_INFORMATION, nullptr, nullptr, &dacl,
                              nullptr, &read_back),
            static_cast<DWORD>(ERROR_SUCCESS));
  expect_pipes_dacl(dacl);
  ::LocalFree(read_back);
}

TEST_F(pipe_security_test, refusals_carry_the_system_code) {
  const pipes_security_descriptor sd = make_pipes_security_descriptor();
  winapi::unique_handle pipe(make_pipe(L"\\\\.\\pipe\\vorbel_security_test_no_write_dac", 0));
  ASSERT_TRUE(pipe);
  std::error_code code;
  EXPECT_FALSE(apply_pipe_security(pipe.get(), sd, code));
  EXPECT_EQ(code.value(), static_cast<int>(ERROR_ACCESS_DENIED));
  const auto lines = find_lines(L"apply_pipe_security", L"SetSecurityInfo err=5");
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 4u);

  // An empty holder never reaches the system.
  EXPECT_FALSE(apply_pipe_security(pipe.get(), pipes_security_descriptor(), code));
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
  EXPECT_TRUE(has_line(L"adjust_process_priviledges", L"-> adjust_process_priviledges()"));
  EXPECT_FALSE(has_line(L"adjust_process_priviledges", L"err="));
}

}  // namespace
