// One pipe connection, on either side: the frames waiting to be written to
// it and the overlapped I/O loop that writes them and reads the peer's.
#pragma once

#include <windows.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "frame_codec.h"
#include "platform/handles.h"
#include "platform/srw_sync.h"

namespace parlo::ipc::impl {

class gateway_impl;

// An encoded frame, shared by every connection it is queued for.
using frame_ptr = std::shared_ptr<const std::vector<unsigned char>>;

// Most bytes that may wait for one connection: a largest frame and 16 MiB
// more. A peer that reads slower than its side posts is dropped (error event
// ERROR_NOT_ENOUGH_QUOTA, then a disconnect) instead of growing memory; on
// reconnecting it gets the tables anew, which a silently dropped message
// would not give it.
inline constexpr std::uint64_t max_queued_bytes = frame::max_frame_size + (16u << 20);

// Ownership: shared (std::shared_ptr) by the thread that runs the connection
// and by its pipe's routing list, through which the gateway's tap queues
// frames; the pipe handle is the connection's and is closed by
// close_handle() after the disconnect event.
// Threads: enqueue() and close_queue() from any thread (the tap runs on the
// bus's delivery thread); everything else on the connection's own thread.
class connection {
 public:
  connection(gateway_impl& gateway, winapi::unique_handle pipe, const std::string& pipe_name,
             bool local);
  connection(const connection&) = delete;
  connection& operator=(const connection&) = delete;
  virtual ~connection() = default;

  HANDLE handle() const { return pipe_.get(); }
  // The process at the other end, as the system reported it; set once,
  // before run(), and stamped on every message delivered from the pipe.
  void set_peer_pid(std::uint32_t pid) { peer_pid_ = pid; }
  std::uint32_t peer_pid() const { return peer_pid_; }
  // Whether the construction got its wake event; a connection without it is
  // closed at once.
  bool usable() const { return static_cast<bool>(wake_event_); }

  // Queues `frame` for writing. Frames queued before run() wait (a client
  // that is not admitted yet must not get data). Over max_queued_bytes the
  // frame is dropped and the connection fails with ERROR_NOT_ENOUGH_QUOTA.
  void enqueue(const frame_ptr& frame);
  // Drops the queued frames and every later one.
  void close_queue();

  // Reads and writes until the gateway stops, the peer goes, or the peer
  // breaks the protocol (then an error event). Raises the start-
  // communication event when the peer's hello is in; the caller raises
  // connect and disconnect around it.
  void run();
  // Whether the peer's hello arrived during run().
  bool communicated() const { return hello_seen_; }

  // Disconnects (server side) and closes the handle.
  void close_handle();

 protected:
  // The peer's hello and messages, on the connection's thread. 0, or the code
  // of an error event that ends the connection.
  virtual std::uint32_t on_hello(const frame::hello& hello) = 0;
  virtual std::uint32_t on_message(const frame::message_view& message) = 0;

  // Delivers a message to local channel `channel`, with the origin blob set
  // to the peer's pid: retries a full delivery queue for a while. 0 when
  // delivered or dropped (with a line), or the code of an error that ends
  // the connection.
  std::uint32_t inject(const std::string& channel, const frame::message_view& message);

  gateway_impl& gateway_;
  const std::string& pipe_name_;
  const bool local_;

 private:
  struct write_state;

  // Takes the next bytes to write from the queue; false when there are none.
  bool take_write_locked(write_state& state);
  std::uint32_t handle_read(const unsigned char* data, std::size_t size);
  std::uint32_t handle_frame(const frame::frame_reader& reader);
  // Raises the error event for the local or remote side.
  void raise_error(std::uint32_t err);
  const wchar_t* log_name() const;

  winapi::unique_handle pipe_;
  std::uint32_t peer_pid_ = 0;
  winapi::unique_handle wake_event_;  // auto-reset: a frame was queued

  srw_mutex mutex_;  // guards the queue
  std::deque<frame_ptr> queue_;
  std::uint64_t queued_bytes_ = 0;  // queued plus in flight
  bool queue_closed_ = false;
  bool overflow_ = false;

  frame::frame_reader reader_;
  bool hello_seen_ = false;
};

}  // namespace parlo::ipc::impl
