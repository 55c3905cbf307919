// Shared by the fault tests: this test program is the serving process (its
// registry, one bus "main" exporting "alerts" on pipes), and its peers are
// vorbel_host processes signed in several ways and the hand-written
// hostile_peer. Everything here waits with a bound.
#pragma once

#include <windows.h>

#include <psapi.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdint>
#include <cstdlib>
#include <cwchar>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "e2e/host_process.h"
#include "gateway/gateway.h"
#include "platform/srw_sync.h"
#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace faults {

using namespace std::chrono_literals;
using clock = std::chrono::steady_clock;
using e2e::host_process;

// pid -> the (channel, id) pairs of that process, duplicates kept.
using table = std::map<std::uint32_t, std::multiset<std::pair<std::string, std::string>>>;

inline std::string show(const table& t) {
  std::ostringstream out;
  for (const auto& [pid, items] : t) {
    out << "pid " << pid << ":";
    for (const auto& [channel, id] : items) out << " " << channel << "/" << id;
    out << "\n";
  }
  return out.str();
}

// A whole number from the environment, or `fallback`: the long variants of
// the tests are run by hand with a larger figure.
inline long env_number(const char* name, long fallback) {
  const char* text = std::getenv(name);
  if (text == nullptr || *text == '\0') return fallback;
  return std::strtol(text, nullptr, 10);
}

inline std::string escape_json(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '\\' || c == '"') out += '\\';
    out += c;
  }
  return out;
}

// A vorbel_host configuration that imports "alerts" of bus "main" over `pipe`.
inline std::string importing(const std::string& pipe) {
  return "{\"bus\": \"main\", \"local_channels\": [\"alerts\"], \"imported_channels\": "
         "[{\"channel\": \"alerts\", \"pipe\": \"" + escape_json(pipe) +
         "\", \"remote_channel\": \"alerts\", \"remote_bus\": \"main\"}]}";
}

// Starts a vorbel_host image (host_a, host_b, ...) as peer `name`.
inline std::unique_ptr<host_process> start_host(const wchar_t* image, const std::wstring& name,
                                                const std::string& config_json) {
  const std::wstring config = e2e::write_file(name + L".json", config_json);
  const std::wstring log = e2e::program_dir() + name + L".log";
  ::DeleteFileW(log.c_str());
  return std::make_unique<host_process>(e2e::host_image(image), config, log);
}

// Reads a peer's table with its "list" command: "list: N" and one
// "  pid=P channel=C id=I" line per listener, fenced by an echo marker.
inline bool peer_table(host_process& peer, table& out, std::chrono::milliseconds timeout = 10s) {
  static std::atomic<int> next{0};
  const std::string marker = "table-end-" + std::to_string(++next);
  peer.send("list");
  peer.send("echo " + marker);
  if (!peer.wait_for(marker, timeout)) return false;
  std::istringstream lines(peer.output());
  std::vector<std::string> block;
  for (std::string line; std::getline(lines, line);) {
    if (line == marker) break;
    if (line.rfind("list: ", 0) == 0) block.clear();
    block.push_back(line);
  }
  out.clear();
  for (const std::string& line : block) {
    const std::size_t channel_at = line.find(" channel=");
    const std::size_t id_at = line.find(" id=", channel_at == std::string::npos ? 0 : channel_at);
    if (line.rfind("  pid=", 0) != 0 || channel_at == std::string::npos || id_at == std::string::npos) continue;
    const auto pid = static_cast<std::uint32_t>(std::stoul(line.substr(6, channel_at - 6)));
    out[pid].emplace(line.substr(channel_at + 9, id_at - channel_at - 9), line.substr(id_at + 4));
  }
  return true;
}

// A bus observer that keeps the table its notifications describe and the
// time of each one. Notifications arrive on the bus's notifier thread; the
// test thread reads and waits.
class table_observer final : public ibus_observer {
 public:
  struct event {
    bool added;
    std::uint32_t pid;
    std::string channel;
    std::string id;
    clock::time_point at;
  };

  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_ibus_observer) ? static_cast<ibus_observer*>(this) : nullptr;
  }
  void on_new_listener(std::uint32_t pid, const char* channel, const char* id) override {
    record(true, pid, channel, id);
  }
  void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) override {
    record(false, pid, channel, id);
  }

  table current() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return table_;
  }
  std::multiset<std::pair<std::string, std::string>> of(std::uint32_t pid) {
    std::lock_guard<srw_mutex> lock(mutex_);
    auto found = table_.find(pid);
    return found == table_.end() ? std::multiset<std::pair<std::string, std::string>>() : found->second;
  }
  std::vector<event> events() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return events_;
  }
  std::size_t total_events() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return total_;
  }
  // Forgets the event history (the table stays), so a long run keeps no
  // growing record in the process it measures.
  void forget_events() {
    std::lock_guard<srw_mutex> lock(mutex_);
    events_.clear();
    events_.shrink_to_fit();
  }
  void keep_events(bool keep) {
    std::lock_guard<srw_mutex> lock(mutex_);
    keep_ = keep;
  }

  // Waits until `condition` holds on the table. Polls rather than being
  // woken by every notification: a waiter woken 100,000 times would fight
  // the notifier thread for the mutex and slow down what it measures.
  template <typename Condition>
  bool wait(Condition condition, std::chrono::milliseconds timeout = 10s) {
    return test_support::wait_until([&] {
      std::lock_guard<srw_mutex> lock(mutex_);
      return condition(table_);
    }, timeout);
  }
  bool wait_has(std::uint32_t pid, const std::string& channel, const std::string& id,
                std::chrono::milliseconds timeout = 10s) {
    return wait([&](const table& t) {
      auto found = t.find(pid);
      return found != t.end() && found->second.count({channel, id}) != 0;
    }, timeout);
  }
  bool wait_gone(std::uint32_t pid, std::chrono::milliseconds timeout = 10s) {
    return wait([&](const table& t) { return t.count(pid) == 0; }, timeout);
  }

 private:
  void record(bool added, std::uint32_t pid, const char* channel, const char* id) {
    const clock::time_point now = clock::now();
    std::lock_guard<srw_mutex> lock(mutex_);
    auto& items = table_[pid];
    if (added) {
      items.emplace(channel, id);
    } else {
      auto found = items.find({channel, id});
      if (found != items.end()) items.erase(found);
      if (items.empty()) table_.erase(pid);
    }
    ++total_;
    if (keep_) events_.push_back(event{added, pid, channel, id, now});
  }

  srw_mutex mutex_;
  table table_;
  std::vector<event> events_;
  std::size_t total_ = 0;
  bool keep_ = true;
};

// This process as a serving process: bus "main" with channel "alerts"
// exported on `pipes` (name, security level).
class serving_process {
 public:
  explicit serving_process(const std::vector<std::pair<std::string, std::uint32_t>>& pipes) {
    provider_.local = {"alerts"};
    for (const auto& [pipe, level] : pipes) provider_.exports.push_back({"alerts", pipe, true, 3, level});
    bus_ = registry_.create_bus("main", &provider_);
    if (bus_ != nullptr && registry_.get_gateway("main") != nullptr) {
      bus_->add_observer(&observer, 0);
    }
  }
  serving_process(const serving_process&) = delete;
  serving_process& operator=(const serving_process&) = delete;
  ~serving_process() {
    if (bus_ != nullptr) {
      bus_->remove_observer(&observer, 0);
      registry_.destroy_bus("main");
    }
  }

  bool up() { return bus_ != nullptr && registry_.get_gateway("main") != nullptr; }
  ibus& bus() { return *bus_; }
  gateway_observer& events() { return static_cast<gateway*>(registry_.get_gateway("main"))->events(); }
  std::uint32_t pid() const { return ::GetCurrentProcessId(); }

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
};

// Handle count and private bytes of this process.
struct process_metrics {
  DWORD handles = 0;
  std::uint64_t private_bytes = 0;
};

// This process's handles as listed in the system's handle table
// (NtQuerySystemInformation, SystemHandleInformation): value -> object type.
inline std::map<USHORT, std::wstring> own_handles() {
  struct entry {
    USHORT pid;
    USHORT creator_back_trace;
    UCHAR object_type;
    UCHAR attributes;
    USHORT handle;
    PVOID object;
    ULONG granted_access;
  };
  struct handle_table {
    ULONG count;
    entry entries[1];
  };
  using query_fn = LONG(WINAPI*)(int, void*, ULONG, ULONG*);
  const auto query = reinterpret_cast<query_fn>(
      reinterpret_cast<void*>(::GetProcAddress(::GetModuleHandleW(L"ntdll.dll"), "NtQuerySystemInformation")));
  std::map<USHORT, std::wstring> handles;
  if (query == nullptr) return handles;
  constexpr int system_handle_information = 16;
  constexpr LONG info_length_mismatch = static_cast<LONG>(0xC0000004);
  std::vector<unsigned char> buffer(1 << 20);
  ULONG needed = 0;
  LONG status = 0;
  while ((status = query(system_handle_information, buffer.data(), static_cast<ULONG>(buffer.size()),
                         &needed)) == info_length_mismatch &&
         buffer.size() < (256u << 20)) {
    buffer.resize(buffer.size() * 2);
  }
  if (status != 0) return handles;
  using object_fn = LONG(WINAPI*)(HANDLE, int, void*, ULONG, ULONG*);
  const auto query_object = reinterpret_cast<object_fn>(
      reinterpret_cast<void*>(::GetProcAddress(::GetModuleHandleW(L"ntdll.dll"), "NtQueryObject")));
  const auto* table = reinterpret_cast<const handle_table*>(buffer.data());
  const auto own = static_cast<USHORT>(::GetCurrentProcessId());
  for (ULONG i = 0; i < table->count; ++i) {
    if (table->entries[i].pid != own) continue;
    std::wstring type = L"type " + std::to_wstring(table->entries[i].object_type);
    // ObjectTypeInformation starts with the type's name as a UNICODE_STRING.
    alignas(8) unsigned char info[1024];
    struct counted { USHORT length; USHORT capacity; const wchar_t* text; };
    const HANDLE handle = reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(table->entries[i].handle));
    if (query_object != nullptr && query_object(handle, 2, info, sizeof(info), nullptr) == 0) {
      const auto* name = reinterpret_cast<const counted*>(info);
      if (name->text != nullptr) type.assign(name->text, name->length / sizeof(wchar_t));
    }
    handles[table->entries[i].handle] = type;
  }
  return handles;
}

// What a handle of this process is, for a leak report: a thread's id, start
// address (module + offset, for addr2line) and whether it has ended; a
// file's name. Events are left unprobed: a wait would reset an auto-reset one.
inline std::string describe_handle(USHORT value, const std::wstring& type) {
  const HANDLE handle = reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(value));
  char text[512] = "";
  if (type == L"Thread") {
    using info_fn = LONG(WINAPI*)(HANDLE, int, void*, ULONG, ULONG*);
    const auto query = reinterpret_cast<info_fn>(
        reinterpret_cast<void*>(::GetProcAddress(::GetModuleHandleW(L"ntdll.dll"), "NtQueryInformationThread")));
    void* start = nullptr;
    constexpr int thread_query_set_win32_start_address = 9;
    if (query != nullptr) query(handle, thread_query_set_win32_start_address, &start, sizeof(start), nullptr);
    HMODULE module = nullptr;
    wchar_t path[MAX_PATH] = L"";
    ::GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS | GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                         static_cast<LPCWSTR>(start), &module);
    if (module != nullptr) ::GetModuleFileNameW(module, path, MAX_PATH);
    const wchar_t* base = std::wcsrchr(path, L'\\');
    std::snprintf(text, sizeof(text), " (id %lu, start %ls+0x%llx, %s)", ::GetThreadId(handle),
                  base != nullptr ? base + 1 : path,
                  static_cast<unsigned long long>(static_cast<char*>(start) - reinterpret_cast<char*>(module)),
                  ::WaitForSingleObject(handle, 0) == WAIT_OBJECT_0 ? "ended" : "running");
  } else if (type == L"File") {
    alignas(8) unsigned char info[sizeof(FILE_NAME_INFO) + MAX_PATH * sizeof(wchar_t)]{};
    if (::GetFileInformationByHandleEx(handle, FileNameInfo, info, sizeof(info))) {
      const auto* name = reinterpret_cast<const FILE_NAME_INFO*>(info);
      std::snprintf(text, sizeof(text), " (%.*ls)", static_cast<int>(name->FileNameLength / sizeof(wchar_t)),
                    name->FileName);
    }
  }
  return text;
}

// What `after` holds that `before` did not, e.g. "0x1a4 Event".
inline std::string new_handles(const std::map<USHORT, std::wstring>& before,
                               const std::map<USHORT, std::wstring>& after) {
  std::string out;
  for (const auto& [value, type] : after) {
    auto found = before.find(value);
    if (found != before.end() && found->second == type) continue;
    char hex[16];
    std::snprintf(hex, sizeof(hex), "0x%x ", value);
    out += hex + std::string(type.begin(), type.end()) + describe_handle(value, type) + "; ";
  }
  return out;
}

// Wine 8 answers GetProcessHandleCount with 0 and PrivateUsage with 0; it
// fills PagefileUsage with the process's anonymous resident memory, and its
// system handle table is right. Windows gives the first two.
inline process_metrics measure_self() {
  process_metrics m;
  ::GetProcessHandleCount(::GetCurrentProcess(), &m.handles);
  if (m.handles == 0) m.handles = static_cast<DWORD>(own_handles().size());
  PROCESS_MEMORY_COUNTERS_EX counters{};
  counters.cb = sizeof(counters);
  if (::GetProcessMemoryInfo(::GetCurrentProcess(), reinterpret_cast<PROCESS_MEMORY_COUNTERS*>(&counters),
                             sizeof(counters))) {
    m.private_bytes = counters.PrivateUsage != 0 ? counters.PrivateUsage : counters.PagefileUsage;
  }
  return m;
}

// The hand-written hostile peer, beside the other fault peers.
inline std::wstring hostile_image() { return e2e::program_dir() + L"..\\fault_peers\\hostile_peer.exe"; }

// A hostile_peer process aimed at `pipe`. run() sends one command and
// returns its result line ("sent ...", "connected ...", "failed ...").
class hostile {
 public:
  hostile(const std::wstring& name, const std::string& pipe)
      : process_(hostile_image(), e2e::write_file(name + L".pipe", pipe + "\n"),
                 e2e::program_dir() + name + L".log") {}

  bool ready() const { return process_.ready(); }
  DWORD pid() const { return process_.pid(); }
  host_process& process() { return process_; }

  std::string run(const std::string& command, std::chrono::milliseconds timeout = 60s) {
    const std::string marker = "@" + std::to_string(++sequence_);
    process_.send(command);
    process_.send("echo " + marker);
    if (!process_.wait_for(marker, timeout)) return "timed out: " + command;
    std::istringstream lines(process_.output());
    std::string result;
    for (std::string line; std::getline(lines, line);) {
      if (line == marker) break;
      if (line.rfind("sent ", 0) == 0 || line.rfind("failed ", 0) == 0 ||
          line.rfind("connected ", 0) == 0) {
        result = line;
      }
    }
    return result;
  }

  // How many lines of its output begin with `prefix`.
  std::size_t count(const std::string& prefix) {
    std::istringstream lines(process_.output());
    std::size_t n = 0;
    for (std::string line; std::getline(lines, line);) n += line.rfind(prefix, 0) == 0 ? 1 : 0;
    return n;
  }
  bool wait_count(const std::string& prefix, std::size_t n, std::chrono::milliseconds timeout = 10s) {
    return test_support::wait_until([&] { return count(prefix) >= n; }, timeout);
  }

 private:
  host_process process_;
  int sequence_ = 0;
};

// Ends `pid` the hard way and returns the moment its handle was signalled,
// as seen by a thread that was already waiting on it.
inline bool kill_and_time(DWORD pid, clock::time_point& exited) {
  HANDLE process = ::OpenProcess(SYNCHRONIZE | PROCESS_TERMINATE, /* inherit */ FALSE, pid);
  if (process == nullptr) return false;
  srw_mutex mutex;
  srw_condition_variable waiting_cv;
  bool waiting = false;
  bool signalled = false;
  std::thread watcher([&] {
    {
      std::lock_guard<srw_mutex> lock(mutex);
      waiting = true;
    }
    waiting_cv.notify_one();
    signalled = ::WaitForSingleObject(process, 10000) == WAIT_OBJECT_0;
    exited = clock::now();
  });
  {
    std::unique_lock<srw_mutex> lock(mutex);
    waiting_cv.wait(lock, [&] { return waiting; });
  }
  ::TerminateProcess(process, 9);
  watcher.join();
  ::CloseHandle(process);
  return signalled;
}

}  // namespace faults
