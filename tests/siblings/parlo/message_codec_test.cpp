// The wire form of a message: exact layout, round trips, and refusal of
// every malformed input without reading past it.
#include "message_codec.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <vector>

namespace {

using parlo::codec::blob_field;
using parlo::codec::decode;
using parlo::codec::encode;
using parlo::codec::message_content;
using parlo::codec::status;
using bytes = std::vector<unsigned char>;

blob_field field(std::string name, const std::string& data) {
  return blob_field{std::move(name), bytes(data.begin(), data.end())};
}

bytes encoded(const message_content& content) {
  bytes out;
  EXPECT_EQ(status::ok, encode(content, out));
  return out;
}

// Decodes a copy held in a buffer of exactly `data.size()` bytes, so that a
// read past the end would touch memory the heap checker can see.
status decode_exact(const bytes& data, message_content& out) {
  std::unique_ptr<unsigned char[]> exact(new unsigned char[data.size() + 1]);
  if (!data.empty()) std::memcpy(exact.get(), data.data(), data.size());
  return decode(exact.get(), data.size(), out);
}

void put_u16(bytes& out, std::size_t at, std::uint16_t value) {
  out[at] = static_cast<unsigned char>(value);
  out[at + 1] = static_cast<unsigned char>(value >> 8);
}

void put_u32(bytes& out, std::size_t at, std::uint32_t value) {
  for (int i = 0; i < 4; ++i) out[at + i] = static_cast<unsigned char>(value >> (8 * i));
}

TEST(message_codec, layout_is_little_endian_header_then_fields) {
  message_content content;
  content.id = 0x04030201;
  content.fields.push_back(field("ab", "xyz"));
  content.fields.push_back(field("e", ""));
  const bytes expected = {
      'P',  'R',  'L',  '1',   // magic
      0x01, 0x02, 0x03, 0x04,  // id
      0x02, 0x00, 0x00, 0x00,  // two fields
      0x02, 0x00, 0x03, 0x00, 0x00, 0x00, 'a',  'b',  'x',
      'y',  'z',  0x01, 0x00, 0x00, 0x00, 0x00, 0x00, 'e',
  };
  EXPECT_EQ(expected, encoded(content));
  EXPECT_EQ(expected.size(), parlo::codec::encoded_size(content));

  unsigned char buffer[64];
  std::uint64_t written = 0;
  EXPECT_EQ(status::too_large,
            parlo::codec::encode_into(content, buffer, expected.size() - 1, written));
  EXPECT_EQ(0u, written);
  EXPECT_EQ(status::ok, parlo::codec::encode_into(content, buffer, sizeof buffer, written));
  EXPECT_EQ(expected.size(), written);
}

TEST(message_codec, round_trip_keeps_id_names_bytes_and_order) {
  message_content content;
  content.id = 0xFFFFFFFF;
  content.fields.push_back(field(std::string(parlo::codec::max_name_length, 'n'), "long name"));
  content.fields.push_back(field("binary", std::string("\0\xFF\x01", 3)));
  content.fields.push_back(field("empty", ""));
  content.fields.push_back(field("a", std::string(100000, 'q')));

  message_content back;
  ASSERT_EQ(status::ok, decode_exact(encoded(content), back));
  EXPECT_EQ(content.id, back.id);
  ASSERT_EQ(content.fields.size(), back.fields.size());
  for (std::size_t i = 0; i < content.fields.size(); ++i) {
    EXPECT_EQ(content.fields[i].name, back.fields[i].name);
    EXPECT_EQ(content.fields[i].data, back.fields[i].data);
  }

  message_content empty;
  ASSERT_EQ(status::ok, decode_exact(encoded(empty), back));
  EXPECT_EQ(0u, back.id);
  EXPECT_TRUE(back.fields.empty());
}

TEST(message_codec, every_truncation_and_any_trailing_byte_is_refused) {
  message_content content;
  content.id = 7;
  content.fields.push_back(field("one", "12345"));
  content.fields.push_back(field("two", "6"));
  const bytes good = encoded(content);
  for (std::size_t size = 0; size < good.size(); ++size) {
    message_content out;
    out.id = 99;
    const bytes prefix(good.begin(), good.begin() + static_cast<std::ptrdiff_t>(size));
    EXPECT_EQ(status::truncated, decode_exact(prefix, out)) << "size " << size;
    EXPECT_EQ(0u, out.id) << "a refused input leaves nothing behind";
    EXPECT_TRUE(out.fields.empty());
  }
  bytes longer = good;
  longer.push_back(0);
  message_content out;
  EXPECT_EQ(status::trailing_bytes, decode_exact(longer, out));
  EXPECT_EQ(status::truncated, decode(nullptr, 12, out));
}

TEST(message_codec, malformed_headers_and_fields_are_refused) {
  message_content content;
  content.fields.push_back(field("name", "data"));
  const bytes good = encoded(content);  // field header at 12, name at 18
  message_content out;

  bytes bad = good;
  bad[0] = 'X';
  EXPECT_EQ(status::bad_magic, decode_exact(bad, out));

  bad = good;
  put_u32(bad, 8, parlo::codec::max_fields + 1);
  EXPECT_EQ(status::too_many_fields, decode_exact(bad, out));

  // A count that the input cannot hold is refused before anything is
  // reserved for it.
  bad = good;
  put_u32(bad, 8, parlo::codec::max_fields);
  EXPECT_EQ(status::truncated, decode_exact(bad, out));

  bad = good;
  put_u16(bad, 12, 0);
  EXPECT_EQ(status::bad_name, decode_exact(bad, out));

  bad = good;
  put_u16(bad, 12, static_cast<std::uint16_t>(parlo::codec::max_name_length + 1));
  EXPECT_EQ(status::bad_name, decode_exact(bad, out));

  bad = good;
  bad[19] = 0;  // a zero byte inside the name
  EXPECT_EQ(status::bad_name, decode_exact(bad, out));

  bad = good;
  put_u32(bad, 14, 0xFFFFFFFF);  // data size far beyond the limit
  EXPECT_EQ(status::too_large, decode_exact(bad, out));

  bad = good;
  put_u32(bad, 14, 5);  // one byte more than the input holds
  EXPECT_EQ(status::truncated, decode_exact(bad, out));

  content.fields.push_back(field("name", "again"));
  bytes twice;
  content.fields[1].name = "nama";
  twice = encoded(content);
  twice[twice.size() - 6] = 'e';  // second name becomes "name"
  EXPECT_EQ(status::duplicate_name, decode_exact(twice, out));
}

TEST(message_codec, limits_hold_for_encoding_and_decoding) {
  message_content too_many;
  for (std::uint32_t i = 0; i <= parlo::codec::max_fields; ++i)
    too_many.fields.push_back(field("f" + std::to_string(i), ""));
  bytes out;
  EXPECT_EQ(status::too_many_fields, encode(too_many, out));
  EXPECT_TRUE(out.empty());
  too_many.fields.pop_back();
  EXPECT_EQ(status::ok, parlo::codec::check_limits(too_many));

  message_content big;
  big.fields.push_back(blob_field{"a", bytes(parlo::codec::max_content_size, 0)});
  EXPECT_EQ(status::too_large, parlo::codec::check_limits(big)) << "name bytes count too";
  big.fields[0].data.pop_back();
  const bytes largest = encoded(big);
  message_content back;
  EXPECT_EQ(status::ok, decode(largest.data(), largest.size(), back));

  bytes oversized(static_cast<std::size_t>(parlo::codec::max_encoded_size) + 1, 0);
  std::memcpy(oversized.data(), parlo::codec::magic, 4);
  EXPECT_EQ(status::too_large, decode(oversized.data(), oversized.size(), back));

  message_content named;
  named.fields.push_back(field("", "x"));
  EXPECT_EQ(status::bad_name, encode(named, out));
  named.fields[0].name = std::string("a\0b", 3);
  EXPECT_EQ(status::bad_name, encode(named, out));
  named.fields[0].name = "same";
  named.fields.push_back(field("same", "y"));
  EXPECT_EQ(status::duplicate_name, encode(named, out));
}

TEST(message_codec, random_and_mutated_inputs_decode_safely_and_canonically) {
  std::mt19937 random(12345);
  message_content content;
  content.id = 3;
  content.fields.push_back(field("alpha", "0123456789"));
  content.fields.push_back(field("b", ""));
  content.fields.push_back(field("gamma", "xyz"));
  const bytes good = encoded(content);

  int accepted = 0;
  for (int round = 0; round < 20000; ++round) {
    bytes input;
    if (round % 2 == 0) {
      input = good;
      const int flips = 1 + static_cast<int>(random() % 4);
      for (int i = 0; i < flips; ++i)
        input[random() % input.size()] = static_cast<unsigned char>(random());
      if (random() % 4 == 0) input.resize(random() % (input.size() + 1));
    } else {
      input.resize(random() % 64);
      for (unsigned char& b : input) b = static_cast<unsigned char>(random());
      if (input.size() >= 4) std::memcpy(input.data(), parlo::codec::magic, 4);
    }
    message_content out;
    if (decode_exact(input, out) == status::ok) {
      ++accepted;
      // What decodes is exactly what encoding it again gives.
      EXPECT_EQ(input, encoded(out)) << "round " << round;
    }
  }
  EXPECT_GT(accepted, 0) << "some mutations (data bytes) stay valid";
}

}  // namespace
