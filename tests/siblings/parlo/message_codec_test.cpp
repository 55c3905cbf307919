// The wire form of a message: exact layout, round trips, and refusal of
// every malformed input without reading past it.
#include "message_codec.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace {

using namespace parlo::codec;
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

void put_le(bytes& out, std::size_t at, std::uint32_t value, int size) {
  for (int i = 0; i < size; ++i) out[at + i] = static_cast<unsigned char>(value >> (8 * i));
}

TEST(message_codec, layout_is_little_endian_header_then_fields) {
  message_content content;
  content.id = 0x04030201;
  content.fields = {field("ab", "xyz"), field("e", "")};
  const bytes expected = {
      'P',  'R',  'L',  '1',   // magic
      0x01, 0x02, 0x03, 0x04,  // id
      0x02, 0x00, 0x00, 0x00,  // two fields
      0x02, 0x00, 0x03, 0x00, 0x00, 0x00, 'a',  'b',  'x',
      'y',  'z',  0x01, 0x00, 0x00, 0x00, 0x00, 0x00, 'e',
  };
  EXPECT_EQ(expected, encoded(content));
  EXPECT_EQ(expected.size(), encoded_size(content));

  unsigned char buffer[64];
  std::uint64_t written = 0;
  EXPECT_EQ(status::too_large, encode_into(content, buffer, expected.size() - 1, written));
  EXPECT_EQ(0u, written);
  EXPECT_EQ(status::ok, encode_into(content, buffer, sizeof buffer, written));
  EXPECT_EQ(expected.size(), written);
}

TEST(message_codec, round_trip_keeps_id_names_bytes_and_order) {
  message_content content;
  content.id = 0xFFFFFFFF;
  content.fields = {field(std::string(max_name_length, 'n'), "long name"),
                    field("binary", std::string("\0\xFF\x01", 3)), field("empty", ""),
                    field("a", std::string(100000, 'q'))};
  message_content back;
  ASSERT_EQ(status::ok, decode_exact(encoded(content), back));
  EXPECT_EQ(content.id, back.id);
  ASSERT_EQ(content.fields.size(), back.fields.size());
  for (std::size_t i = 0; i < content.fields.size(); ++i) {
    EXPECT_EQ(content.fields[i].name, back.fields[i].name);
    EXPECT_EQ(content.fields[i].data, back.fields[i].data);
  }
  ASSERT_EQ(status::ok, decode_exact(encoded(message_content{}), back));
  EXPECT_EQ(0u, back.id);
  EXPECT_TRUE(back.fields.empty());
}

TEST(message_codec, every_truncation_and_any_trailing_byte_is_refused) {
  message_content content;
  content.id = 7;
  content.fields = {field("one", "12345"), field("two", "6")};
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
  content.fields = {field("name", "data"), field("nama", "again")};
  const bytes good = encoded(content);  // first field header at 12, its name at 18
  const struct {
    const char* what;
    std::function<void(bytes&)> spoil;
    status expected;
  } cases[] = {
      {"magic", [](bytes& b) { b[0] = 'X'; }, status::bad_magic},
      {"too many fields", [](bytes& b) { put_le(b, 8, max_fields + 1, 4); },
       status::too_many_fields},
      // A count the input cannot hold is refused before anything is reserved.
      {"count past the end", [](bytes& b) { put_le(b, 8, max_fields, 4); }, status::truncated},
      {"empty name", [](bytes& b) { put_le(b, 12, 0, 2); }, status::bad_name},
      {"long name", [](bytes& b) { put_le(b, 12, max_name_length + 1, 2); }, status::bad_name},
      {"zero byte in a name", [](bytes& b) { b[19] = 0; }, status::bad_name},
      {"size far beyond the limit", [](bytes& b) { put_le(b, 14, 0xFFFFFFFF, 4); },
       status::too_large},
      {"size past the end",  // one byte more than the rest of the input
       [](bytes& b) { put_le(b, 14, static_cast<std::uint32_t>(b.size() - 22 + 1), 4); },
       status::truncated},
      {"duplicate name", [](bytes& b) { b[b.size() - 6] = 'e'; }, status::duplicate_name},
  };
  for (const auto& c : cases) {
    bytes bad = good;
    c.spoil(bad);
    message_content out;
    EXPECT_EQ(c.expected, decode_exact(bad, out)) << c.what;
  }
}

TEST(message_codec, limits_hold_for_encoding_and_decoding) {
  message_content too_many;
  for (std::uint32_t i = 0; i <= max_fields; ++i)
    too_many.fields.push_back(field("f" + std::to_string(i), ""));
  bytes out;
  EXPECT_EQ(status::too_many_fields, encode(too_many, out));
  EXPECT_TRUE(out.empty());
  too_many.fields.pop_back();
  EXPECT_EQ(status::ok, check_limits(too_many));

  message_content big;
  big.fields.push_back(blob_field{"a", bytes(max_content_size, 0)});
  EXPECT_EQ(status::too_large, check_limits(big)) << "name bytes count too";
  big.fields[0].data.pop_back();
  const bytes largest = encoded(big);
  message_content back;
  EXPECT_EQ(status::ok, decode(largest.data(), largest.size(), back));
  bytes oversized(static_cast<std::size_t>(max_encoded_size) + 1, 0);
  std::memcpy(oversized.data(), magic, 4);
  EXPECT_EQ(status::too_large, decode(oversized.data(), oversized.size(), back));

  message_content named;
  for (const std::string& name : {std::string(), std::string("a\0b", 3)}) {
    named.fields = {field(name, "x")};
    EXPECT_EQ(status::bad_name, encode(named, out));
  }
  named.fields = {field("same", "x"), field("same", "y")};
  EXPECT_EQ(status::duplicate_name, encode(named, out));
}

}  // namespace
