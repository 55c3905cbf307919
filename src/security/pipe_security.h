// The security descriptor the component stamps onto its named pipes, and
// the security privilege of its own process.
//
// make_pipes_security_descriptor and adjust_process_priviledges run once, on
// the thread that builds a gateway observer; apply_pipe_security runs on the
// IPC library's event threads and only reads the descriptor. Nothing here
// throws for a system failure.
#pragma once

#include <windows.h>

#include <cstdint>
#include <system_error>
#include <vector>

#include "platform/handles.h"

// Owns an absolute security descriptor with the pipes' DACL and no SACL,
// owner or group. Move-only; built once, then only read. Destruction frees
// the descriptor block and the ACL that SetEntriesInAclW made for it. Empty
// (all three null) when building failed: nothing is then applied to pipes.
struct pipes_security_descriptor {
  PSECURITY_DESCRIPTOR descriptor = nullptr;
  PACL dacl = nullptr;  // the descriptor's DACL, owned
  PACL sacl = nullptr;  // the descriptor's SACL: null, none is set

  pipes_security_descriptor() noexcept = default;
  pipes_security_descriptor(pipes_security_descriptor&& other) noexcept;
  pipes_security_descriptor& operator=(pipes_security_descriptor&& other) noexcept;
  pipes_security_descriptor(const pipes_security_descriptor&) = delete;
  pipes_security_descriptor& operator=(const pipes_security_descriptor&) = delete;
  ~pipes_security_descriptor();

  bool empty() const noexcept { return descriptor == nullptr; }
  explicit operator bool() const noexcept { return descriptor != nullptr; }

 private:
  void free_all() noexcept;
};

// A SID (or ACL) allocated by the system and released with LocalFree.
struct local_free_traits {
  using pointer = void*;
  static void close(void* memory) noexcept { ::LocalFree(memory); }
};
using unique_local_sid = winapi::unique_any<local_free_traits>;

// What every trustee of the pipes' DACL may do: connect, read and write data
// (FILE_GENERIC_READ, FILE_WRITE_DATA, FILE_WRITE_EA, FILE_WRITE_ATTRIBUTES),
// but neither add instances of the pipe (FILE_CREATE_PIPE_INSTANCE) nor
// change its security.
inline constexpr std::uint32_t pipe_client_access = 0x0012019B;

// The DACL of the pipes: pipe_client_access for everyone, network service,
// network logons, low integrity processes and app containers; full control
// for administrators, LocalSystem and the user this process runs as. Empty
// on failure.
pipes_security_descriptor make_pipes_security_descriptor();

// The security-information flags that apply_pipe_security passes: DACL when
// the descriptor has one, SACL when it has one.
std::uint32_t pipe_security_information(const pipes_security_descriptor& descriptor);

// Sets the descriptor's DACL (and SACL, if any) on `pipe`, which must have
// been opened with WRITE_DAC. True when the system accepted it. Several
// threads may stamp pipes at once.
bool apply_pipe_security(HANDLE pipe, const pipes_security_descriptor& descriptor, std::error_code& code);

// Enables the security privilege in the process token. True also when the
// token does not hold the privilege (the system reports it without failing).
bool adjust_process_priviledges(std::error_code& code);

// A well-known SID of `type` in an owned buffer cut to its size; empty on
// failure.
std::vector<std::uint8_t> create_well_know_sid(std::uint32_t type, std::error_code& code);
// The SID of an "S-1-..." text; empty on failure.
unique_local_sid string_to_sid(const wchar_t* text, std::error_code& code);

// The descriptor's DACL or SACL pointer; null on failure (or when absent).
PACL get_dacl(PSECURITY_DESCRIPTOR descriptor);
PACL get_sacl(PSECURITY_DESCRIPTOR descriptor);
