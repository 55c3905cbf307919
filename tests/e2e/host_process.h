// A vorbel_host process driven through its standard streams: commands go to
// its input, every line it prints is collected, and a test waits (bounded)
// for the lines it expects.
#pragma once

#include <windows.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/srw_sync.h"

namespace e2e {

// The folder of this test program, with a trailing backslash.
inline std::wstring program_dir() {
  wchar_t path[MAX_PATH];
  const DWORD n = ::GetModuleFileNameW(nullptr, path, MAX_PATH);
  std::wstring dir(path, n);
  dir.resize(dir.find_last_of(L'\\') + 1);
  return dir;
}

// A host image beside the peer hosts: host_a (signed like this program),
// host_b (another signer), host_unsigned, host_tampered.
inline std::wstring host_image(const wchar_t* name) {
  return program_dir() + L"..\\e2e_hosts\\" + name + L".exe";
}

// Writes `text` to a file in this program's folder and returns its path.
inline std::wstring write_file(const std::wstring& name, const std::string& text) {
  const std::wstring path = program_dir() + name;
  std::ofstream(std::filesystem::path(path), std::ios::binary) << text;
  return path;
}

inline std::string read_file(const std::wstring& path) {
  std::ifstream in(std::filesystem::path(path), std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

class host_process {
 public:
  // Starts `image` with `--config <config> --log <log> --stdin` and waits
  // for its "ready" line.
  //
  // Under Wine a process start now and then never reaches the program's
  // first line (about once in a thousand starts, loaded machine or not): no
  // output, no log, the process still running. Such a start is ended and
  // made once more, and said on standard error; a program that printed
  // anything is never started again, so its own failures stay visible.
  host_process(const std::wstring& image, const std::wstring& config, const std::wstring& log) {
    std::wstring command = L"\"" + image + L"\" --config \"" + config + L"\" --log \"" + log + L"\" --stdin";
    for (int attempt = 0; attempt < 2; ++attempt) {
      if (attempt > 0) {
        std::fprintf(stderr, "host_process: %ls: %s; starting it again\n", image.c_str(), start_failure_.c_str());
        end_process();
      }
      start(image, command);
      ready_ = wait_line([](const std::string& l) { return l.rfind("ready ", 0) == 0; },
                         std::chrono::seconds(20));
      if (ready_ || !output().empty()) break;
      start_failure_ = process_ == nullptr ? "CreateProcess err=" + std::to_string(create_error_)
                       : running()        ? std::string("nothing printed in 20 s, still running")
                                          : "exited with code " + std::to_string(exit_code()) +
                                                " before printing anything";
    }
  }
  host_process(const host_process&) = delete;
  host_process& operator=(const host_process&) = delete;
  ~host_process() {
    if (process_ != nullptr && running()) {
      send("quit");
      if (::WaitForSingleObject(process_, 5000) != WAIT_OBJECT_0) ::TerminateProcess(process_, 1);
    }
    end_process();
  }

  bool ready() const { return ready_; }
  // Why the last start printed nothing; empty when it did.
  const std::string& start_failure() const { return start_failure_; }
  DWORD pid() const { return pid_; }
  bool running() const { return ::WaitForSingleObject(process_, 0) == WAIT_TIMEOUT; }

  void send(const std::string& command) {
    const std::string line = command + "\n";
    DWORD written = 0;
    if (input_ != nullptr) ::WriteFile(input_, line.data(), static_cast<DWORD>(line.size()), &written, nullptr);
  }

  // Ends the process the hard way, as a crash would.
  void kill() {
    ::TerminateProcess(process_, 9);
    ::WaitForSingleObject(process_, 10000);
  }

  // Waits until a line (any seen so far, or a new one) satisfies `match`.
  bool wait_line(const std::function<bool(const std::string&)>& match,
                 std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    std::unique_lock<srw_mutex> lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] {
      for (const auto& line : lines_) {
        if (match(line)) return true;
      }
      return false;
    });
  }
  bool wait_for(const std::string& exact, std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    return wait_line([&](const std::string& l) { return l == exact; }, timeout);
  }
  // The time at which a line equal to `exact` was read, waiting for it.
  bool line_time(const std::string& exact, std::chrono::steady_clock::time_point& at,
                 std::chrono::milliseconds timeout) {
    std::unique_lock<srw_mutex> lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] {
      for (std::size_t i = 0; i < lines_.size(); ++i) {
        if (lines_[i] == exact) {
          at = times_[i];
          return true;
        }
      }
      return false;
    });
  }
  bool has_line(const std::string& exact) {
    std::lock_guard<srw_mutex> lock(mutex_);
    for (const auto& line : lines_) {
      if (line == exact) return true;
    }
    return false;
  }
  std::string output() {
    std::lock_guard<srw_mutex> lock(mutex_);
    std::string all;
    for (const auto& line : lines_) all += line + "\n";
    return all;
  }

 private:
  void start(const std::wstring& image, std::wstring& command) {
    SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
    HANDLE child_in = nullptr;
    HANDLE child_out = nullptr;
    ::CreatePipe(&child_in, &input_, &inherit, 0);
    ::CreatePipe(&output_, &child_out, &inherit, 0);
    ::SetHandleInformation(input_, HANDLE_FLAG_INHERIT, 0);
    ::SetHandleInformation(output_, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = child_in;
    startup.hStdOutput = child_out;
    startup.hStdError = child_out;
    PROCESS_INFORMATION info{};
    if (::CreateProcessW(image.c_str(), command.data(), nullptr, nullptr, /* inherit_handles */ TRUE,
                         /* flags */ 0, nullptr, nullptr, &startup, &info)) {
      process_ = info.hProcess;
      pid_ = info.dwProcessId;
      ::CloseHandle(info.hThread);
    } else {
      create_error_ = ::GetLastError();
    }
    ::CloseHandle(child_in);
    ::CloseHandle(child_out);
    reader_ = std::thread([this] { read_lines(); });
  }
  // Ends the process if it still runs and lets go of everything of it.
  void end_process() {
    if (process_ != nullptr && running()) {
      ::TerminateProcess(process_, 1);
      ::WaitForSingleObject(process_, 10000);
    }
    close_input();
    if (reader_.joinable()) reader_.join();
    if (output_ != nullptr) ::CloseHandle(output_);
    output_ = nullptr;
    if (process_ != nullptr) ::CloseHandle(process_);
    process_ = nullptr;
    pid_ = 0;
    std::lock_guard<srw_mutex> lock(mutex_);
    lines_.clear();
    times_.clear();
  }
  DWORD exit_code() const {
    DWORD code = 0;
    ::GetExitCodeProcess(process_, &code);
    return code;
  }
  void close_input() {
    if (input_ != nullptr) ::CloseHandle(input_);
    input_ = nullptr;
  }
  void read_lines() {
    std::string pending;
    char buffer[4096];
    DWORD read = 0;
    while (::ReadFile(output_, buffer, sizeof(buffer), &read, nullptr) && read > 0) {
      const auto now = std::chrono::steady_clock::now();
      pending.append(buffer, read);
      std::size_t end;
      while ((end = pending.find('\n')) != std::string::npos) {
        std::string line = pending.substr(0, end);
        if (!line.empty() && line.back() == '\r') line.pop_back();
        pending.erase(0, end + 1);
        std::lock_guard<srw_mutex> lock(mutex_);
        lines_.push_back(std::move(line));
        times_.push_back(now);
        changed_.notify_all();
      }
    }
  }

  HANDLE input_ = nullptr;
  HANDLE output_ = nullptr;
  HANDLE process_ = nullptr;
  DWORD pid_ = 0;
  DWORD create_error_ = 0;
  bool ready_ = false;
  std::string start_failure_;
  std::thread reader_;
  srw_mutex mutex_;
  srw_condition_variable changed_;
  std::vector<std::string> lines_;
  std::vector<std::chrono::steady_clock::time_point> times_;
};

}  // namespace e2e
