// Frames of parlo_ipc.dll's pipe protocol: how channel joins and messages
// travel between two gateways over one named-pipe connection.
//
// Pure C++17 without any system header, so that it builds natively (fuzzing,
// sanitizers) as well as for Windows. Decoding trusts nothing in the input;
// nothing is allocated before the length that governs it has been checked.
//
// Byte stream of one connection, in each direction: frames back to back.
// Every integer is little-endian.
//
//   frame:   4  length L: the bytes that follow this field, 1..max_frame_length
//            1  type (1 hello, 2 message)
//            L-1 payload
//
//   hello (type 1), the first frame each side sends, exactly once:
//            2  protocol version, protocol_version
//            2  bus name length n, 1..max_name_length
//            n  bus name: the server's own bus, or the bus the client asks for
//            2  channel count c, 0..max_hello_channels
//            c times:
//              2  channel name length m, 1..max_name_length
//              m  channel name: the channels the server exports on the pipe,
//                 or the server's channels the client joins
//            nothing after the last channel
//
//   message (type 2):
//            2  channel name length m, 1..max_name_length
//            m  channel name, as the receiving side knows it (the server's
//               channel name in both directions)
//            rest: the message's parlo wire form (siblings/parlo/
//               message_codec.h), at least one byte, checked by the
//               receiving bus when it is injected
//
// Names are UTF-8 without zero bytes; they are not checked further here.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "bus/parlo/parlo_ext.h"

namespace parlo::ipc::frame {

enum class frame_type : std::uint8_t {
  hello = 1,
  message = 2,
};

inline constexpr std::uint16_t protocol_version = 1;
inline constexpr std::size_t length_size = 4;
inline constexpr std::size_t header_size = length_size + 1;
inline constexpr std::size_t max_name_length = parlo::max_name_length;
inline constexpr std::size_t max_hello_channels = 4096;
// The largest length field: a message frame carrying the largest message a
// bus can encode under the longest channel name. A hello never comes close.
inline constexpr std::uint64_t max_frame_length = 1 + 2 + max_name_length + parlo::ext::max_wire_size;
inline constexpr std::uint64_t max_frame_size = length_size + max_frame_length;

enum class status {
  ok,
  truncated,          // the payload ends inside a field
  oversized,          // length field over max_frame_length
  empty_frame,        // length field 0: no type byte
  unknown_type,       // type byte other than hello or message
  bad_version,        // a hello of another protocol version
  bad_name,           // empty, longer than max_name_length, or holds a zero byte
  too_many_channels,  // more than max_hello_channels in a hello
  trailing_bytes,     // bytes after the last channel of a hello
  empty_message,      // a message frame without wire bytes
};

// A short English text for `value`, e.g. "oversized".
const char* status_text(status value) noexcept;

struct hello {
  std::uint16_t version = protocol_version;
  std::string bus_name;
  std::vector<std::string> channels;
};

// A decoded message frame; views into the payload it was decoded from.
struct message_view {
  std::string_view channel;
  const unsigned char* wire = nullptr;
  std::size_t wire_size = 0;
};

// Whether `name` is a name the protocol carries (1..max_name_length bytes,
// no zero byte).
bool valid_name(std::string_view name) noexcept;

// Replace `out` with the whole frame (length field included). bad_name,
// too_many_channels, empty_message or oversized when the input breaks the
// rules above; `out` is then empty. May throw std::bad_alloc.
status encode_hello(const hello& value, std::vector<unsigned char>& out);
status encode_message(std::string_view channel, const void* wire, std::uint64_t wire_size,
                      std::vector<unsigned char>& out);

// Decode the payload of a frame (the bytes after the type byte). Only on ok
// does `out` hold the result. decode_hello may throw std::bad_alloc.
status decode_hello(const unsigned char* payload, std::size_t size, hello& out);
status decode_message(const unsigned char* payload, std::size_t size, message_view& out) noexcept;

// Cuts a byte stream into frames. Feed it what the pipe gives, in pieces of
// any size; it stops at the end of each frame so the caller can handle it.
//
//   while (size > 0) {
//     const std::size_t used = reader.feed(data, size);
//     data += used; size -= used;
//     if (reader.failed()) ...close the connection...
//     if (reader.complete()) { ...reader.type(), reader.payload()...; reader.next(); }
//   }
//
// A length field that breaks the rules fails the reader as soon as its four
// bytes are in, an unknown type as soon as its byte is in, before any payload
// is kept; a failed reader consumes nothing more. The payload buffer grows only with bytes actually
// received, so memory stays within max_frame_size per connection.
class frame_reader {
 public:
  // Consumes bytes from `data` up to the end of the current frame; returns
  // how many. Consumes nothing while a frame is complete or the reader failed.
  std::size_t feed(const void* data, std::size_t size);

  bool failed() const noexcept { return state_ != status::ok; }
  // ok, or why the stream was given up.
  status state() const noexcept { return state_; }
  bool complete() const noexcept { return complete_; }
  // The complete frame's type and payload (after the type byte).
  frame_type type() const noexcept { return type_; }
  const std::vector<unsigned char>& payload() const noexcept { return payload_; }
  // The length field of the frame being read (0 before it is in).
  std::uint64_t length() const noexcept { return length_; }
  // Forgets the complete frame; the next feed starts the next frame.
  void next() noexcept;

 private:
  unsigned char header_[header_size] = {};
  std::size_t header_fill_ = 0;
  std::uint64_t length_ = 0;
  frame_type type_ = frame_type::hello;
  std::vector<unsigned char> payload_;
  bool complete_ = false;
  status state_ = status::ok;
};

}  // namespace parlo::ipc::frame
