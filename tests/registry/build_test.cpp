// Building buses from a configuration provider through the registry, over the
// real messaging stand-in. This program has no parlo_ipc.dll beside it, so
// every gateway build fails at the library load.
#include <gtest/gtest.h>

#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

using test_support::config_provider;
using test_support::has_line;

class build : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  vorbel_impl registry;
};

TEST_F(build, an_empty_configuration_gives_a_bus_without_gateway) {
  config_provider provider;
  ibus* bus = registry.create_bus("empty", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(nullptr, registry.get_gateway("empty"));
  EXPECT_TRUE(has_line(L"build_bus", L"build bus name=empty"));
  EXPECT_TRUE(has_line(L"build_gateway", L"exported & imported channels are empty"));
  EXPECT_TRUE(has_line(L"build_bus", L"-> build_bus()"));
  const auto calls = provider.calls();
  ASSERT_EQ(4u, calls.size());
  EXPECT_EQ("local", calls[0].what);
  EXPECT_EQ("exported", calls[1].what);
  EXPECT_EQ("imported", calls[2].what);
  EXPECT_EQ("is_default_bus", calls[3].what);
  // The bus works: its local channels exist and listeners register.
  EXPECT_EQ(0u, bus->register_listener("c", "l"));
  EXPECT_TRUE(bus->is_registered_listener("c", "l"));
  registry.destroy_bus("empty");
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

TEST_F(build, local_channels_are_created_in_the_library) {
  config_provider provider;
  provider.local = {"alpha", "beta", "alpha"};  // creating an existing channel again is fine
  ibus* bus = registry.create_bus("channels", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_TRUE(has_line(L"build_bus", L"create_channel name=beta"));
  registry.destroy_bus("channels");
}

TEST_F(build, imports_only_are_probed_with_fresh_cursors_and_a_gateway_failure_keeps_the_bus) {
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

}  // namespace
