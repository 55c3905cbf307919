// The library's gateway: the channels a bus exports and imports over named
// pipes, the taps that send local posts out, and the pipe servers and
// clients that run between start and stop.
#pragma once

#include <windows.h>

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "connection.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "parlo_api.h"
#include "pipe_config.h"
#include "pipe_support.h"
#include "platform/handles.h"
#include "platform/srw_sync.h"

namespace parlo::ipc::impl {

class pipe_client;
class pipe_server;

// Created by create_gateway, freed by destroy_gateway. The event sink and the
// bus are the caller's and outlive it. Threads: the four slots on the
// caller's threads, serialised by a control mutex; the tap callback on the
// bus's delivery thread; the event raisers on the listener, connection and
// client threads, which stop() joins.
class gateway_impl final : public parlo::ipc::gateway {
 public:
  gateway_impl(parlo::bus* bus, gateway::events* sink);
  gateway_impl(const gateway_impl&) = delete;
  gateway_impl& operator=(const gateway_impl&) = delete;
  ~gateway_impl();

  // Binds parlo.dll's extension and prepares the stop event. 0 or a code.
  std::uint32_t init();

  std::uint32_t start() override;
  std::uint32_t stop() override;
  std::uint32_t export_channel(const char* channel, const char* pipe,
                               std::uint32_t link_type) override;
  std::uint32_t import_channel(const char* channel, const char* pipe, const char* bus_name,
                               const char* remote_channel, std::uint32_t link_type) override;

  // What the servers, clients and connections use.
  parlo::bus* bus() const { return bus_; }
  const parlo_api& api() const { return api_; }
  // Manual-reset; set from stop() until the threads are joined.
  HANDLE stop_event() const { return stop_event_.get(); }
  bool stopping() const;
  // Waits on the stop event up to `ms`; true when it is set.
  bool wait_stop(DWORD ms) const;
  // The initial security of the pipes served.
  SECURITY_ATTRIBUTES* pipe_security() { return &security_attributes_; }

  // Events to the sink. An exception from the sink is logged and swallowed;
  // from a connect event it counts as a refusal.
  void raise_listen(HANDLE pipe, const char* name);
  bool raise_local_connect(HANDLE pipe, std::uint32_t pid);
  void raise_local_disconnect(HANDLE pipe);
  void raise_local_start_communication(HANDLE pipe);
  void raise_local_error(HANDLE pipe, std::uint32_t err);
  bool raise_remote_connect(HANDLE pipe, std::uint32_t pid);
  void raise_remote_disconnect(HANDLE pipe);
  void raise_remote_start_communication(HANDLE pipe);
  void raise_remote_error(HANDLE pipe, std::uint32_t err);

  // Marks the calling thread as one of this gateway's for its lifetime, so
  // that start and stop from inside an event are refused rather than
  // joining the calling thread itself.
  class thread_scope {
   public:
    explicit thread_scope(const gateway_impl& gateway);
    thread_scope(const thread_scope&) = delete;
    thread_scope& operator=(const thread_scope&) = delete;
    ~thread_scope();

   private:
    const void* previous_;
  };
  bool on_own_thread() const;

 private:
  // Where local posts of one channel go.
  struct route {
    std::vector<pipe_server*> servers;
    std::vector<std::pair<pipe_client*, std::string>> clients;  // with the remote name
  };

  static void tap_callback(const char* channel, const void* bytes, std::uint64_t size,
                           void* context);
  void on_local_post(const char* channel, const void* bytes, std::uint64_t size);
  std::uint32_t start_locked();
  void stop_locked();

  parlo::bus* const bus_;
  gateway::events* const sink_;
  parlo_api api_;
  winapi::unique_handle stop_event_;
  unique_local security_descriptor_;
  SECURITY_ATTRIBUTES security_attributes_{};

  srw_mutex control_mutex_;  // start, stop, export, import
  bool running_ = false;
  // Keyed by pipe_key(path).
  std::map<std::wstring, exported_pipe> exports_;
  std::map<std::wstring, imported_pipe> imports_;

  // While running; fixed between start and stop, so the tap reads them
  // without a lock.
  std::vector<std::unique_ptr<pipe_server>> servers_;
  std::vector<std::unique_ptr<pipe_client>> clients_;
  std::map<std::string, route, std::less<>> routes_;
  std::vector<std::uint64_t> taps_;
};

}  // namespace parlo::ipc::impl
