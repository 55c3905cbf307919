// Building a listeners message from any list of listeners in order: shared
// by encode_listeners and listeners_encoder, which live in translation units
// of their own so that the compiler inlines the builder's calls into each
// (one unit with both instantiations made encoding 12 % slower under Wine).
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "listeners_message_generated.h"

namespace comm {
namespace build {

// Builds the message into `builder`, which must be empty.
template <typename Listeners>
inline void build_listeners(flatbuffers::FlatBufferBuilder& builder, std::uint32_t pid,
                            const Listeners& listeners) {
  std::vector<flatbuffers::Offset<wire::listener>> tables;
  tables.reserve(listeners.size());
  for (const listener& item : listeners) {
    // The id string is made first and the id field added first: peers may
    // compare buffers byte for byte.
    const auto id = builder.CreateString(item.id);
    const auto channel = builder.CreateString(item.channel);
    wire::listenerBuilder table(builder);
    table.add_id(id);
    table.add_channel(channel);
    tables.push_back(table.Finish());
  }
  const auto vector = builder.CreateVector(tables);
  wire::listeners_messageBuilder root(builder);
  root.add_listeners(vector);
  root.add_pid(pid);  // a pid of 0 is the default and is left out
  builder.Finish(root.Finish());
}

// At least 1 KB, and room for the whole message up front: a builder that
// regrows copies everything built so far each time, which made large tables
// cost several times their size.
template <typename Listeners>
inline std::size_t expected_size(const Listeners& listeners) {
  std::uint64_t expected = listeners_fixed_bound;
  for (const listener& item : listeners) {
    expected += listener_encoded_bound(item.channel.size(), item.id.size());
  }
  return static_cast<std::size_t>(std::max<std::uint64_t>(1024, expected));
}

}  // namespace build
}  // namespace comm
