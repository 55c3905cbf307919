// Controls of the recording parlo_ipc.dll double (tests/doubles). Holding one
// keeps the library loaded, so that what it recorded survives the gateways
// that load and unload it.
#pragma once

#include <windows.h>

#include <cstdint>
#include <string>

namespace gateway_test_support {

class ipc_controls {
 public:
  ipc_controls() : module_(::LoadLibraryW(L"parlo_ipc.dll")) {}
  ~ipc_controls() {
    if (module_ != nullptr) ::FreeLibrary(module_);
  }
  ipc_controls(const ipc_controls&) = delete;
  ipc_controls& operator=(const ipc_controls&) = delete;

  bool present() const { return module_ != nullptr; }
  // The calls since the last take, one per line; and forgets them.
  std::string take() {
    auto calls = fn<std::size_t (*)(char*, std::size_t)>("IpcDoubleCalls");
    std::string text(calls(nullptr, 0) + 1, '\0');
    text.resize(calls(text.data(), text.size()));
    fn<void (*)()>("IpcDoubleClearCalls")();
    return text;
  }
  // What the double's operation `which` returns from now on.
  void set_result(int which, std::uint32_t result) {
    fn<void (*)(int, std::uint32_t)>("IpcDoubleSetResult")(which, result);
  }

 private:
  template <typename Fn>
  Fn fn(const char* name) const {
    return reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(module_, name)));
  }
  HMODULE module_;
};

}  // namespace gateway_test_support
