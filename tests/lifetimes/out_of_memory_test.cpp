// Allocation failures at every entry that a host or a sibling library calls:
// the exports, the public faces, the service channel's delivery, the IPC
// library's event sink, and the stand-ins' exports (their sources are built
// into this program, so that its operator new reaches them). Each entry is
// called again and again with its 1st, 2nd, 3rd... allocation failing, until
// a call makes no allocation that fails. Nothing may escape; a failure is
// reported as the signature allows, with an error line; and afterwards
// everything still works, from another thread. Entries that allocate nothing
// (QmGetInterface, remove_observer, the stand-ins' destroy and untap,
// LogDeinit) are left out: no failure reaches them.
#include <gtest/gtest.h>
#include <vorbel/vorbel.h>

#include <functional>
#include <string>
#include <vector>

#include "bus/bus.h"
#include "bus/comm/listeners_codec.h"
#include "bus/parlo/parlo.h"
#include "bus/parlo/parlo_ext.h"
#include "component/factory.h"
#include "gateway/gateway_observer.h"
#include "lifetimes.h"
#include "message_codec.h"
#include "platform/observable.h"
#include "registry/vorbel_impl.h"
#include "security/pipes.h"
#include "support/bus_observer.h"
#include "support/config_provider.h"
#include "test_heap.h"

extern "C" {
std::uint32_t QmCreateObject(const wchar_t* name, const GUID& iid, void** out);
void QmDestroyObject(const wchar_t* name, void* object);
// The stand-ins' exports, built into this program.
parlo::bus* create_bus(const char* name);
void destroy_bus(parlo::bus* bus);
std::uint32_t parlo_tap(parlo::bus* bus, const char* channel, parlo::ext::tap_callback callback, void* context,
                        std::uint64_t* tap_id);
std::uint32_t parlo_untap(parlo::bus* bus, std::uint64_t tap_id);
std::uint32_t parlo_inject(parlo::bus* bus, const char* channel, const void* bytes, std::uint64_t size);
void parlo_set_log(parlo::ext::log_callback callback, void* context);
parlo::ipc::gateway* create_gateway(parlo::bus* bus, parlo::ipc::gateway::events* sink);
void destroy_gateway(parlo::ipc::gateway* gateway);
void LogInit();
void LogDeinit();
std::int32_t LogWrite(std::int16_t depth_step, const std::uint32_t* level, HMODULE module, const wchar_t* function,
                      const wchar_t* format, ...);
}

namespace {

using namespace lifetimes_test;

std::atomic<bool> parlo_error{false};  // parlo's own lines come through its log callback

// A reported failure left its line: an error of the component, of parlo, or
// the admission's refusal.
bool explained() {
  for (const auto& line : test_support::log_lines()) {
    if (line.level <= logging::level_error || line.text.find(L"DENY pid=") == 0) return true;
  }
  return parlo_error;
}

struct entry {
  using action = std::function<void()>;
  entry(const char* n, std::function<bool()> c, action s = nullptr, action u = nullptr,
        std::function<bool()> r = nullptr)
      : name(n), call(std::move(c)), setup(std::move(s)), cleanup(std::move(u)), refused(std::move(r)) {}
  const char* name;
  std::function<bool()> call;  // under the failure: true when its result reports one
  action setup, cleanup;       // before and after each call, without failures
  std::function<bool()> refused;  // after the call: it had no effect, though it reported nothing
};

// Stops at the first fault of an entry, so that one broken entry does not
// bury the others.
void sweep(const entry& e) {
  for (std::size_t n = 1; n < 5000; ++n) {
    if (e.setup) e.setup();
    test_support::clear_log();
    parlo_error = false;
    bool reported = false;
    std::string escaped;
    test_heap::fail_nth(n);
    try {
      reported = e.call();
    } catch (const std::exception& ex) {
      escaped = ex.what();
    } catch (...) {
      escaped = "an unknown exception";
    }
    const bool failed = test_heap::failed();
    test_heap::fail_nth(0);
    reported = reported || (e.refused && e.refused());
    const bool told = !reported || explained();
    if (e.cleanup) e.cleanup();
    if (!escaped.empty()) {
      ADD_FAILURE() << e.name << ": allocation " << n << " let " << escaped << " out";
      return;
    }
    if (!failed) {
      EXPECT_FALSE(reported) << e.name << " failed with no allocation failing";
      return;
    }
    if (!told) {
      ADD_FAILURE() << e.name << ": allocation " << n << " failed the call without an error line";
      return;
    }
  }
  ADD_FAILURE() << e.name << ": more allocations than the sweep allows";
}

struct list_owner final : qm::observable<igateway_observer_base*, igateway> {
  void* GetInterface(GUID) override { return nullptr; }
};

struct null_sink final : parlo::ipc::gateway::events {
  void on_listen(parlo::ipc::pipe_handle, const char*) override {}
  bool on_local_connect(parlo::ipc::pipe_handle, std::uint32_t) override { return true; }
  void on_local_disconnect(parlo::ipc::pipe_handle) override {}
  void on_local_start_communication(parlo::ipc::pipe_handle) override {}
  void on_local_error(parlo::ipc::pipe_handle, std::uint32_t) override {}
  bool on_remote_connect(parlo::ipc::pipe_handle, std::uint32_t) override { return true; }
  void on_remote_disconnect(parlo::ipc::pipe_handle) override {}
  void on_remote_start_communication(parlo::ipc::pipe_handle) override {}
  void on_remote_error(parlo::ipc::pipe_handle, std::uint32_t) override {}
};

void on_tap(const char*, const void*, std::uint64_t, void*) {}

bool code(std::uint32_t result, std::uint32_t failure) {
  EXPECT_TRUE(result == 0 || result == failure) << result;
  return result != 0;
}

TEST(out_of_memory, every_entry_reports_a_failed_allocation_and_stays_usable) {
  ::SetEnvironmentVariableW(L"SCRIBO_LOG_FILE", L"NUL");
  parlo_set_log([](std::uint32_t level, const char*, const char*, void*) { parlo_error = parlo_error || level == 4; },
                nullptr);
  const DWORD own = ::GetCurrentProcessId();
  // Names longer than a short string's own buffer, so that copies allocate.
  const char *const kept = "out_of_memory_kept_bus", *const fresh = "out_of_memory_fresh_bus";
  const char* const id = "a-listener-id-longer-than-sixteen";
  test_support::config_provider local, served;
  local.local = served.local = {"alerts"};
  served.exports = {{"alerts", "\\\\.\\pipe\\vorbel_out_of_memory", true, 3, 1}};
  vorbel_impl registry;
  ibus* kept_bus = registry.create_bus(kept, &served);
  igateway* kept_gateway = registry.get_gateway(kept);
  ASSERT_TRUE(kept_bus != nullptr && kept_gateway != nullptr) << test_support::dump_log();
  comm::service_channel& service = *static_cast<bus*>(kept_bus)->get_service_channel();
  auto* messaging = static_cast<parlo::bus*>(kept_bus->get_messaging_bus());
  gate_observer observer;
  auto unregister_all = [&] {
    while (kept_bus->is_registered_listener("alerts", id)) kept_bus->unregister_listener("alerts", id);
  };

  list_owner owner;
  gateway_observer sink(&owner.observer_list());
  sink.set_pipe_security_map(make_pipe_security_map({{"\\\\.\\pipe\\vorbel_out_of_memory_sink", 1}}));
  winapi::unique_handle pipe = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_out_of_memory_sink");
  winapi::unique_handle client = open_client(L"\\\\.\\pipe\\vorbel_out_of_memory_sink");
  ASSERT_TRUE(pipe && client);
  HANDLE h = pipe.get();
  // Both put the component's DACL on the pipe, which Wine wants protected
  // again before the next time.
  auto reprotect = [&] { security_test::reprotect(h); };

  parlo::bus* standin = create_bus("out_of_memory_standin");
  ASSERT_TRUE(standin != nullptr && standin->create_channel("alerts") == 0);
  std::vector<unsigned char> wire;
  parlo::codec::encode(parlo::codec::message_content{5, {}}, wire);
  null_sink ipc_events;
  void* p = nullptr;
  parlo::bus* pb = nullptr;
  parlo::ipc::gateway* pg = nullptr;
  std::uint64_t tap = 0;
  parlo::message* message = nullptr;
  auto service_message = [&](std::uint32_t kind) {
    return [&, kind] {
      message = messaging->create_message(0);
      message->set_message_id(kind);
      const auto bytes = comm::encode_listeners(4242, {{"alerts", "remote"}});
      message->set_blob("params", bytes.data(), bytes.size());
    };
  };
  auto release_message = [&] { message->release(); };

  const entry entries[] = {
      {"QmCreateObject", [&] { return code(QmCreateObject(L"vorbel", IID_IQmBaseInterface, &(p = nullptr)), 14); },
       nullptr, [&] {
         if (p != nullptr) QmDestroyObject(L"vorbel", p);
         EXPECT_EQ(0, vorbel_factory().use_count()) << "a use counted for a failed creation";
       }},
      {"QmDestroyObject", [&] { return QmDestroyObject(L"vorbel", p), false; }, [&] {
         QmCreateObject(L"vorbel", IID_IQmBaseInterface, &p);
         static_cast<ivorbel*>(p)->create_bus(fresh, &local);  // left for the last release
       }, nullptr, [&] { return vorbel_factory().use_count() != 0; }},
      {"ivorbel::create_bus", [&] { return registry.create_bus(fresh, &local) == nullptr; }, nullptr,
       [&] { if (registry.get_bus(fresh) != nullptr) registry.destroy_bus(fresh); }},
      {"ivorbel::destroy_bus", [&] { return registry.destroy_bus(fresh), false; },
       [&] { registry.create_bus(fresh, &local); },
       [&] { if (registry.get_bus(fresh) != nullptr) registry.destroy_bus(fresh); },
       [&] { return registry.get_bus(fresh) != nullptr; }},
      {"ivorbel::get_bus", [&] { return registry.get_bus(kept) != kept_bus; }},
      {"ivorbel::get_gateway", [&] { return registry.get_gateway(kept) != kept_gateway; }},
      {"ibus::register_listener", [&] { return code(kept_bus->register_listener("alerts", id), 14); }, nullptr,
       unregister_all},
      {"ibus::unregister_listener", [&] { return code(kept_bus->unregister_listener("alerts", id), 14); },
       [&] { kept_bus->register_listener("alerts", id); }, unregister_all},
      {"ibus::is_registered_listener", [&] { return !kept_bus->is_registered_listener("alerts", id); },
       [&] { kept_bus->register_listener("alerts", id); }, unregister_all},
      {"ibus::add_observer", [&] { return !kept_bus->add_observer(observer.bus_face(), 1); }, nullptr,
       [&] { kept_bus->remove_observer(observer.bus_face(), 1); }},
      {"igateway::add_observer", [&] { return !kept_gateway->add_observer(observer.gateway_face(), 1); }, nullptr,
       [&] { kept_gateway->remove_observer(observer.gateway_face(), 1); }},
      {"service channel: listeners", [&] { return service.on_message(message), false; }, service_message(2),
       release_message},
      {"service channel: request", [&] { return service.on_message(message), false; }, service_message(1),
       release_message},
      {"on_listen", [&] { return sink.on_listen(h, "\\\\.\\pipe\\vorbel_out_of_memory_sink"), false; }, nullptr,
       reprotect},
      {"on_local_connect", [&] { return !sink.on_local_connect(h, own); }, nullptr,
       [&] { reprotect(), sink.on_local_disconnect(h); }},
      {"on_local_disconnect", [&] { return sink.on_local_disconnect(h), false; }},
      {"on_local_start_communication", [&] { return sink.on_local_start_communication(h), false; }},
      {"on_local_error", [&] { return sink.on_local_error(h, 5), false; }},
      {"on_remote_connect", [&] { return !sink.on_remote_connect(h, own); }, nullptr,
       [&] { sink.on_remote_disconnect(h); }},
      {"on_remote_disconnect", [&] { return sink.on_remote_disconnect(h), false; }},
      {"on_remote_start_communication", [&] { return sink.on_remote_start_communication(h), false; }},
      {"on_remote_error", [&] { return sink.on_remote_error(h, 5), false; }},
      {"parlo create_bus", [&] { return (pb = create_bus("out_of_memory_parlo")) == nullptr; }, nullptr,
       [&] { if (pb != nullptr) destroy_bus(pb); }},
      {"parlo_tap", [&] { return parlo_tap(standin, "alerts", on_tap, nullptr, &tap) != 0; }, nullptr,
       [&] { if (tap != 0) parlo_untap(standin, tap); }},
      {"parlo_inject", [&] { return parlo_inject(standin, "alerts", wire.data(), wire.size()) != 0; }},
      {"parlo_ipc create_gateway", [&] { return (pg = create_gateway(messaging, &ipc_events)) == nullptr; }, nullptr,
       [&] { if (pg != nullptr) destroy_gateway(pg); }},
      {"scribo LogInit", [] { return LogInit(), false; }, nullptr, [] { LogDeinit(); }},
      {"scribo LogWrite", [] {
         const std::uint32_t level = 16;
         return code(static_cast<std::uint32_t>(LogWrite(0, &level, nullptr, L"test", L"%s %d", L"line", 2)),
                     static_cast<std::uint32_t>(E_OUTOFMEMORY)) && false;  // scribo has no log of its own
       }},
  };
  for (const entry& e : entries) sweep(e);
  sink.run_on_worker([](connections_cache&) {});

  // Every lock the failures went through is free: the calls work from
  // another thread, and notifications still come.
  bounded_thread after([&] {
    void* q = nullptr;
    EXPECT_EQ(0u, QmCreateObject(L"vorbel", IID_IQmBaseInterface, &q));
    QmDestroyObject(L"vorbel", q);
    EXPECT_NE(nullptr, registry.create_bus(fresh, &local));
    registry.destroy_bus(fresh);
    test_support::recording_bus_observer listening;
    EXPECT_TRUE(kept_bus->add_observer(&listening, 0));
    EXPECT_EQ(0u, kept_bus->register_listener("alerts", id));
    EXPECT_TRUE(listening.wait_for_count(1));
    EXPECT_TRUE(kept_bus->remove_observer(&listening, 0));
    EXPECT_TRUE(kept_gateway->add_observer(observer.gateway_face(), 0));
    EXPECT_TRUE(owner.add_observer(observer.gateway_face(), 0));
    EXPECT_TRUE(sink.on_remote_connect(h, own));
    sink.run_on_worker([](connections_cache&) {});
    EXPECT_EQ(1, observer.calls.load());
  });
  after.join_or_die(60s, "the same calls without failures, from another thread");
  destroy_bus(standin);
  registry.destroy_bus(kept);
}

}  // namespace
