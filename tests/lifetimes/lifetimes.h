// Helpers of the lifetimes tests: an observer of buses and gateways that can
// hold one notification, and work on a thread of its own waited for with a
// bound.
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/igateway.h>

#include <windows.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform/handles.h"
#include "support/log_capture.h"

namespace lifetimes_test {

using namespace std::chrono_literals;

struct event {
  winapi::unique_handle handle{::CreateEventW(nullptr, /* manual_reset */ TRUE, FALSE, nullptr)};
  void set() { ::SetEvent(handle.get()); }
  bool wait(std::chrono::milliseconds bound = 30s) {
    return ::WaitForSingleObject(handle.get(), static_cast<DWORD>(bound.count())) == WAIT_OBJECT_0;
  }
};

// A client end of `pipe`, or null.
inline winapi::unique_handle open_client(const wchar_t* pipe) {
  HANDLE client = ::CreateFileW(pipe, GENERIC_READ | GENERIC_WRITE, /* share */ 0, nullptr, OPEN_EXISTING,
                                /* flags */ 0, /* template_file */ nullptr);
  return winapi::unique_handle(client == INVALID_HANDLE_VALUE ? nullptr : client);
}

// Armed, its next notification sets `entered`, waits for `released` and runs
// `inside`; later ones run `after`. Every call is counted, and gateway
// connects and disconnects are kept as "<event> <name> <pid>" (read them once
// the notifying thread is done).
class gate_observer final : public ibus_observer, public igateway_observer {
 public:
  std::function<void()> inside, after;
  event entered, released;
  std::atomic<bool> armed{false}, left{false};
  std::atomic<int> calls{0};
  std::vector<std::string> events;

  void* GetInterface(GUID iid) override {
    if (qm::same_iid(iid, IID_ibus_observer)) return static_cast<ibus_observer*>(this);
    if (qm::same_iid(iid, IID_igateway_observer)) return static_cast<igateway_observer*>(this);
    return nullptr;
  }
  ibus_observer_base* bus_face() { return static_cast<ibus_observer*>(this); }
  igateway_observer_base* gateway_face() { return static_cast<igateway_observer*>(this); }

  void on_new_listener(std::uint32_t, const char*, const char*) override { hit(); }
  void on_listener_removed(std::uint32_t, const char*, const char*) override { hit(); }
  void on_listen(const char*) override {}
  void on_local_connect(const char* name, std::uint32_t pid) override { hit("local_connect", name, pid); }
  void on_local_disconnect(const char* name, std::uint32_t pid) override { hit("local_disconnect", name, pid); }
  void on_local_start_communication(const char*, std::uint32_t) override {}
  void on_local_error(const char*, std::uint32_t, std::uint32_t) override {}
  void on_remote_connect(const char* name, std::uint32_t pid) override { hit("remote_connect", name, pid); }
  void on_remote_disconnect(const char* name, std::uint32_t pid) override { hit("remote_disconnect", name, pid); }
  void on_remote_start_communication(const char*, std::uint32_t) override {}
  void on_remote_error(const char*, std::uint32_t, std::uint32_t) override {}

 private:
  void hit(const char* what = nullptr, const char* name = "", std::uint32_t pid = 0) {
    if (what != nullptr) events.push_back(std::string(what) + " " + name + " " + std::to_string(pid));
    ++calls;
    if (!armed.exchange(false)) {
      if (after) after();
      return;
    }
    entered.set();
    released.wait(60s);
    if (inside) inside();
    left = true;
  }
};

// Runs `work` on a thread of its own. A thread still running at the bound of
// join_or_die is hung: the program says what it waited for and ends as failed,
// since the hung threads would hold it until CTest's timeout.
class bounded_thread {
 public:
  explicit bounded_thread(std::function<void()> work) : thread_([this, work] { work(), done_ = true; }) {}
  ~bounded_thread() {
    if (thread_.joinable()) thread_.join();
  }
  bool done() const { return done_; }
  void join_or_die(std::chrono::milliseconds bound, const std::string& what) {
    if (!test_support::wait_until([this] { return done_.load(); }, bound)) {
      std::fprintf(stderr, "[  FAILED  ] hung: %s did not end within %lld ms\n", what.c_str(),
                   static_cast<long long>(bound.count()));
      std::fflush(stderr);
      ::TerminateProcess(::GetCurrentProcess(), 3);
    }
    thread_.join();
  }

 private:
  std::atomic<bool> done_{false};
  std::thread thread_;
};

}  // namespace lifetimes_test
