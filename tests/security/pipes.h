// Server pipes as the IPC library makes them, for tests that put the
// component's DACL on a real pipe.
#pragma once

#include <windows.h>
#include <aclapi.h>
#include <sddl.h>

#include "platform/handles.h"
#include "security/pipe_security.h"

namespace security_test {

// WRITE_DAC and a protected initial DACL, so the component's DACL applies
// cleanly under Wine. SDDL "D:P(A;;GA;;;WD)": protected, generic all for
// Everyone.
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

// The pipe's current DACL, read back from the handle; `holder` keeps it.
inline PACL dacl_of(HANDLE pipe, unique_local_sid& holder) {
  PACL dacl = nullptr;
  PSECURITY_DESCRIPTOR descriptor = nullptr;
  ::GetSecurityInfo(pipe, SE_KERNEL_OBJECT, DACL_SECURITY_INFORMATION, nullptr, nullptr, &dacl, nullptr, &descriptor);
  holder.reset(descriptor);
  return dacl;
}

// Wine drops the DACL's protection when SetSecurityInfo sets one and then
// crashes in the next SetSecurityInfo on the handle; the IPC library
// re-protects its pipes after every event that may have set a DACL, so do
// the tests.
inline void reprotect(HANDLE pipe) {
  unique_local_sid holder;
  const PACL current = dacl_of(pipe, holder);
  if (!holder) return;
  SECURITY_DESCRIPTOR protected_dacl;
  ::InitializeSecurityDescriptor(&protected_dacl, SECURITY_DESCRIPTOR_REVISION);
  ::SetSecurityDescriptorDacl(&protected_dacl, /* present */ TRUE, current, /* defaulted */ FALSE);
  ::SetSecurityDescriptorControl(&protected_dacl, SE_DACL_PROTECTED, SE_DACL_PROTECTED);
  ::SetKernelObjectSecurity(pipe, DACL_SECURITY_INFORMATION, &protected_dacl);
}

}  // namespace security_test
