// The version resource and signature of every binary a host receives, read
// back the way Windows tools read them; the shipped binaries sit beside this
// program, which itself stands for those that name no description.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>
#include <vector>

#include "security/signature.h"
#include "version_expected.h"

namespace {

TEST(version_resource, every_binary_carries_the_version_its_purpose_and_its_signature) {
  wchar_t self[MAX_PATH];
  const std::wstring own(self, ::GetModuleFileNameW(nullptr, self, MAX_PATH));
  const DWORD high = MAKELONG(VORBEL_EXPECTED_VERSION_MINOR, VORBEL_EXPECTED_VERSION_MAJOR);
  const DWORD low = MAKELONG(VORBEL_EXPECTED_VERSION_TWEAK, VORBEL_EXPECTED_VERSION_PATCH);
  for (const std::wstring file : {L"vorbel.dll", L"scribo.dll", L"parlo.dll", L"parlo_ipc.dll", L"vorbel_host.exe",
                                  L"version_resource_test.exe"}) {
    SCOPED_TRACE(std::string(file.begin(), file.end()));
    const std::wstring path = own.substr(0, own.find_last_of(L'\\') + 1) + file;
    std::vector<unsigned char> data(::GetFileVersionInfoSizeW(path.c_str(), nullptr));
    ASSERT_TRUE(!data.empty() && ::GetFileVersionInfoW(path.c_str(), 0, static_cast<DWORD>(data.size()), data.data()));
    const auto query = [&](const std::wstring& name) -> const void* {
      void* value = nullptr;
      UINT length = 0;
      return ::VerQueryValueW(data.data(), name.c_str(), &value, &length) && length > 0 ? value : nullptr;
    };
    const auto* fixed = static_cast<const VS_FIXEDFILEINFO*>(query(L"\\"));
    ASSERT_NE(nullptr, fixed);
    EXPECT_EQ(high, fixed->dwFileVersionMS);
    EXPECT_EQ(low, fixed->dwFileVersionLS);
    const auto text = [&](const wchar_t* name) {  // U.S. English, Unicode: the Translation entry
      const void* value = query(std::wstring(L"\\StringFileInfo\\040904b0\\") + name);
      return std::wstring(value != nullptr ? static_cast<const wchar_t*>(value) : L"(none)");
    };
    EXPECT_EQ(VORBEL_EXPECTED_PRODUCT, text(L"ProductName"));
    EXPECT_EQ(VORBEL_EXPECTED_VERSION, text(L"FileVersion"));
    EXPECT_EQ(file, text(L"OriginalFilename"));
    // Shipped files say what they are; others get the default.
    EXPECT_EQ(file != L"version_resource_test.exe", text(L"FileDescription") != L"version_resource_test (vorbel build)");
    // The resource is linked in before the signature is added.
    std::error_code code;
    EXPECT_TRUE(VORBEL_EXPECTED_SIGNED == 0 || is_trusted(path, code)) << code.message();
  }
}

}  // namespace
