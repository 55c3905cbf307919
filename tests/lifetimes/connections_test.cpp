// Connections at the gateway's edge: what a connection's notifications name
// when its pipe handle is gone before the worker runs, and a peer process
// joined by two pipes, one of which ends.
#include <gtest/gtest.h>

#include "e2e/host_process.h"
#include "gateway/gateway_observer.h"
#include "lifetimes.h"
#include "platform/observable.h"
#include "platform/win_api.h"
#include "security/pipes.h"

namespace {

using namespace lifetimes_test;
using namespace test_support;

struct list_owner final : qm::observable<igateway_observer_base*, igateway> {
  void* GetInterface(GUID) override { return nullptr; }
};

// The IPC library closes a pipe's handle right after it reported the
// disconnect, and the system may give the value to the next pipe, all before
// the gateway's worker gets to the connection's tasks.
TEST(connections, a_connection_is_named_after_its_pipe_even_when_its_handle_is_gone_before_the_worker_runs) {
  const std::string own = std::to_string(::GetCurrentProcessId());
  for (const bool local : {true, false}) {
    SCOPED_TRACE(local ? "local" : "remote");
    list_owner owner;
    gateway_observer sink(&owner.observer_list());
    sink.set_pipe_security_map(make_pipe_security_map({{"\\\\.\\pipe\\vorbel_lifetimes_first", 1}}));
    gate_observer observer;
    owner.add_observer(observer.gateway_face(), 0);
    event held, hold;
    bounded_thread holder([&] { sink.run_on_worker([&](connections_cache&) { held.set(), hold.wait(); }); });
    ASSERT_TRUE(held.wait());
    winapi::unique_handle first = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_lifetimes_first");
    winapi::unique_handle client = open_client(L"\\\\.\\pipe\\vorbel_lifetimes_first");
    ASSERT_TRUE(first && client);
    HANDLE value = first.get();
    if (local) {
      ASSERT_TRUE(sink.on_local_connect(value, ::GetCurrentProcessId())) << dump_log();
      security_test::reprotect(value);
      sink.on_local_disconnect(value);
    } else {
      ASSERT_TRUE(sink.on_remote_connect(value, ::GetCurrentProcessId()));
      sink.on_remote_disconnect(value);
    }
    client.reset();
    first.reset();
    winapi::unique_handle second = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_lifetimes_second");
    hold.set();
    holder.join_or_die(30s, "the held worker");
    sink.run_on_worker([](connections_cache&) {});
    const std::string kind = local ? "local" : "remote";
    EXPECT_EQ((std::vector<std::string>{kind + "_connect \\vorbel_lifetimes_first " + own,
                                        kind + "_disconnect \\vorbel_lifetimes_first " + own}),
              observer.events)
        << "the second pipe " << (second.get() == value ? "reuses" : "does not reuse") << " the first one's handle";
  }
}

// The server end of this process's connection to `pid` on `pipe`, found
// among the process's handles.
HANDLE server_end(const std::wstring& pipe, DWORD pid) {
  DWORD flags = 0;
  for (ULONG_PTR value = 4, misses = 0; misses < 1024; value += 4) {
    HANDLE handle = reinterpret_cast<HANDLE>(value);
    misses = ::GetHandleInformation(handle, &flags) ? 0 : misses + 1;
    std::error_code code;
    ULONG client = 0;
    if (misses == 0 && winapi::query_file_name(handle, code) == pipe &&
        ::GetNamedPipeClientProcessId(handle, &client) && client == pid) {
      return handle;
    }
  }
  return nullptr;
}

// When one of two connections between two processes ends, the peer is still
// there and will not publish its listeners again: they stay until its last
// connection ends.
TEST(connections, a_peer_keeps_its_listeners_until_its_last_connection_ends) {
  using namespace e2e;
  clear_log();
  const std::string first = "\\\\.\\pipe\\vorbel_lifetimes_two_1", second = "\\\\.\\pipe\\vorbel_lifetimes_two_2";
  this_process us({{first, 0}, {second, 0}}, {}, "ours");
  ASSERT_TRUE(us.up()) << dump_log();
  auto peer = start_host("host_a", "two_pipes_peer", host_config({first, second}));
  ASSERT_TRUE(peer->ready()) << peer->output();
  peer->send("register alerts theirs");
  ASSERT_TRUE(wait_until([&] { return us.connection_count() == 2; }, 20s)) << "both pipes never connected";
  // Each list of the peer comes over both pipes, and an older one may still
  // be on its way over the slower pipe: it would take "theirs" away and give
  // it back. A list sent once both pipes are up is let land first.
  peer->send("register alerts settled");
  ASSERT_TRUE(us.observer.wait_has(peer->pid(), "settled"));
  ::Sleep(500);
  clear_log();

  HANDLE end = server_end(L"\\vorbel_lifetimes_two_1", peer->pid());
  ASSERT_NE(nullptr, end);
  ::DisconnectNamedPipe(end);
  ASSERT_TRUE(wait_for_line(L"notify_on_local_disconnect_handler::task::operator ()",
                            L"pipe_name=\\vorbel_lifetimes_two_1 remote_pid=" + std::to_wstring(peer->pid()), 20s));
  // Past the disconnect on the gateway's worker, and past what the bus made
  // of it on its notifier.
  us.connection_count();
  us.bus().register_listener("alerts", "after");
  ASSERT_TRUE(us.observer.wait_has(::GetCurrentProcessId(), "after"));
  EXPECT_FALSE(has_line(L"notify_listener_removed", L"pid=" + std::to_wstring(peer->pid())))
      << "the peer's listeners were dropped while its other connection lived";
  EXPECT_TRUE(us.bus().is_registered_listener("alerts", "theirs"));

  peer->kill();
  EXPECT_TRUE(us.observer.wait_gone(peer->pid(), 20s)) << "the peer's last connection ended and its listeners stayed";
}

}  // namespace
