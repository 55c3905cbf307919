// The peer images the build signs for the trust tests, and a running peer.
#pragma once

#include <windows.h>

#include <string>

namespace security_test {

// Full path of an image in ../security_images/ beside the test program:
// child_a (signer A, ours), child_b, child_case (A's subject in other letter
// case), child_serial, child_noname (no subject name), child_unsigned and
// child_tampered (signed by A, then changed).
inline std::wstring image_path(const wchar_t* name) {
  wchar_t self[MAX_PATH];
  const DWORD n = ::GetModuleFileNameW(nullptr, self, MAX_PATH);
  std::wstring dir(self, n);
  dir.resize(dir.find_last_of(L'\\') + 1);
  const std::wstring relative = dir + L"..\\security_images\\" + name + L".exe";
  wchar_t full[MAX_PATH];
  const DWORD m = ::GetFullPathNameW(relative.c_str(), MAX_PATH, full, nullptr);
  return std::wstring(full, m);
}

// A peer process that runs until stop() closes its standard input.
class child_process {
 public:
  explicit child_process(const std::wstring& path) {
    SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
    HANDLE read_end = nullptr;
    HANDLE output = nullptr;
    HANDLE write_end = nullptr;
    if (!::CreatePipe(&read_end, &input_, &inherit, 0)) return;
    if (!::CreatePipe(&output, &write_end, &inherit, 0)) return;
    ::SetHandleInformation(input_, HANDLE_FLAG_INHERIT, 0);
    ::SetHandleInformation(output, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = read_end;
    startup.hStdOutput = write_end;
    std::wstring command = L"\"" + path + L"\"";
    PROCESS_INFORMATION info{};
    if (::CreateProcessW(path.c_str(), command.data(), nullptr, nullptr, /* inherit_handles */ TRUE,
                         /* flags */ 0, nullptr, nullptr, &startup, &info)) {
      process_ = info.hProcess;
      pid_ = info.dwProcessId;
      ::CloseHandle(info.hThread);
    }
    ::CloseHandle(read_end);
    ::CloseHandle(write_end);
    // Its ready byte; a peer that dies first breaks the pipe instead.
    char ready = 0;
    DWORD read = 0;
    if (process_ != nullptr && !(::ReadFile(output, &ready, 1, &read, nullptr) && read == 1)) {
      ::TerminateProcess(process_, 1);
      ::CloseHandle(process_);
      process_ = nullptr;
    }
    ::CloseHandle(output);
  }
  child_process(const child_process&) = delete;
  child_process& operator=(const child_process&) = delete;
  ~child_process() {
    if (!stop() && process_ != nullptr) ::TerminateProcess(process_, 1);
    if (process_ != nullptr) ::CloseHandle(process_);
  }

  bool running() const { return process_ != nullptr; }
  DWORD pid() const { return pid_; }
  HANDLE handle() const { return process_; }

  // Closes the peer's input and waits (bounded) for it to exit.
  bool stop() {
    if (input_ != nullptr) ::CloseHandle(input_);
    input_ = nullptr;
    return process_ != nullptr && ::WaitForSingleObject(process_, 10000) == WAIT_OBJECT_0;
  }

 private:
  HANDLE input_ = nullptr;
  HANDLE process_ = nullptr;
  DWORD pid_ = 0;
};

}  // namespace security_test
