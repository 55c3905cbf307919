// The messaging library's extension exports (parlo_ext.h), found in the
// parlo.dll that the process has already loaded.
#pragma once

#include <windows.h>

#include <cstdint>

#include "bus/parlo/parlo_ext.h"
#include "platform/handles.h"

namespace parlo::ipc::impl {

// One per gateway, owned by it. Holds a counted reference on parlo.dll so the
// library stays loaded while taps point into it. Read-only once bound, so any
// thread may call through it.
struct parlo_api {
  winapi::unique_module module;
  ext::tap_fn tap = nullptr;
  ext::untap_fn untap = nullptr;
  ext::inject_fn inject = nullptr;

  // 0, or the Win32 code (with a line) when parlo.dll is not loaded or lacks
  // an export.
  std::uint32_t bind();
};

}  // namespace parlo::ipc::impl
