#include "security/image_file.h"

#include <aclapi.h>

#include <cstring>
#include <filesystem>
#include <sstream>
#include <tuple>

#include "platform/win_api.h"
#include "platform/win_error.h"

namespace {

std::error_code last_error() { return winapi::make_win_error(::GetLastError()); }

// NtQueryInformationProcess, found in ntdll at run time (it is not in every
// import library), and the one class used with it: given a file handle, it
// answers whether that file is the image of the process.
using query_process_fn = LONG(NTAPI*)(HANDLE process, ULONG info_class, void* info, ULONG length, ULONG* returned);
constexpr ULONG process_image_file_mapping = 44;
constexpr LONG status_success = 0;
constexpr LONG status_unsuccessful = static_cast<LONG>(0xC0000001);  // not the image
constexpr LONG status_not_implemented = static_cast<LONG>(0xC0000002);
constexpr LONG status_invalid_info_class = static_cast<LONG>(0xC0000003);
constexpr LONG status_not_supported = static_cast<LONG>(0xC00000BB);

query_process_fn query_process() {
  static const query_process_fn query = reinterpret_cast<query_process_fn>(
      reinterpret_cast<void*>(::GetProcAddress(::GetModuleHandleW(L"ntdll.dll"), "NtQueryInformationProcess")));
  return query;
}

// FILE_ID_INFO and its class (18), which systems from Windows 8 on answer;
// the build targets Windows 7, whose headers lack them.
struct file_id_info {
  ULONGLONG volume_serial;
  BYTE file_id[16];
};
constexpr auto file_id_info_class = static_cast<FILE_INFO_BY_HANDLE_CLASS>(18);

std::uint64_t join(DWORD high, DWORD low) { return (static_cast<std::uint64_t>(high) << 32) | low; }

// What the peer's user may do to one element of the path (MAXIMUM_ALLOWED
// against the element's owner, group and DACL, with the owner's implicit
// rights); false and the code when the element's security cannot be read.
bool granted_access(HANDLE token, const std::wstring& element, DWORD& granted, std::error_code& code) {
  PSECURITY_DESCRIPTOR raw = nullptr;
  const DWORD read = ::GetNamedSecurityInfoW(
      element.c_str(), SE_FILE_OBJECT, OWNER_SECURITY_INFORMATION | GROUP_SECURITY_INFORMATION | DACL_SECURITY_INFORMATION,
      /* owner */ nullptr, /* group */ nullptr, /* dacl */ nullptr, /* sacl */ nullptr, &raw);
  if (read != ERROR_SUCCESS) {
    code = winapi::make_win_error(read);
    return false;
  }
  struct local_traits {
    using pointer = PSECURITY_DESCRIPTOR;
    static void close(PSECURITY_DESCRIPTOR d) noexcept { ::LocalFree(d); }
  };
  winapi::unique_any<local_traits> descriptor(raw);
  GENERIC_MAPPING mapping{FILE_GENERIC_READ, FILE_GENERIC_WRITE, FILE_GENERIC_EXECUTE, FILE_ALL_ACCESS};
  PRIVILEGE_SET privileges{};
  DWORD privileges_length = sizeof(privileges);
  BOOL status = FALSE;
  granted = 0;
  if (!::AccessCheck(descriptor.get(), token, /* desired */ MAXIMUM_ALLOWED, &mapping, &privileges,
                     &privileges_length, &granted, /* access_status */ &status)) {
    code = last_error();
    return false;
  }
  if (!status) granted = 0;
  return true;
}

}  // namespace

winapi::unique_handle open_image(const std::wstring& path, std::error_code& code) {
  HANDLE file = ::CreateFileW(path.c_str(), /* access */ GENERIC_READ | FILE_EXECUTE, /* share */ FILE_SHARE_READ,
                              /* security */ nullptr, OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, /* template_file */ nullptr);
  if (file == INVALID_HANDLE_VALUE) {
    code = last_error();
    return {};
  }
  code = {};
  return winapi::unique_handle(file);
}

bool operator<(const image_identity& left, const image_identity& right) {
  return std::tie(left.volume, left.file_id, left.size, left.last_write) <
         std::tie(right.volume, right.file_id, right.size, right.last_write);
}

bool operator==(const image_identity& left, const image_identity& right) {
  return !(left < right) && !(right < left);
}

bool read_image_identity(HANDLE file, image_identity& identity, std::error_code& code) {
  BY_HANDLE_FILE_INFORMATION info{};
  if (!::GetFileInformationByHandle(file, &info)) {
    code = last_error();
    return false;
  }
  identity = image_identity{};
  identity.volume = info.dwVolumeSerialNumber;
  identity.size = join(info.nFileSizeHigh, info.nFileSizeLow);
  identity.last_write = join(info.ftLastWriteTime.dwHighDateTime, info.ftLastWriteTime.dwLowDateTime);
  // The 128-bit id where the file system has one (ReFS ids do not fit in 64
  // bits); the 64-bit index otherwise.
  file_id_info id{};
  if (::GetFileInformationByHandleEx(file, file_id_info_class, &id, sizeof(id))) {
    identity.volume = id.volume_serial;
    std::memcpy(identity.file_id.data(), id.file_id, identity.file_id.size());
  } else {
    const std::uint64_t index = join(info.nFileIndexHigh, info.nFileIndexLow);
    std::memcpy(identity.file_id.data(), &index, sizeof(index));
  }
  code = {};
  return true;
}

running_image check_running_image(HANDLE process, HANDLE file, std::error_code& code) {
  code = {};
  const query_process_fn query = query_process();
  if (query == nullptr) return running_image::unsupported;
  HANDLE file_handle = file;
  const LONG status = query(process, process_image_file_mapping, &file_handle, sizeof(file_handle), nullptr);
  switch (status) {
    case status_success:
      return running_image::same;
    case status_unsuccessful:
      return running_image::different;
    case status_not_implemented:
    case status_invalid_info_class:
    case status_not_supported:
      return running_image::unsupported;
    default:
      code = winapi::make_win_error(static_cast<std::uint32_t>(status));
      return running_image::failed;
  }
}

bool running_image_check_supported() {
  static const bool supported = [] {
    std::error_code code;
    const std::wstring self = winapi::this_process::get_filename(code);
    if (code) return false;
    const winapi::unique_handle image = open_image(self, code);
    if (code) return false;
    return check_running_image(::GetCurrentProcess(), image.get(), code) == running_image::same;
  }();
  return supported;
}

bool is_protected_image_path(HANDLE process, const std::wstring& path, std::wstring& where,
                             std::error_code& code) {
  code = {};
  where.clear();
  HANDLE raw_token = nullptr;
  if (!::OpenProcessToken(process, TOKEN_QUERY | TOKEN_DUPLICATE, &raw_token)) {
    code = last_error();
    return false;
  }
  const winapi::unique_handle primary(raw_token);
  HANDLE raw_impersonation = nullptr;
  if (!::DuplicateToken(primary.get(), SecurityIdentification, &raw_impersonation)) {
    code = last_error();
    return false;
  }
  const winapi::unique_handle token(raw_impersonation);

  // The image itself: nobody may write it, remove it or rename it (DELETE),
  // or give themselves those rights. Each folder from the image's up to the
  // root: nobody may remove or rename an entry in it (FILE_DELETE_CHILD),
  // remove or rename the folder itself (DELETE; a root cannot be), or change
  // its security. Another file can only appear at the path after the file
  // or one of its folders has moved away, which each of these forbids.
  constexpr DWORD change_security = WRITE_DAC | WRITE_OWNER;
  const std::filesystem::path image(path);
  const std::filesystem::path root = image.root_path();
  std::filesystem::path element = image;
  DWORD forbidden = DELETE | change_security | FILE_WRITE_DATA | FILE_APPEND_DATA;
  for (;;) {
    const bool at_root = element == root || element.parent_path() == element;
    if (at_root) forbidden &= ~static_cast<DWORD>(DELETE);
    DWORD granted = 0;
    if (!granted_access(token.get(), element.wstring(), granted, code)) return false;
    if ((granted & forbidden) != 0) {
      std::wostringstream text;
      text << L"\"" << element.wstring() << L"\" grants 0x" << std::hex << (granted & forbidden);
      where = text.str();
      return false;
    }
    if (at_root || !element.has_parent_path()) return true;
    element = element.parent_path();
    forbidden = DELETE | change_security | FILE_DELETE_CHILD;
  }
}
