// The client side of one imported pipe: connecting (and reconnecting) to the
// server, and the connection that joins the local channels with the
// server's.
#pragma once

#include <windows.h>

#include <memory>
#include <mutex>
#include <thread>

#include "connection.h"
#include "pipe_config.h"
#include "platform/handles.h"
#include "platform/srw_sync.h"

namespace parlo::ipc::impl {

class gateway_impl;
class pipe_client;

// The connection to the server. Shared like every connection (connection.h).
class client_connection final : public connection {
 public:
  client_connection(gateway_impl& gateway, winapi::unique_handle pipe, pipe_client& client);

 protected:
  std::uint32_t on_hello(const frame::hello& hello) override;
  std::uint32_t on_message(const frame::message_view& message) override;

 private:
  pipe_client& client_;
};

// Owned by the gateway while it runs. Threads: its own thread runs the
// connect loop and the connection; the gateway's control thread calls
// start() and join(); the tap calls forward() on the bus's delivery thread.
class pipe_client {
 public:
  pipe_client(gateway_impl& gateway, const imported_pipe& config);
  pipe_client(const pipe_client&) = delete;
  pipe_client& operator=(const pipe_client&) = delete;
  ~pipe_client();

  const imported_pipe& config() const { return config_; }

  // Starts the thread, which connects in the background: a server that is
  // not there yet is retried. Throws std::system_error.
  void start();
  // Waits for the thread; call after the gateway's stop event is set.
  void join();

  // Queues `frame` for the server when a connection exists.
  void forward(const frame_ptr& frame);

 private:
  void run();

  gateway_impl& gateway_;
  const imported_pipe config_;
  frame_ptr hello_;
  std::thread thread_;

  srw_mutex mutex_;  // guards current_
  std::shared_ptr<client_connection> current_;
};

}  // namespace parlo::ipc::impl
