// Win32 error codes, the checked wrappers and the handle holders.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>
#include <system_error>

#include "platform/win_api.h"

namespace {

using winapi::make_win_error;

std::string system_text(DWORD code) {
  char buffer[4096] = {};
  return std::string(buffer, ::FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                                              nullptr, code, 0, buffer, sizeof buffer, nullptr));
}

// What `call` throws; the text must be "<call> failed: <system message>".
template <typename F>
std::error_code thrown_by(F&& call, const std::string& text) {
  try {
    call();
  } catch (const std::system_error& e) {
    EXPECT_EQ(std::string(e.what()), text + ": " + e.code().message());
    return e.code();
  }
  ADD_FAILURE() << "nothing thrown for " << text;
  return std::error_code();
}

TEST(win_api_test, MessagesAreTheSystemTextOrUnknownWithAnUnsignedCode) {
  ASSERT_TRUE(system_text(99999).empty() && system_text(0xFFFFFFFE).empty());
  EXPECT_EQ(make_win_error(99999).message(), "unknown error 99999");
  EXPECT_EQ(std::error_code(-2, winapi::win_error_category()).message(), "unknown error 4294967294");
  const std::string text = make_win_error(ERROR_ACCESS_DENIED).message();
  EXPECT_EQ(text, system_text(ERROR_ACCESS_DENIED));
  EXPECT_EQ(text.substr(text.size() - 1), "\n");  // kept as the system gives it
}

TEST(win_api_test, ThrowingWrappersNameTheCall) {
  EXPECT_EQ(thrown_by([] { winapi::load_library(L"no_such_library_4711.dll"); }, "LoadLibrary failed"),
            make_win_error(ERROR_MOD_NOT_FOUND));
  HMODULE kernel = ::GetModuleHandleW(L"kernel32.dll");
  EXPECT_EQ(thrown_by([&] { winapi::get_proc_address(kernel, "NoSuchExport"); }, "GetProcAddress failed"),
            make_win_error(ERROR_PROC_NOT_FOUND));
  EXPECT_EQ(thrown_by([] { winapi::module_directory(reinterpret_cast<HMODULE>(0x1230000)); },
                      "GetModuleFileName failed").category(),
            winapi::win_error_category());

  // Process ids are multiples of 4 and far below this one.
  const DWORD pid = 0xFFFFFFF8;
  ASSERT_EQ(::OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, pid), nullptr);
  const DWORD reported = ::GetLastError();
  EXPECT_EQ(thrown_by([&] { winapi::open_process(PROCESS_QUERY_LIMITED_INFORMATION, pid); }, "OpenProcess failed"),
            make_win_error(reported));
}

TEST(win_api_test, ModuleDirectoryEndsInABackslash) {
  std::error_code code = make_win_error(1);
  const std::wstring exe = winapi::this_process::get_filename(code);
  EXPECT_EQ(code, std::error_code());
  const std::wstring dir = winapi::module_directory(winapi::current_module());
  EXPECT_EQ(exe.substr(0, exe.rfind(L'\\') + 1), dir);
  EXPECT_EQ(dir.back(), L'\\');
}

TEST(win_api_test, Utf16ToUtf8) {
  std::error_code code = make_win_error(1);
  EXPECT_EQ(winapi::utf16_to_utf8(L"", code), "");
  EXPECT_EQ(code, std::error_code());
  EXPECT_EQ(winapi::utf16_to_utf8(L"a\u00e9\U0001F600", code), "a\xC3\xA9\xF0\x9F\x98\x80");
  EXPECT_EQ(winapi::utf16_to_utf8(static_cast<const wchar_t*>(nullptr), code), "");
  EXPECT_EQ(code, make_win_error(ERROR_INVALID_PARAMETER));
}

TEST(win_api_test, QueryFileNameOfAPipeAndOfAClosedHandle) {
  const std::wstring name = L"vorbel_platform_test_" + std::to_wstring(::GetCurrentProcessId());
  winapi::unique_handle pipe(::CreateNamedPipeW((L"\\\\.\\pipe\\" + name).c_str(), PIPE_ACCESS_DUPLEX,
                                                PIPE_TYPE_BYTE, /* max_instances */ 1, /* out_buffer */ 0,
                                                /* in_buffer */ 0, /* timeout */ 0, nullptr));
  ASSERT_NE(pipe.get(), INVALID_HANDLE_VALUE);
  std::error_code code = make_win_error(1);
  EXPECT_EQ(winapi::query_file_name(pipe.get(), code), L"\\" + name);
  EXPECT_EQ(code, std::error_code());
  HANDLE closed = ::CreateEventW(nullptr, TRUE, FALSE, nullptr);
  ::CloseHandle(closed);
  EXPECT_EQ(winapi::query_file_name(closed, code), L"");
  EXPECT_EQ(code, make_win_error(ERROR_INVALID_HANDLE));
}

TEST(win_api_test, HolderResetKeepsTheLastErrorAndMoveClosesWhatWasHeld) {
  winapi::unique_handle first(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  winapi::unique_handle second(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  const HANDLE replaced = first.get();
  first = std::move(second);
  DWORD flags = 0;
  EXPECT_FALSE(::GetHandleInformation(replaced, &flags));
  const HANDLE held = first.get();
  winapi::unique_handle bogus(reinterpret_cast<HANDLE>(0x7FF0));  // its close fails
  for (auto* holder : {&first, &bogus}) {
    ::SetLastError(1234);
    holder->reset();
    EXPECT_EQ(::GetLastError(), 1234u);
  }
  EXPECT_FALSE(::GetHandleInformation(held, &flags));
}

}  // namespace
