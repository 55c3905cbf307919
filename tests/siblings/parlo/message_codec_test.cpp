// The wire form of a message refuses malformed input without reading past it
// or leaving anything half decoded. Round trips are the native fuzzer's part.
#include "message_codec.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace {

using namespace parlo::codec;
using bytes = std::vector<unsigned char>;

void put_le(bytes& out, std::size_t at, std::uint32_t value, int size) {
  for (int i = 0; i < size; ++i) out[at + i] = static_cast<unsigned char>(value >> (8 * i));
}

TEST(message_codec, malformed_input_is_refused) {
  message_content content;
  content.id = 7;
  content.fields = {{"name", {'d', 'a', 't', 'a'}}, {"nama", {'a', 'g', 'a', 'i', 'n'}}};
  bytes good;
  ASSERT_EQ(status::ok, encode(content, good));  // first field header at 12, its name at 18
  const struct {
    const char* what;
    std::function<void(bytes&)> spoil;
    status expected;
  } cases[] = {
      {"magic", [](bytes& b) { b[0] = 'X'; }, status::bad_magic},
      {"too many fields", [](bytes& b) { put_le(b, 8, max_fields + 1, 4); },
       status::too_many_fields},
      {"count past the end", [](bytes& b) { put_le(b, 8, max_fields, 4); }, status::truncated},
      {"empty name", [](bytes& b) { put_le(b, 12, 0, 2); }, status::bad_name},
      {"long name", [](bytes& b) { put_le(b, 12, max_name_length + 1, 2); }, status::bad_name},
      {"zero byte in a name", [](bytes& b) { b[19] = 0; }, status::bad_name},
      {"size far beyond the limit", [](bytes& b) { put_le(b, 14, 0xFFFFFFFF, 4); },
       status::too_large},
      {"size one past the end",
       [](bytes& b) { put_le(b, 14, static_cast<std::uint32_t>(b.size() - 22 + 1), 4); },
       status::truncated},
      {"duplicate name", [](bytes& b) { b[b.size() - 6] = 'e'; }, status::duplicate_name},
      {"cut inside a field", [](bytes& b) { b.pop_back(); }, status::truncated},
      {"trailing byte", [](bytes& b) { b.push_back(0); }, status::trailing_bytes},
  };
  for (const auto& c : cases) {
    bytes bad = good;
    c.spoil(bad);
    message_content out;
    out.id = 99;
    EXPECT_EQ(c.expected, decode(bad.data(), bad.size(), out)) << c.what;
    EXPECT_TRUE(out.id == 0 && out.fields.empty()) << "a refused input leaves nothing behind";
  }
}

}  // namespace
