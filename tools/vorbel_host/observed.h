// What the host learns from the component's notifications, and the two
// observers that feed it.
//
// observed_state is owned by main and outlives both observers' registration.
// The component's notifier threads (one per bus, one per gateway) call the
// observers, which record the change and print its line under one mutex, so
// the table, the printed lines and `list` always agree. The command thread
// reads the state and waits on it. Lock order: the state's mutex, then the
// console's. No lock of the host is held while calling into the component,
// so a notification can never wait for a call that waits for it.
#pragma once

#include "console.h"

#include <vorbel/ibus.h>
#include <vorbel/igateway.h>
#include <vorbel/igateway_admission.h>

#include <nlohmann/json.hpp>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

namespace vorbel_host {

struct connection {
  bool local = true;  // a pipe this process serves; false: one it opened
  std::string pipe;
  std::uint32_t pid = 0;
  bool operator<(const connection& other) const {
    return std::tie(local, pipe, pid) < std::tie(other.local, other.pipe, other.pid);
  }
};

// One admission decision, or an explanation, as the host prints it: the
// text "WORD [SIDE] ALLOW|DENY pid=... reason=..." and the JSON object of
// `event`. Strings of `a` are read during the call only.
std::string admission_text(const char* word, const gateway_admission& a);
nlohmann::ordered_json admission_object(const char* event, const gateway_admission& a);

class observed_state {
 public:
  explicit observed_state(console& out) : out_(out) {}
  observed_state(const observed_state&) = delete;
  observed_state& operator=(const observed_state&) = delete;

  // Notifier threads.
  void listener_added(std::uint32_t pid, const std::string& channel, const std::string& id);
  void listener_removed(std::uint32_t pid, const std::string& channel, const std::string& id);
  // `event` is "listen", "connect", "start", "disconnect" or "error".
  void gateway_event(const char* event, bool local, const std::string& pipe, std::uint32_t pid,
                     std::optional<std::uint32_t> err);
  void admission(const gateway_admission& a);

  // Command thread. Waits until some process (`pid`, or any when empty) has
  // the listener (`present`) or none has it (`!present`). Returns the pid
  // that matched when present, 0 when absent, nothing when the time is up.
  std::optional<std::uint32_t> wait_listener(const std::string& channel, const std::string& id,
                                             std::optional<std::uint32_t> pid, bool present,
                                             std::chrono::milliseconds timeout);
  // Prints the listener table (`list`) or the live connections.
  void print_listeners();
  void print_connections(bool has_gateway);

 private:
  using listener = std::pair<std::string, std::string>;  // channel, id

  std::optional<std::uint32_t> find_locked(const listener& wanted,
                                           std::optional<std::uint32_t> pid) const;

  console& out_;
  std::mutex mutex_;
  std::condition_variable changed_;
  // Equal listeners may be registered twice and are notified twice: a
  // multiset keeps the count the bus keeps.
  std::map<std::uint32_t, std::multiset<listener>> listeners_;
  std::multiset<connection> connections_;
};

// Observer of the bus; called on the bus's notifier thread.
class bus_watch final : public ibus_observer {
 public:
  explicit bus_watch(observed_state& state) : state_(state) {}
  void* GetInterface(GUID iid) override;
  void on_new_listener(std::uint32_t pid, const char* channel, const char* id) override;
  void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) override;

 private:
  observed_state& state_;
};

// Observer of the bus's gateway, of its connections and of its admission
// decisions; called on the gateway's notifier thread.
class gateway_watch final : public igateway_observer, public igateway_admission_observer {
 public:
  explicit gateway_watch(observed_state& state) : state_(state) {}
  void* GetInterface(GUID iid) override;
  void on_admission(const gateway_admission* admission) override;
  void on_listen(const char* name) override;
  void on_local_connect(const char* name, std::uint32_t pid) override;
  void on_local_disconnect(const char* name, std::uint32_t pid) override;
  void on_local_start_communication(const char* name, std::uint32_t pid) override;
  void on_local_error(const char* name, std::uint32_t pid, std::uint32_t err) override;
  void on_remote_connect(const char* name, std::uint32_t pid) override;
  void on_remote_disconnect(const char* name, std::uint32_t pid) override;
  void on_remote_start_communication(const char* name, std::uint32_t pid) override;
  void on_remote_error(const char* name, std::uint32_t pid, std::uint32_t err) override;

 private:
  observed_state& state_;
};

}  // namespace vorbel_host
