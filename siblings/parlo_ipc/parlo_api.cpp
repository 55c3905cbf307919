#include "parlo_api.h"

#include "logging/logger.h"

namespace parlo::ipc::impl {
namespace {

template <typename Fn>
Fn resolve(HMODULE module, const char* name) {
  return reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(module, name)));
}

}  // namespace

std::uint32_t parlo_api::bind() {
  HMODULE found = nullptr;
  // Flags 0: a counted reference, released with the gateway.
  if (!::GetModuleHandleExW(0, L"parlo.dll", &found) || found == nullptr) {
    const DWORD err = ::GetLastError();
    logging::logger_stream(logging::level_error, L"parlo_ipc::parlo_api::bind")
        << L"parlo.dll is not loaded err=" << err;
    return err != 0 ? err : ERROR_MOD_NOT_FOUND;
  }
  module.reset(found);
  tap = resolve<ext::tap_fn>(found, "parlo_tap");
  untap = resolve<ext::untap_fn>(found, "parlo_untap");
  inject = resolve<ext::inject_fn>(found, "parlo_inject");
  if (tap == nullptr || untap == nullptr || inject == nullptr) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::parlo_api::bind")
        << L"parlo.dll lacks parlo_tap, parlo_untap or parlo_inject";
    return ERROR_PROC_NOT_FOUND;
  }
  return 0;
}

}  // namespace parlo::ipc::impl
