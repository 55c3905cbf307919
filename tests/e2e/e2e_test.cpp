// The system across real processes under Wine: this test program is one
// process of the product (its registry, bus and gateway built from a
// configuration, signed like every program of the build), and vorbel_host
// processes, signed in several ways, are its peers over named pipes.
#include <gtest/gtest.h>

#include <windows.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "e2e/host_process.h"
#include "gateway/gateway.h"
#include "registry/vorbel_impl.h"
#include "support/bus_observer.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

using e2e::host_image;
using e2e::host_process;
using namespace std::chrono_literals;
using test_support::added;
using test_support::notification;
using test_support::removed;

// A JSON configuration for a host: imports of `channel` over each pipe (the
// same-named channel of bus "main") and/or exports on pipes.
struct host_config {
  std::vector<std::string> imports;  // pipes
  std::vector<std::pair<std::string, int>> exports;  // pipe, security
  std::string channel = "alerts";

  std::string json() const {
    std::string text = "{\"bus\": \"main\", \"local_channels\": [\"" + channel + "\"]";
    auto escape = [](const std::string& pipe) {
      std::string out;
      for (char c : pipe) {
        if (c == '\\') out += '\\';
        out += c;
      }
      return out;
    };
    if (!imports.empty()) {
      text += ", \"imported_channels\": [";
      for (std::size_t i = 0; i < imports.size(); ++i) {
        text += (i ? ", " : "") + std::string("{\"channel\": \"") + channel + "\", \"pipe\": \"" +
                escape(imports[i]) + "\", \"remote_channel\": \"" + channel +
                "\", \"remote_bus\": \"main\"}";
      }
      text += "]";
    }
    if (!exports.empty()) {
      text += ", \"exported_channels\": [";
      for (std::size_t i = 0; i < exports.size(); ++i) {
        text += (i ? ", " : "") + std::string("{\"channel\": \"") + channel + "\", \"pipe\": \"" +
                escape(exports[i].first) + "\", \"security\": " + std::to_string(exports[i].second) + "}";
      }
      text += "]";
    }
    return text + "}";
  }
};

host_config importing(std::vector<std::string> pipes) {
  host_config config;
  config.imports = std::move(pipes);
  return config;
}

std::unique_ptr<host_process> start_host(const wchar_t* image, const std::wstring& name,
                                         const host_config& config) {
  const std::wstring config_path = e2e::write_file(name + L".json", config.json());
  const std::wstring log_path = e2e::program_dir() + name + L".log";
  ::DeleteFileW(log_path.c_str());
  return std::make_unique<host_process>(host_image(image), config_path, log_path);
}

std::string host_log(const std::wstring& name) {
  return e2e::read_file(e2e::program_dir() + name + L".log");
}

std::string plus(DWORD pid, const std::string& channel, const std::string& id) {
  return "+ pid=" + std::to_string(pid) + " channel=" + channel + " id=" + id;
}
std::string minus(DWORD pid, const std::string& channel, const std::string& id) {
  return "- pid=" + std::to_string(pid) + " channel=" + channel + " id=" + id;
}

const std::string pipe_level0 = "\\\\.\\pipe\\vorbel_e2e_level0";
const std::string pipe_level1 = "\\\\.\\pipe\\vorbel_e2e_level1";

// This process's side: a registry with one bus that exports or imports.
class e2e_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  void TearDown() override {
    if (bus_ != nullptr) {
      bus_->remove_observer(&observer, 0);
      registry.destroy_bus("main");
    }
  }

  void start_bus(const std::vector<std::pair<std::string, std::uint32_t>>& exports,
                 const std::vector<std::string>& imports = {}) {
    provider.local = {"alerts"};
    for (const auto& [pipe, level] : exports) provider.exports.push_back({"alerts", pipe, true, 3, level});
    for (const auto& pipe : imports) provider.imports.push_back({"alerts", pipe, "alerts", "main"});
    bus_ = registry.create_bus("main", &provider);
    ASSERT_NE(nullptr, bus_);
    ASSERT_NE(nullptr, registry.get_gateway("main")) << test_support::dump_log();
    ASSERT_TRUE(bus_->add_observer(&observer, 0));
  }
  gateway_observer& events() { return static_cast<gateway*>(registry.get_gateway("main"))->events(); }

  bool heard(const notification& expected, std::chrono::milliseconds timeout = 10s) {
    return test_support::wait_until(
        [&] {
          const auto seen = observer.seen();
          return std::find(seen.begin(), seen.end(), expected) != seen.end();
        },
        timeout);
  }
  bool log_has(const std::wstring& function, const std::wstring& part,
               std::chrono::milliseconds timeout = 10s) {
    return test_support::wait_for_line(function, part, timeout);
  }

  DWORD own() const { return ::GetCurrentProcessId(); }

  vorbel_impl registry;
  test_support::config_provider provider;
  test_support::recording_bus_observer observer;
  ibus* bus_ = nullptr;
};

TEST_F(e2e_test, two_processes_exchange_tables_and_a_killed_peer_is_dropped) {
  start_bus({{pipe_level0, 0}});
  ASSERT_EQ(0u, bus_->register_listener("alerts", "a1"));
  auto peer = start_host(L"host_a", L"peer_a", importing({pipe_level0}));
  ASSERT_TRUE(peer->ready()) << peer->output();

  peer->send("register alerts b1");
  EXPECT_TRUE(heard(added(peer->pid(), "alerts", "b1"))) << test_support::dump_log();
  EXPECT_TRUE(peer->wait_for(plus(own(), "alerts", "a1"))) << peer->output();
  EXPECT_TRUE(bus_->is_registered_listener("alerts", "b1"));

  peer->send("unregister alerts b1");
  EXPECT_TRUE(heard(removed(peer->pid(), "alerts", "b1")));
  ASSERT_EQ(0u, bus_->register_listener("alerts", "a2"));
  EXPECT_TRUE(peer->wait_for(plus(own(), "alerts", "a2"))) << peer->output();

  peer->send("register alerts b2");
  peer->send("register alerts b3");
  ASSERT_TRUE(heard(added(peer->pid(), "alerts", "b3")));
  EXPECT_EQ(1u, events().trusted_process_count());
  const DWORD peer_pid = peer->pid();
  peer->kill();
  EXPECT_TRUE(heard(removed(peer_pid, "alerts", "b2")));
  EXPECT_TRUE(heard(removed(peer_pid, "alerts", "b3")));
  EXPECT_FALSE(bus_->is_registered_listener("alerts", "b2"));
  EXPECT_TRUE(test_support::wait_until([&] { return events().trusted_process_count() == 0; }))
      << "the trust entry goes when the process exits";
}

TEST_F(e2e_test, admission_depends_on_the_peers_signer_and_the_pipes_level) {
  start_bus({{pipe_level0, 0}, {pipe_level1, 1}});
  ASSERT_EQ(0u, bus_->register_listener("alerts", "a1"));

  // Another signer: refused where only our signer may come, admitted on the
  // pipe that takes any valid signer.
  auto other = start_host(L"host_b", L"peer_b", importing({pipe_level0, pipe_level1}));
  ASSERT_TRUE(other->ready()) << other->output();
  other->send("register alerts b1");
  EXPECT_TRUE(heard(added(other->pid(), "alerts", "b1")));
  EXPECT_TRUE(log_has(L"gateway_observer::is_allowed",
                      L"DENY pid=" + std::to_wstring(other->pid()) + L" reason: check process security failed"));
  EXPECT_TRUE(log_has(L"gateway_observer::is_allowed_process", L"found it in cache, trust=low_trust"))
      << "the refused pipe's client retries and is answered from the cache";

  // Unsigned and tampered peers: refused on both levels, the retry from the
  // cache.
  for (const wchar_t* image : {L"host_unsigned", L"host_tampered"}) {
    test_support::clear_log();
    auto bad = start_host(image, std::wstring(L"peer_") + image, importing({pipe_level0, pipe_level1}));
    ASSERT_TRUE(bad->ready()) << bad->output();
    bad->send("register alerts x1");
    const std::wstring deny = L"DENY pid=" + std::to_wstring(bad->pid()) + L" reason: check process security failed";
    EXPECT_TRUE(test_support::wait_until(
        [&] { return test_support::find_lines(L"gateway_observer::is_allowed", deny).size() >= 3; }))
        << test_support::dump_log();
    EXPECT_TRUE(log_has(L"gateway_observer::is_allowed_process", L"found it in cache, trust=untrusted"));
    EXPECT_FALSE(bus_->is_registered_listener("alerts", "x1"));
    EXPECT_FALSE(bad->has_line(plus(own(), "alerts", "a1"))) << "a refused peer learns nothing";
  }
}

TEST_F(e2e_test, an_unsigned_serving_process_refuses_everyone) {
  const std::string unsigned_pipe = "\\\\.\\pipe\\vorbel_e2e_unsigned";
  host_config config;
  config.exports = {{unsigned_pipe, 1}};
  config.imports = {pipe_level1};
  auto server = start_host(L"host_unsigned", L"server_unsigned", config);
  ASSERT_TRUE(server->ready()) << server->output();
  start_bus({{pipe_level1, 1}}, {unsigned_pipe});
  server->send("register alerts u1");
  ASSERT_EQ(0u, bus_->register_listener("alerts", "a1"));

  // Its own gateway takes remote connections as ever; only what it serves is
  // closed to all.
  EXPECT_TRUE(test_support::wait_until([&] {
    const std::string log = host_log(L"server_unsigned");
    return log.find("current process signature is invalid => DENY ALL") != std::string::npos &&
           log.find("gateway_observer::on_remote_connect") != std::string::npos;
  })) << host_log(L"server_unsigned");
  // And a signed exporter refuses it in turn: an unsigned process reaches
  // nobody.
  EXPECT_TRUE(log_has(L"gateway_observer::is_allowed",
                      L"DENY pid=" + std::to_wstring(server->pid()) + L" reason: check process security failed"));
  std::this_thread::sleep_for(500ms);  // room for a wrong admission to show
  EXPECT_FALSE(bus_->is_registered_listener("alerts", "u1"));
}

TEST_F(e2e_test, a_server_learns_every_client_and_clients_learn_only_the_server) {
  start_bus({{pipe_level0, 0}});
  ASSERT_EQ(0u, bus_->register_listener("alerts", "server"));
  auto first = start_host(L"host_a", L"client_1", importing({pipe_level0}));
  auto second = start_host(L"host_a", L"client_2", importing({pipe_level0}));
  ASSERT_TRUE(first->ready() && second->ready());
  first->send("register alerts one");
  second->send("register alerts two");
  EXPECT_TRUE(heard(added(first->pid(), "alerts", "one")));
  EXPECT_TRUE(heard(added(second->pid(), "alerts", "two")));
  EXPECT_TRUE(first->wait_for(plus(own(), "alerts", "server")));
  EXPECT_TRUE(second->wait_for(plus(own(), "alerts", "server")));
  // Messages from a pipe are never relayed onto another pipe, so a client's
  // table holds what its own connections told it.
  std::this_thread::sleep_for(500ms);
  EXPECT_FALSE(first->has_line(plus(second->pid(), "alerts", "two"))) << first->output();
  EXPECT_FALSE(second->has_line(plus(first->pid(), "alerts", "one"))) << second->output();
}

TEST_F(e2e_test, clients_rejoin_a_restarted_server_and_the_tables_converge) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_e2e_restart";
  host_config server_config;
  server_config.exports = {{pipe, 0}};
  auto server = start_host(L"host_a", L"server_1", server_config);
  ASSERT_TRUE(server->ready());
  server->send("register alerts s1");
  start_bus({}, {pipe});
  ASSERT_EQ(0u, bus_->register_listener("alerts", "c1"));
  auto client = start_host(L"host_a", L"client", importing({pipe}));
  ASSERT_TRUE(client->ready());
  EXPECT_TRUE(heard(added(server->pid(), "alerts", "s1")));
  EXPECT_TRUE(client->wait_for(plus(server->pid(), "alerts", "s1")));
  EXPECT_TRUE(server->wait_for(plus(own(), "alerts", "c1")));

  const DWORD old_pid = server->pid();
  server->kill();
  EXPECT_TRUE(heard(removed(old_pid, "alerts", "s1")));
  EXPECT_TRUE(client->wait_for(minus(old_pid, "alerts", "s1")));

  auto restarted = start_host(L"host_a", L"server_2", server_config);
  ASSERT_TRUE(restarted->ready());
  restarted->send("register alerts s2");
  EXPECT_TRUE(heard(added(restarted->pid(), "alerts", "s2"), 20s)) << test_support::dump_log();
  EXPECT_TRUE(client->wait_for(plus(restarted->pid(), "alerts", "s2"), 20s)) << client->output();
  EXPECT_TRUE(restarted->wait_for(plus(own(), "alerts", "c1"), 20s)) << restarted->output();
}

TEST_F(e2e_test, registration_reaches_the_other_process_in_milliseconds) {
  start_bus({{pipe_level0, 0}});
  auto peer = start_host(L"host_a", L"latency_peer", importing({pipe_level0}));
  ASSERT_TRUE(peer->ready());
  peer->send("register alerts ready");
  ASSERT_TRUE(heard(added(peer->pid(), "alerts", "ready")));
  std::vector<double> ms;
  for (int i = 0; i < 120; ++i) {
    const std::string id = "lat" + std::to_string(i);
    const auto start = std::chrono::steady_clock::now();
    bus_->register_listener("alerts", id.c_str());
    std::chrono::steady_clock::time_point seen;
    ASSERT_TRUE(peer->line_time(plus(own(), "alerts", id), seen, 10s));
    ms.push_back(std::chrono::duration<double, std::milli>(seen - start).count());
    bus_->unregister_listener("alerts", id.c_str());
  }
  std::sort(ms.begin(), ms.end());
  const double median = ms[ms.size() / 2];
  std::printf("register_listener here -> '+' line in the peer: median %.2f ms, p90 %.2f ms, max %.2f ms (n=%zu)\n",
              median, ms[ms.size() * 9 / 10], ms.back(), ms.size());
  EXPECT_LT(median, 250.0) << "a registration should cross a pipe in well under a quarter second";
}

}  // namespace
