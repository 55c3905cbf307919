// The baseline: a plain named pipe between two processes, message mode, one
// synchronous write and read per message, the way any two processes would
// talk without the component.
#pragma once

#include <windows.h>

#include <cstddef>
#include <string>
#include <vector>

#include "platform/handles.h"

namespace bench {

// Largest message the echo handles; a sink reads larger ones in pieces.
constexpr std::size_t raw_max_message = 1024 * 1024;
// The pipe's own buffers: the size the gateway's pipes have, so both paths
// get the same kernel buffering.
constexpr DWORD raw_pipe_buffer = 64 * 1024;

// The serving end; used by one thread.
class raw_pipe_server {
 public:
  // Creates the pipe; false (with a line on standard error) on failure.
  bool create(const std::string& name);
  // Completes the connection of a client that has already opened the pipe.
  bool accept();
  // Writes `payload` and reads the echo back; false unless the same number
  // of bytes came back.
  bool round_trip(const std::string& payload);
  // Writes `payload` without waiting for an answer (a sink peer).
  bool send(const std::string& payload);

 private:
  winapi::unique_handle pipe_;
  std::vector<char> buffer_ = std::vector<char>(raw_max_message);
};

// The client end in the peer: opens `name` (0 or a Win32 code).
DWORD raw_pipe_open(const std::string& name, winapi::unique_handle& pipe);
// Echoes every message on `pipe` until the server closes it; with `sink`
// only 1-byte messages are answered (with 1 byte), so a server can stream
// and then wait for everything to have been read.
void raw_pipe_echo(HANDLE pipe, bool sink);

}  // namespace bench
