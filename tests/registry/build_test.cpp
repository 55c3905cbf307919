// Building a bus and its gateway from a configuration provider, over the real
// messaging stand-in and a recording double of the IPC library.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>

#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

// The calls the recording parlo_ipc.dll double was given since the last
// take, one a line. Loaded here for the whole run, so what it recorded
// survives the gateways that load and unload it.
std::string take_ipc_calls() {
  static const HMODULE ipc = ::LoadLibraryW(L"parlo_ipc.dll");
  auto calls = reinterpret_cast<std::size_t (*)(char*, std::size_t)>(
      reinterpret_cast<void*>(::GetProcAddress(ipc, "IpcDoubleCalls")));
  std::string text(calls(nullptr, 0) + 1, '\0');
  text.resize(calls(text.data(), text.size()));
  reinterpret_cast<void (*)()>(reinterpret_cast<void*>(::GetProcAddress(ipc, "IpcDoubleClearCalls")))();
  return text;
}

TEST(build, exports_are_probed_then_enumerated_from_the_start_and_each_pipe_carries_the_service_channel) {
  take_ipc_calls();
  vorbel_impl registry;
  test_support::config_provider provider;
  // The first leaves link type and security as the component preset them.
  provider.exports = {{"orders", "\\\\.\\pipe\\p1", false}, {"prices", "\\\\.\\pipe\\p1", true, 7, 1}};
  provider.imports = {{"local", "pipe_b", "remote", "remote_bus"}, {"local2", "pipe_b", "remote2", "remote_bus"}};
  ASSERT_NE(nullptr, registry.create_bus("exporter", &provider));
  EXPECT_EQ("0012", provider.exported_cursors) << "the probe, then the enumeration from the first element";
  EXPECT_EQ(
      "create bus\n"
      "export orders \\\\.\\pipe\\p1 3\n"
      "export vorbel_service \\\\.\\pipe\\p1 3\n"
      "export prices \\\\.\\pipe\\p1 7\n"
      "import local pipe_b remote_bus remote 3\n"
      "import vorbel_service pipe_b remote_bus vorbel_service 3\n"
      "import local2 pipe_b remote_bus remote2 3\n"
      "start\n",
      take_ipc_calls());
  registry.destroy_bus("exporter");
  EXPECT_EQ("stop\ndestroy\n", take_ipc_calls());
}

// Levels 0 and 1 are the only ones: any other is refused where it is
// configured, before it reaches the IPC library, and the bus goes without a
// gateway rather than with a pipe that admission would treat one way on
// first contact and another from its cache.
TEST(build, a_pipe_security_level_other_than_0_or_1_is_refused_with_a_line) {
  take_ipc_calls();
  vorbel_impl registry;
  test_support::config_provider exporter, importer;
  exporter.exports = {{"orders", "\\\\.\\pipe\\p2", true, 3, 2}};
  importer.imports = {{"local", "pipe_c", "remote", "remote_bus", 7}};
  for (auto [provider, name] : {std::pair{&exporter, "level2"}, std::pair{&importer, "level7"}}) {
    SCOPED_TRACE(name);
    test_support::clear_log();
    ASSERT_NE(nullptr, registry.create_bus(name, provider));
    EXPECT_EQ(nullptr, registry.get_gateway(name));
    EXPECT_EQ("create bus\ndestroy\n", take_ipc_calls());
    EXPECT_EQ(1u, test_support::find_lines(L"", L"is no pipe security level (0 or 1)").size())
        << test_support::dump_log();
    registry.destroy_bus(name);
  }
}

}  // namespace
