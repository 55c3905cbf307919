// Server pipes as the IPC library makes them, for tests that put the
// component's DACL on a real pipe.
#pragma once

#include <windows.h>
#include <aclapi.h>
#include <sddl.h>

#include "platform/handles.h"

namespace security_test {

// WRITE_DAC (unless `open_mode` leaves it out) and a protected initial DACL,
// so the component's DACL applies cleanly under Wine. SDDL "D:P(A;;GA;;;WD)":
// protected DACL, generic all for Everyone.
inline winapi::unique_handle make_pipe(const wchar_t* name, DWORD open_mode = WRITE_DAC) {
  PSECURITY_DESCRIPTOR initial = nullptr;
  ::ConvertStringSecurityDescriptorToSecurityDescriptorW(L"D:P(A;;GA;;;WD)", SDDL_REVISION_1, &initial, nullptr);
  SECURITY_ATTRIBUTES attributes{sizeof(attributes), initial, FALSE};
  HANDLE pipe = ::CreateNamedPipeW(name, PIPE_ACCESS_DUPLEX | open_mode, PIPE_TYPE_BYTE | PIPE_WAIT,
                                   /* max_instances */ 4, /* out_buffer */ 4096, /* in_buffer */ 4096,
                                   /* default_timeout */ 0, &attributes);
  ::LocalFree(initial);
  return winapi::unique_handle(pipe == INVALID_HANDLE_VALUE ? nullptr : pipe);
}

// The pipe's current DACL, read back from the handle.
struct dacl_of {
  PACL dacl = nullptr;
  PSECURITY_DESCRIPTOR descriptor = nullptr;
  explicit dacl_of(HANDLE pipe) {
    if (::GetSecurityInfo(pipe, SE_KERNEL_OBJECT, DACL_SECURITY_INFORMATION, nullptr, nullptr, &dacl,
                          nullptr, &descriptor) != ERROR_SUCCESS) {
      dacl = nullptr;
    }
  }
  ~dacl_of() { ::LocalFree(descriptor); }
  dacl_of(const dacl_of&) = delete;
  dacl_of& operator=(const dacl_of&) = delete;
  DWORD entries() const { return dacl != nullptr ? dacl->AceCount : 0; }
};

// Wine drops the DACL's protection when SetSecurityInfo sets a DACL, and then
// crashes in the next SetSecurityInfo on the handle (it looks for a parent
// DACL that pipes do not have). The IPC library re-protects its pipes after
// every event that may have set one; so do the tests.
inline void reprotect(HANDLE pipe) {
  const dacl_of current(pipe);
  if (current.descriptor == nullptr) return;
  SECURITY_DESCRIPTOR protected_dacl;
  ::InitializeSecurityDescriptor(&protected_dacl, SECURITY_DESCRIPTOR_REVISION);
  ::SetSecurityDescriptorDacl(&protected_dacl, /* present */ TRUE, current.dacl, /* defaulted */ FALSE);
  ::SetSecurityDescriptorControl(&protected_dacl, SE_DACL_PROTECTED, SE_DACL_PROTECTED);
  ::SetKernelObjectSecurity(pipe, DACL_SECURITY_INFORMATION, &protected_dacl);
}

}  // namespace security_test
