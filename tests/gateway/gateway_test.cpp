// The gateway over a recording IPC library: what it asks of the library, the
// pipes it records, and how it joins its bus to its observers.
#include <gtest/gtest.h>

#include <windows.h>

#include <memory>
#include <string>
#include <system_error>

#include "bus/bus.h"
#include "gateway/gateway.h"
#include "support/log_capture.h"

namespace {

using test_support::has_line;

template <typename Fn>
Fn ipc_double(const char* name) {
  HMODULE module = ::GetModuleHandleW(L"parlo_ipc.dll");
  return module == nullptr ? nullptr
                           : reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(module, name)));
}

// The library is loaded by the gateway; these load it too, so that the test
// can reach the double's controls before and after a gateway exists.
class ipc_controls {
 public:
  ipc_controls() : module_(::LoadLibraryW(L"parlo_ipc.dll")) {}
  ~ipc_controls() { ::FreeLibrary(module_); }
  std::string calls() {
    auto fn = ipc_double<std::size_t (*)(char*, std::size_t)>("IpcDoubleCalls");
    std::string text(fn(nullptr, 0) + 1, '\0');
    text.resize(fn(text.data(), text.size()));
    return text;
  }
  std::string take() {
    std::string text = calls();
    ipc_double<void (*)()>("IpcDoubleClearCalls")();
    return text;
  }
  void set_result(int which, std::uint32_t result) {
    ipc_double<void (*)(int, std::uint32_t)>("IpcDoubleSetResult")(which, result);
  }

 private:
  HMODULE module_;
};

class gateway_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    controls.take();
    owner = std::make_unique<bus>("gateway_bus");
    owner->subscribe();
  }
  void TearDown() override {
    owner->unsubscribe();
    owner.reset();
  }
  ipc_controls controls;
  std::unique_ptr<bus> owner;
};

TEST_F(gateway_test, is_built_over_the_library_with_the_bus_and_answers_three_identifiers) {
  gateway g(owner.get());
  EXPECT_EQ("create bus\n", controls.take());
  void* face = g.GetInterface(IID_IQmBaseInterface);
  EXPECT_EQ(static_cast<igateway*>(&g), face);
  EXPECT_EQ(face, g.GetInterface(IID_igateway_base));
  EXPECT_EQ(face, g.GetInterface(IID_igateway));
  EXPECT_EQ(nullptr, g.GetInterface(IID_ibus));
  EXPECT_TRUE(has_line(L"gateway::GetInterface", L"unknown interface "));
}

TEST_F(gateway_test, a_library_that_gives_no_gateway_fails_the_construction_with_31) {
  controls.set_result(0, 1);
  try {
    gateway g(owner.get());
    FAIL() << "the constructor must throw";
  } catch (const std::system_error& e) {
    EXPECT_EQ(31, e.code().value());
    EXPECT_EQ(0, std::string(e.what()).rfind("create_gateway failed", 0)) << e.what();
  }
  controls.set_result(0, 0);
  const auto lines = test_support::find_lines(L"make_ipc_gateway", L"create_gateway fail");
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(2u, lines[0].level);
}

TEST_F(gateway_test, exports_record_the_latest_level_and_carry_the_service_channel_once) {
  gateway g(owner.get());
  controls.take();
  EXPECT_EQ(0u, g.export_channel("orders", "\\\\.\\pipe\\p1", 3, 0));
  EXPECT_EQ(0u, g.export_channel("prices", "\\\\.\\pipe\\p1", 7, 1));
  EXPECT_EQ(
      "export orders \\\\.\\pipe\\p1 3\n"
      "export vorbel_service \\\\.\\pipe\\p1 3\n"
      "export prices \\\\.\\pipe\\p1 7\n",
      controls.take());
  ASSERT_EQ(1u, g.pipes().size());
  EXPECT_EQ(1u, g.pipes().at("\\\\.\\pipe\\p1"));
  EXPECT_TRUE(has_line(L"comm::service_channel::export_channel", L"already exported on pipe=\\\\.\\pipe\\p1"));
  EXPECT_TRUE(has_line(L"gateway::export_channel", L"channel=prices link_type=7 security=1"));
}

TEST_F(gateway_test, null_strings_are_refused_before_anything_is_recorded_or_called) {
  gateway g(owner.get());
  controls.take();
  EXPECT_EQ(87u, g.export_channel("c", nullptr, 3, 0));
  EXPECT_EQ(87u, g.export_channel(nullptr, "p", 3, 0));
  EXPECT_EQ(87u, g.import_channel("bus", "c", "p", nullptr, 3, 0));
  EXPECT_EQ(87u, g.import_channel(nullptr, "c", "p", "r", 3, 0));
  EXPECT_TRUE(g.pipes().empty());
  EXPECT_EQ("", controls.take());
  EXPECT_EQ(4u, test_support::find_lines(L"", L"bus_name or channel or pipe is nullptr").size());
}

TEST_F(gateway_test, a_failed_export_still_records_the_pipe_and_carries_the_service_channel) {
  gateway g(owner.get());
  controls.take();
  controls.set_result(3, 5);
  EXPECT_EQ(5u, g.export_channel("orders", "pipe_a", 3, 0));
  controls.set_result(3, 0);
  EXPECT_EQ("export orders pipe_a 3\nexport vorbel_service pipe_a 3\n", controls.take())
      << "the service channel's export failed too, so it is not recorded";
  EXPECT_EQ(1u, g.pipes().count("pipe_a"));
  EXPECT_TRUE(has_line(L"gateway::export_channel", L"export_channel err=5"));
  EXPECT_TRUE(has_line(L"comm::service_channel::export_channel",
                       L"export_channel service on pipe=pipe_a err=5"));
  // The next export on that pipe tries the service channel again.
  EXPECT_EQ(0u, g.export_channel("more", "pipe_a", 3, 0));
  EXPECT_EQ("export more pipe_a 3\nexport vorbel_service pipe_a 3\n", controls.take());
}

TEST_F(gateway_test, imports_join_the_remote_service_channel_over_the_same_pipe) {
  gateway g(owner.get());
  controls.take();
  EXPECT_EQ(0u, g.import_channel("remote_bus", "local", "pipe_b", "remote", 3, 1));
  EXPECT_EQ(0u, g.import_channel("remote_bus", "local2", "pipe_b", "remote2", 3, 1));
  EXPECT_EQ(
      "import local pipe_b remote_bus remote 3\n"
      "import vorbel_service pipe_b remote_bus vorbel_service 3\n"
      "import local2 pipe_b remote_bus remote2 3\n",
      controls.take());
  EXPECT_TRUE(has_line(L"gateway::import_channel", L"bus_name=remote_bus channel=local link_type=3 security=1"));
}

TEST_F(gateway_test, start_joins_the_bus_and_stop_leaves_it_first) {
  gateway g(owner.get());
  auto* bus_face = static_cast<igateway_observer*>(owner.get());
  controls.take();
  ASSERT_EQ(0u, g.start());
  EXPECT_FALSE(g.add_observer(bus_face, 9)) << "the bus is already an observer";
  EXPECT_EQ(0u, g.stop());
  EXPECT_EQ("start\nstop\n", controls.take());
  EXPECT_TRUE(g.add_observer(bus_face, 0)) << "stop removed the bus";
  EXPECT_TRUE(g.remove_observer(bus_face, 0));
}

TEST_F(gateway_test, a_failed_start_adds_no_observer_and_reports_its_code) {
  gateway g(owner.get());
  auto* bus_face = static_cast<igateway_observer*>(owner.get());
  controls.set_result(1, 7);
  controls.set_result(2, 9);
  EXPECT_EQ(7u, g.start());
  EXPECT_TRUE(has_line(L"gateway::start", L"start gateway err=7"));
  EXPECT_EQ(9u, g.stop());
  EXPECT_TRUE(has_line(L"gateway::stop", L"stop gateway err=9"));
  controls.set_result(1, 0);
  controls.set_result(2, 0);
  EXPECT_TRUE(g.add_observer(bus_face, 0)) << "no observer was added by the failed start";
  EXPECT_TRUE(g.remove_observer(bus_face, 0));
}

TEST_F(gateway_test, destruction_destroys_the_library_gateway_then_unloads_the_library) {
  {
    gateway g(owner.get());
    controls.take();
  }
  EXPECT_EQ("destroy\n", controls.take());
  ::FreeLibrary(::GetModuleHandleW(L"parlo_ipc.dll"));  // drop the controls' own reference
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"parlo_ipc.dll")) << "the gateway gave its reference back";
  ::LoadLibraryW(L"parlo_ipc.dll");  // the controls' reference again
}

}  // namespace
