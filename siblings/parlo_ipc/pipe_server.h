// The serving side of one exported pipe: the listening instances, the
// admission of each client through the event sink, and the connections of
// the admitted clients.
#pragma once

#include <windows.h>

#include <atomic>
#include <list>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "connection.h"
#include "pipe_config.h"
#include "platform/handles.h"
#include "platform/srw_sync.h"

namespace parlo::ipc::impl {

class gateway_impl;
class pipe_server;

// Most clients served at once on one pipe; further clients are disconnected
// at once (with a line) and retry later, so threads stay bounded.
inline constexpr std::size_t max_clients_per_pipe = 64;

// A client's connection. Shared like every connection (connection.h); the
// join filter is written on the connection's thread when the client's hello
// arrives and read by the tap.
class server_connection final : public connection {
 public:
  server_connection(gateway_impl& gateway, winapi::unique_handle pipe, pipe_server& server);

  // Whether frames of local channel `channel` go to this client: every
  // exported channel until its hello is in (nothing posted after the
  // admission is lost), afterwards the channels it joined.
  bool wants(const std::string& channel);

 protected:
  std::uint32_t on_hello(const frame::hello& hello) override;
  std::uint32_t on_message(const frame::message_view& message) override;

 private:
  pipe_server& server_;
  srw_mutex filter_mutex_;
  bool filtered_ = false;
  std::set<std::string> joined_;
};

// Owned by the gateway while it runs. Threads: the listener thread runs
// listen() and starts one thread per client connection (serve()), which
// raises the client's connect event: admissions of several clients run at
// once, so a slow one holds back no other. The gateway's control thread
// calls open(), start() and join(); the tap calls forward() on the bus's
// delivery thread.
class pipe_server {
 public:
  pipe_server(gateway_impl& gateway, const exported_pipe& config);
  pipe_server(const pipe_server&) = delete;
  pipe_server& operator=(const pipe_server&) = delete;
  ~pipe_server();

  const exported_pipe& config() const { return config_; }
  gateway_impl& gateway() const { return gateway_; }

  // Creates the pipe's first instance with FILE_FLAG_FIRST_PIPE_INSTANCE, so
  // that a process already owning the name is an error, not a silent
  // takeover. 0 or the Win32 code (with a line).
  DWORD open();
  // Starts the listener thread. Throws std::system_error.
  void start();
  // Waits for the listener thread, which first waits for the connection
  // threads; call after the gateway's stop event is set.
  void join();

  // Queues `frame` (of local channel `channel`) for every connection that
  // takes the channel.
  void forward(const std::string& channel, const frame_ptr& frame);

 private:
  struct worker {
    std::shared_ptr<server_connection> link;
    std::thread thread;
    std::atomic<bool> done{false};
  };

  DWORD create_instance(bool first, winapi::unique_handle& instance);
  void listen();
  void accept(winapi::unique_handle instance);
  void serve(worker& work);
  void unroute(const std::shared_ptr<server_connection>& link);
  // Joins the threads of ended connections; the number still running.
  std::size_t reap();

  gateway_impl& gateway_;
  const exported_pipe config_;
  frame_ptr hello_;
  winapi::unique_handle first_;  // until the listener takes it
  std::thread listener_;
  std::list<worker> workers_;  // listener thread only

  srw_mutex mutex_;  // guards routed_
  std::vector<std::shared_ptr<server_connection>> routed_;
};

}  // namespace parlo::ipc::impl
