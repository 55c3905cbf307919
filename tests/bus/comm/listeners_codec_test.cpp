// The listeners message on the wire: what a receiver accepts and refuses.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <random>

#include "bus/comm/listeners_codec.h"
#include "listeners_message_generated.h"

namespace {

using comm::decode_listeners;
using comm::encode_listeners;

listener_list decode_ok(const std::vector<std::uint8_t>& bytes, std::uint32_t& pid) {
  listener_list out;
  EXPECT_TRUE(decode_listeners(bytes.data(), bytes.size(), pid, out));
  return out;
}

std::vector<std::uint8_t> finish(flatbuffers::FlatBufferBuilder& builder,
                                 flatbuffers::Offset<comm::wire::listeners_message> root) {
  builder.Finish(root);
  return std::vector<std::uint8_t>(builder.GetBufferPointer(),
                                   builder.GetBufferPointer() + builder.GetSize());
}

bool has_pid_field(const std::uint8_t* buffer) {
  const auto* root = flatbuffers::GetRoot<flatbuffers::Table>(buffer);
  return root->CheckField(comm::wire::listeners_message::VT_PID);
}

TEST(listeners_codec, round_trip_keeps_pid_and_every_listener_in_listener_order) {
  // Out-of-order lists come back sorted, duplicates adjacent; one out of place
  // at the very end, or an equal pair among ordered neighbours, too.
  const struct {
    std::uint32_t pid;
    listener_list sent, expected;
  } cases[] = {
      {4242, {{"a", "x"}, {"a", "y"}, {"b", "x"}, {"b", "x"}}, {{"a", "x"}, {"a", "y"}, {"b", "x"}, {"b", "x"}}},
      {7, {}, {}},
      {0, {{"c", "i"}}, {{"c", "i"}}},
      {4, {{"a", "1"}, {"a", "1"}, {"b", "2"}, {"c", "3"}, {"a", "0"}},
       {{"a", "0"}, {"a", "1"}, {"a", "1"}, {"b", "2"}, {"c", "3"}}},
      {5, {{"b", "1"}, {"a", "2"}, {"b", "0"}, {"a", "2"}, {"ab", ""}},
       {{"a", "2"}, {"a", "2"}, {"ab", ""}, {"b", "0"}, {"b", "1"}}},
  };
  for (const auto& c : cases) {
    const auto bytes = encode_listeners(c.pid, c.sent);
    // The vector is there even when empty; pid 0 is left out and read as 0.
    ASSERT_NE(nullptr, comm::wire::Getlisteners_message(bytes.data())->listeners()) << c.pid;
    EXPECT_EQ(c.pid != 0, has_pid_field(bytes.data())) << c.pid;
    std::uint32_t pid = 99;
    EXPECT_EQ(c.expected, decode_ok(bytes, pid)) << c.pid;
    EXPECT_EQ(c.pid, pid);
  }
}

TEST(listeners_codec, fields_are_added_in_the_agreed_order) {
  // The id string is created before the channel string, so (building back to
  // front) it lies after it in the buffer.
  const auto bytes = encode_listeners(1, {{"channel-text", "id-text"}});
  const auto* item = comm::wire::Getlisteners_message(bytes.data())->listeners()->Get(0);
  EXPECT_GT(reinterpret_cast<std::uintptr_t>(item->id()), reinterpret_cast<std::uintptr_t>(item->channel()));
}

TEST(listeners_codec, strings_are_cut_at_their_first_zero_byte) {
  const listener_list sent = {{std::string("chan\0nel", 8), std::string("i\0d", 3)}};
  std::uint32_t pid = 0;
  const auto got = decode_ok(encode_listeners(3, sent), pid);
  ASSERT_EQ(1u, got.size());
  EXPECT_EQ("chan", got.front().channel);
  EXPECT_EQ("i", got.front().id);
}

TEST(listeners_codec, incomplete_messages_are_refused_whole) {
  std::uint32_t pid = 0;
  listener_list out;
  {
    flatbuffers::FlatBufferBuilder builder;
    comm::wire::listeners_messageBuilder root(builder);
    root.add_pid(12);
    const auto bytes = finish(builder, root.Finish());
    EXPECT_FALSE(decode_listeners(bytes.data(), bytes.size(), pid, out)) << "no listeners vector";
  }
  {
    flatbuffers::FlatBufferBuilder builder;
    const auto good = comm::wire::Createlistener(builder, builder.CreateString("a"), builder.CreateString("x"));
    const auto no_id = comm::wire::Createlistener(builder, builder.CreateString("b"), 0);
    const auto bytes = finish(builder, comm::wire::Createlisteners_message(
                                           builder, 12, builder.CreateVector(std::vector{good, no_id})));
    EXPECT_FALSE(decode_listeners(bytes.data(), bytes.size(), pid, out)) << "a listener without id";
  }
  {
    flatbuffers::FlatBufferBuilder builder;
    const auto no_channel = comm::wire::Createlistener(builder, 0, builder.CreateString("x"));
    const auto bytes = finish(builder, comm::wire::Createlisteners_message(
                                           builder, 12, builder.CreateVector(std::vector{no_channel})));
    EXPECT_FALSE(decode_listeners(bytes.data(), bytes.size(), pid, out)) << "a listener without channel";
  }
  EXPECT_TRUE(out.empty()) << "a refused message yields nothing";
}

TEST(listeners_codec, damaged_bytes_are_refused_without_harm) {
  const auto good = encode_listeners(77, {{"alpha", "one"}, {"beta", "two"}});
  std::uint32_t pid = 0;
  listener_list out;
  EXPECT_FALSE(decode_listeners(nullptr, 16, pid, out));
  EXPECT_FALSE(decode_listeners(good.data(), 0, pid, out));
  for (std::size_t cut = 1; cut < good.size(); ++cut) {
    EXPECT_FALSE(decode_listeners(good.data(), cut, pid, out)) << "truncated to " << cut;
  }
  // Every single-byte corruption either still verifies or is refused; it
  // never crashes or reads out of bounds.
  std::mt19937 random(1);
  for (int round = 0; round < 2000; ++round) {
    auto bytes = good;
    bytes[random() % bytes.size()] = static_cast<std::uint8_t>(random());
    listener_list any;
    decode_listeners(bytes.data(), bytes.size(), pid, any);
  }
  std::vector<std::uint8_t> garbage(4096);
  for (auto& b : garbage) b = static_cast<std::uint8_t>(random());
  EXPECT_FALSE(decode_listeners(garbage.data(), garbage.size(), pid, out));
}

TEST(listeners_codec, a_large_unsorted_list_decodes_in_reasonable_time) {
  // Inserting one by one into a list would take quadratic time: a hostile
  // peer could wedge the delivery thread with one message.
  listener_list sent;
  std::mt19937 random(7);
  for (int i = 0; i < 100000; ++i) sent.push_back({"channel" + std::to_string(random() % 1000), std::to_string(i)});
  const auto bytes = encode_listeners(9, sent);
  const auto start = std::chrono::steady_clock::now();
  std::uint32_t pid = 0;
  const auto got = decode_ok(bytes, pid);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
  EXPECT_EQ(sent.size(), got.size());
  EXPECT_TRUE(std::is_sorted(got.begin(), got.end()));
}

// Found by fuzzing. The four vector entries refer to one listener table,
// whose channel and id refer to one string: it verifies, yet reading it
// copies 80 bytes of text out of 76. Scaled up (100,000 entries, one 10 KB
// string: a 410 KB message), a receiver spent 14 s and 2 GB building the list.
TEST(listeners_codec, entries_sharing_one_string_are_refused) {
  const std::vector<std::uint8_t> shared = {
      0x04, 0x00, 0x00, 0x00,  // root table at 4
      0xe0, 0xff, 0xff, 0xff,  // root table: its vtable at 4 + 32
      0x05, 0xff, 0xff, 0x00,  // pid
      0x04, 0x00, 0x00, 0x00,  // listeners: the vector at 16
      0x04, 0x00, 0x00, 0x00,  // vector: 4 entries, each to the table at 44
      0x18, 0x00, 0x00, 0x00, 0x14, 0x00, 0x00, 0x00, 0x10, 0x00, 0x00, 0x00, 0x0c, 0x00, 0x00, 0x00,
      0x08, 0x00, 0x0c, 0x00, 0x04, 0x00, 0x08, 0x00,  // vtable of both tables: fields at 4 and 8
      0x08, 0x00, 0x00, 0x00,  // listener table at 44: its vtable at 44 - 8
      0x0c, 0x00, 0x00, 0x00,  // channel: the string at 60
      0x08, 0x00, 0x00, 0x00,  // id: the same string
      0x13, 0x00, 0x00, 0x00,  // unused
      0x0b, 0x00, 0x00, 0x00,  // string at 60: 11 bytes
      0xff, 0xff, 0xff, 0xff, 0x63, 0x63, 0x63, 0x63, 0x63, 0x62, 0x00,
      0x00,  // its terminator
  };
  std::uint32_t pid = 0;
  listener_list out;
  EXPECT_FALSE(comm::verify_listeners(shared.data(), shared.size(), pid));
  EXPECT_FALSE(decode_listeners(shared.data(), shared.size(), pid, out));
  EXPECT_TRUE(out.empty());

  const auto share = [](std::size_t entries, const std::string& text) {
    flatbuffers::FlatBufferBuilder builder;
    const auto string = builder.CreateString(text);
    const auto table = comm::wire::Createlistener(builder, string, string);
    const std::vector<flatbuffers::Offset<comm::wire::listener>> items(entries, table);
    return finish(builder, comm::wire::Createlisteners_message(builder, 5, builder.CreateVector(items)));
  };
  // Sharing that copies no more than was sent is still read.
  const auto small = share(4, "ab");
  EXPECT_EQ(4u, decode_ok(small, pid).size());
  const auto large = share(20000, std::string(1000, 'c'));
  EXPECT_FALSE(decode_listeners(large.data(), large.size(), pid, out)) << "40 MB of copies from 81 KB";
  EXPECT_TRUE(out.empty());
  // Empty strings copy nothing, but a shared table still turns 4 bytes of
  // vector into a list entry of a hundred.
  const auto empty = share(100000, "");
  EXPECT_FALSE(decode_listeners(empty.data(), empty.size(), pid, out)) << "100,000 entries in "
                                                                        << empty.size() << " bytes";
  EXPECT_TRUE(out.empty());
}

}  // namespace
