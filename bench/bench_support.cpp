#include "bench_support.h"

#include <cstdio>

#include "bench_main.h"

namespace bench {

std::string logging_setting() {
  wchar_t value[64];
  const DWORD n = ::GetEnvironmentVariableW(L"SCRIBO_LOG_LEVEL", value, 64);
  if (n == 0 || n >= 64) return "SCRIBO_LOG_LEVEL unset: every line, trace included, is written";
  return "SCRIBO_LOG_LEVEL=" + std::string(value, value + n);
}

std::int64_t now_ticks() {
  LARGE_INTEGER now;
  ::QueryPerformanceCounter(&now);
  return now.QuadPart;
}

double ticks_to_us(std::int64_t ticks) {
  static const double per_us = [] {
    LARGE_INTEGER frequency;
    ::QueryPerformanceFrequency(&frequency);
    return static_cast<double>(frequency.QuadPart) / 1e6;
  }();
  return static_cast<double>(ticks) / per_us;
}

void print_line(const std::string& line) {
  static std::mutex mutex;
  std::lock_guard<std::mutex> lock(mutex);
  std::fwrite(line.data(), 1, line.size(), stdout);
  std::fputc('\n', stdout);
  std::fflush(stdout);
}

std::wstring own_image() {
  std::wstring path(MAX_PATH, L'\0');
  for (;;) {
    const DWORD n = ::GetModuleFileNameW(nullptr, &path[0], static_cast<DWORD>(path.size()));
    if (n < path.size()) {
      path.resize(n);
      return path;
    }
    path.resize(path.size() * 2);
  }
}

std::string pipe_name(const char* tag) {
  return std::string("\\\\.\\pipe\\vorbel_bench_") + tag + "_" + std::to_string(::GetCurrentProcessId());
}

peer_process::~peer_process() {
  if (process_) {
    send("quit");
    if (::WaitForSingleObject(process_.get(), 5000) != WAIT_OBJECT_0) {
      ::TerminateProcess(process_.get(), 1);
      ::WaitForSingleObject(process_.get(), 5000);
    }
  }
  input_.reset();
  // The peer has gone, so its end of the output pipe is closed and the
  // reader's ReadFile returns.
  if (reader_.joinable()) reader_.join();
}

bool peer_process::start(const std::wstring& image) {
  SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
  HANDLE child_in = nullptr;
  HANDLE our_in = nullptr;
  HANDLE our_out = nullptr;
  HANDLE child_out = nullptr;
  if (!::CreatePipe(&child_in, &our_in, &inherit, 0)) {
    const DWORD err = ::GetLastError();
    std::fprintf(stderr, "vorbel_bench: CreatePipe failed err=%lu\n", err);
    return false;
  }
  input_.reset(our_in);
  winapi::unique_handle child_in_holder(child_in);
  if (!::CreatePipe(&our_out, &child_out, &inherit, 0)) {
    const DWORD err = ::GetLastError();
    std::fprintf(stderr, "vorbel_bench: CreatePipe failed err=%lu\n", err);
    return false;
  }
  output_.reset(our_out);
  winapi::unique_handle child_out_holder(child_out);
  ::SetHandleInformation(input_.get(), HANDLE_FLAG_INHERIT, 0);
  ::SetHandleInformation(output_.get(), HANDLE_FLAG_INHERIT, 0);

  STARTUPINFOW startup{};
  startup.cb = sizeof(startup);
  startup.dwFlags = STARTF_USESTDHANDLES;
  startup.hStdInput = child_in;
  startup.hStdOutput = child_out;
  startup.hStdError = ::GetStdHandle(STD_ERROR_HANDLE);
  std::wstring command = L"\"" + image + L"\" peer";
  PROCESS_INFORMATION info{};
  if (!::CreateProcessW(image.c_str(), &command[0], /* process_attributes */ nullptr,
                        /* thread_attributes */ nullptr, /* inherit_handles */ TRUE,
                        /* creation_flags */ 0, /* environment */ nullptr,
                        /* current_directory */ nullptr, &startup, &info)) {
    const DWORD err = ::GetLastError();
    std::fprintf(stderr, "vorbel_bench: CreateProcess failed err=%lu\n", err);
    return false;
  }
  process_.reset(info.hProcess);
  ::CloseHandle(info.hThread);
  pid_ = info.dwProcessId;
  // Our copies of the child's ends go now, so its exit ends our reads.
  child_in_holder.reset();
  child_out_holder.reset();
  reader_ = std::thread([this] { read_lines(); });
  if (take_line("ready", std::chrono::seconds(20)).empty()) {
    std::fprintf(stderr, "vorbel_bench: the peer did not start\n");
    return false;
  }
  return true;
}

void peer_process::send(const std::string& command) {
  const std::string line = command + "\n";
  DWORD written = 0;
  if (input_) ::WriteFile(input_.get(), line.data(), static_cast<DWORD>(line.size()), &written, nullptr);
}

std::string peer_process::take_line(const std::string& prefix, std::chrono::milliseconds timeout) {
  std::unique_lock<std::mutex> lock(mutex_);
  std::string found;
  changed_.wait_for(lock, timeout, [&] {
    for (auto it = lines_.begin(); it != lines_.end(); ++it) {
      if (it->compare(0, prefix.size(), prefix) == 0) {
        found = std::move(*it);
        lines_.erase(it);
        return true;
      }
    }
    return ended_;
  });
  return found;
}

std::string peer_process::request(const std::string& command, const std::string& prefix,
                                  std::chrono::milliseconds timeout) {
  send(command);
  return take_line(prefix, timeout);
}

void peer_process::read_lines() {
  std::string pending;
  char buffer[4096];
  DWORD read = 0;
  while (::ReadFile(output_.get(), buffer, sizeof(buffer), &read, nullptr) && read > 0) {
    pending.append(buffer, read);
    std::size_t end;
    while ((end = pending.find('\n')) != std::string::npos) {
      std::string line = pending.substr(0, end);
      if (!line.empty() && line.back() == '\r') line.pop_back();
      pending.erase(0, end + 1);
      if (on_line) on_line(line);
      std::lock_guard<std::mutex> lock(mutex_);
      lines_.push_back(std::move(line));
      changed_.notify_all();
    }
  }
  std::lock_guard<std::mutex> lock(mutex_);
  ended_ = true;
  changed_.notify_all();
}

std::uint64_t table_hash(const listener_list& table) {
  std::uint64_t hash = 14695981039346656037ull;
  const auto add = [&](const std::string& text) {
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 1099511628211ull;
    hash = (hash ^ 0u) * 1099511628211ull;
  };
  for (const listener& item : table) {
    add(item.channel);
    add(item.id);
  }
  return hash;
}

bool fixed_configuration::next_local_channel(std::uint64_t* cursor, const char** channel_name) {
  if (*cursor >= local.size()) return false;
  *channel_name = local[(*cursor)++].c_str();
  return true;
}

bool fixed_configuration::next_exported_channel(std::uint64_t* cursor, const char** channel_name,
                                                const char** pipe_name, std::uint32_t* link_type,
                                                std::uint32_t* security) {
  if (*cursor >= exports.size()) return false;
  const exported& e = exports[(*cursor)++];
  *channel_name = e.channel.c_str();
  *pipe_name = e.pipe.c_str();
  *link_type = 3;
  *security = 0;
  return true;
}

bool fixed_configuration::next_imported_channel(std::uint64_t* cursor, const char** channel_name,
                                                const char** pipe_name, std::uint32_t* link_type,
                                                std::uint32_t* security,
                                                const char** remote_channel_name,
                                                const char** remote_bus_name) {
  if (*cursor >= imports.size()) return false;
  const imported& i = imports[(*cursor)++];
  *channel_name = i.channel.c_str();
  *pipe_name = i.pipe.c_str();
  *remote_channel_name = i.channel.c_str();
  *remote_bus_name = i.remote_bus.c_str();
  *link_type = 3;
  *security = 0;
  return true;
}

}  // namespace bench
