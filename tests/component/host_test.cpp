// vorbel.dll as a host sees it: loaded with LoadLibraryW from the program's
// folder, reached only through its three exports and the public headers.
#include <gtest/gtest.h>

#include <vorbel/host.h>

#include <windows.h>

#include "support/bus_observer.h"
#include "support/config_provider.h"

namespace {

std::wstring program_dir() {
  wchar_t path[MAX_PATH];
  const DWORD n = ::GetModuleFileNameW(nullptr, path, MAX_PATH);
  std::wstring dir(path, n);
  return dir.substr(0, dir.find_last_of(L'\\'));
}

TEST(host, a_bus_through_the_exports_only) {
  vorbel::host_library library;
  ASSERT_EQ(0u, library.open(program_dir()));
  ivorbel* registry = library.registry();
  ASSERT_NE(nullptr, registry);
  auto get_interface = reinterpret_cast<QmGetInterface_fn>(
      reinterpret_cast<void*>(::GetProcAddress(library.module(), "QmGetInterface")));
  ASSERT_NE(nullptr, get_interface);
  EXPECT_EQ(static_cast<void*>(registry), get_interface(IID_ivorbel));

  test_support::config_provider provider;
  provider.is_default = true;
  provider.local = {"alerts"};
  ibus* bus = registry->create_bus("main", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(bus, registry->get_bus(nullptr));
  EXPECT_EQ(nullptr, registry->get_gateway("main"));

  test_support::recording_bus_observer observer;
  ASSERT_TRUE(bus->add_observer(&observer, 0));
  EXPECT_EQ(0u, bus->register_listener("alerts", "x"));
  ASSERT_TRUE(observer.wait_for_count(1));
  EXPECT_EQ(test_support::added(::GetCurrentProcessId(), "alerts", "x"), observer.seen()[0]);
  EXPECT_EQ(87u, bus->register_listener(nullptr, "x"));
  EXPECT_TRUE(bus->remove_observer(&observer, 0));
  registry->destroy_bus("main");
  EXPECT_EQ(nullptr, registry->get_bus("main"));
  library.close();
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"vorbel.dll")) << "the last use unloads the component";
}

TEST(host, a_missing_folder_is_a_load_error) {
  vorbel::host_library library;
  EXPECT_NE(0u, library.open(L"C:\\no\\such\\folder"));
  EXPECT_EQ(nullptr, library.registry());
}

}  // namespace
