// Win32 error paths where a misread or overwritten last error would report
// the wrong fault.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>
#include <system_error>

#include "platform/win_api.h"

TEST(win_api_test, ThrownErrorsAreTheCallsOwnAndHolderResetKeepsTheLastError) {
  ASSERT_EQ(::OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, 0xFFFFFFF8), nullptr);  // no such process
  const DWORD open_error = ::GetLastError();
  try {
    winapi::open_process(PROCESS_QUERY_LIMITED_INFORMATION, 0xFFFFFFF8);
    ADD_FAILURE() << "nothing thrown";
  } catch (const std::system_error& e) {
    EXPECT_EQ(e.code(), winapi::make_win_error(open_error));
    EXPECT_EQ(std::string(e.what()), "OpenProcess failed: " + e.code().message());
  }
  // Codes without a system text are printed unsigned.
  EXPECT_EQ(std::error_code(-2, winapi::win_error_category()).message(), "unknown error 4294967294");

  winapi::unique_handle first(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  const HANDLE replaced = first.get();
  first = winapi::unique_handle(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  EXPECT_EQ(WAIT_FAILED, ::WaitForSingleObject(replaced, 0)) << "the replaced handle is still open";
  winapi::unique_handle bogus(reinterpret_cast<HANDLE>(0x7FF0));  // its close fails
  for (auto* holder : {&first, &bogus}) {
    ::SetLastError(1234);
    holder->reset();
    EXPECT_EQ(::GetLastError(), 1234u);
  }
}
