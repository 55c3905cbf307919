// The system across real processes under Wine: vorbel_host peers (in
// ../e2e_hosts/, signed in several ways) driven through their standard
// streams, and this test program as the process they join, with an observer
// that keeps the table its notifications describe. Every wait has a bound.
// Paths are relative to the test program's folder, where CTest runs it.
#pragma once

#include <windows.h>
#include <psapi.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "gateway/gateway.h"
#include "platform/srw_sync.h"
#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace e2e {

using namespace std::chrono_literals;
using clock = std::chrono::steady_clock;
using items = std::multiset<std::string>;      // ids of channel "alerts"
using table = std::map<std::uint32_t, items>;  // by pid
using pipes = std::vector<std::pair<std::string, std::uint32_t>>;  // name, security level

inline DWORD own() { return ::GetCurrentProcessId(); }

// How long a wait across processes may take before it counts as failed. On
// a loaded 2-core machine a process start, an admission and a client's
// retry after its backoff take seconds, not milliseconds; a wait ends as
// soon as its condition holds, so only a failure pays for the margin.
inline constexpr std::chrono::milliseconds patience = 30s;

// A whole number from the environment, or `fallback`: long runs are made by
// hand with a larger figure.
inline long env_number(const char* name, long fallback) {
  const char* text = std::getenv(name);
  return text == nullptr || *text == '\0' ? fallback : std::strtol(text, nullptr, 10);
}
inline std::string write_file(const std::string& name, const std::string& text) {
  std::ofstream(name, std::ios::binary) << text;
  return name;
}
inline std::string read_file(const std::string& name) {
  std::ifstream in(name, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}
inline std::string plus(DWORD pid, const std::string& id) {
  return "+ pid=" + std::to_string(pid) + " channel=alerts id=" + id;
}

// A peer process driven through its standard streams: commands go to its
// input, and what it prints goes to the file <name>.out, read as it grows.
class host_process {
 public:
  // Starts `image` with `--config <config> --log <name>.log --stdin` and
  // waits for its "ready" line.
  //
  // Under Wine a process start now and then never reaches the program's
  // first line (about once in a thousand starts, loaded machine or not): no
  // output, no log, the process still running. Such a start is ended and
  // made once more, and said on standard error; a program that printed
  // anything is never started again, so its own failures stay visible.
  host_process(const std::string& image, const std::string& config, const std::string& name) : out_(name + ".out") {
    std::string command = "\"" + image + "\" --config \"" + config + "\" --log \"" + name + ".log\" --stdin";
    for (int attempt = 0; attempt < 2; ++attempt) {
      if (attempt > 0) {
        std::fprintf(stderr, "host_process: %s: nothing printed in 20 s; starting it again\n", image.c_str());
        end_process();
      }
      start(image, command);
      ready_ = !wait_line("ready ", 20s).empty();
      if (ready_ || output() != "\n") break;
    }
  }
  host_process(const host_process&) = delete;
  host_process& operator=(const host_process&) = delete;
  ~host_process() {
    send("quit");
    ::WaitForSingleObject(process_, 5000);
    end_process();
  }

  bool ready() const { return ready_; }
  DWORD pid() const { return pid_; }

  void send(const std::string& command) {
    const std::string line = command + "\n";
    DWORD written = 0;
    ::WriteFile(input_, line.data(), static_cast<DWORD>(line.size()), &written, nullptr);
  }

  // Ends the process the hard way, as a crash would; returns the moment its
  // handle was seen signalled.
  clock::time_point kill() {
    ::TerminateProcess(process_, 9);
    ::WaitForSingleObject(process_, 10000);
    return clock::now();
  }

  // Waits for a whole line that begins with `start` and returns it; empty
  // when none came in time.
  std::string wait_line(const std::string& start, std::chrono::milliseconds timeout = patience) const {
    std::string line;
    test_support::wait_until([&] {
      const std::string text = output();
      const std::size_t at = text.find("\n" + start);
      const std::size_t end = at == std::string::npos ? at : text.find('\n', at + 1);
      if (end != std::string::npos) line = text.substr(at + 1, end - at - 1);
      return end != std::string::npos;
    }, timeout);
    return line;
  }
  ::testing::AssertionResult wait_for(const std::string& exact, std::chrono::milliseconds timeout = patience) const {
    if (wait_line(exact + "\n", timeout) == exact) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "waited " << timeout.count() << " ms" << " for the line \"" << exact
                                         << "\" from " << out_ << "; it printed instead:" << output();
  }
  // Everything printed so far, each line after a newline.
  std::string output() const {
    std::string text = "\n" + read_file(out_);
    text.erase(std::remove(text.begin(), text.end(), '\r'), text.end());
    return text;
  }

 private:
  void start(const std::string& image, std::string& command) {
    SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
    HANDLE child_in = nullptr;
    ::CreatePipe(&child_in, &input_, &inherit, 0);
    ::SetHandleInformation(input_, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOA startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = child_in;
    startup.hStdOutput = startup.hStdError =
        ::CreateFileA(out_.c_str(), GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, &inherit,
                      CREATE_ALWAYS, FILE_ATTRIBUTE_NORMAL, /* template_file */ nullptr);
    PROCESS_INFORMATION info{};
    ::CreateProcessA(image.c_str(), command.data(), nullptr, nullptr, /* inherit_handles */ TRUE, /* flags */ 0,
                     nullptr, nullptr, &startup, &info);
    process_ = info.hProcess;
    pid_ = info.dwProcessId;
    for (HANDLE handle : {info.hThread, child_in, startup.hStdOutput}) ::CloseHandle(handle);
  }
  // Ends the process if it still runs and lets go of it.
  void end_process() {
    ::TerminateProcess(process_, 1);
    ::WaitForSingleObject(process_, 10000);
    if (input_ != nullptr) ::CloseHandle(input_);
    if (process_ != nullptr) ::CloseHandle(process_);
    input_ = process_ = nullptr;
  }

  const std::string out_;
  HANDLE input_ = nullptr;
  HANDLE process_ = nullptr;
  DWORD pid_ = 0;
  bool ready_ = false;
};

// Wine 8 leaves PrivateUsage at 0 and fills PagefileUsage with the process's
// anonymous resident memory.
inline long long private_bytes() {
  PROCESS_MEMORY_COUNTERS_EX counters{};
  ::GetProcessMemoryInfo(::GetCurrentProcess(), reinterpret_cast<PROCESS_MEMORY_COUNTERS*>(&counters),
                         sizeof(counters));
  return static_cast<long long>(counters.PrivateUsage != 0 ? counters.PrivateUsage : counters.PagefileUsage);
}

// The bytes of every block in use in every heap of this process. Unlike the
// resident memory, freed blocks that a heap keeps for later do not count, so
// what a burst of large messages leaves behind reads the same from run to run.
inline long long heap_bytes_in_use() {
  std::vector<HANDLE> heaps(64);
  DWORD count = ::GetProcessHeaps(static_cast<DWORD>(heaps.size()), heaps.data());
  if (count > heaps.size()) {
    heaps.resize(count + 16);
    count = ::GetProcessHeaps(static_cast<DWORD>(heaps.size()), heaps.data());
  }
  heaps.resize(std::min<std::size_t>(count, heaps.size()));
  long long total = 0;
  for (HANDLE heap : heaps) {
    if (!::HeapLock(heap)) continue;
    PROCESS_HEAP_ENTRY entry{};
    while (::HeapWalk(heap, &entry)) {
      if ((entry.wFlags & PROCESS_HEAP_ENTRY_BUSY) != 0) total += entry.cbData;
    }
    ::HeapUnlock(heap);
  }
  return total;
}

// A vorbel_host configuration of bus "main" and its channel "alerts",
// imported over each pipe of `imports` (admitting a server at
// `import_level`) and exported on each (pipe, level).
inline std::string host_config(const std::vector<std::string>& imports, const pipes& exports = {},
                               std::uint32_t import_level = 0) {
  auto add = [](std::string& list, std::string pipe, const std::string& rest) {
    for (std::size_t at = 0; (at = pipe.find('\\', at)) != std::string::npos; at += 2) pipe.insert(at, "\\");
    list += (list.empty() ? "{\"channel\": \"alerts\", \"pipe\": \"" : ", {\"channel\": \"alerts\", \"pipe\": \"") +
            pipe + "\", " + rest + "}";
  };
  std::string in, out;
  for (const auto& pipe : imports) {
    add(in, pipe, "\"remote_channel\": \"alerts\", \"remote_bus\": \"main\", \"security\": " +
                      std::to_string(import_level));
  }
  for (const auto& [pipe, level] : exports) add(out, pipe, "\"security\": " + std::to_string(level));
  return "{\"bus\": \"main\", \"local_channels\": [\"alerts\"], \"imported_channels\": [" + in +
         "], \"exported_channels\": [" + out + "]}";
}

// Starts the image host_a (signed like this program), host_b (another
// signer), host_unsigned or host_tampered as peer `name` (its log: name.log).
inline std::unique_ptr<host_process> start_host(const std::string& image, const std::string& name,
                                                const std::string& config) {
  return std::make_unique<host_process>("..\\e2e_hosts\\" + image + ".exe", write_file(name + ".json", config), name);
}

// A peer's table, read with its "list" command ("list: N", then one
// "  pid=P channel=alerts id=I" line per listener) fenced by an echo marker.
inline bool peer_table(host_process& peer, table& out) {
  static int next = 0;
  const std::string marker = "table-end-" + std::to_string(++next);
  peer.send("list");
  peer.send("echo " + marker);
  if (!peer.wait_for(marker)) return false;
  std::istringstream lines(peer.output());
  for (std::string line; std::getline(lines, line) && line != marker;) {
    unsigned pid = 0;
    char id[256];
    if (line.rfind("list: ", 0) == 0) out.clear();
    if (std::sscanf(line.c_str(), "  pid=%u channel=alerts id=%255s", &pid, id) == 2) out[pid].insert(id);
  }
  return true;
}

// A bus observer that keeps the table its notifications describe. They come
// on the bus's notifier thread; test threads read and wait.
class table_observer final : public ibus_observer {
 public:
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_ibus_observer) ? static_cast<ibus_observer*>(this) : nullptr;
  }
  void on_new_listener(std::uint32_t pid, const char*, const char* id) override {
    std::lock_guard<srw_mutex> lock(mutex_);
    table_[pid].insert(id);
  }
  void on_listener_removed(std::uint32_t pid, const char*, const char* id) override {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (table_[pid].count(id) != 0) table_[pid].erase(table_[pid].find(id));
    if (table_[pid].empty()) table_.erase(pid);
  }

  table current() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return table_;
  }

  // Polls rather than being woken by every notification: a waiter woken
  // 100,000 times would fight the notifier thread for the lock.
  // A failure says what was waited for and the table seen at the end.
  ::testing::AssertionResult wait(const std::function<bool(const table&)>& condition,
                                  std::chrono::milliseconds timeout = patience,
                                  const std::string& what = "the table to meet the test's condition") {
    if (test_support::wait_until([&] {
          std::lock_guard<srw_mutex> lock(mutex_);
          return condition(table_);
        }, timeout)) {
      return ::testing::AssertionSuccess();
    }
    return ::testing::AssertionFailure() << "waited " << timeout.count() << " ms" << " for " << what
                                         << "; the observed table was " << ::testing::PrintToString(current());
  }
  ::testing::AssertionResult wait_has(std::uint32_t pid, const std::string& id, bool present = true,
                                      std::chrono::milliseconds timeout = patience) {
    return wait([&](const table& t) { return (t.count(pid) != 0 && t.at(pid).count(id) != 0) == present; }, timeout,
                "pid " + std::to_string(pid) + (present ? " to list " : " to no longer list ") + id);
  }
  ::testing::AssertionResult wait_gone(std::uint32_t pid, std::chrono::milliseconds timeout = patience) {
    return wait([&](const table& t) { return t.count(pid) == 0; }, timeout,
                "every listener of pid " + std::to_string(pid) + " to be gone");
  }

 private:
  srw_mutex mutex_;
  table table_;
};

// This process as a peer: bus "main" with channel "alerts" exported on each
// (pipe, level), imported over each pipe of `imports` (admitting a server at
// `import_level`), and its listener `listener`; with `protected_image_paths`
// it admits only peers whose image path their user cannot change.
class this_process {
 public:
  this_process(const pipes& exports, const std::vector<std::string>& imports, const char* listener,
               std::uint32_t import_level = 0, bool protected_image_paths = false) {
    provider_.local = {"alerts"};
    provider_.protected_image_paths = protected_image_paths;
    for (const auto& [pipe, level] : exports) provider_.exports.push_back({"alerts", pipe, true, 3, level});
    for (const auto& pipe : imports) provider_.imports.push_back({"alerts", pipe, "alerts", "main", import_level});
    bus_ = registry_.create_bus("main", &provider_);
    registered_ = bus_ && bus_->add_observer(&observer, 0) && bus_->register_listener("alerts", listener) == 0;
  }
  ~this_process() {
    if (bus_ == nullptr) return;
    bus_->remove_observer(&observer, 0);
    registry_.destroy_bus("main");
  }

  bool up() { return registered_ && registry_.get_gateway("main") != nullptr; }
  ibus& bus() { return *bus_; }
  gateway_observer& events() { return static_cast<gateway*>(registry_.get_gateway("main"))->events(); }
  // The gateway's public face, as a host reaches it.
  igateway& gateway_face() { return *registry_.get_gateway("main"); }
  std::size_t connection_count() {
    std::size_t count = 0;
    events().run_on_worker([&](connections_cache& cache) { count = cache.size(); });
    return count;
  }

  table_observer observer;

 private:
  vorbel_impl registry_;
  test_support::config_provider provider_;
  ibus* bus_ = nullptr;
  bool registered_ = false;
};

}  // namespace e2e
