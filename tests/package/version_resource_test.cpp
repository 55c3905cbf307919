// The version resource and the signature of every binary a host receives,
// read back the way Windows tools read them (GetFileVersionInfoW,
// VerQueryValueW, WinVerifyTrust). The shipped binaries are copied beside
// this program.
#include <gtest/gtest.h>

#include <windows.h>

#include <cstdint>
#include <cwchar>
#include <optional>
#include <set>
#include <string>
#include <system_error>
#include <vector>

#include "security/signature.h"
#include "version_expected.h"

namespace {

struct shipped_binary {
  const wchar_t* file;
  bool is_dll;
};

const shipped_binary shipped[] = {
    {L"vorbel.dll", true},    {L"scribo.dll", true},       {L"parlo.dll", true},
    {L"parlo_ipc.dll", true}, {L"vorbel_host.exe", false},
};

// For messages: the names here are ASCII.
std::string narrow(const std::wstring& text) {
  std::string out;
  for (const wchar_t c : text) out += c < 0x80 ? static_cast<char>(c) : '?';
  return out;
}

std::wstring own_path() {
  std::wstring path(32768, L'\0');
  const DWORD length = ::GetModuleFileNameW(nullptr, &path[0], static_cast<DWORD>(path.size()));
  path.resize(length < path.size() ? length : 0);
  return path;
}

std::wstring beside_me(const wchar_t* file) {
  const std::wstring self = own_path();
  return self.substr(0, self.find_last_of(L"\\/") + 1) + file;
}

std::wstring hex4(unsigned value) {
  const wchar_t digits[] = L"0123456789abcdef";
  std::wstring text(4, L'0');
  for (int i = 3; i >= 0; --i, value >>= 4) text[static_cast<std::size_t>(i)] = digits[value & 0xF];
  return text;
}

// One file's version resource.
class version_info {
 public:
  // False with the system's code when the file has no readable resource.
  bool load(const std::wstring& path, DWORD& err) {
    DWORD ignored = 0;
    const DWORD size = ::GetFileVersionInfoSizeW(path.c_str(), &ignored);
    if (size == 0) {
      err = ::GetLastError();
      return false;
    }
    data_.assign(size, 0);
    if (!::GetFileVersionInfoW(path.c_str(), /* ignored */ 0, size, data_.data())) {
      err = ::GetLastError();
      return false;
    }
    err = 0;
    return true;
  }

  const VS_FIXEDFILEINFO* fixed() {
    void* value = nullptr;
    UINT length = 0;
    if (!::VerQueryValueW(data_.data(), L"\\", &value, &length) ||
        length < sizeof(VS_FIXEDFILEINFO)) {
      return nullptr;
    }
    return static_cast<const VS_FIXEDFILEINFO*>(value);
  }

  // The string `name` in the first language the Translation table lists, as
  // Explorer looks it up; absent when either is missing.
  std::optional<std::wstring> text(const wchar_t* name) {
    void* value = nullptr;
    UINT length = 0;
    if (!::VerQueryValueW(data_.data(), L"\\VarFileInfo\\Translation", &value, &length) ||
        length < 2 * sizeof(WORD)) {
      return std::nullopt;
    }
    const WORD* translation = static_cast<const WORD*>(value);
    const std::wstring block =
        L"\\StringFileInfo\\" + hex4(translation[0]) + hex4(translation[1]) + L"\\" + name;
    if (!::VerQueryValueW(data_.data(), block.c_str(), &value, &length) || length == 0) {
      return std::nullopt;
    }
    const wchar_t* chars = static_cast<const wchar_t*>(value);
    return std::wstring(chars, ::wcsnlen(chars, length));
  }

 private:
  std::vector<unsigned char> data_;
};

void expect_project_version(const VS_FIXEDFILEINFO& info, bool is_dll) {
  const DWORD high = MAKELONG(VORBEL_EXPECTED_VERSION_MINOR, VORBEL_EXPECTED_VERSION_MAJOR);
  const DWORD low = MAKELONG(VORBEL_EXPECTED_VERSION_TWEAK, VORBEL_EXPECTED_VERSION_PATCH);
  EXPECT_EQ(info.dwSignature, 0xFEEF04BDu);
  EXPECT_EQ(info.dwFileVersionMS, high);
  EXPECT_EQ(info.dwFileVersionLS, low);
  EXPECT_EQ(info.dwProductVersionMS, high);
  EXPECT_EQ(info.dwProductVersionLS, low);
  EXPECT_EQ(info.dwFileOS, static_cast<DWORD>(VOS_NT_WINDOWS32));
  EXPECT_EQ(info.dwFileType, static_cast<DWORD>(is_dll ? VFT_DLL : VFT_APP));
  EXPECT_EQ(info.dwFileFlags & info.dwFileFlagsMask, 0u);
}

TEST(version_resource, shipped_binaries_carry_the_project_version) {
  for (const shipped_binary& binary : shipped) {
    SCOPED_TRACE(narrow(binary.file));
    version_info info;
    DWORD err = 0;
    ASSERT_TRUE(info.load(beside_me(binary.file), err)) << "err=" << err;
    const VS_FIXEDFILEINFO* fixed = info.fixed();
    ASSERT_NE(fixed, nullptr);
    expect_project_version(*fixed, binary.is_dll);
  }
}

TEST(version_resource, shipped_binaries_name_product_company_file_and_purpose) {
  std::set<std::wstring> descriptions;
  for (const shipped_binary& binary : shipped) {
    SCOPED_TRACE(narrow(binary.file));
    version_info info;
    DWORD err = 0;
    ASSERT_TRUE(info.load(beside_me(binary.file), err)) << "err=" << err;
    EXPECT_EQ(info.text(L"ProductName"), std::wstring(VORBEL_EXPECTED_PRODUCT));
    EXPECT_EQ(info.text(L"CompanyName"), std::wstring(VORBEL_EXPECTED_COMPANY));
    EXPECT_EQ(info.text(L"FileVersion"), std::wstring(VORBEL_EXPECTED_VERSION));
    EXPECT_EQ(info.text(L"ProductVersion"), std::wstring(VORBEL_EXPECTED_VERSION));
    // The name the linker gave the file, not the target's.
    EXPECT_EQ(info.text(L"OriginalFilename"), std::wstring(binary.file));
    EXPECT_TRUE(info.text(L"InternalName").has_value());

    // Each shipped file says what it is, in its own words rather than the
    // default every other binary gets.
    const std::optional<std::wstring> description = info.text(L"FileDescription");
    ASSERT_TRUE(description.has_value());
    EXPECT_FALSE(description->empty());
    EXPECT_EQ(description->find(L"(vorbel build)"), std::wstring::npos) << narrow(*description);
    EXPECT_TRUE(descriptions.insert(*description).second)
        << "description shared with another file: " << narrow(*description);
  }
}

// Binaries that name no description (test programs, doubles, tools to come)
// still carry a resource with the project's version.
TEST(version_resource, a_binary_without_a_description_gets_the_default) {
  version_info info;
  DWORD err = 0;
  ASSERT_TRUE(info.load(own_path(), err)) << "err=" << err;
  const VS_FIXEDFILEINFO* fixed = info.fixed();
  ASSERT_NE(fixed, nullptr);
  expect_project_version(*fixed, /* is_dll */ false);
  EXPECT_EQ(info.text(L"FileDescription"), std::wstring(L"version_resource_test (vorbel build)"));
  EXPECT_EQ(info.text(L"OriginalFilename"), std::wstring(L"version_resource_test.exe"));
  EXPECT_EQ(info.text(L"ProductName"), std::wstring(VORBEL_EXPECTED_PRODUCT));
}

// The resource is linked in before the signature is added: every shipped
// file still verifies, and carries the signer this build's programs carry
// (a peer is admitted only with its host's signer).
TEST(version_resource, shipped_binaries_are_signed_by_the_build_signer) {
  constexpr bool signed_build = VORBEL_EXPECTED_SIGNED != 0;
  if constexpr (!signed_build) GTEST_SKIP() << "this build signs nothing";
  std::error_code code;
  const std::optional<signature> own = get_signature(own_path(), code);
  ASSERT_TRUE(own.has_value()) << code.message();
  for (const shipped_binary& binary : shipped) {
    SCOPED_TRACE(narrow(binary.file));
    const std::wstring path = beside_me(binary.file);
    EXPECT_TRUE(is_trusted(path, code)) << code.message();
    const std::optional<signature> theirs = get_signature(path, code);
    ASSERT_TRUE(theirs.has_value()) << code.message();
    EXPECT_EQ(theirs->subject, own->subject);
    EXPECT_EQ(theirs->serial_number, own->serial_number);
  }
}

}  // namespace
