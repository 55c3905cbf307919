#include "bus/comm/listeners_build.h"

#include <memory>

namespace comm {

struct listeners_encoder::state {
  flatbuffers::FlatBufferBuilder builder{1024};
  // What the builder was made for; expected_size is an upper bound of the
  // message, so the builder never grows beyond it.
  std::size_t capacity = 1024;
};

listeners_encoder::listeners_encoder() : state_(std::make_unique<state>()) {}
listeners_encoder::~listeners_encoder() = default;

listeners_encoder::bytes listeners_encoder::encode(std::uint32_t pid, const listener_set& listeners) {
  const std::size_t expected = build::expected_size(listeners);
  // Kept while the table needs at least a quarter of it; a table that
  // shrank a lot gives the memory back.
  if (state_->capacity < expected || state_->capacity / 4 > expected) {
    state_->builder = flatbuffers::FlatBufferBuilder(expected);
    state_->capacity = expected;
  } else {
    state_->builder.Clear();
  }
  build::build_listeners(state_->builder, pid, listeners);
  return bytes{state_->builder.GetBufferPointer(), state_->builder.GetSize()};
}

}  // namespace comm
