// The pipe protocol's frames: round trips through encoder and stream reader,
// and the refusal of every kind of broken input.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "frame_codec.h"

namespace {

using namespace parlo::ipc::frame;
using bytes = std::vector<unsigned char>;

bytes raw_frame(std::uint64_t length, unsigned char type, const bytes& payload = {}) {
  bytes out;
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<unsigned char>(length >> (8 * i)));
  out.push_back(type);
  out.insert(out.end(), payload.begin(), payload.end());
  return out;
}

void put_name(bytes& out, const std::string& name) {
  out.push_back(static_cast<unsigned char>(name.size()));
  out.push_back(static_cast<unsigned char>(name.size() >> 8));
  out.insert(out.end(), name.begin(), name.end());
}

// A hello payload written by hand, so that the decoder is not only checked
// against the encoder.
bytes hello_payload(std::uint16_t version, const std::string& bus,
                    const std::vector<std::string>& channels) {
  bytes out = {static_cast<unsigned char>(version), static_cast<unsigned char>(version >> 8)};
  put_name(out, bus);
  out.push_back(static_cast<unsigned char>(channels.size()));
  out.push_back(static_cast<unsigned char>(channels.size() >> 8));
  for (const std::string& channel : channels) put_name(out, channel);
  return out;
}

struct read_result {
  std::vector<std::pair<frame_type, bytes>> frames;
  status state = status::ok;
  std::size_t consumed = 0;
};

// Feeds `stream` in pieces of `step` bytes and collects the frames.
read_result read_all(const bytes& stream, std::size_t step) {
  read_result result;
  frame_reader reader;
  while (result.consumed < stream.size()) {
    const std::size_t piece = std::min(step, stream.size() - result.consumed);
    const std::size_t used = reader.feed(stream.data() + result.consumed, piece);
    result.consumed += used;
    if (reader.failed()) break;
    if (reader.complete()) {
      result.frames.emplace_back(reader.type(), reader.payload());
      reader.next();
    } else if (used == 0) {
      break;
    }
  }
  result.state = reader.state();
  return result;
}

TEST(frame_codec, hellos_and_messages_survive_any_split_of_the_stream) {
  hello sent;
  sent.bus_name = "server_bus";
  sent.channels = {"vorbel_service", std::string(max_name_length, 'c')};
  hello empty;
  empty.bus_name = "b";
  bytes stream, frame;
  ASSERT_EQ(encode_hello(sent, stream), status::ok);
  EXPECT_EQ(stream, raw_frame(stream.size() - 4, 1, hello_payload(1, "server_bus", sent.channels)));
  ASSERT_EQ(encode_hello(empty, frame), status::ok);
  stream.insert(stream.end(), frame.begin(), frame.end());
  const bytes wire = {'P', 'R', 'L', '1', 0, 1, 2, 3, 0, 0, 0, 0};
  ASSERT_EQ(encode_message("alpha", wire.data(), wire.size(), frame), status::ok);
  stream.insert(stream.end(), frame.begin(), frame.end());

  for (std::size_t step : {std::size_t{1}, std::size_t{3}, stream.size()}) {
    SCOPED_TRACE(step);
    const read_result result = read_all(stream, step);
    ASSERT_EQ(result.state, status::ok);
    ASSERT_EQ(result.frames.size(), 3u);
    EXPECT_EQ(result.consumed, stream.size());
    hello got;
    ASSERT_EQ(result.frames[0].first, frame_type::hello);
    ASSERT_EQ(decode_hello(result.frames[0].second.data(), result.frames[0].second.size(), got),
              status::ok);
    EXPECT_EQ(got.bus_name, sent.bus_name);
    EXPECT_EQ(got.channels, sent.channels);
    ASSERT_EQ(decode_hello(result.frames[1].second.data(), result.frames[1].second.size(), got),
              status::ok);
    EXPECT_TRUE(got.channels.empty());
    message_view view;
    ASSERT_EQ(result.frames[2].first, frame_type::message);
    ASSERT_EQ(decode_message(result.frames[2].second.data(), result.frames[2].second.size(), view),
              status::ok);
    EXPECT_EQ(view.channel, "alpha");
    EXPECT_EQ(bytes(view.wire, view.wire + view.wire_size), wire);
  }
}

TEST(frame_codec, the_reader_refuses_a_bad_header_before_keeping_any_payload) {
  const struct {
    const char* what;
    bytes stream;
    status expected;
    std::size_t consumed;  // taken before giving up: no type byte is waited for
  } cases[] = {
      {"over the maximum", raw_frame(max_frame_length + 1, 2), status::oversized, 4},
      {"largest 32-bit length", raw_frame(0xFFFFFFFFu, 2), status::oversized, 4},
      {"zero length", raw_frame(0, 2), status::empty_frame, 4},
      {"unknown type", raw_frame(3, 9, {1, 2}), status::unknown_type, 5},
      {"type zero", raw_frame(1, 0), status::unknown_type, 5},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    bytes stream = c.stream;
    stream.resize(stream.size() + 16, 0xAA);  // more bytes that must stay unread
    const read_result result = read_all(stream, stream.size());
    EXPECT_EQ(result.state, c.expected);
    EXPECT_EQ(result.consumed, c.consumed);
    EXPECT_TRUE(result.frames.empty());
  }
  // A failed reader takes nothing more, whatever follows.
  frame_reader reader;
  const bytes bad = raw_frame(1, 7), good = raw_frame(1, 2);
  reader.feed(bad.data(), bad.size());
  reader.next();
  EXPECT_EQ(reader.feed(good.data(), good.size()), 0u);
  EXPECT_TRUE(reader.failed());
}

TEST(frame_codec, the_reader_keeps_only_what_arrived_up_to_the_largest_length) {
  frame_reader reader;
  const bytes header = raw_frame(max_frame_length, 2), some(1000, 1);
  EXPECT_EQ(reader.feed(header.data(), header.size()), header.size());
  EXPECT_EQ(reader.feed(some.data(), some.size()), some.size());
  EXPECT_FALSE(reader.failed() || reader.complete());
  EXPECT_EQ(reader.payload().size(), some.size());
  // A frame of a type byte alone is complete, with an empty payload.
  const read_result result = read_all(raw_frame(1, 2), 1);
  ASSERT_EQ(result.frames.size(), 1u);
  message_view view;
  EXPECT_EQ(decode_message(result.frames[0].second.data(), 0, view), status::truncated);
}

TEST(frame_codec, broken_payloads_are_refused_and_leave_nothing_half_decoded) {
  const std::string long_name(max_name_length + 1, 'n');
  bytes count_past_end = hello_payload(1, "bus", {});
  count_past_end[count_past_end.size() - 2] = 0xFF;  // claims 255 channels
  bytes trailing = hello_payload(1, "bus", {"a"});
  trailing.push_back(0);
  const struct {
    const char* what;
    bytes payload;
    status expected;
  } hellos[] = {
      {"empty", {}, status::truncated},
      {"half a version", {1}, status::truncated},
      {"other version", hello_payload(2, "bus", {}), status::bad_version},
      {"empty bus name", hello_payload(1, "", {}), status::bad_name},
      {"long bus name", hello_payload(1, long_name, {}), status::bad_name},
      {"empty channel", hello_payload(1, "bus", {""}), status::bad_name},
      {"long channel", hello_payload(1, "bus", {long_name}), status::bad_name},
      {"zero byte in a channel", hello_payload(1, "bus", {std::string("a\0b", 3)}), status::bad_name},
      {"count past the end", count_past_end, status::truncated},
      {"too many channels", hello_payload(1, "bus", std::vector<std::string>(4097, "c")),
       status::too_many_channels},
      {"trailing byte", trailing, status::trailing_bytes},
  };
  for (const auto& c : hellos) {
    SCOPED_TRACE(c.what);
    hello out;
    out.bus_name = "stale";
    EXPECT_EQ(decode_hello(c.payload.data(), c.payload.size(), out), c.expected);
    EXPECT_TRUE(out.bus_name.empty());
  }

  const struct {
    const char* what;
    bytes payload;
    status expected;
  } messages[] = {
      {"empty", {}, status::truncated},
      {"name cut short", {5, 0, 'a', 'l'}, status::truncated},
      {"no wire bytes", {5, 0, 'a', 'l', 'p', 'h', 'a'}, status::empty_message},
      {"empty name", {0, 0, 1}, status::bad_name},
  };
  for (const auto& c : messages) {
    SCOPED_TRACE(c.what);
    message_view out;
    EXPECT_EQ(decode_message(c.payload.data(), c.payload.size(), out), c.expected);
    EXPECT_EQ(out.wire, nullptr);
  }
}

TEST(frame_codec, the_encoders_refuse_what_the_decoders_would) {
  bytes out = {1, 2, 3};
  hello h;
  EXPECT_EQ(encode_hello(h, out), status::bad_name);  // no bus name
  EXPECT_TRUE(out.empty());
  h.bus_name = "bus";
  h.channels.assign(max_hello_channels + 1, "c");
  EXPECT_EQ(encode_hello(h, out), status::too_many_channels);
  h.channels = {std::string(max_name_length + 1, 'x')};
  EXPECT_EQ(encode_hello(h, out), status::bad_name);
  const unsigned char byte = 1;
  EXPECT_EQ(encode_message("", &byte, 1, out), status::bad_name);
  EXPECT_EQ(encode_message("c", &byte, 0, out), status::empty_message);
  EXPECT_EQ(encode_message("c", nullptr, 1, out), status::empty_message);
  // Sizes are checked before any byte is read.
  EXPECT_EQ(encode_message("c", &byte, max_frame_length, out), status::oversized);
  EXPECT_TRUE(out.empty());
}

}  // namespace
