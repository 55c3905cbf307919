// Interface of parlo_ipc.dll, the named-pipe IPC library that joins the
// channels of buses in different processes. Shared by the component and the
// stand-in library under siblings/parlo_ipc.
//
// The component loads the library from its own folder, creates one gateway
// per bus with its event sink, and calls only the four slots below. The
// library calls the sink from its own threads, possibly several at once, from
// create_gateway on and never after destroy_gateway has returned. Pipe
// handles stay the library's; the component never closes them.
//
// Several connect events may run at once, also on one pipe: an admission
// that takes long (a large image to verify) holds back no other connection.
//
// Origin of delivered messages: every message the library delivers from a
// pipe carries the blob origin_pid_blob, 4 bytes, little-endian: the id of
// the process at the other end of that connection as the system reports it
// (the client's on a served pipe, the server's on an opened one), set by the
// receiving library whatever the sender put under that name. Messages posted
// in this process never carry it. A message that cannot take the blob (it is
// at the messaging library's limits) is not delivered.
#pragma once

#include <cstdint>

namespace parlo {
class bus;
}

namespace parlo::ipc {

// A pipe's Win32 handle.
using pipe_handle = void*;

// The blob naming the process a delivered message came from (see above).
inline constexpr const char* origin_pid_blob = "parlo_ipc.origin_pid";

class gateway {
 public:
  // Pipe events. "local" events concern pipes this process serves (exported
  // channels), "remote" events pipes it opened to other processes (imported
  // channels). No destructor slot.
  class events {
   public:
    // A pipe instance is listening; `name` may be null.
    virtual void on_listen(pipe_handle pipe, const char* name) = 0;
    // A client connected; false refuses it (the library disconnects it
    // without reading anything from it).
    virtual bool on_local_connect(pipe_handle pipe, std::uint32_t pid) = 0;
    virtual void on_local_disconnect(pipe_handle pipe) = 0;
    virtual void on_local_start_communication(pipe_handle pipe) = 0;
    virtual void on_local_error(pipe_handle pipe, std::uint32_t err) = 0;
    // This process connected to a server with process id `pid`.
    virtual bool on_remote_connect(pipe_handle pipe, std::uint32_t pid) = 0;
    virtual void on_remote_disconnect(pipe_handle pipe) = 0;
    virtual void on_remote_start_communication(pipe_handle pipe) = 0;
    virtual void on_remote_error(pipe_handle pipe, std::uint32_t err) = 0;

   protected:
    ~events() = default;
  };

  // Each returns 0 for success.
  virtual std::uint32_t start() = 0;
  virtual std::uint32_t stop() = 0;
  // Offers the local channel on the named pipe.
  virtual std::uint32_t export_channel(const char* channel, const char* pipe,
                                       std::uint32_t link_type) = 0;
  // Joins the local channel with `remote_channel` of bus `bus_name`, reached
  // over the named pipe.
  virtual std::uint32_t import_channel(const char* channel, const char* pipe, const char* bus_name,
                                       const char* remote_channel, std::uint32_t link_type) = 0;

 protected:
  ~gateway() = default;
};

// Exports, resolved by name: "create_gateway" and "destroy_gateway".
using create_gateway_fn = gateway* (*)(parlo::bus* bus, gateway::events* sink);
using destroy_gateway_fn = void (*)(gateway* gateway);

}  // namespace parlo::ipc
