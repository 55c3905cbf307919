// The peer images the build signs for the trust tests, and a running peer.
#pragma once

#include <windows.h>

#include <string>

namespace security_test {

// An image in ../security_images/ beside the test program: child_a (signer
// A, ours), child_b, child_case (A's subject in other letter case),
// child_serial, child_noname, child_unsigned, child_tampered.
inline std::wstring image_path(const wchar_t* name) {
  wchar_t self[MAX_PATH];
  std::wstring dir(self, ::GetModuleFileNameW(nullptr, self, MAX_PATH));
  dir.resize(dir.find_last_of(L'\\') + 1);
  wchar_t full[MAX_PATH];
  const std::wstring relative = dir + L"..\\security_images\\" + name + L".exe";
  return std::wstring(full, ::GetFullPathNameW(relative.c_str(), MAX_PATH, full, nullptr));
}

// A peer process, fully up once constructed (its module list readable),
// that runs until its standard input is closed.
class child_process {
 public:
  explicit child_process(const std::wstring& path) {
    SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
    HANDLE in_read = nullptr, out_read = nullptr, out_write = nullptr;
    ::CreatePipe(&in_read, &input_, &inherit, 0);
    ::CreatePipe(&out_read, &out_write, &inherit, 0);
    ::SetHandleInformation(input_, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = in_read;
    startup.hStdOutput = out_write;
    std::wstring command = L"\"" + path + L"\"";
    PROCESS_INFORMATION info{};
    ::CreateProcessW(path.c_str(), command.data(), nullptr, nullptr, /* inherit_handles */ TRUE,
                     /* flags */ 0, nullptr, nullptr, &startup, &info);
    process_ = info.hProcess;
    ::CloseHandle(info.hThread);
    ::CloseHandle(in_read);
    ::CloseHandle(out_write);
    char ready = 0;  // one byte once up; a peer that dies first breaks the pipe
    DWORD read = 0;
    if (::ReadFile(out_read, &ready, 1, &read, nullptr) && read == 1) pid_ = info.dwProcessId;
    ::CloseHandle(out_read);
  }
  child_process(const child_process&) = delete;
  child_process& operator=(const child_process&) = delete;
  ~child_process() {
    ::CloseHandle(input_);
    if (process_ == nullptr) return;
    if (::WaitForSingleObject(process_, 10000) != WAIT_OBJECT_0) ::TerminateProcess(process_, 1);
    ::CloseHandle(process_);
  }

  bool running() const { return pid_ != 0; }
  DWORD pid() const { return pid_; }

 private:
  HANDLE input_ = nullptr, process_ = nullptr;
  DWORD pid_ = 0;
};

}  // namespace security_test
