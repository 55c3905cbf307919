// Authenticode signatures of image files: whether a file's embedded
// signature verifies, and who signed it.
//
// Free functions without shared state; any thread may call them at once
// (the gateway observer calls them from the IPC library's event threads).
// System failures never throw: they travel as Win32-category error codes.
#pragma once

#include <windows.h>

#include <cstdint>
#include <optional>
#include <string>
#include <system_error>

// The signer of a file: its signing certificate's serial number (hex, two
// lower-case digits per byte, most significant byte first), and the simple
// display names of the certificate's issuer and subject. The subject is the
// signer name that trust classification compares.
struct signature {
  std::wstring serial_number;
  std::wstring issuer;
  std::wstring subject;
};

// True when the file's embedded signature verifies (no revocation check,
// URL retrieval from the cache only). An unsigned file or a signature the
// system distrusts is false with success; any other failure of verification
// is false with the system's code.
bool is_trusted(const std::wstring& path, std::error_code& code);

// The signer of the file's first signature; an empty record and the code on
// failure. A signature whose signer certificate is not in the embedded store
// gives an empty record with success.
signature read_signature(const std::wstring& path, std::error_code& code);

// read_signature, traced, with a warning line on failure; absent whenever
// the code is an error.
std::optional<signature> get_signature(const std::wstring& path, std::error_code& code);

// The signer of the current process's own image; absent on any failure (the
// reason is only in the log).
std::optional<signature> get_current_signature();

// What one verification of an open image file found. The signer is taken
// from that same verification (the certificate that signed what was
// verified), so the verdict and the signer are about one file even when
// somebody replaces the file at its path meanwhile.
struct image_verdict {
  // The embedded signature verifies (the same settings as is_trusted).
  bool trusted = false;
  // What the verification returned: 0, or an HRESULT such as 0x800B0100 (no
  // signature) or 0x80096010 (the digest does not match).
  std::uint32_t result = 0;
  // A failure of verification other than "unsigned" or "not trusted".
  std::error_code code;
  // When trusted: the signer, or absent with `signer_code` when it cannot be
  // read from the verification.
  std::optional<signature> signer;
  std::error_code signer_code;
};

// Verifies the image open as `file` (read access; `path` names it for the
// system and the lines) and reads its signer from that verification. Writes
// the "get_signature err=0x" warning when the signer cannot be read.
image_verdict verify_image(HANDLE file, const std::wstring& path);
