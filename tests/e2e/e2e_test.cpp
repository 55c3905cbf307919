// The system across real processes: this test program is one process of the
// product (signed like every program of the build), and vorbel_host
// processes, signed in several ways, are its peers over named pipes.
#include <gtest/gtest.h>

#include "e2e/host_process.h"

namespace {

using namespace e2e;
using namespace test_support;

const std::string level0 = "\\\\.\\pipe\\vorbel_e2e_level0";
const std::string level1 = "\\\\.\\pipe\\vorbel_e2e_level1";

std::wstring deny(DWORD pid) {
  return L"DENY pid=" + std::to_wstring(pid) + L" reason: check process security failed";
}

class e2e_test : public ::testing::Test {
 protected:
  void SetUp() override { clear_log(); }
};

TEST_F(e2e_test, admission_depends_on_the_peers_signer_and_the_pipes_level) {
  this_process us({{level0, 0}, {level1, 1}}, {}, "a1");
  ASSERT_TRUE(us.up()) << dump_log();

  // Another signer: refused where only our signer may come, admitted on the
  // pipe that takes any valid signer.
  auto other = start_host("host_b", "peer_b", host_config({level0, level1}, {}, 1));
  ASSERT_TRUE(other->ready()) << other->output();
  other->send("register alerts b1");
  EXPECT_TRUE(us.observer.wait_has(other->pid(), "b1"));
  EXPECT_TRUE(wait_for_line(L"gateway_observer::is_allowed_process", L"found it in cache, trust=low_trust", patience))
      << "the refused pipe's client retries and is answered from the cache";
  EXPECT_TRUE(wait_until([&] { return find_lines(L"gateway_observer::is_allowed", deny(other->pid())).size() >= 2; },
                         patience))
      << "the first decision and the retry answered from the cache both refuse it:\n" << dump_log();

  // Unsigned and tampered peers: refused on both levels, the retry from the
  // cache, and they learn nothing.
  for (const std::string image : {"host_unsigned", "host_tampered"}) {
    clear_log();
    auto bad = start_host(image, "peer_" + image, host_config({level0, level1}));
    ASSERT_TRUE(bad->ready()) << bad->output();
    bad->send("register alerts x1");
    EXPECT_TRUE(wait_until([&] {
      return find_lines(L"gateway_observer::is_allowed", deny(bad->pid())).size() >= 3;
    }, patience)) << "a first refusal and retries:\n" << dump_log();
    EXPECT_TRUE(wait_for_line(L"gateway_observer::is_allowed_process", L"found it in cache, trust=untrusted", patience));
    EXPECT_FALSE(us.bus().is_registered_listener("alerts", "x1"));
    EXPECT_EQ(std::string::npos, bad->output().find(plus(own(), "a1")));
  }
}

// A server, this process and another client: the server learns both
// clients' listeners and they learn the server's; a server killed and
// restarted under the same pipe name is rejoined and the tables converge.
TEST_F(e2e_test, processes_exchange_tables_and_rejoin_a_restarted_server) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_e2e_restart";
  auto server = start_host("host_a", "server_1", host_config({}, {{pipe, 0}}));
  ASSERT_TRUE(server->ready());
  server->send("register alerts s1");
  server->send("register alerts s2");
  this_process us({}, {pipe}, "c1");
  ASSERT_TRUE(us.up()) << dump_log();
  auto client = start_host("host_a", "client", host_config({pipe}));
  ASSERT_TRUE(client->ready());
  client->send("register alerts c2");
  EXPECT_TRUE(us.observer.wait_has(server->pid(), "s2"));
  EXPECT_TRUE(server->wait_for(plus(own(), "c1")) && server->wait_for(plus(client->pid(), "c2")));
  server->send("unregister alerts s2");
  EXPECT_TRUE(us.observer.wait_has(server->pid(), "s2", false));

  const DWORD old_pid = server->pid();
  server->kill();
  EXPECT_TRUE(us.observer.wait_gone(old_pid));
  EXPECT_TRUE(client->wait_for("- pid=" + std::to_string(old_pid) + " channel=alerts id=s1"));
  server = start_host("host_a", "server_2", host_config({}, {{pipe, 0}}));
  ASSERT_TRUE(server->ready());
  server->send("register alerts s3");
  // The clients find the new server after their backoff.
  EXPECT_TRUE(us.observer.wait_has(server->pid(), "s3")) << dump_log();
  EXPECT_TRUE(client->wait_for(plus(server->pid(), "s3")));
  EXPECT_TRUE(server->wait_for(plus(own(), "c1")));
}

// A listener too large for any message is refused with 87 and a line,
// instead of being taken and making every later publication unreadable: the
// process's later listeners still reach its peer, and the peer never sees a
// publication without its table.
TEST_F(e2e_test, an_oversized_listener_is_refused_and_later_ones_still_reach_the_peer) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_e2e_oversize";
  this_process us({{pipe, 0}}, {}, "before");
  ASSERT_TRUE(us.up()) << dump_log();
  write_file("oversize_peer.log", "");  // the logging library appends
  auto peer = start_host("host_a", "oversize_peer", host_config({pipe}));
  ASSERT_TRUE(peer->ready()) << peer->output();
  ASSERT_TRUE(peer->wait_for(plus(own(), "before"), 20s)) << peer->output();
  const std::string huge(16u << 20, 'h');
  EXPECT_EQ(87u, us.bus().register_listener("alerts", huge.c_str()));
  EXPECT_TRUE(has_line(L"bus::register_listener", L"id longer than 65536 bytes")) << dump_log();
  EXPECT_EQ(0u, us.bus().register_listener("alerts", "after"));
  EXPECT_TRUE(peer->wait_for(plus(own(), "after"), 20s)) << peer->output();
  // A table as large as the bus takes still reaches the peer whole, with
  // what the pipe adds to it on the way.
  std::string id(ibus_max_listener_name, 'i');
  for (int i = 100; i < 400 && us.bus().register_listener("big", id.replace(0, 3, std::to_string(i)).c_str()) == 0;) ++i;
  EXPECT_TRUE(has_line(L"bus::register_listener", L"listener refused: the table would take more than")) << dump_log();
  EXPECT_EQ(0u, us.bus().register_listener("alerts", "last"));
  EXPECT_TRUE(peer->wait_for(plus(own(), "last"), 30s)) << "the full table did not reach the peer";
  EXPECT_EQ(std::string::npos, read_file("oversize_peer.log").find("params blob")) << "the peer got an empty publication";
  EXPECT_FALSE(has_line(L"comm::service_channel::publish_listeners", L"")) << dump_log();
}

}  // namespace
