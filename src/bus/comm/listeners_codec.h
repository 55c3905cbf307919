// Encoding and decoding of the listeners message: pure functions over bytes,
// free of Win32 calls, so that they can be fuzzed in a native build.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "bus/listener.h"

namespace comm {

// Limits a received buffer must keep to be read at all.
constexpr std::size_t listeners_max_depth = 64;
constexpr std::size_t listeners_max_tables = 1000000;

// The finished flatbuffers bytes for `pid` and `listeners` (list order kept).
std::vector<std::uint8_t> encode_listeners(std::uint32_t pid, const listener_list& listeners);

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
