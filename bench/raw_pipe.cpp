#include "raw_pipe.h"

#include <cstdio>

namespace bench {

bool raw_pipe_server::create(const std::string& name) {
  const std::wstring path(name.begin(), name.end());
  HANDLE pipe = ::CreateNamedPipeW(path.c_str(), PIPE_ACCESS_DUPLEX,
                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                   /* max_instances */ 1,
                                   /* out_buffer_size */ raw_pipe_buffer,
                                   /* in_buffer_size */ raw_pipe_buffer,
                                   /* default_timeout_ms */ 0, /* security_attributes */ nullptr);
  if (pipe == INVALID_HANDLE_VALUE) {
    const DWORD err = ::GetLastError();
    std::fprintf(stderr, "vorbel_bench: CreateNamedPipe failed err=%lu\n", err);
    return false;
  }
  pipe_.reset(pipe);
  return true;
}

bool raw_pipe_server::accept() {
  if (::ConnectNamedPipe(pipe_.get(), nullptr)) return true;
  const DWORD err = ::GetLastError();
  if (err == ERROR_PIPE_CONNECTED) return true;
  std::fprintf(stderr, "vorbel_bench: ConnectNamedPipe failed err=%lu\n", err);
  return false;
}

bool raw_pipe_server::round_trip(const std::string& payload) {
  DWORD written = 0;
  if (!::WriteFile(pipe_.get(), payload.data(), static_cast<DWORD>(payload.size()), &written, nullptr)) {
    return false;
  }
  DWORD read = 0;
  if (!::ReadFile(pipe_.get(), buffer_.data(), static_cast<DWORD>(buffer_.size()), &read, nullptr)) {
    return false;
  }
  return read == payload.size();
}

bool raw_pipe_server::send(const std::string& payload) {
  DWORD written = 0;
  return ::WriteFile(pipe_.get(), payload.data(), static_cast<DWORD>(payload.size()), &written, nullptr) &&
         written == payload.size();
}

DWORD raw_pipe_open(const std::string& name, winapi::unique_handle& pipe) {
  const std::wstring path(name.begin(), name.end());
  HANDLE handle = ::CreateFileW(path.c_str(), GENERIC_READ | GENERIC_WRITE, /* share */ 0,
                                /* security_attributes */ nullptr, OPEN_EXISTING, /* flags */ 0,
                                /* template */ nullptr);
  if (handle == INVALID_HANDLE_VALUE) return ::GetLastError();
  pipe.reset(handle);
  DWORD mode = PIPE_READMODE_MESSAGE;
  if (!::SetNamedPipeHandleState(handle, &mode, nullptr, nullptr)) return ::GetLastError();
  return 0;
}

void raw_pipe_echo(HANDLE pipe, bool sink) {
  std::vector<char> buffer(raw_max_message);
  for (;;) {
    DWORD read = 0;
    if (!::ReadFile(pipe, buffer.data(), static_cast<DWORD>(buffer.size()), &read, nullptr)) {
      const DWORD err = ::GetLastError();
      if (sink && err == ERROR_MORE_DATA) continue;  // the rest follows
      return;
    }
    if (sink && read != 1) continue;
    DWORD written = 0;
    if (!::WriteFile(pipe, buffer.data(), read, &written, nullptr)) return;
  }
}

}  // namespace bench
