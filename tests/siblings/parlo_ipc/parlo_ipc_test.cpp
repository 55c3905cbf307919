// parlo_ipc.dll over a real pipe: two parlo.dll buses of this process joined
// by two gateways. Hostile peers, kills and restarts across processes are
// the fault and end-to-end tests' part.
#include <gtest/gtest.h>
#include <windows.h>

#include <atomic>
#include <mutex>
#include <string>

#include "bus/parlo/parlo.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "platform/handles.h"
#include "platform/win_api.h"
#include "support/log_capture.h"

namespace {

using parlo::ipc::pipe_handle;
using test_support::wait_until;

const std::wstring folder = winapi::module_directory(winapi::current_module());
const winapi::unique_module parlo_dll = winapi::load_library((folder + L"parlo.dll").c_str());
const winapi::unique_module ipc_dll = winapi::load_library((folder + L"parlo_ipc.dll").c_str());
template <typename Fn>
Fn from(const winapi::unique_module& module, const char* name) {
  return winapi::get_proc_address_as<Fn>(module.get(), name);
}
const auto create_bus = from<parlo::create_bus_fn>(parlo_dll, "create_bus");
const auto destroy_bus = from<parlo::destroy_bus_fn>(parlo_dll, "destroy_bus");
const auto create_gateway = from<parlo::ipc::create_gateway_fn>(ipc_dll, "create_gateway");
const auto destroy_gateway = from<parlo::ipc::destroy_gateway_fn>(ipc_dll, "destroy_gateway");

// A bus with one subscribed channel, joined to a pipe through its gateway,
// whose events it hears: it admits every peer and counts the connections
// that started communicating.
struct endpoint final : parlo::ipc::gateway::events {
  parlo::bus* bus;
  parlo::channel* channel;
  parlo::ipc::gateway* gateway;
  std::atomic<int> started{0};
  std::mutex mutex;
  std::string texts;  // each delivered text and a line end

  endpoint(const char* name, const char* channel_name) : bus(create_bus(name)) {
    EXPECT_EQ(0u, bus->create_channel(channel_name));
    channel = bus->get_channel(channel_name);
    EXPECT_EQ(0u, channel->create_subscription()->listen(&endpoint::deliver, this, 0));
    gateway = create_gateway(bus, this);
  }
  ~endpoint() {
    destroy_gateway(gateway);
    destroy_bus(bus);
  }
  void on_listen(pipe_handle, const char*) override {}
  bool on_local_connect(pipe_handle, std::uint32_t) override { return true; }
  void on_local_disconnect(pipe_handle) override {}
  void on_local_start_communication(pipe_handle) override { ++started; }
  void on_local_error(pipe_handle, std::uint32_t) override {}
  bool on_remote_connect(pipe_handle, std::uint32_t) override { return true; }
  void on_remote_disconnect(pipe_handle) override {}
  void on_remote_start_communication(pipe_handle) override { ++started; }
  void on_remote_error(pipe_handle, std::uint32_t) override {}
  void post(const std::string& text) {
    parlo::message* message = bus->create_message(0);
    message->set_blob("text", text.data(), text.size());
    EXPECT_EQ(0u, channel->post(message));
    message->release();
  }
  bool received(const std::string& text) {
    return wait_until([&] {
      std::lock_guard<std::mutex> lock(mutex);
      return texts.find(text + "\n") != std::string::npos;
    });
  }
  static void deliver(parlo::message* message, void* context) {
    auto* self = static_cast<endpoint*>(context);
    std::uint64_t size = 0;
    const auto* bytes = static_cast<const char*>(message->get_blob("text", &size));
    std::lock_guard<std::mutex> lock(self->mutex);
    self->texts.append(bytes, size).append("\n");
  }
};

// The client names the pipe by its full path with the prefix in other letters
// than the server's bare name: the same pipe.
TEST(parlo_ipc, an_exported_and_an_imported_channel_exchange_messages_both_ways) {
  const std::string pipe = "parlo_ipc_test_" + std::to_string(::GetCurrentProcessId());
  const std::string full_path = "\\\\.\\PIPE\\" + pipe;
  endpoint server("server", "alpha"), client("client", "a_local");
  ASSERT_EQ(0u, server.gateway->export_channel("alpha", pipe.c_str(), 3));
  ASSERT_EQ(0u, client.gateway->import_channel("a_local", full_path.c_str(), "server", "alpha", 3));
  ASSERT_EQ(0u, server.gateway->start());
  ASSERT_EQ(0u, client.gateway->start());
  ASSERT_TRUE(wait_until([&] { return server.started == 1 && client.started == 1; }));
  client.post("from the client");
  server.post("from the server");
  EXPECT_TRUE(server.received("from the client"));
  EXPECT_TRUE(client.received("from the server"));
}

}  // namespace
