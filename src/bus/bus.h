// The bus behind every bus name of the registry.
//
// Owns its messaging-library bus (and the library), its service channel, its
// notifier thread, its publisher thread and the listener table of this
// process and of every connected process. Created and destroyed by the
// registry under its mutex. Host threads call the ibus operations; the
// messaging library's delivery threads call the service-channel face; the
// gateway's notification thread calls the igateway_observer face. `mutex_`
// guards the table and the record of connected and departed processes;
// notifications never run under it: they are posted to `notifier_` and run
// there one at a time. A change of this process's table, a peer's request and
// a connection only mark the table changed; `publisher_` encodes it (under
// `mutex_`) and posts it (outside) on its own thread, paced.
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/igateway.h>

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "bus/comm/service_channel.h"
#include "bus/listener.h"
#include "bus/notifications.h"
#include "bus/publisher.h"
#include "platform/handles.h"
#include "platform/observable.h"
#include "platform/srw_sync.h"
#include "platform/task_pool.h"

namespace parlo {
class bus;
}

class bus final : public qm::observable<ibus_observer_base*, ibus>,
                  public comm::iservice_channel_observer,
                  public igateway_observer {
 public:
  // Loads parlo.dll from this component's folder and creates the library's
  // bus for `name`. Throws std::system_error when it cannot.
  explicit bus(const char* name);
  bus(const bus&) = delete;
  bus& operator=(const bus&) = delete;
  ~bus() override;

  // IQmBaseInterface, for both the ibus and the igateway_observer faces.
  void* GetInterface(GUID iid) override;

  // ibus
  void* get_messaging_bus() override;
  std::uint32_t register_listener(const char* channel, const char* id) override;
  std::uint32_t unregister_listener(const char* channel, const char* id) override;
  bool is_registered_listener(const char* channel, const char* id) override;

  // comm::iservice_channel_observer
  std::uint32_t on_listeners_requested() override;
  void on_remote_listeners(const std::uint32_t& pid, listener_list listeners, std::uint32_t origin) override;

  // igateway_observer
  void on_listen(const char* name) override;
  void on_local_connect(const char* name, std::uint32_t pid) override;
  void on_local_disconnect(const char* name, std::uint32_t pid) override;
  void on_local_start_communication(const char* name, std::uint32_t pid) override;
  void on_local_error(const char* name, std::uint32_t pid, std::uint32_t err) override;
  void on_remote_connect(const char* name, std::uint32_t pid) override;
  void on_remote_disconnect(const char* name, std::uint32_t pid) override;
  void on_remote_start_communication(const char* name, std::uint32_t pid) override;
  void on_remote_error(const char* name, std::uint32_t pid, std::uint32_t err) override;

  // Creates the service channel and starts receiving on it (a failure is
  // logged and leaves the bus without one).
  void subscribe();
  // Ends the subscription and destroys the service channel.
  void unsubscribe();
  // Null before subscribe, after unsubscribe, or when its creation failed.
  comm::service_channel* get_service_channel() const { return service_channel_.get(); }

  std::uint32_t pid() const { return pid_; }

  // True once every change of this process's table so far has been
  // published (for tests and benchmarks, which wait for the publisher).
  bool wait_published(std::chrono::milliseconds timeout) { return publisher_.wait_idle(timeout); }

 private:
  struct library_record {
    winapi::unique_module module;
    parlo::bus* (*create_bus)(const char*);
    void (*destroy_bus)(parlo::bus*);
  };
  struct messaging_bus_deleter {
    void (*destroy_bus)(parlo::bus*);
    void operator()(parlo::bus* b) const { destroy_bus(b); }
  };

  struct own_change {
    bool added;
    listener item;
  };
  // Makes room for one more change, so that logging it cannot throw.
  void reserve_change_locked();
  // Appends a change for the publisher, or cancels the one before it (the
  // same listener added, then removed); room was reserved.
  void log_change_locked(own_change change) noexcept;
  // Nothing will publish this bus's table: changes are no longer kept.
  void stop_keeping_changes();
  // Takes the changes under `mutex_`, applies them to `published_`, encodes
  // and posts it; runs on the publisher's thread.
  publisher::outcome send_table();
  void on_connect(std::uint32_t pid);
  // A connection to process `pid` ended; its listeners go with its last one.
  void drop_process(std::uint32_t pid);
  // Notes that process `pid` has no connection left that this bus heard of.
  void mark_departed_locked(std::uint32_t pid);

  // Declaration order is teardown order in reverse: the library outlives the
  // messaging bus, which outlives the notifier and the table. The destructor
  // stops the notifier before any of them goes.
  std::unique_ptr<library_record> library_;
  std::unique_ptr<parlo::bus, messaging_bus_deleter> messaging_bus_;
  std::uint32_t pid_;
  std::unique_ptr<comm::service_channel> service_channel_;
  bus_observer_list* observer_list_;
  task_pool<0> notifier_;
  // This process's listeners with their counts, found by hash so that a
  // registration costs the same however large the table; an upper bound of
  // their encoded size and their number (a registration that would take the
  // message beyond what the messaging library carries, or the table beyond
  // what peers take from one process, is refused); and the changes the
  // publisher has not taken yet, in order. A removal right after the same
  // listener's addition cancels it in place, so a host that registers and
  // removes a listener again and again leaves no trail.
  std::unordered_map<listener, std::size_t, listener_hash> own_;
  std::uint64_t own_bytes_ = comm::listeners_fixed_bound;
  std::size_t own_count_ = 0;
  std::vector<own_change> own_changes_;
  // False once it is clear that nothing will take the changes (no service
  // channel, or unsubscribed): they are then not kept.
  bool keeps_changes_ = true;
  // Other processes' listeners, as they published them.
  std::map<std::uint32_t, listener_list> listeners_;
  // Connections per remote process, as the gateway's events told them.
  std::map<std::uint32_t, std::uint32_t> connections_;
  // Processes whose last connection ended, most recent last: a list of
  // theirs still on its way (it travels on the messaging library's delivery
  // thread, the disconnect on the gateway's) must not bring their listeners
  // back. A process leaves the set when it connects again.
  std::set<std::uint32_t> departed_;
  std::deque<std::uint32_t> departed_order_;
  srw_mutex mutex_;
  // Used on the publisher's thread only: this process's table in listener
  // order as last taken (own_changes_ applied), and its encoder.
  listener_set published_;
  std::vector<own_change> taken_changes_;
  comm::listeners_encoder encoder_;
  // Last: stopped first, before anything `send_table` touches goes.
  publisher publisher_;
};
