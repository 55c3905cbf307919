// Building buses from a configuration provider through the registry, over the
// real messaging stand-in. Built twice: without parlo_ipc.dll beside it, where
// every gateway build fails at the library load, and with a recording double
// of it, where the gateway's calls into the library can be read back.
#include <gtest/gtest.h>

#include <windows.h>

#include "gateway/ipc_double.h"
#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

using test_support::config_provider;
using test_support::has_line;

// Loaded for the whole run when the recording IPC library sits beside this
// program (the build that has one).
gateway_test_support::ipc_controls ipc;

class build : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  vorbel_impl registry;
};

TEST_F(build, local_channels_only_give_a_bus_without_gateway) {
  config_provider provider;
  provider.local = {"alpha", "beta", "alpha"};  // creating an existing channel again is fine
  ibus* bus = registry.create_bus("local", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(nullptr, registry.get_gateway("local"));
  EXPECT_TRUE(has_line(L"build_bus", L"build bus name=local"));
  EXPECT_TRUE(has_line(L"build_bus", L"create_channel name=beta"));
  EXPECT_TRUE(has_line(L"build_gateway", L"exported & imported channels are empty"));
  EXPECT_TRUE(has_line(L"build_bus", L"-> build_bus()"));
  std::string order;
  for (const auto& call : provider.calls()) order += call.what + " ";
  EXPECT_EQ("local local local local exported imported is_default_bus ", order);
  // The bus works: listeners register.
  EXPECT_EQ(0u, bus->register_listener("alpha", "l"));
  EXPECT_TRUE(bus->is_registered_listener("alpha", "l"));
  registry.destroy_bus("local");
}

TEST_F(build, a_refused_local_channel_fails_the_build_and_stops_the_enumeration) {
  config_provider provider;
  provider.is_default = true;
  provider.local = {"first", "", "third"};  // the library refuses an empty name
  EXPECT_EQ(nullptr, registry.create_bus("broken", &provider));
  const auto locals = provider.calls_of("local");
  ASSERT_EQ(2u, locals.size()) << "the third channel is never asked for";
  EXPECT_EQ(0u, locals[0].cursor);
  EXPECT_EQ(1u, locals[1].cursor);
  EXPECT_TRUE(provider.calls_of("is_default_bus").empty());
  EXPECT_TRUE(provider.calls_of("exported").empty());
  const auto lines = test_support::find_lines(L"build_bus", L"create_channel name= err=");
  ASSERT_EQ(1u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(L"create_channel name= err=87", lines[0].text);
  EXPECT_EQ(4u, lines[0].level);
  EXPECT_EQ(nullptr, registry.get_bus("broken"));
  EXPECT_EQ(nullptr, registry.get_bus(nullptr));
}

TEST_F(build, imports_only_are_probed_with_fresh_cursors_and_a_gateway_failure_keeps_the_bus) {
  if (ipc.present()) GTEST_SKIP() << "this build has the IPC library";
  config_provider provider;
  provider.imports = {{"local", "\\\\.\\pipe\\p", "remote", "remote_bus"}};
  ibus* bus = registry.create_bus("importer", &provider);
  ASSERT_NE(nullptr, bus) << "a gateway that cannot be built does not fail the bus";
  EXPECT_EQ(nullptr, registry.get_gateway("importer"));
  const auto exported = provider.calls_of("exported");
  ASSERT_EQ(1u, exported.size());
  EXPECT_EQ(0u, exported[0].cursor);
  const auto imported = provider.calls_of("imported");
  ASSERT_EQ(1u, imported.size());
  EXPECT_EQ(0u, imported[0].cursor);
  const auto errors = test_support::find_lines(L"build_gateway", L"LoadLibrary failed");
  ASSERT_EQ(1u, errors.size()) << test_support::dump_log();
  EXPECT_EQ(4u, errors[0].level);
  registry.destroy_bus("importer");
}

TEST_F(build, one_export_is_probed_then_enumerated_from_the_start_and_exported_once) {
  if (!ipc.present()) GTEST_SKIP() << "needs the recording IPC library";
  config_provider provider;
  provider.exports = {{"orders", "\\\\.\\pipe\\orders", false}};  // leaves link type and security alone
  ibus* bus = registry.create_bus("exporter", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_NE(nullptr, registry.get_gateway("exporter"));
  const auto exported = provider.calls_of("exported");
  ASSERT_EQ(3u, exported.size()) << "the probe, the element, the end";
  EXPECT_EQ(0u, exported[0].cursor);
  EXPECT_EQ(0u, exported[1].cursor) << "the real enumeration starts again from the first element";
  EXPECT_EQ(1u, exported[2].cursor);
  for (const auto& call : exported) {
    EXPECT_EQ(3u, call.link_type_in);
    EXPECT_EQ(0u, call.security_in);
  }
  const auto imported = provider.calls_of("imported");
  ASSERT_EQ(1u, imported.size()) << "the probe stopped at the export; the enumeration ran once";
  EXPECT_EQ(0u, imported[0].cursor);
  const std::string calls = ipc.take();
  EXPECT_NE(std::string::npos, calls.find("export orders \\\\.\\pipe\\orders 3\n")) << calls;
  EXPECT_EQ(std::string::npos, calls.find("export orders", calls.find("export orders") + 1))
      << "exported exactly once: " << calls;
  EXPECT_NE(std::string::npos, calls.find("start\n"));
  registry.destroy_bus("exporter");
  EXPECT_EQ("stop\ndestroy\n", ipc.take());
}

TEST_F(build, a_failed_export_stops_before_the_imports_and_keeps_the_bus) {
  if (!ipc.present()) GTEST_SKIP() << "needs the recording IPC library";
  config_provider provider;
  provider.exports = {{"orders", "pipe_x", true, 3, 1}};
  provider.imports = {{"local", "pipe_y", "remote", "remote_bus"}};
  ipc.take();
  ipc.set_result(3, 50);
  ibus* bus = registry.create_bus("failing", &provider);
  ipc.set_result(3, 0);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(nullptr, registry.get_gateway("failing"));
  EXPECT_TRUE(provider.calls_of("imported").empty())
      << "the probe stopped at the export it found, and the imports never started";
  EXPECT_TRUE(has_line(L"export_channels", L"export channel name=orders on pipe=pipe_x err=50"));
  const std::string calls = ipc.take();
  EXPECT_EQ(std::string::npos, calls.find("import ")) << calls;
  EXPECT_EQ(std::string::npos, calls.find("start")) << calls;
  EXPECT_NE(std::string::npos, calls.find("destroy")) << calls;
  registry.destroy_bus("failing");
}

}  // namespace
