#include "bus/comm/listeners_codec.h"

#include <algorithm>

#include "bus/comm/listeners_build.h"

namespace comm {
namespace {

std::string copy_to_first_zero(const flatbuffers::String* text) {
  const char* bytes = text->c_str();
  return std::string(bytes, std::find(bytes, bytes + text->size(), '\0'));
}

}  // namespace

std::vector<std::uint8_t> encode_listeners(std::uint32_t pid, const listener_list& listeners) {
  flatbuffers::FlatBufferBuilder builder(build::expected_size(listeners));
  build::build_listeners(builder, pid, listeners);
  return std::vector<std::uint8_t>(builder.GetBufferPointer(),
                                   builder.GetBufferPointer() + builder.GetSize());
}

bool verify_listeners(const std::uint8_t* data, std::size_t size, std::uint32_t& pid) {
  if (data == nullptr || size == 0) return false;
  flatbuffers::Verifier verifier(data, size, listeners_max_depth, listeners_max_tables,
                                 /* check_alignment */ true);
  if (!wire::Verifylisteners_messageBuffer(verifier)) return false;
  const wire::listeners_message* message = wire::Getlisteners_message(data);
  const auto* items = message->listeners();
  if (items == nullptr) return false;
  // A publisher's entry takes at least 32 bytes (its offset, its table, two
  // strings); entries that share tables would let a small buffer expand into
  // a list many times its size. Half that still leaves room for any encoder.
  if (items->size() > size / 16) return false;
  // A publisher writes every string once, so its listeners' strings together
  // never outgrow the buffer. Entries that all refer to one table or string
  // still verify, and would make a message of a few hundred kilobytes expand
  // into gigabytes of copies on the receiving thread.
  std::uint64_t text_bytes = 0;
  for (const wire::listener* item : *items) {
    if (item == nullptr || item->channel() == nullptr || item->id() == nullptr) return false;
    text_bytes += std::uint64_t{item->channel()->size()} + item->id()->size();
  }
  if (text_bytes > size) return false;
  pid = message->pid();
  return true;
}

listener_list read_listeners(const std::uint8_t* data) {
  const auto* items = wire::Getlisteners_message(data)->listeners();
  listener_list received;
  bool in_order = true;
  for (const wire::listener* item : *items) {
    listener next{copy_to_first_zero(item->channel()), copy_to_first_zero(item->id())};
    if (in_order && !received.empty() && next < received.back()) in_order = false;
    received.push_back(std::move(next));
  }
  // Inserting each listener at its sorted place gives the sorted multiset.
  // A publisher sends its list in that order, so one pass usually confirms
  // it and nothing is compared again (string comparison is slow under some
  // C runtimes); any other list gets a merge sort of its nodes, n log n, so
  // a large hostile list cannot wedge the delivery thread either.
  if (!in_order) received.sort();
  return received;
}

std::size_t count_listeners(const std::uint8_t* data) {
  return wire::Getlisteners_message(data)->listeners()->size();
}

bool decode_listeners(const std::uint8_t* data, std::size_t size, std::uint32_t& pid,
                      listener_list& listeners) {
  std::uint32_t read_pid = 0;
  if (!verify_listeners(data, size, read_pid)) return false;
  pid = read_pid;
  listeners = read_listeners(data);
  return true;
}

}  // namespace comm
