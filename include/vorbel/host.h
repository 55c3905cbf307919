// Header-only helper for hosts: loads vorbel.dll from a folder, creates the
// bus registry and gives it back on destruction.
//
//   vorbel::host_library lib;
//   if (std::uint32_t err = lib.open(L"C:\\product\\bin")) { ... }
//   ibus* bus = lib.registry()->create_bus("main", &config);
//   ...
//   lib.registry()->destroy_bus("main");
//
// One owner, one thread at a time; not copyable. Destroy every bus you created
// before the helper goes.
#pragma once

#include <vorbel/vorbel.h>

#include <windows.h>

#include <cstdint>
#include <string>

namespace vorbel {

class host_library {
 public:
  host_library() = default;
  host_library(const host_library&) = delete;
  host_library& operator=(const host_library&) = delete;
  ~host_library() { close(); }

  // Loads `folder`\vorbel.dll (the folder must also hold the sibling
  // libraries) and creates the registry. Returns 0 or a Win32 error code: the
  // loader's, 127 when an export is missing, or QmCreateObject's result.
  std::uint32_t open(const std::wstring& folder) {
    close();
    std::wstring path = folder;
    if (!path.empty() && path.back() != L'\\' && path.back() != L'/') path += L'\\';
    path += L"vorbel.dll";
    module_ = ::LoadLibraryW(path.c_str());
    if (module_ == nullptr) {
      const DWORD err = ::GetLastError();
      return err != 0 ? err : ERROR_MOD_NOT_FOUND;
    }
    create_ = reinterpret_cast<QmCreateObject_fn>(
        reinterpret_cast<void*>(::GetProcAddress(module_, "QmCreateObject")));
    destroy_ = reinterpret_cast<QmDestroyObject_fn>(
        reinterpret_cast<void*>(::GetProcAddress(module_, "QmDestroyObject")));
    if (create_ == nullptr || destroy_ == nullptr) {
      close();
      return ERROR_PROC_NOT_FOUND;
    }
    void* object = nullptr;
    const std::uint32_t err = create_(VORBEL_OBJECT_NAME, IID_IQmBaseInterface, &object);
    if (err != 0 || object == nullptr) {
      close();
      return err != 0 ? err : ERROR_OUTOFMEMORY;
    }
    registry_ = static_cast<ivorbel*>(object);
    return 0;
  }

  // Gives the registry back and unloads the library.
  void close() {
    if (registry_ != nullptr) {
      destroy_(VORBEL_OBJECT_NAME, registry_);
      registry_ = nullptr;
    }
    if (module_ != nullptr) {
      ::FreeLibrary(module_);
      module_ = nullptr;
    }
    create_ = nullptr;
    destroy_ = nullptr;
  }

  ivorbel* registry() const { return registry_; }
  HMODULE module() const { return module_; }

 private:
  HMODULE module_ = nullptr;
  QmCreateObject_fn create_ = nullptr;
  QmDestroyObject_fn destroy_ = nullptr;
  ivorbel* registry_ = nullptr;
};

}  // namespace vorbel
