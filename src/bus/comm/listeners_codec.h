// Encoding and decoding of the listeners message: pure functions over bytes,
// free of Win32 calls, so that they can be fuzzed in a native build.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "bus/listener.h"

namespace comm {

// Limits a received buffer must keep to be read at all.
constexpr std::size_t listeners_max_depth = 64;
constexpr std::size_t listeners_max_tables = 1000000;

// An upper bound of what a listener with strings of these lengths adds to
// an encoded message: each string takes its length, a 4-byte length field, a
// zero byte and padding to 4 (at most length + 8); its table 12 bytes and
// its vector entry 4. The message's own parts (root table, vector length,
// the one shared vtable of the listener tables) stay within
// listeners_fixed_bound. A sender can keep the sum while its table changes
// instead of encoding to learn the size.
constexpr std::uint64_t listener_encoded_bound(std::size_t channel_size, std::size_t id_size) {
  return std::uint64_t{channel_size} + id_size + 32;
}
constexpr std::uint64_t listeners_fixed_bound = 64;

// The finished flatbuffers bytes for `pid` and `listeners` (list order kept).
std::vector<std::uint8_t> encode_listeners(std::uint32_t pid, const listener_list& listeners);

// Encodes tables again and again into one builder, whose memory is kept
// from one message to the next: a fresh buffer of a large table costs more
// under some heaps than encoding into it. One thread at a time.
class listeners_encoder {
 public:
  listeners_encoder();
  ~listeners_encoder();
  listeners_encoder(const listeners_encoder&) = delete;
  listeners_encoder& operator=(const listeners_encoder&) = delete;

  struct bytes {
    const std::uint8_t* data;
    std::size_t size;
  };
  // The message for `pid` and `listeners` (in set order, which is listener
  // order), valid until the next encode. Throws std::bad_alloc.
  bytes encode(std::uint32_t pid, const listener_set& listeners);

 private:
  struct state;
  std::unique_ptr<state> state_;
};

// Verifies `data` (depth 64, at most 1,000,000 tables, alignment checked)
// and reads the publisher's pid. False when it fails verification, lacks the
// listeners vector, a listener lacks its channel or id, or the listeners'
// strings together are longer than the buffer (entries sharing strings): the
// whole message is then refused. Allocates nothing, so a receiver can drop a
// message (its own publication, say) before paying for the list.
bool verify_listeners(const std::uint8_t* data, std::size_t size, std::uint32_t& pid);

// The listeners of a buffer that verify_listeners accepted, in listener
// order.
listener_list read_listeners(const std::uint8_t* data);

// How many listeners a buffer that verify_listeners accepted holds, without
// reading them.
std::size_t count_listeners(const std::uint8_t* data);

// Both steps: false (and `listeners` untouched) when verification refuses.
bool decode_listeners(const std::uint8_t* data, std::size_t size, std::uint32_t& pid,
                      listener_list& listeners);

}  // namespace comm
