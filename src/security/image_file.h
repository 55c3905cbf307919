// The image file of a peer process: opening it once for every check, its
// identity on disk, whether it is the file the process actually runs, and
// whether the peer's user could put another file at its path.
//
// Free functions without shared state, called from the IPC library's event
// threads during admission; any thread may call them at once. System
// failures never throw: they travel as Win32-category error codes.
#pragma once

#include <windows.h>

#include <array>
#include <cstdint>
#include <string>
#include <system_error>

#include "platform/handles.h"

// Opens `path` for reading and for the running-image check (FILE_EXECUTE),
// sharing it for reading only: while the handle is open nobody can write,
// rename or delete the file, so every check made through it sees one file.
// Empty and the code on failure.
winapi::unique_handle open_image(const std::wstring& path, std::error_code& code);

// What makes one file on disk that file and no other as far as a verdict
// about its content goes: the volume, the file's id on it, its size and its
// last write time. Ordered, to key a map.
struct image_identity {
  std::uint64_t volume = 0;
  std::array<std::uint8_t, 16> file_id{};
  std::uint64_t size = 0;
  std::uint64_t last_write = 0;
};
bool operator<(const image_identity& left, const image_identity& right);
bool operator==(const image_identity& left, const image_identity& right);

// The identity of the open file `file`; false and the code on failure.
bool read_image_identity(HANDLE file, image_identity& identity, std::error_code& code);

// Whether the open file `file` is the image that `process` runs, as the
// kernel knows it (the file object behind the process's image section, not
// a name: a process that renamed its image aside and put another file at its
// path runs the renamed file).
enum class running_image {
  same,         // the file is the process's image
  different,    // the process runs another file
  unsupported,  // the system cannot tell (Wine)
  failed,       // the question failed; `code` says why
};
// `process` needs PROCESS_QUERY_INFORMATION, `file` FILE_EXECUTE (open_image).
running_image check_running_image(HANDLE process, HANDLE file, std::error_code& code);

// Whether this system answers check_running_image, asked once about this
// process's own image.
bool running_image_check_supported();

// Whether the user of `process` can neither remove nor rename the image at
// `path` or any folder on its way from the volume's root, nor change the
// security of any of them, nor write the image: then nobody running as that
// user can put another file at `path`. `process` needs
// PROCESS_QUERY_LIMITED_INFORMATION. False with `where` (the element that
// fails, and what the user may do to it) when the path is not protected;
// false with the code when it cannot be told.
bool is_protected_image_path(HANDLE process, const std::wstring& path, std::wstring& where,
                             std::error_code& code);
