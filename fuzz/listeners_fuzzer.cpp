// Fuzzes the receiving side of the listeners message: any bytes a peer can
// put in the "params" blob go through verification and list building.
//
// On every input: a refused buffer leaves the caller's pid and list as they
// were. On an accepted one: the list holds one listener per wire entry, each
// string cut at its first zero byte, in listener order (the same list as
// inserting the entries one by one at their sorted place), whose strings
// together are no longer than the input; re-encoding it and decoding again
// gives the same pid and list.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>

#include "bus/comm/listeners_codec.h"
#include "fuzz_check.h"
#include "listeners_message_generated.h"

namespace {

// Above this many entries the quadratic reference ordering is skipped.
constexpr std::size_t max_reference_entries = 512;

std::string cut_at_zero(const flatbuffers::String* text) {
  const char* bytes = text->c_str();
  return std::string(bytes, std::find(bytes, bytes + text->size(), '\0'));
}

// The list a receiver must build: each wire entry, in wire order, inserted
// before the first element that does not order before it.
listener_list reference_list(const std::uint8_t* data) {
  listener_list out;
  for (const comm::wire::listener* item : *comm::wire::Getlisteners_message(data)->listeners()) {
    insert_sorted(out, listener{cut_at_zero(item->channel()), cut_at_zero(item->id())});
  }
  return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const listener_list sentinel = {{"sentinel-channel", "sentinel-id"}};
  std::uint32_t pid = 0xA5A5A5A5u;
  listener_list listeners = sentinel;
  const bool accepted = comm::decode_listeners(data, size, pid, listeners);

  std::uint32_t verified_pid = 0;
  FUZZ_CHECK(accepted == comm::verify_listeners(data, size, verified_pid));
  if (!accepted) {
    FUZZ_CHECK(pid == 0xA5A5A5A5u);
    FUZZ_CHECK(listeners == sentinel);
    return 0;
  }
  FUZZ_CHECK(pid == verified_pid);

  const auto* entries = comm::wire::Getlisteners_message(data)->listeners();
  FUZZ_CHECK(entries != nullptr);
  FUZZ_CHECK(listeners.size() == entries->size());
  FUZZ_CHECK(std::is_sorted(listeners.begin(), listeners.end()));
  std::size_t text_bytes = 0;
  for (const listener& item : listeners) {
    FUZZ_CHECK(item.channel.find('\0') == std::string::npos);
    FUZZ_CHECK(item.id.find('\0') == std::string::npos);
    text_bytes += item.channel.size() + item.id.size();
  }
  // Every string of an accepted buffer is stored in it once: the copies a
  // receiver makes never outgrow what the peer sent.
  FUZZ_CHECK(text_bytes <= size);
  if (entries->size() <= max_reference_entries) FUZZ_CHECK(listeners == reference_list(data));

  // What this process would publish from the list decodes to the same.
  const std::vector<std::uint8_t> again = comm::encode_listeners(pid, listeners);
  std::uint32_t pid_again = ~pid;
  listener_list listeners_again;
  FUZZ_CHECK(comm::decode_listeners(again.data(), again.size(), pid_again, listeners_again));
  FUZZ_CHECK(pid_again == pid);
  FUZZ_CHECK(listeners_again == listeners);
  return 0;
}
