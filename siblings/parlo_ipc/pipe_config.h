// What a gateway was asked to carry over each pipe: the exported channels of
// the pipes it serves and the joins of the pipes it opens.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace parlo::ipc::impl {

// Link types, a bit set: which ways a channel's messages cross the pipe.
enum : std::uint32_t {
  link_send = 1,     // local posts go out over the pipe
  link_receive = 2,  // messages from the pipe are delivered locally
  link_both = link_send | link_receive,
};

// A pipe this gateway serves.
struct exported_pipe {
  std::string name;    // as the caller gave it; passed to on_listen
  std::wstring path;   // "\\.\pipe\..."
  std::map<std::string, std::uint32_t> channels;  // local channel -> link type
};

// A local channel joined with a channel of the server's bus.
struct channel_join {
  std::string local;
  std::string remote;
  std::uint32_t link;
};

// A pipe this gateway opens to another process.
struct imported_pipe {
  std::string name;
  std::wstring path;
  std::string bus_name;  // of the first import over the pipe
  std::vector<channel_join> joins;
};

}  // namespace parlo::ipc::impl
