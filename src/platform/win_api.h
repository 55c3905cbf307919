// Checked wrappers around the system calls the component relies on.
//
// The throwing forms raise std::system_error with the Win32 code and a text
// naming the call ("LoadLibrary failed", ...); the error_code forms never
// throw for a system failure and return an empty result with the code.
// Nothing here logs: logging, where wanted, is the caller's.
#pragma once

#include <windows.h>

#include <cstdint>
#include <string>
#include <system_error>

#include "platform/handles.h"
#include "platform/win_error.h"

namespace winapi {

// This component's own module, without taking a reference. Null and the code
// on failure.
HMODULE current_module(std::error_code& code) noexcept;
// Throws "GetModuleHandleEx failed".
HMODULE current_module();

// The folder of `module`'s file, ending in a backslash. Throws
// "GetModuleFileName failed" (also when the path was cut) or, with code 31,
// "GetModuleFileName returned an unexpected path".
std::wstring module_directory(HMODULE module);

// Throws "LoadLibrary failed".
unique_module load_library(const wchar_t* path);
// Throws "GetProcAddress failed".
FARPROC get_proc_address(HMODULE module, const char* name);

// Resolves an export into a typed function pointer.
template <typename Fn>
Fn get_proc_address_as(HMODULE module, const char* name) {
  return reinterpret_cast<Fn>(reinterpret_cast<void*>(get_proc_address(module, name)));
}

// OpenProcess(access, not inheritable, pid). Throws "OpenProcess failed".
unique_handle open_process(DWORD access, DWORD pid);

namespace this_process {
// Full path of the current process's executable; empty and the code on
// failure.
std::wstring get_filename(std::error_code& code);
}  // namespace this_process

// UTF-8 form of a zero-terminated wide text; empty and the code on failure.
std::string utf16_to_utf8(const wchar_t* text, std::error_code& code);
inline std::string utf16_to_utf8(const std::wstring& text, std::error_code& code) {
  return utf16_to_utf8(text.c_str(), code);
}

// The wide form of a zero-terminated UTF-8 text; empty and the code on
// failure, invalid UTF-8 included.
std::wstring utf8_to_utf16(const char* text, std::error_code& code);

// The name of the file behind a kernel handle; for a named pipe a backslash
// and the pipe's own name. Empty and the code on failure.
std::wstring query_file_name(HANDLE handle, std::error_code& code);

}  // namespace winapi
