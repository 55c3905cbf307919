// Helpers shared by the server and client sides of the gateway: pipe names,
// events and the pipes' initial security descriptor.
#pragma once

#include <windows.h>

#include <string>

#include "platform/handles.h"

namespace parlo::ipc::impl {

// The Win32 path of a configured pipe name: a bare name ("vorbel_pipe") gets
// the local prefix "\\.\pipe\"; a full local path ("\\.\pipe\vorbel_pipe",
// the prefix in any letter case) is kept. Names of pipes on other machines,
// empty names, texts that are not UTF-8 and paths over 256 characters are
// refused (false).
bool to_pipe_path(const char* name, std::wstring& path);

// The key under which a pipe path is compared: pipe names are not case
// sensitive, so "\\.\PIPE\A" and "\\.\pipe\a" are one pipe.
std::wstring pipe_key(const std::wstring& path);

// A new unnamed event, not signalled; empty on failure, GetLastError() set.
winapi::unique_handle make_event(bool manual_reset);

// Holder of memory from LocalAlloc (what the SDDL conversions return).
struct local_free_traits {
  using pointer = void*;
  static void close(void* memory) noexcept { ::LocalFree(memory); }
};
using unique_local = winapi::unique_any<local_free_traits>;

// The security descriptor every pipe instance starts with: a protected DACL
// that admits only SYSTEM and the current user, until the component puts its
// own DACL on the pipe when it hears on_listen. 0, or the Win32 code.
DWORD make_initial_pipe_security(unique_local& descriptor);

}  // namespace parlo::ipc::impl
