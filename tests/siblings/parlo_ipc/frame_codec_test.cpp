// The pipe protocol's frames refuse hostile input: a bad header before any
// payload is kept, a broken payload with nothing half decoded.
#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

#include "frame_codec.h"

namespace {

using namespace parlo::ipc::frame;
using bytes = std::vector<unsigned char>;

bytes raw_frame(std::uint64_t length, unsigned char type) {
  bytes out;
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<unsigned char>(length >> (8 * i)));
  out.push_back(type);
  return out;
}

TEST(frame_codec, the_reader_refuses_a_bad_header_before_keeping_any_payload) {
  const struct {
    const char* what;
    bytes stream;
    status expected;
    std::size_t consumed;  // no type byte is waited for after a bad length
  } cases[] = {
      {"over the maximum", raw_frame(max_frame_length + 1, 2), status::oversized, 4},
      {"largest 32-bit length", raw_frame(0xFFFFFFFFu, 2), status::oversized, 4},
      {"zero length", raw_frame(0, 2), status::empty_frame, 4},
      {"unknown type", raw_frame(3, 9), status::unknown_type, 5},
      {"type zero", raw_frame(1, 0), status::unknown_type, 5},
  };
  for (const auto& c : cases) {
    bytes stream = c.stream;
    stream.resize(stream.size() + 16, 0xAA);  // must stay unread
    frame_reader reader;
    EXPECT_EQ(reader.feed(stream.data(), stream.size()), c.consumed) << c.what;
    EXPECT_EQ(reader.state(), c.expected) << c.what;
    reader.next();
    EXPECT_EQ(reader.feed(stream.data(), stream.size()), 0u) << "a failed reader takes no more";
  }
}

TEST(frame_codec, broken_payloads_are_refused_and_leave_nothing_half_decoded) {
  // hello: version, bus name length and bytes, channel count, each channel's
  // length and bytes; message: channel name length and bytes, wire bytes.
  const struct {
    const char* what;
    frame_type type;
    bytes payload;
    status expected;
  } cases[] = {
      {"half a version", frame_type::hello, {1}, status::truncated},
      {"other version", frame_type::hello, {2, 0, 3, 0, 'b', 'u', 's', 0, 0}, status::bad_version},
      {"empty bus name", frame_type::hello, {1, 0, 0, 0, 0, 0}, status::bad_name},
      {"zero byte in a channel", frame_type::hello, {1, 0, 1, 0, 'b', 1, 0, 2, 0, 'a', 0},
       status::bad_name},
      {"count past the end", frame_type::hello, {1, 0, 1, 0, 'b', 255, 0, 1, 0, 'c'},
       status::truncated},
      {"4097 channels", frame_type::hello, {1, 0, 1, 0, 'b', 0x01, 0x10}, status::too_many_channels},
      {"trailing byte", frame_type::hello, {1, 0, 1, 0, 'b', 0, 0, 0}, status::trailing_bytes},
      {"empty", frame_type::message, {}, status::truncated},
      {"name cut short", frame_type::message, {5, 0, 'a', 'l'}, status::truncated},
      {"no wire bytes", frame_type::message, {5, 0, 'a', 'l', 'p', 'h', 'a'}, status::empty_message},
      {"empty name", frame_type::message, {0, 0, 1}, status::bad_name},
  };
  for (const auto& c : cases) {
    hello greeting;
    greeting.bus_name = "stale";
    message_view message;
    EXPECT_EQ(c.type == frame_type::hello
                  ? decode_hello(c.payload.data(), c.payload.size(), greeting)
                  : decode_message(c.payload.data(), c.payload.size(), message),
              c.expected)
        << c.what;
    EXPECT_TRUE(greeting.bus_name.empty() == (c.type == frame_type::hello)) << c.what;
    EXPECT_EQ(message.wire, nullptr) << c.what;
  }
}

}  // namespace
