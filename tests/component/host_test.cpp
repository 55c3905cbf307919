// vorbel.dll as a host sees it: loaded with LoadLibraryW from the program's
// folder, reached only through its three exports and the public headers.
#include <gtest/gtest.h>

#include <vorbel/host.h>

#include <windows.h>

#include "support/config_provider.h"

namespace {

TEST(host, a_bus_through_the_exports_only) {
  wchar_t path[MAX_PATH];
  const std::wstring program(path, ::GetModuleFileNameW(nullptr, path, MAX_PATH));
  vorbel::host_library library;
  ASSERT_EQ(0u, library.open(program.substr(0, program.find_last_of(L'\\'))));
  ivorbel* registry = library.registry();
  ASSERT_NE(nullptr, registry);

  test_support::config_provider provider;
  provider.is_default = true;
  provider.local = {"alerts"};
  ibus* bus = registry->create_bus("main", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(bus, registry->get_bus(nullptr));
  EXPECT_EQ(0u, bus->register_listener("alerts", "x"));
  EXPECT_TRUE(bus->is_registered_listener("alerts", "x"));
  registry->destroy_bus("main");
  library.close();
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"vorbel.dll")) << "the last use unloads the component";
}

}  // namespace
