// Writes the seed corpora of the fuzzers: real messages made by the encoders,
// one file each, into <out>/listeners, <out>/message_codec and <out>/frame.
//
//   fuzz_seeds build-fuzz/seeds
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "frame_codec.h"
#include "listeners_message_generated.h"
#include "message_codec.h"

namespace {

namespace fs = std::filesystem;
using bytes = std::vector<unsigned char>;

bool failed = false;

void write_seed(const fs::path& dir, const std::string& name, const bytes& content) {
  std::ofstream out(dir / name, std::ios::binary | std::ios::trunc);
  out.write(reinterpret_cast<const char*>(content.data()), static_cast<std::streamsize>(content.size()));
  if (!out) {
    std::fprintf(stderr, "fuzz_seeds: cannot write %s\n", (dir / name).string().c_str());
    failed = true;
  }
}

void check(bool ok, const char* what) {
  if (ok) return;
  std::fprintf(stderr, "fuzz_seeds: encoding failed: %s\n", what);
  failed = true;
}

bytes listeners_bytes(std::uint32_t pid, const listener_list& listeners) {
  const std::vector<std::uint8_t> out = comm::encode_listeners(pid, listeners);
  return bytes(out.begin(), out.end());
}

// A valid buffer that no bus writes: `entries` vector entries all refer to
// one listener table, so the receiver copies its strings once per entry.
bytes shared_table_bytes(std::size_t entries, const std::string& channel, const std::string& id) {
  flatbuffers::FlatBufferBuilder builder;
  const auto table = comm::wire::Createlistener(builder, builder.CreateString(channel), builder.CreateString(id));
  const std::vector<flatbuffers::Offset<comm::wire::listener>> items(entries, table);
  builder.Finish(comm::wire::Createlisteners_message(builder, 5, builder.CreateVector(items)));
  return bytes(builder.GetBufferPointer(), builder.GetBufferPointer() + builder.GetSize());
}

// The listeners messages a bus publishes, and one shaped by hand.
std::vector<std::pair<std::string, bytes>> listeners_seeds() {
  listener_list many;
  for (int i = 0; i < 200; ++i) {
    // Unsorted, with repeats: what a peer that does not sort might send.
    many.push_back({"channel" + std::to_string((i * 37) % 50), "listener" + std::to_string(i % 120)});
  }
  return {
      {"empty", listeners_bytes(4242, {})},
      {"empty_pid_zero", listeners_bytes(0, {})},
      {"one", listeners_bytes(1234, {{"orders", "billing"}})},
      {"same_channel_two_ids", listeners_bytes(77, {{"orders", "a"}, {"orders", "b"}})},
      {"duplicates", listeners_bytes(78, {{"x", "1"}, {"x", "1"}, {"a", ""}, {"", "z"}})},
      {"many", listeners_bytes(0xFFFFFFFFu, many)},
      {"long_names", listeners_bytes(9, {{std::string(1000, 'c'), std::string(255, 'i')},
                                         {std::string(300, 'd'), "short"}})},
      {"zero_bytes", listeners_bytes(10, {{std::string("chan\0nel", 8), std::string("\0id", 3)},
                                          {std::string(4, '\0'), "plain"}})},
      {"utf8", listeners_bytes(11, {{"k\xC3\xA4nal", "\xE2\x9C\x93"}})},
      {"shared_table", shared_table_bytes(4, "ab", "c")},
  };
}

parlo::codec::blob_field blob(std::string name, const bytes& data) {
  return parlo::codec::blob_field{std::move(name), data};
}

bytes wire_bytes(const parlo::codec::message_content& content) {
  bytes out;
  check(parlo::codec::encode(content, out) == parlo::codec::status::ok, "message");
  return out;
}

// Messages of the service channel and of ordinary channels in wire form.
std::vector<std::pair<std::string, bytes>> message_seeds() {
  parlo::codec::message_content request;
  request.id = 1;
  parlo::codec::message_content listeners;
  listeners.id = 2;
  listeners.fields.push_back(blob("params", listeners_bytes(4242, {{"orders", "billing"}, {"audit", "x"}})));
  parlo::codec::message_content several;
  several.id = 0x01020304;
  several.fields.push_back(blob("params", {1, 2, 3, 4}));
  several.fields.push_back(blob("empty", {}));
  several.fields.push_back(blob("binary", {0, 0xFF, 0, 0x80, 0x7F}));
  several.fields.push_back(blob(std::string(255, 'n'), bytes(64, 0xAB)));
  several.fields.push_back(blob("text", bytes{'h', 'e', 'l', 'l', 'o'}));
  parlo::codec::message_content many_fields;
  many_fields.id = 3;
  for (int i = 0; i < 100; ++i) many_fields.fields.push_back(blob("f" + std::to_string(i), bytes(i % 7, 'v')));
  parlo::codec::message_content large;
  large.id = 4;
  large.fields.push_back(blob("payload", bytes(3000, 0x5A)));
  return {
      {"request", wire_bytes(request)},
      {"listeners", wire_bytes(listeners)},
      {"several_blobs", wire_bytes(several)},
      {"many_fields", wire_bytes(many_fields)},
      {"large_blob", wire_bytes(large)},
  };
}

bytes hello_frame(const std::string& bus, const std::vector<std::string>& channels) {
  parlo::ipc::frame::hello value;
  value.bus_name = bus;
  value.channels = channels;
  bytes out;
  check(parlo::ipc::frame::encode_hello(value, out) == parlo::ipc::frame::status::ok, "hello");
  return out;
}

bytes message_frame(const std::string& channel, const bytes& wire) {
  bytes out;
  check(parlo::ipc::frame::encode_message(channel, wire.data(), wire.size(), out) ==
            parlo::ipc::frame::status::ok,
        "message frame");
  return out;
}

// Each frame type, alone and as a connection's stream of frames.
std::vector<std::pair<std::string, bytes>> frame_seeds() {
  const auto messages = message_seeds();
  const bytes server_hello = hello_frame("bus_a", {"vorbel_service", "orders", "audit"});
  const bytes client_hello = hello_frame("bus_a", {});
  std::vector<std::string> many;
  for (int i = 0; i < 64; ++i) many.push_back("channel" + std::to_string(i));
  std::vector<std::pair<std::string, bytes>> seeds = {
      {"hello_server", server_hello},
      {"hello_client", client_hello},
      {"hello_many_channels", hello_frame(std::string(255, 'b'), many)},
  };
  bytes stream = server_hello;
  for (const auto& [name, wire] : messages) {
    const bytes frame = message_frame(name == "request" || name == "listeners" ? "vorbel_service" : "orders", wire);
    seeds.emplace_back("message_" + name, frame);
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  seeds.emplace_back("stream", stream);
  return seeds;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: fuzz_seeds <output folder>\n");
    return 2;
  }
  const fs::path root = argv[1];
  const std::pair<const char*, std::vector<std::pair<std::string, bytes>>> sets[] = {
      {"listeners", listeners_seeds()},
      {"message_codec", message_seeds()},
      {"frame", frame_seeds()},
  };
  for (const auto& [folder, seeds] : sets) {
    std::error_code error;
    fs::create_directories(root / folder, error);
    if (error) {
      std::fprintf(stderr, "fuzz_seeds: cannot create %s: %s\n", (root / folder).string().c_str(),
                   error.message().c_str());
      return 1;
    }
    for (const auto& [name, content] : seeds) write_seed(root / folder, name, content);
  }
  return failed ? 1 : 0;
}
