// Process attach and detach of vorbel.dll: keeps the process-wide logging
// binding alive while the library is loaded.
#include <windows.h>

#include "logging/log_dll.h"

BOOL WINAPI DllMain(HINSTANCE /*module*/, DWORD reason, LPVOID reserved) {
  switch (reason) {
    case DLL_PROCESS_ATTACH:
      logging::process_attach();
      break;
    case DLL_PROCESS_DETACH:
      // A non-null `reserved` means the process is terminating: the loader may
      // already have detached the logging library, so it must not be called.
      logging::process_detach(/* process_terminating */ reserved != nullptr);
      break;
    default:
      break;
  }
  return TRUE;
}
