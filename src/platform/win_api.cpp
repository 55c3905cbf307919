#include "platform/win_api.h"

#include <cstring>

namespace winapi {
namespace {

constexpr DWORD path_capacity = 32767;

std::error_code last_error_code() noexcept {
  return make_win_error(::GetLastError());
}

}  // namespace

HMODULE current_module(std::error_code& code) noexcept {
  HMODULE module = nullptr;
  if (!::GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS |
                                GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                            reinterpret_cast<LPCWSTR>(
                                static_cast<HMODULE (*)(std::error_code&) noexcept>(&current_module)),
                            &module)) {
    code = last_error_code();
    return nullptr;
  }
  code = std::error_code();
  return module;
}

HMODULE current_module() {
  std::error_code code;
  HMODULE module = current_module(code);
  if (code != std::error_code()) throw std::system_error(code, "GetModuleHandleEx failed");
  return module;
}

std::wstring module_directory(HMODULE module) {
  std::wstring path(path_capacity, L'\0');
  const DWORD n = ::GetModuleFileNameW(module, path.data(), path_capacity);
  const DWORD err = ::GetLastError();
  if (n == 0) throw_win_error(err, "GetModuleFileName failed");
  if (n == path_capacity && err != 0) throw_win_error(err, "GetModuleFileName failed");
  path.resize(n);
  const std::size_t slash = path.rfind(L'\\');
  if (slash == std::wstring::npos) {
    throw_win_error(gen_failure, "GetModuleFileName returned an unexpected path");
  }
  path.resize(slash + 1);
  path.shrink_to_fit();
  return path;
}

unique_module load_library(const wchar_t* path) {
  HMODULE module = ::LoadLibraryW(path);
  if (module == nullptr) {
    const std::error_code code = last_error_code();
    if (code != std::error_code()) throw std::system_error(code, "LoadLibrary failed");
  }
  return unique_module(module);
}

FARPROC get_proc_address(HMODULE module, const char* name) {
  FARPROC proc = ::GetProcAddress(module, name);
  if (proc == nullptr) {
    const std::error_code code = last_error_code();
    if (code != std::error_code()) throw std::system_error(code, "GetProcAddress failed");
  }
  return proc;
}

unique_handle open_process(DWORD access, DWORD pid) {
  HANDLE process = ::OpenProcess(access, /* inherit */ FALSE, pid);
  if (process == nullptr) {
    const std::error_code code = last_error_code();
    if (code != std::error_code()) throw std::system_error(code, "OpenProcess failed");
  }
  return unique_handle(process);
}

namespace this_process {

std::wstring get_filename(std::error_code& code) {
  std::wstring path(path_capacity, L'\0');
  const DWORD n = ::GetModuleFileNameW(nullptr, path.data(), path_capacity);
  const DWORD err = ::GetLastError();
  if (n == 0 || (n == path_capacity && err != 0)) {
    code = make_win_error(err);
    return std::wstring();
  }
  path.resize(n);
  path.shrink_to_fit();
  code = std::error_code();
  return path;
}

}  // namespace this_process

std::string utf16_to_utf8(const wchar_t* text, std::error_code& code) {
  const int n = ::WideCharToMultiByte(CP_UTF8, 0, text, -1, nullptr, 0, nullptr, nullptr);
  const DWORD err = ::GetLastError();
  code = (n == 0 && err != 0) ? make_win_error(err) : std::error_code();
  if (n == 0) return std::string();
  std::string result(static_cast<std::size_t>(n), '\0');
  const int r = ::WideCharToMultiByte(CP_UTF8, 0, text, -1, result.data(), n, nullptr, nullptr);
  if (r == 0) {
    const DWORD convert_err = ::GetLastError();
    if (convert_err != 0) {
      code = make_win_error(convert_err);
      return std::string();
    }
  }
  result.resize(r > 0 ? static_cast<std::size_t>(r - 1) : 0);
  result.shrink_to_fit();
  code = std::error_code();
  return result;
}

std::wstring utf8_to_utf16(const char* text, std::error_code& code) {
  code = std::error_code();
  if (text == nullptr || *text == '\0') return std::wstring();
  const int n = ::MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, text, -1, nullptr, 0);
  if (n == 0) {
    code = last_error_code();
    return std::wstring();
  }
  std::wstring result(static_cast<std::size_t>(n), L'\0');
  const int r = ::MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, text, -1, result.data(), n);
  if (r == 0) {
    code = last_error_code();
    return std::wstring();
  }
  result.resize(static_cast<std::size_t>(r - 1));
  return result;
}

std::wstring query_file_name(HANDLE handle, std::error_code& code) {
  // The buffer holds a FILE_NAME_INFO: a 32-bit byte length, then the name.
  std::wstring buffer(path_capacity, L'\0');
  if (!::GetFileInformationByHandleEx(handle, FileNameInfo, buffer.data(), path_capacity)) {
    code = last_error_code();
    return std::wstring();
  }
  FILE_NAME_INFO info;
  std::memcpy(&info.FileNameLength, buffer.data(), sizeof info.FileNameLength);
  const std::size_t offset = offsetof(FILE_NAME_INFO, FileName) / sizeof(wchar_t);
  std::size_t length = info.FileNameLength / sizeof(wchar_t);
  if (length > buffer.size() - offset) length = buffer.size() - offset;
  buffer.erase(0, offset);
  buffer.resize(length);
  code = std::error_code();
  return buffer;
}

}  // namespace winapi
