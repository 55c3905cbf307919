#include "security/pipe_security.h"

#include <aclapi.h>
#include <sddl.h>

#include <iterator>
#include <utility>

#include "logging/logger.h"
#include "platform/win_error.h"

pipes_security_descriptor::pipes_security_descriptor(pipes_security_descriptor&& other) noexcept
    : descriptor(std::exchange(other.descriptor, nullptr)),
      dacl(std::exchange(other.dacl, nullptr)),
      sacl(std::exchange(other.sacl, nullptr)) {}

pipes_security_descriptor& pipes_security_descriptor::operator=(pipes_security_descriptor&& other) noexcept {
  if (this != &other) {
    free_all();
    descriptor = std::exchange(other.descriptor, nullptr);
    dacl = std::exchange(other.dacl, nullptr);
    sacl = std::exchange(other.sacl, nullptr);
  }
  return *this;
}

pipes_security_descriptor::~pipes_security_descriptor() { free_all(); }

void pipes_security_descriptor::free_all() noexcept {
  const DWORD last_error = ::GetLastError();
  // The descriptor only points at the ACL; both go together.
  if (dacl != nullptr) ::LocalFree(dacl);
  if (descriptor != nullptr) ::LocalFree(descriptor);
  ::SetLastError(last_error);
  descriptor = nullptr;
  dacl = nullptr;
  sacl = nullptr;
}

namespace {

struct local_acl_traits {
  using pointer = PACL;
  static void close(PACL acl) noexcept { ::LocalFree(acl); }
};
using unique_local_acl = winapi::unique_any<local_acl_traits>;

struct local_descriptor_traits {
  using pointer = PSECURITY_DESCRIPTOR;
  static void close(PSECURITY_DESCRIPTOR descriptor) noexcept { ::LocalFree(descriptor); }
};
using unique_local_descriptor = winapi::unique_any<local_descriptor_traits>;

static_assert(pipe_client_access == (FILE_GENERIC_READ | FILE_WRITE_DATA | FILE_WRITE_EA | FILE_WRITE_ATTRIBUTES),
              "what a client of the pipe may do");
static_assert((pipe_client_access & (FILE_CREATE_PIPE_INSTANCE | WRITE_DAC | WRITE_OWNER | DELETE)) == 0,
              "a client may not serve the pipe or take it over");

EXPLICIT_ACCESS_W granting(PSID sid, DWORD mask, TRUSTEE_TYPE type = TRUSTEE_IS_WELL_KNOWN_GROUP) {
  EXPLICIT_ACCESS_W entry{};
  entry.grfAccessPermissions = mask;
  entry.grfAccessMode = SET_ACCESS;
  entry.grfInheritance = NO_INHERITANCE;
  entry.Trustee.pMultipleTrustee = nullptr;
  entry.Trustee.MultipleTrusteeOperation = NO_MULTIPLE_TRUSTEE;
  entry.Trustee.TrusteeForm = TRUSTEE_IS_SID;
  entry.Trustee.TrusteeType = type;
  entry.Trustee.ptstrName = static_cast<LPWSTR>(sid);
  return entry;
}

// The user this process runs as, copied out of its token; empty (with a
// line) when the token cannot be read.
std::vector<std::uint8_t> token_user_sid() {
  HANDLE raw_token = nullptr;
  if (!::OpenProcessToken(::GetCurrentProcess(), TOKEN_QUERY, &raw_token)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, L"make_pipes_security_descriptor")
        << L"OpenProcessToken err=" << error;
    return {};
  }
  winapi::unique_handle token(raw_token);
  DWORD needed = 0;
  ::GetTokenInformation(token.get(), TokenUser, nullptr, 0, &needed);
  std::vector<std::uint8_t> buffer(needed == 0 ? sizeof(TOKEN_USER) : needed);
  if (!::GetTokenInformation(token.get(), TokenUser, buffer.data(), static_cast<DWORD>(buffer.size()), &needed)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, L"make_pipes_security_descriptor")
        << L"GetTokenInformation TokenUser err=" << error;
    return {};
  }
  const PSID sid = reinterpret_cast<const TOKEN_USER*>(buffer.data())->User.Sid;
  const auto* bytes = static_cast<const std::uint8_t*>(sid);
  return std::vector<std::uint8_t>(bytes, bytes + ::GetLengthSid(sid));
}

}  // namespace

pipes_security_descriptor make_pipes_security_descriptor() {
  logging::trace_scope trace(L"make_pipes_security_descriptor");
  constexpr wchar_t function[] = L"make_pipes_security_descriptor";

  // The DACL, in order (SIDs live until SetEntriesInAclW has copied them).
  // The DACL says who may open the pipe, not who is served: admission by
  // code signature decides that. So every trustee may connect and talk, and
  // only the few who own the machine or this process may serve the name or
  // change who may:
  //   S-1-1-0       Everyone                  pipe_client_access: connect, read, write data
  //   S-1-5-20      Network Service           pipe_client_access
  //   S-1-5-2       Network logon users       pipe_client_access
  //   S-1-16-4096   Low mandatory level       pipe_client_access
  //   S-1-5-32-544  Administrators            GENERIC_ALL | STANDARD_RIGHTS_REQUIRED: full control
  //   S-1-15-2-1    All application packages  pipe_client_access
  //   S-1-5-18      LocalSystem               GENERIC_ALL: full control
  //   this process's token user               GENERIC_ALL: full control
  // pipe_client_access is 0x0012019B: FILE_GENERIC_READ (READ_CONTROL,
  // SYNCHRONIZE, FILE_READ_DATA, FILE_READ_ATTRIBUTES, FILE_READ_EA),
  // FILE_WRITE_DATA, FILE_WRITE_EA and FILE_WRITE_ATTRIBUTES (a client sets
  // its read mode with it). It leaves out FILE_CREATE_PIPE_INSTANCE (the
  // same bit as FILE_APPEND_DATA, part of GENERIC_WRITE), with which a
  // process may add instances of the name and serve our clients, and
  // WRITE_DAC, WRITE_OWNER and DELETE, with which it may take the pipe over.
  // The last two entries exist because adding the next instance of our own
  // pipe is an access check against this DACL too: the serving process is
  // often not an administrator, and a service runs as LocalSystem.
  // A SID that cannot be made leaves its entry out; the rest keep their order.
  struct well_known_entry {
    WELL_KNOWN_SID_TYPE type;
    DWORD mask;
  };
  static const well_known_entry well_known[] = {
      {WinWorldSid, pipe_client_access},
      {WinNetworkServiceSid, pipe_client_access},
      {WinNetworkSid, pipe_client_access},
      {WinLowLabelSid, pipe_client_access},
  };
  struct string_entry {
    const wchar_t* sid;
    DWORD mask;
  };
  static const string_entry from_text[] = {
      {L"S-1-5-32-544", GENERIC_ALL | STANDARD_RIGHTS_REQUIRED},
      {L"S-1-15-2-1", pipe_client_access},
      {L"S-1-5-18", GENERIC_ALL},
  };

  std::vector<EXPLICIT_ACCESS_W> entries;
  entries.reserve(8);
  std::vector<std::vector<std::uint8_t>> well_known_sids;
  well_known_sids.reserve(std::size(well_known));
  std::vector<unique_local_sid> text_sids;
  text_sids.reserve(std::size(from_text));

  for (const well_known_entry& e : well_known) {
    std::error_code ignored;
    well_known_sids.push_back(create_well_know_sid(static_cast<std::uint32_t>(e.type), ignored));
    if (!well_known_sids.back().empty()) entries.push_back(granting(well_known_sids.back().data(), e.mask));
  }
  for (const string_entry& e : from_text) {
    std::error_code ignored;
    text_sids.push_back(string_to_sid(e.sid, ignored));
    if (text_sids.back()) entries.push_back(granting(text_sids.back().get(), e.mask));
  }
  std::vector<std::uint8_t> own_user = token_user_sid();
  if (!own_user.empty()) entries.push_back(granting(own_user.data(), GENERIC_ALL, TRUSTEE_IS_USER));

  PACL raw_acl = nullptr;
  const DWORD set_result = ::SetEntriesInAclW(static_cast<ULONG>(entries.size()), entries.data(),
                                              /* old_acl */ nullptr, &raw_acl);
  if (set_result != ERROR_SUCCESS) {
    logging::logger_stream(logging::level_error, function) << L"SetEntriesInAcl err=" << set_result;
    return {};
  }
  unique_local_acl acl(raw_acl);

  unique_local_descriptor block(::LocalAlloc(LPTR, SECURITY_DESCRIPTOR_MIN_LENGTH));
  if (!block) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, function) << L"LocalAlloc err=" << error;
    return {};
  }
  if (!::InitializeSecurityDescriptor(block.get(), SECURITY_DESCRIPTOR_REVISION)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, function) << L"InitializeSecurityDescriptor err=" << error;
    return {};
  }
  if (!::SetSecurityDescriptorDacl(block.get(), /* dacl_present */ TRUE, acl.get(), /* defaulted */ FALSE)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, function) << L"SetSecurityDescriptorDacl err=" << error;
    return {};
  }

  pipes_security_descriptor result;
  result.descriptor = block.release();
  result.dacl = get_dacl(result.descriptor);
  result.sacl = get_sacl(result.descriptor);
  if (result.dacl != acl.get()) {
    // The holder frees the ACL through its DACL pointer; a descriptor whose
    // DACL cannot be read back would leak it and apply nothing anyway.
    result.dacl = nullptr;
    return {};
  }
  (void)acl.release();  // owned by `result` from here on
  return result;
}

std::uint32_t pipe_security_information(const pipes_security_descriptor& descriptor) {
  std::uint32_t flags = 0;
  if (descriptor.sacl != nullptr) flags |= SACL_SECURITY_INFORMATION;
  if (descriptor.dacl != nullptr) flags |= DACL_SECURITY_INFORMATION;
  return flags;
}

bool apply_pipe_security(HANDLE pipe, const pipes_security_descriptor& descriptor, std::error_code& code) {
  logging::trace_scope trace(L"apply_pipe_security");
  const std::uint32_t flags = pipe_security_information(descriptor);
  if (flags == 0) {
    // Nothing to set: an empty holder must not reach the system, which would
    // report success for a call that protected nothing.
    code = winapi::make_win_error(ERROR_INVALID_PARAMETER);
    logging::logger_stream(logging::level_error, L"apply_pipe_security")
        << L"empty security descriptor err=" << static_cast<std::uint32_t>(ERROR_INVALID_PARAMETER);
    return false;
  }
  // A pipe handle is a kernel object: set exactly this DACL on it. As a file
  // object, the call would also work out what the pipe file system's root
  // passes down, which a pipe neither needs nor (under Wine, where it
  // crashes unless the current DACL is protected) survives.
  const DWORD result = ::SetSecurityInfo(pipe, SE_KERNEL_OBJECT, flags, /* owner */ nullptr, /* group */ nullptr,
                                         descriptor.dacl, descriptor.sacl);
  if (result != ERROR_SUCCESS) {
    code = winapi::make_win_error(result);
    logging::logger_stream(logging::level_error, L"apply_pipe_security") << L"SetSecurityInfo err=" << result;
    return false;
  }
  code = {};
  return true;
}

bool adjust_process_priviledges(std::error_code& code) {
  logging::trace_scope trace(L"adjust_process_priviledges");
  constexpr wchar_t function[] = L"adjust_process_priviledges";

  HANDLE raw_token = nullptr;
  if (!::OpenProcessToken(::GetCurrentProcess(), TOKEN_ADJUST_PRIVILEGES | TOKEN_QUERY, &raw_token)) {
    code = winapi::make_win_error(::GetLastError());
    logging::logger_stream(logging::level_error, function) << L"open_process_token err=" << code.value();
    return false;
  }
  winapi::unique_handle token(raw_token);

  LUID luid{};
  if (!::LookupPrivilegeValueW(/* system */ nullptr, SE_SECURITY_NAME, &luid)) {
    code = winapi::make_win_error(::GetLastError());
    logging::logger_stream(logging::level_error, function)
        << L"LookupPrivilegeValue SE_SECURITY_NAME err=" << code.value();
    return false;
  }

  TOKEN_PRIVILEGES privileges{};
  privileges.PrivilegeCount = 1;
  privileges.Privileges[0].Luid = luid;
  privileges.Privileges[0].Attributes = SE_PRIVILEGE_ENABLED;
  TOKEN_PRIVILEGES previous{};  // one privilege: 16 bytes
  static_assert(sizeof(TOKEN_PRIVILEGES) == 16, "one privilege fits 16 bytes");
  DWORD return_length = 0;
  if (!::AdjustTokenPrivileges(token.get(), /* disable_all */ FALSE, &privileges, sizeof(privileges), &previous,
                               &return_length)) {
    code = winapi::make_win_error(::GetLastError());
    logging::logger_stream(logging::level_error, function) << L"AdjustTokenPrivileges err=" << code.value();
    return false;
  }
  // ERROR_NOT_ALL_ASSIGNED (token without the privilege) arrives with a
  // successful call and counts as success.
  code = {};
  return true;
}

std::vector<std::uint8_t> create_well_know_sid(std::uint32_t type, std::error_code& code) {
  std::vector<std::uint8_t> sid(SECURITY_MAX_SID_SIZE, 0);
  DWORD size = SECURITY_MAX_SID_SIZE;
  if (!::CreateWellKnownSid(static_cast<WELL_KNOWN_SID_TYPE>(type), /* domain_sid */ nullptr, sid.data(), &size)) {
    code = winapi::make_win_error(::GetLastError());
    logging::logger_stream(logging::level_error, L"create_well_know_sid")
        << L"CreateWellKnownSid type=" << static_cast<std::int32_t>(type) << L" err=" << code.value();
    return {};
  }
  sid.resize(size);
  code = {};
  return sid;
}

unique_local_sid string_to_sid(const wchar_t* text, std::error_code& code) {
  if (text == nullptr) {
    code = winapi::make_win_error(ERROR_INVALID_PARAMETER);
    logging::logger_stream(logging::level_error, L"string_to_sid")
        << L"ConvertStringSidToSid  err=" << code.value();
    return {};
  }
  PSID sid = nullptr;
  if (!::ConvertStringSidToSidW(text, &sid)) {
    code = winapi::make_win_error(::GetLastError());
    logging::logger_stream(logging::level_error, L"string_to_sid")
        << L"ConvertStringSidToSid " << text << L" err=" << code.value();
    return {};
  }
  code = {};
  return unique_local_sid(sid);
}

PACL get_dacl(PSECURITY_DESCRIPTOR descriptor) {
  BOOL present = FALSE;
  BOOL defaulted = FALSE;
  PACL acl = nullptr;
  if (!::GetSecurityDescriptorDacl(descriptor, &present, &acl, &defaulted)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, L"get_dacl")
        << L"GetSecurityDescriptorDacl err=" << static_cast<std::int32_t>(error);
    return nullptr;
  }
  return acl;
}

PACL get_sacl(PSECURITY_DESCRIPTOR descriptor) {
  BOOL present = FALSE;
  BOOL defaulted = FALSE;
  PACL acl = nullptr;
  if (!::GetSecurityDescriptorSacl(descriptor, &present, &acl, &defaulted)) {
    const DWORD error = ::GetLastError();
    logging::logger_stream(logging::level_error, L"get_sacl")
        << L"GetSecurityDescriptorSacl err=" << static_cast<std::int32_t>(error);
    return nullptr;
  }
  return acl;
}
