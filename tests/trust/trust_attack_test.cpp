// A local attacker against the trust boundary, in real processes: a program
// that renames itself in its own loader data, a server of another signer
// squatting on a pipe that we import, a low-trust peer posting a list under
// another process's pid, and a flood of listeners under a pid that no
// connection carries. Each attack runs beside a control that must behave as
// before.
#include <gtest/gtest.h>

#include <windows.h>

#include <psapi.h>

#include <algorithm>
#include <functional>
#include <tuple>

#include "intruder.h"

namespace {

using namespace e2e;
using namespace test_support;
using namespace trust_test;

std::wstring deny(DWORD pid) { return L"DENY pid=" + std::to_wstring(pid) + L" reason: check process security failed"; }


class trust_attack_test : public ::testing::Test {
 protected:
  void SetUp() override { clear_log(); }
};

// The image path of a peer comes from the kernel, not from the peer's own
// memory: an unsigned program that names a signed image in its loader data
// is still the unsigned program.
TEST_F(trust_attack_test, a_program_renaming_itself_in_its_own_memory_is_judged_by_its_real_image) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_trust_masquerade";
  this_process us({{pipe, 0}}, {}, "server");
  ASSERT_TRUE(us.up()) << dump_log();
  const std::string signed_image = full_path("..\\e2e_hosts\\host_a.exe");
  // Image, whether it names host_a in its loader data, the verdict.
  const std::tuple<const char*, bool, const char*> cases[] = {
      {"intruder_a", false, "admitted"},
      {"intruder_unsigned", false, "refused"},
      {"intruder_unsigned", true, "refused"},
  };
  for (const auto& [image, masquerade, expected] : cases) {
    SCOPED_TRACE(std::string(image) + (masquerade ? " naming host_a" : ""));
    intruder peer(image, "masquerade", pipe);
    ASSERT_TRUE(peer.ready()) << peer.output();
    if (masquerade) {
      ASSERT_EQ("ok", peer.run("masquerade " + signed_image));
    }
    ASSERT_EQ("ok server=" + std::to_string(own()), peer.run("connect"));
    EXPECT_EQ(expected, verdict(peer.pid())) << dump_log();
    peer.run("close");
  }
}

// A client admits the server it joins at the level configured for that
// import: by default only a server of its own signer.
TEST_F(trust_attack_test, a_client_joins_only_a_server_that_its_import_level_admits) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_trust_squat";
  // Who serves the pipe (at level 1: it would take us), our import's level,
  // whether we join.
  const std::tuple<const char*, std::uint32_t, bool> cases[] = {
      {"host_a", 0, true},
      {"host_b", 0, false},
      {"host_b", 1, true},
  };
  for (const auto& [image, level, joined] : cases) {
    SCOPED_TRACE(std::string(image) + " at import level " + std::to_string(level));
    clear_log();
    auto server = start_host(image, "squatter", host_config({}, {{pipe, 1}}));
    ASSERT_TRUE(server->ready()) << server->output();
    server->send("register alerts s1");
    this_process us({}, {pipe}, "client", level);
    ASSERT_TRUE(us.up()) << dump_log();
    if (joined) {
      EXPECT_TRUE(us.observer.wait_has(server->pid(), "s1", true, 20s)) << dump_log();
      EXPECT_TRUE(server->wait_for(plus(own(), "client"), 20s)) << server->output();
      continue;
    }
    // Refused, and refused again on the retry, before a byte moved.
    EXPECT_TRUE(wait_until([&] { return find_lines(L"gateway_observer::is_allowed", deny(server->pid())).size() >= 2; },
                           20s))
        << dump_log();
    EXPECT_TRUE(has_line(L"parlo_ipc::pipe_client::run", L"the sink turned down server pid=" +
                                                             std::to_wstring(server->pid())));
    EXPECT_FALSE(has_line(L"gateway_observer::on_remote_start_communication", L"")) << "no hello was read";
    EXPECT_EQ(0u, us.observer.current().count(server->pid()));
    EXPECT_EQ(std::string::npos, server->output().find(plus(own(), "client")));
  }
}

// A low-trust peer may publish its own list, not another process's.
TEST_F(trust_attack_test, a_list_is_taken_only_under_the_pid_of_the_connection_it_came_on) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_trust_forged";
  this_process us({{pipe, 1}}, {}, "server");
  ASSERT_TRUE(us.up()) << dump_log();
  auto genuine = start_host("host_a", "genuine", host_config({pipe}));
  ASSERT_TRUE(genuine->ready()) << genuine->output();
  genuine->send("register alerts g1");
  ASSERT_TRUE(us.observer.wait_has(genuine->pid(), "g1")) << dump_log();

  intruder peer("intruder_b", "forger", pipe);
  ASSERT_TRUE(peer.ready()) << peer.output();
  ASSERT_EQ("ok server=" + std::to_string(own()), peer.run("connect"));
  // The forged lists first, the second with an origin of its own making:
  // once the peer's own list is in, they were handled.
  ASSERT_EQ("ok", peer.write(hello() + listeners(genuine->pid(), 1, "forged") +
                             listeners(genuine->pid(), 1, "origin", genuine->pid()) + listeners(peer.pid(), 1, "own")));
  ASSERT_TRUE(us.observer.wait_has(peer.pid(), "own0", true, 20s)) << "the control: its own list" << dump_log();
  EXPECT_EQ(items{"g1"}, us.observer.current()[genuine->pid()]);
  const auto lines = find_lines(L"comm::service_channel::on_message",
                                L"listeners message of pid=" + std::to_wstring(genuine->pid()) +
                                    L" refused: it came from pid=" + std::to_wstring(peer.pid()));
  ASSERT_EQ(2u, lines.size()) << dump_log();
  EXPECT_EQ(8u, lines[0].level);
  EXPECT_TRUE(find_lines(L"gateway_observer::on_local_error", L"").empty()) << "the connection stays";
}

// Lists under a pid that no connection carries, and lists over the cap, are
// never stored: the memory they came in goes back when the sender goes.
TEST_F(trust_attack_test, a_flood_under_a_phantom_pid_or_over_the_cap_leaves_nothing_behind) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_trust_flood";
  this_process us({{pipe, 1}}, {}, "server");
  ASSERT_TRUE(us.up()) << dump_log();
  const std::uint32_t phantom = 0x3FFFFFF0;  // no process has it
  // One connection from a peer of another signer: hello, what `attack`
  // builds for its pid, a list of its own (in once the rest was handled),
  // then it goes.
  auto round = [&](const std::string& name, const std::function<bytes(DWORD)>& attack) {
    intruder peer("intruder_b", name, pipe);
    ASSERT_TRUE(peer.ready()) << peer.output();
    ASSERT_EQ("ok server=" + std::to_string(own()), peer.run("connect"));
    ASSERT_EQ("ok", peer.write(hello() + attack(peer.pid()) + listeners(peer.pid(), 2, "own")));
    ASSERT_TRUE(us.observer.wait_has(peer.pid(), "own1", true, 60s)) << dump_log();
    EXPECT_TRUE(find_lines(L"gateway_observer::on_local_error", L"").empty()) << "the connection stays";
    peer.run("close");
    ASSERT_TRUE(us.observer.wait_gone(peer.pid(), 20s));
  };
  // A round of the same sizes first, under our own pid, which every
  // receiver drops before reading the list: the pipe, the messaging library
  // and the heap make what they keep for messages this large. The bytes in
  // use are counted block by block: the resident memory moves by a few MiB
  // from round to round under Wine with the blocks the heap keeps free.
  round("warm_up", [](DWORD) { return listeners(own(), 100000, "w") + listeners(own(), 65537, "b"); });
  clear_log();
  const long long before = heap_bytes_in_use();
  const long long resident_before = private_bytes();
  round("flood", [&](DWORD self) { return listeners(phantom, 100000, "p") + listeners(self, 65537, "big"); });
  EXPECT_EQ(0u, us.observer.current().count(phantom));
  EXPECT_TRUE(has_line(L"comm::service_channel::on_message",
                       L"listeners message of pid=" + std::to_wstring(phantom) + L" refused: it came from pid="))
      << dump_log();
  EXPECT_TRUE(has_line(L"comm::service_channel::on_message", L" refused: 65537 listeners, more than 65536"))
      << dump_log();
  // The connection's thread gives its buffers back just after the
  // disconnect that emptied the table.
  long long after = 0;
  wait_until([&] { return (after = heap_bytes_in_use()) - before < (1 << 20); }, 10s);
  std::printf("heap in use: %lld KiB before the flood, %lld KiB after its sender left (resident %lld -> %lld KiB)\n",
              before / 1024, after / 1024, resident_before / 1024, private_bytes() / 1024);
  EXPECT_LT(after - before, 1 << 20) << "bytes the flood left in use";
}

}  // namespace
