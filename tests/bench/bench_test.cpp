// The benchmark program's own parts: the statistics its tables are made of,
// the listener names the byte formula rests on, the raw pipe baseline, and
// the bus helpers over a real gateway.
#include <gtest/gtest.h>

#include <windows.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "bench_support.h"
#include "bus/comm/listeners_codec.h"
#include "bus_side.h"
#include "codec_bench.h"
#include "raw_pipe.h"
#include "stats.h"
#include "support/log_capture.h"

namespace {

using namespace std::chrono_literals;

TEST(bench_stats, percentiles_are_nearest_rank_of_unsorted_samples) {
  std::vector<double> samples;
  for (int i = 1000; i >= 1; --i) samples.push_back(i);
  const bench::summary s = bench::summarize(samples);
  EXPECT_EQ(1000u, s.count);
  EXPECT_EQ(500, s.p50);
  EXPECT_EQ(990, s.p99) << "the 990th of 1,000, not an interpolation";
  EXPECT_EQ(1000, s.max);
  EXPECT_DOUBLE_EQ(500.5, s.mean);
  // Few samples: p99 is the largest, never past the end.
  EXPECT_EQ(3, bench::summarize({3, 1, 2}).p99);
  EXPECT_EQ(0, bench::summarize({}).p50);
}

TEST(bench_stats, verdicts_name_the_shortfall) {
  EXPECT_EQ("met", bench::verdict_at_most(1.5, 1.5));
  EXPECT_EQ("**missed** by 20 %", bench::verdict_at_most(1.8, 1.5));
  EXPECT_EQ("met", bench::verdict_below(1999, 2000));
  EXPECT_NE("met", bench::verdict_below(2000, 2000)) << "a strict bound";
}

TEST(bench_names, each_listener_adds_52_bytes_so_the_publications_sum_to_26_n_squared) {
  // Ids ascend, so the table is already in listener order.
  const listener_list table = bench::make_listener_table(300);
  EXPECT_TRUE(std::is_sorted(table.begin(), table.end()));
  EXPECT_EQ(19u, table.back().id.size());
  listener_list growing;
  std::size_t previous = comm::encode_listeners(77, growing).size();
  for (const listener& item : table) {
    growing.push_back(item);
    const std::size_t size = comm::encode_listeners(77, growing).size();
    ASSERT_EQ(previous + 52, size) << "at " << growing.size() << " listeners";
    previous = size;
  }
}

// The serving end and a client thread in this process.
struct raw_pair {
  explicit raw_pair(bool sink) {
    const std::string name = bench::pipe_name(sink ? "test_sink" : "test_echo");
    created = server.create(name);
    client = std::thread([this, name, sink] {
      winapi::unique_handle pipe;
      if (bench::raw_pipe_open(name, pipe) == 0) bench::raw_pipe_echo(pipe.get(), sink);
    });
    accepted = created && server.accept();
  }
  ~raw_pair() {
    server = bench::raw_pipe_server();  // closes the pipe: the client's read ends
    client.join();
  }
  bench::raw_pipe_server server;
  std::thread client;
  bool created = false;
  bool accepted = false;
};

TEST(bench_raw_pipe, echo_returns_every_size_the_benchmark_uses) {
  raw_pair pair(/* sink */ false);
  ASSERT_TRUE(pair.accepted);
  for (std::size_t size : {std::size_t{1}, std::size_t{64}, std::size_t{65536}, bench::raw_max_message}) {
    EXPECT_TRUE(pair.server.round_trip(std::string(size, 'e'))) << size << " bytes";
  }
}

TEST(bench_raw_pipe, a_sink_reads_messages_larger_than_its_buffer_and_still_answers) {
  // A whole table of 5,000 listeners is 260 KB; a sink that gave up on a
  // message larger than its buffer would leave the writer blocked for good.
  raw_pair pair(/* sink */ true);
  ASSERT_TRUE(pair.accepted);
  auto done = std::async(std::launch::async, [&] {
    return pair.server.send(std::string(bench::raw_max_message + 4096, 's')) &&
           pair.server.send(std::string(300000, 't')) && pair.server.round_trip(std::string(1, '!'));
  });
  ASSERT_EQ(std::future_status::ready, done.wait_for(20s));
  EXPECT_TRUE(done.get());
}

struct echo_probe {
  std::atomic<std::uint64_t> sequence{0};
  std::atomic<std::uint32_t> id{0};
  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<echo_probe*>(context);
    self->id = message->message_id();
    self->sequence = bench::payload_sequence(message);
  }
};

TEST(bench_bus_side, a_post_on_the_serving_bus_reaches_the_joined_bus_with_its_sequence) {
  const std::string pipe = bench::pipe_name("test_bus");
  bench::bus_side server;
  ASSERT_TRUE(server.serve(pipe));
  bench::bus_side client;
  echo_probe probe;
  ASSERT_TRUE(client.join(pipe));
  ASSERT_TRUE(client.subscribe(bench::bench_channel, &echo_probe::on_message, &probe));
  EXPECT_FALSE(client.subscribe("no_such_channel", &echo_probe::on_message, &probe));
  // Posts until the gateway has connected and admitted the client.
  std::uint64_t sent = 0;
  const bool arrived = test_support::wait_until(
      [&] {
        server.post(7, bench::make_payload(64, ++sent));
        return probe.sequence.load() != 0;
      },
      20s);
  ASSERT_TRUE(arrived);
  EXPECT_EQ(7u, probe.id.load());
  EXPECT_LE(probe.sequence.load(), sent);

  // A payload shorter than a sequence number reads as 0; one is never made
  // shorter than 8 bytes.
  parlo::message* shortened = server.messaging()->create_message(0);
  ASSERT_NE(nullptr, shortened);
  shortened->set_blob("payload", "abc", 3);
  EXPECT_EQ(0u, bench::payload_sequence(shortened));
  shortened->release();
  EXPECT_EQ(8u, bench::make_payload(3, 9).size());
}

// vorbel_bench.exe in bin/, three folders up from this test's own folder.
std::wstring bench_image() {
  std::wstring path = bench::own_image();
  path.resize(path.find_last_of(L'\\') + 1);
  return path + L"..\\..\\..\\bin\\vorbel_bench.exe";
}

struct service_line {
  unsigned long long publications = ~0ull;
  unsigned long long bytes = ~0ull;
  unsigned long long empty = ~0ull;
  unsigned long long removed = ~0ull;
};
service_line service(bench::peer_process& peer) {
  service_line s;
  const std::string line = peer.request("service", "service");
  std::sscanf(line.c_str(), "service pubs=%llu bytes=%llu empty=%llu removed=%llu", &s.publications, &s.bytes,
              &s.empty, &s.removed);
  return s;
}

TEST(bench_peer, the_peer_counts_what_the_convergence_table_is_made_of) {
  bench::peer_process peer;
  ASSERT_TRUE(peer.start(bench_image()));

  bench::raw_pipe_server raw;
  const std::string raw_pipe = bench::pipe_name("test_peer_raw");
  ASSERT_TRUE(raw.create(raw_pipe));
  ASSERT_FALSE(peer.request("raw " + raw_pipe + " echo", "ok raw").empty());
  ASSERT_TRUE(raw.accept());
  EXPECT_TRUE(raw.round_trip(std::string(64, 'r')));

  const std::string pipe = bench::pipe_name("test_peer_bus");
  bench::bus_side side;
  ASSERT_TRUE(side.serve(pipe));
  ASSERT_FALSE(peer.request("bus " + pipe, "ok bus").empty());
  // The handshake: this process's empty table, on connect and on request.
  ASSERT_TRUE(test_support::wait_until([&] { return service(peer).empty >= 2; }, 20s));

  ASSERT_FALSE(peer.request("watch print", "ok watch").empty());
  const listener_list table = bench::make_listener_table(3);
  const std::int64_t start = bench::now_ticks();
  std::size_t exact = 0;
  listener_list growing;
  for (const listener& item : table) {
    ASSERT_EQ(0u, side.bus()->register_listener(item.channel.c_str(), item.id.c_str()));
    growing.push_back(item);
    exact += comm::encode_listeners(::GetCurrentProcessId(), growing).size();
  }
  for (const listener& item : table) {
    const std::string line = peer.take_line("+ " + item.id + " ", 10s);
    ASSERT_FALSE(line.empty()) << item.id;
    EXPECT_GT(std::stoll(line.substr(line.find_last_of(' ') + 1)), start) << "one clock for both processes";
  }
  ASSERT_FALSE(peer.request("watch count 3", "ok watch").empty());
  EXPECT_FALSE(peer.take_line("all 3 ", 10s).empty()) << "B already holds all three";

  service_line counted = service(peer);
  EXPECT_EQ(3u, counted.publications) << "one whole-table publication per registration";
  EXPECT_EQ(exact, counted.bytes);
  EXPECT_EQ(0u, counted.removed);

  ASSERT_FALSE(peer.request("watch print", "ok watch").empty());
  ASSERT_EQ(0u, side.bus()->unregister_listener(bench::bench_channel, table.front().id.c_str()));
  EXPECT_FALSE(peer.take_line("- " + table.front().id + " ", 10s).empty());
  counted = service(peer);
  EXPECT_EQ(4u, counted.publications);
  EXPECT_EQ(1u, counted.removed);
}

}  // namespace
