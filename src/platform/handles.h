// Owning holders for module and kernel handles.
//
// One owner; the invalid value is null. reset() closes what it held and
// keeps the thread's last error, so a holder going out of scope between a
// failing call and GetLastError() does not hide the cause.
#pragma once

#include <windows.h>

#include <utility>

namespace winapi {

template <typename Traits>
class unique_any {
 public:
  using pointer = typename Traits::pointer;

  unique_any() noexcept = default;
  explicit unique_any(pointer value) noexcept : value_(value) {}
  unique_any(unique_any&& other) noexcept : value_(other.release()) {}
  unique_any& operator=(unique_any&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  unique_any(const unique_any&) = delete;
  unique_any& operator=(const unique_any&) = delete;
  ~unique_any() { reset(); }

  void reset(pointer value = nullptr) noexcept {
    if (value_ != nullptr) {
      const DWORD last_error = ::GetLastError();
      Traits::close(value_);
      ::SetLastError(last_error);
    }
    value_ = value;
  }
  [[nodiscard]] pointer release() noexcept { return std::exchange(value_, nullptr); }
  pointer get() const noexcept { return value_; }
  explicit operator bool() const noexcept { return value_ != nullptr; }

 private:
  pointer value_ = nullptr;
};

struct module_traits {
  using pointer = HMODULE;
  static void close(HMODULE module) noexcept { ::FreeLibrary(module); }
};

struct handle_traits {
  using pointer = HANDLE;
  static void close(HANDLE handle) noexcept { ::CloseHandle(handle); }
};

// A module handle obtained by loading; FreeLibrary on destruction.
using unique_module = unique_any<module_traits>;
// A kernel object handle; CloseHandle on destruction.
using unique_handle = unique_any<handle_traits>;

}  // namespace winapi
