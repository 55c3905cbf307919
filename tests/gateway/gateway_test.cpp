// The gateway over a recording IPC library: what it asks of the library, the
// pipes it records, and how it joins its bus to its observers.
#include <gtest/gtest.h>

#include <windows.h>

#include <memory>
#include <string>
#include <system_error>

#include "bus/bus.h"
#include "gateway/gateway.h"
#include "gateway/ipc_double.h"
#include "support/log_capture.h"

namespace {

using test_support::has_line;

// Operations of the double whose result a test can set.
enum { op_create = 0, op_start = 1, op_stop = 2, op_export = 3 };

class gateway_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    owner = std::make_unique<bus>("gateway_bus");
    owner->subscribe();
    controls.take();
  }
  void TearDown() override {
    owner->unsubscribe();
    owner.reset();
  }
  gateway_test_support::ipc_controls controls;
  std::unique_ptr<bus> owner;
};

TEST_F(gateway_test, is_built_over_the_library_answers_three_identifiers_and_unloads_it_last) {
  {
    gateway g(owner.get());
    EXPECT_EQ("create bus\n", controls.take());
    void* face = g.GetInterface(IID_IQmBaseInterface);
    EXPECT_EQ(static_cast<igateway*>(&g), face);
    EXPECT_EQ(face, g.GetInterface(IID_igateway_base));
    EXPECT_EQ(face, g.GetInterface(IID_igateway));
    EXPECT_EQ(nullptr, g.GetInterface(IID_ibus));
    EXPECT_TRUE(has_line(L"gateway::GetInterface", L"unknown interface "));
  }
  EXPECT_EQ("destroy\n", controls.take());
  ::FreeLibrary(::GetModuleHandleW(L"parlo_ipc.dll"));  // drop the controls' own reference
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"parlo_ipc.dll")) << "the gateway gave its reference back";
  ::LoadLibraryW(L"parlo_ipc.dll");  // the controls' reference again
}

TEST_F(gateway_test, a_library_that_gives_no_gateway_fails_the_construction_with_31) {
  controls.set_result(op_create, 1);
  try {
    gateway g(owner.get());
    ADD_FAILURE() << "the constructor must throw";
  } catch (const std::system_error& e) {
    EXPECT_EQ(31, e.code().value());
    EXPECT_EQ(0, std::string(e.what()).rfind("create_gateway failed", 0)) << e.what();
  }
  controls.set_result(op_create, 0);
  const auto lines = test_support::find_lines(L"make_ipc_gateway", L"create_gateway fail");
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(2u, lines[0].level);
}

TEST_F(gateway_test, the_service_channel_travels_once_per_pipe_with_exports_and_imports) {
  gateway g(owner.get());
  controls.take();
  EXPECT_EQ(0u, g.export_channel("orders", "\\\\.\\pipe\\p1", 3, 0));
  EXPECT_EQ(0u, g.export_channel("prices", "\\\\.\\pipe\\p1", 7, 1));
  EXPECT_EQ(0u, g.import_channel("remote_bus", "local", "pipe_b", "remote", 3, 1));
  EXPECT_EQ(0u, g.import_channel("remote_bus", "local2", "pipe_b", "remote2", 3, 1));
  EXPECT_EQ(
      "export orders \\\\.\\pipe\\p1 3\n"
      "export vorbel_service \\\\.\\pipe\\p1 3\n"
      "export prices \\\\.\\pipe\\p1 7\n"
      "import local pipe_b remote_bus remote 3\n"
      "import vorbel_service pipe_b remote_bus vorbel_service 3\n"
      "import local2 pipe_b remote_bus remote2 3\n",
      controls.take());
  ASSERT_EQ(2u, g.pipes().size()) << "one entry per pipe";
  EXPECT_EQ(1u, g.pipes().at("\\\\.\\pipe\\p1")) << "the latest level of the pipe";
  EXPECT_EQ(1u, g.pipes().at("pipe_b"));
  EXPECT_TRUE(has_line(L"comm::service_channel::export_channel", L"already exported on pipe=\\\\.\\pipe\\p1"));
  EXPECT_TRUE(has_line(L"gateway::export_channel", L"channel=prices link_type=7 security=1"));
  EXPECT_TRUE(has_line(L"gateway::import_channel", L"bus_name=remote_bus channel=local link_type=3 security=1"));
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
  controls.set_result(op_export, 5);
  EXPECT_EQ(5u, g.export_channel("orders", "pipe_a", 3, 0));
  controls.set_result(op_export, 0);
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

TEST_F(gateway_test, start_joins_the_bus_and_stop_leaves_it_but_a_failed_start_joins_nothing) {
  gateway g(owner.get());
  auto* bus_face = static_cast<igateway_observer*>(owner.get());
  controls.take();
  ASSERT_EQ(0u, g.start());
  EXPECT_FALSE(g.add_observer(bus_face, 9)) << "the bus is already an observer";
  EXPECT_EQ(0u, g.stop());
  EXPECT_EQ("start\nstop\n", controls.take());
  EXPECT_TRUE(g.add_observer(bus_face, 0)) << "stop removed the bus";
  EXPECT_TRUE(g.remove_observer(bus_face, 0));

  controls.set_result(op_start, 7);
  controls.set_result(op_stop, 9);
  EXPECT_EQ(7u, g.start());
  EXPECT_TRUE(has_line(L"gateway::start", L"start gateway err=7"));
  EXPECT_EQ(9u, g.stop());
  EXPECT_TRUE(has_line(L"gateway::stop", L"stop gateway err=9"));
  controls.set_result(op_start, 0);
  controls.set_result(op_stop, 0);
  EXPECT_TRUE(g.add_observer(bus_face, 0)) << "no observer was added by the failed start";
  EXPECT_TRUE(g.remove_observer(bus_face, 0));
}

}  // namespace
