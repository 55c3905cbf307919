// Fuzzes the IPC library's frame reader and frame decoders: the bytes are a
// connection's stream as a hostile peer could send it.
//
// The stream is cut into frames twice: fed whole, and fed in pieces of random
// sizes (drawn from a generator seeded by the input, so a kept input replays
// exactly). Both must give the same frames, the same end state and consume
// the same bytes. Throughout, the reader makes progress whenever it can,
// never announces a length over max_frame_length, never holds more payload
// than the length announced nor than the bytes it was given, and its buffer
// never runs ahead of the bytes received (no reserve on the word of a length
// field). Every complete frame is decoded as its type says; a decoded frame
// encodes back to exactly the bytes it came from.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <random>
#include <utility>
#include <vector>

#include "frame_codec.h"
#include "fuzz_check.h"

using namespace parlo::ipc::frame;

namespace {

using bytes = std::vector<unsigned char>;

// A reader keeps at most this much buffer from one frame for the next.
constexpr std::size_t kept_capacity = std::size_t{1} << 20;

struct stream_result {
  std::vector<std::pair<frame_type, bytes>> frames;
  status state = status::ok;
  std::size_t consumed = 0;
};

void check_reader(const frame_reader& reader, std::uint64_t received_in_frame) {
  FUZZ_CHECK(reader.length() <= max_frame_length);
  const std::vector<unsigned char>& payload = reader.payload();
  if (reader.length() == 0) FUZZ_CHECK(payload.empty());
  else FUZZ_CHECK(payload.size() <= reader.length() - 1);
  FUZZ_CHECK(payload.size() <= received_in_frame);
  FUZZ_CHECK(payload.capacity() <= std::max(kept_capacity, 2 * payload.size()));
  if (reader.complete()) {
    FUZZ_CHECK(!reader.failed());
    FUZZ_CHECK(reader.length() >= 1);
    FUZZ_CHECK(payload.size() == reader.length() - 1);
  }
}

// The frame `payload` came from, length field and type byte included.
bytes whole_frame(frame_type type, const bytes& payload) {
  bytes out;
  const std::uint64_t length = payload.size() + 1;
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<unsigned char>(length >> (8 * i)));
  out.push_back(static_cast<unsigned char>(type));
  out.insert(out.end(), payload.begin(), payload.end());
  return out;
}

void check_frame(frame_type type, const bytes& payload) {
  bytes again;
  if (type == frame_type::hello) {
    hello value;
    value.bus_name = "sentinel";
    const status result = decode_hello(payload.data(), payload.size(), value);
    if (result != status::ok) {
      FUZZ_CHECK(value.bus_name.empty() && value.channels.empty());
      return;
    }
    FUZZ_CHECK(value.version == protocol_version);
    FUZZ_CHECK(valid_name(value.bus_name));
    FUZZ_CHECK(value.channels.size() <= max_hello_channels);
    for (const auto& channel : value.channels) FUZZ_CHECK(valid_name(channel));
    FUZZ_CHECK(encode_hello(value, again) == status::ok);
  } else {
    FUZZ_CHECK(type == frame_type::message);
    message_view view;
    if (decode_message(payload.data(), payload.size(), view) != status::ok) {
      FUZZ_CHECK(view.wire == nullptr && view.wire_size == 0 && view.channel.empty());
      return;
    }
    FUZZ_CHECK(valid_name(view.channel));
    FUZZ_CHECK(view.wire_size >= 1);
    FUZZ_CHECK(view.wire >= payload.data() && view.wire + view.wire_size == payload.data() + payload.size());
    FUZZ_CHECK(encode_message(view.channel, view.wire, view.wire_size, again) == status::ok);
  }
  FUZZ_CHECK(again == whole_frame(type, payload));
}

// Feeds `data` in pieces whose sizes `next_piece` draws, the way a
// connection feeds what each read gives, and collects the frames.
template <typename Pieces>
stream_result read_stream(const std::uint8_t* data, std::size_t size, Pieces next_piece) {
  stream_result result;
  frame_reader reader;
  std::uint64_t received_in_frame = 0;
  std::size_t offset = 0;
  while (offset < size) {
    const std::size_t piece = std::min(size - offset, next_piece());
    std::size_t left = piece;
    while (left > 0) {
      const std::size_t used = reader.feed(data + offset, left);
      FUZZ_CHECK(used <= left);
      offset += used;
      left -= used;
      received_in_frame += used;
      check_reader(reader, received_in_frame);
      if (reader.failed()) {
        FUZZ_CHECK(reader.feed(data + offset, left) == 0);
        result.state = reader.state();
        result.consumed = offset;
        return result;
      }
      if (reader.complete()) {
        FUZZ_CHECK(reader.feed(data + offset, left) == 0);
        result.frames.emplace_back(reader.type(), reader.payload());
        reader.next();
        received_in_frame = 0;
        check_reader(reader, received_in_frame);
        FUZZ_CHECK(!reader.complete() && reader.length() == 0);
      } else {
        // Bytes were offered and the frame is not done: all of them must
        // have been taken, or the caller's loop would spin.
        FUZZ_CHECK(left == 0);
      }
    }
  }
  result.state = reader.state();
  result.consumed = offset;
  return result;
}

std::uint64_t fnv1a(const std::uint8_t* data, std::size_t size) {
  std::uint64_t hash = 14695981039346656037ull;
  for (std::size_t i = 0; i < size; ++i) hash = (hash ^ data[i]) * 1099511628211ull;
  return hash;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const stream_result whole = read_stream(data, size, [size] { return size; });

  std::mt19937_64 random(fnv1a(data, size));
  const stream_result pieces = read_stream(data, size, [&random]() -> std::size_t {
    // Mostly short reads, now and then a long one, as a pipe gives them.
    switch (random() % 4) {
      case 0: return 1;
      case 1: return 1 + random() % 8;
      case 2: return 1 + random() % 64;
      default: return 1 + random() % 4096;
    }
  });

  FUZZ_CHECK(whole.state == pieces.state);
  FUZZ_CHECK(whole.consumed == pieces.consumed);
  FUZZ_CHECK(whole.frames == pieces.frames);
  for (const auto& [type, payload] : whole.frames) check_frame(type, payload);
  return 0;
}
