#include "pipe_support.h"

#include <aclapi.h>
#include <sddl.h>

#include <cstring>
#include <vector>

namespace parlo::ipc::impl {
namespace {

constexpr wchar_t local_prefix[] = L"\\\\.\\pipe\\";
constexpr std::size_t local_prefix_length = sizeof(local_prefix) / sizeof(wchar_t) - 1;
// Longest pipe path CreateNamedPipe takes, prefix included.
constexpr std::size_t max_pipe_path = 256;

wchar_t lower(wchar_t c) { return (c >= L'A' && c <= L'Z') ? static_cast<wchar_t>(c + 32) : c; }

bool starts_with_local_prefix(const std::wstring& text) {
  if (text.size() < local_prefix_length) return false;
  for (std::size_t i = 0; i < local_prefix_length; ++i) {
    if (lower(text[i]) != local_prefix[i]) return false;
  }
  return true;
}

}  // namespace

bool to_pipe_path(const char* name, std::wstring& path) {
  path.clear();
  if (name == nullptr || *name == '\0') return false;
  const std::size_t length = std::strlen(name);
  if (length > max_pipe_path) return false;
  const int wide = ::MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, name,
                                         static_cast<int>(length), nullptr, 0);
  if (wide <= 0) return false;
  std::wstring text(static_cast<std::size_t>(wide), L'\0');
  ::MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, name, static_cast<int>(length),
                        text.data(), wide);
  if (text.compare(0, 2, L"\\\\") == 0) {
    // A full path: only pipes of this machine.
    if (!starts_with_local_prefix(text) || text.size() == local_prefix_length) return false;
    path = std::move(text);
  } else {
    path = local_prefix + text;
  }
  if (path.size() > max_pipe_path) {
    path.clear();
    return false;
  }
  return true;
}

std::wstring pipe_key(const std::wstring& path) {
  std::wstring key = path;
  for (wchar_t& c : key) c = lower(c);
  return key;
}

winapi::unique_handle make_event(bool manual_reset) {
  return winapi::unique_handle(::CreateEventW(/* attributes */ nullptr, manual_reset ? TRUE : FALSE,
                                              /* initial_state */ FALSE, /* name */ nullptr));
}

DWORD make_initial_pipe_security(unique_local& descriptor) {
  descriptor.reset();
  HANDLE raw_token = nullptr;
  if (!::OpenProcessToken(::GetCurrentProcess(), TOKEN_QUERY, &raw_token)) return ::GetLastError();
  winapi::unique_handle token(raw_token);
  DWORD needed = 0;
  ::GetTokenInformation(token.get(), TokenUser, nullptr, 0, &needed);
  if (needed == 0) return ::GetLastError();
  std::vector<unsigned char> buffer(needed);
  if (!::GetTokenInformation(token.get(), TokenUser, buffer.data(), needed, &needed)) {
    return ::GetLastError();
  }
  const auto* user = reinterpret_cast<const TOKEN_USER*>(buffer.data());
  wchar_t* raw_sid = nullptr;
  if (!::ConvertSidToStringSidW(user->User.Sid, &raw_sid)) return ::GetLastError();
  unique_local sid_text(raw_sid);
  // D:P           protected DACL: nothing inherited
  // (A;;GA;;;SY)  allow GENERIC_ALL to LocalSystem
  // (A;;GA;;;<u>) allow GENERIC_ALL to the user this process runs as
  const std::wstring sddl =
      std::wstring(L"D:P(A;;GA;;;SY)(A;;GA;;;") + static_cast<const wchar_t*>(sid_text.get()) + L")";
  PSECURITY_DESCRIPTOR raw_descriptor = nullptr;
  if (!::ConvertStringSecurityDescriptorToSecurityDescriptorW(sddl.c_str(), SDDL_REVISION_1,
                                                              &raw_descriptor,
                                                              /* size */ nullptr)) {
    return ::GetLastError();
  }
  descriptor.reset(raw_descriptor);
  return 0;
}

}  // namespace parlo::ipc::impl
