// The listeners message on the wire: what a receiver accepts and refuses.
// Random damage and size limits are the native fuzzer's; the cases here are
// the ones it found.
#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "listeners_message_generated.h"

namespace wire = comm::wire;

bool decodes(const std::vector<std::uint8_t>& bytes, std::uint32_t& pid, listener_list& out) {
  return comm::decode_listeners(bytes.data(), bytes.size(), pid, out);
}

std::vector<std::uint8_t> finish(flatbuffers::FlatBufferBuilder& builder,
                                 std::vector<flatbuffers::Offset<wire::listener>> items, bool with_vector = true) {
  builder.Finish(wire::Createlisteners_message(builder, 12, with_vector ? builder.CreateVector(items) : 0));
  return std::vector<std::uint8_t>(builder.GetBufferPointer(), builder.GetBufferPointer() + builder.GetSize());
}

TEST(listeners_codec, round_trip_sorts_keeps_duplicates_and_leaves_pid_0_out) {
  // pid, sent, received; an empty vector is still there
  const std::tuple<std::uint32_t, listener_list, listener_list> cases[] = {
      {7, {}, {}}, {0, {{"c", "i"}}, {{"c", "i"}}},
      {5, {{"b", "1"}, {"a", "2"}, {"b", "0"}, {"a", "2"}, {"ab", ""}},
       {{"a", "2"}, {"a", "2"}, {"ab", ""}, {"b", "0"}, {"b", "1"}}}};
  for (const auto& [sent_pid, sent, expected] : cases) {
    const auto bytes = comm::encode_listeners(sent_pid, sent);
    const auto* root = flatbuffers::GetRoot<flatbuffers::Table>(bytes.data());
    EXPECT_EQ(sent_pid != 0, root->CheckField(wire::listeners_message::VT_PID)) << sent_pid;
    std::uint32_t pid = 99;
    listener_list got;
    EXPECT_TRUE(decodes(bytes, pid, got) && pid == sent_pid) << pid;
    EXPECT_EQ(expected, got) << sent_pid;
  }
  // The id string is created before the channel string, so (building back to
  // front) it lies after it in the buffer.
  const auto bytes = comm::encode_listeners(1, {{"channel-text", "id-text"}});
  const auto* item = wire::Getlisteners_message(bytes.data())->listeners()->Get(0);
  EXPECT_GT(reinterpret_cast<std::uintptr_t>(item->id()), reinterpret_cast<std::uintptr_t>(item->channel()));
}

TEST(listeners_codec, incomplete_or_cut_messages_are_refused_whole) {
  std::uint32_t pid = 0;
  listener_list out;
  flatbuffers::FlatBufferBuilder no_vector, no_id;
  EXPECT_FALSE(decodes(finish(no_vector, {}, /* with_vector */ false), pid, out));
  const auto good = wire::Createlistener(no_id, no_id.CreateString("a"), no_id.CreateString("x"));
  EXPECT_FALSE(decodes(finish(no_id, {good, wire::Createlistener(no_id, no_id.CreateString("b"), 0)}), pid, out));
  const auto bytes = comm::encode_listeners(77, {{"alpha", "one"}, {"beta", "two"}});
  EXPECT_FALSE(comm::decode_listeners(nullptr, 16, pid, out));
  for (std::size_t n = 0; n < bytes.size(); ++n) EXPECT_FALSE(comm::decode_listeners(bytes.data(), n, pid, out)) << n;
  EXPECT_TRUE(out.empty()) << "a refused message yields nothing";
}

// Found by fuzzing: vector entries that all refer to one listener table,
// whose channel and id refer to one string, verify; reading them copied far
// more text than was sent (100,000 entries and one 10 KB string, a 410 KB
// message: 14 s and 2 GB to build the list).
TEST(listeners_codec, entries_sharing_one_string_are_refused) {
  const auto share = [](std::size_t entries, const std::string& text) {
    flatbuffers::FlatBufferBuilder builder;
    const auto string = builder.CreateString(text);
    return finish(builder, std::vector(entries, wire::Createlistener(builder, string, string)));
  };
  std::uint32_t pid = 0;
  listener_list small, out;
  EXPECT_TRUE(decodes(share(4, "ab"), pid, small) && small.size() == 4) << "sharing that copies no more than was sent";
  const auto large = share(20000, std::string(1000, 'c'));
  EXPECT_FALSE(comm::verify_listeners(large.data(), large.size(), pid)) << "40 MB of copies from 81 KB";
  EXPECT_FALSE(decodes(large, pid, out));
  // More entries than the buffer holds: each 4 bytes of vector would become
  // a list entry of a hundred.
  EXPECT_FALSE(decodes(share(100000, ""), pid, out));
  EXPECT_TRUE(out.empty());
}


// What a sender counts instead of encoding: never less than the message, so
// a table it accepts always fits; and not much more, so it refuses little
// that would have fitted. Every string length modulo 4 is covered, empty
// strings and long ones included; the reusable encoder gives the same bytes.
TEST(listeners_codec, the_size_bound_holds_for_every_string_length) {
  comm::listeners_encoder encoder;
  for (std::size_t count : {0, 1, 2, 7, 100}) {
    for (std::size_t length = 0; length < 12; ++length) {
      listener_set table;
      std::uint64_t bound = comm::listeners_fixed_bound;
      for (std::size_t i = 0; i < count; ++i) {
        listener item{std::string((length + i) % 9, 'c'), std::string(length * (i % 3) + i % 5, 'i') + std::to_string(i)};
        bound += comm::listener_encoded_bound(item.channel.size(), item.id.size());
        table.insert(std::move(item));
      }
      const auto bytes = comm::encode_listeners(0xFFFFFFFF, listener_list(table.begin(), table.end()));
      EXPECT_LE(bytes.size(), bound) << count << " listeners, length " << length;
      EXPECT_LE(bound - bytes.size(), 64 + 8 * count) << count << " listeners, length " << length;
      const auto reused = encoder.encode(0xFFFFFFFF, table);
      EXPECT_EQ(bytes, std::vector<std::uint8_t>(reused.data, reused.data + reused.size));
    }
  }
  listener_set big;
  big.insert({"c", std::string(65536, 'x')});
  const auto one = encoder.encode(1, big);  // the encoder grows past its first buffer
  EXPECT_LE(one.size, comm::listeners_fixed_bound + comm::listener_encoded_bound(1, 65536));
  std::uint32_t pid = 0;
  listener_list out;
  EXPECT_TRUE(comm::decode_listeners(one.data, one.size, pid, out) && out.size() == 1 && pid == 1);
}

// The listener order is std::string's: bytes compared unsigned, the shorter
// string first on a common prefix, channel before id.
TEST(listeners_codec, listeners_order_by_unsigned_bytes_channel_first) {
  const std::pair<listener, listener> ascending[] = {
      {{"a", "z"}, {"b", "a"}}, {{"a", ""}, {"a", "0"}}, {{"ab", "a"}, {"abc", ""}}, {{"a", "\x7f"}, {"a", "\x80"}},
      {{"\x01", "x"}, {"\xff", "x"}}, {{"same", "id-1"}, {"same", "id-10"}}};
  for (const auto& [low, high] : ascending) {
    EXPECT_TRUE(low < high && !(high < low) && !(low < low)) << low.channel << "/" << low.id;
  }
}
