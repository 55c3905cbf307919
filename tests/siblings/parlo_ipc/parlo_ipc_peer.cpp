// A second process for the IPC library's tests: a bus named "peer" with the
// channel "echo", exported on the pipe after --serve and/or imported over the
// pipe after --join, through parlo.dll and parlo_ipc.dll from this program's
// folder. Every message arriving on "echo" with an id below 1000 is posted
// back on "echo" with 1000 added, so that the test sees its messages cross
// both ways. Runs until its standard input ends; exit codes: 0 done, 2 bad
// arguments, 3 a library or call failed.
#include <windows.h>

#include <cstring>
#include <string>

#include "bus/parlo/parlo.h"
#include "gateway/parlo_ipc/parlo_ipc.h"

namespace {

// Accepts every connection and keeps nothing.
class quiet_sink final : public parlo::ipc::gateway::events {
 public:
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

parlo::channel* g_echo = nullptr;
parlo::bus* g_bus = nullptr;

void on_echo(parlo::message* message, void*) {
  const std::uint32_t id = message->message_id();
  if (id >= 1000) return;
  parlo::message* reply = message->copy();
  if (reply == nullptr) return;
  reply->set_message_id(id + 1000);
  g_echo->post(reply);
  reply->release();
}

template <typename Fn>
Fn resolve(HMODULE module, const char* name) {
  return reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(module, name)));
}

std::wstring beside_me(const wchar_t* file) {
  wchar_t path[MAX_PATH] = {};
  const DWORD n = ::GetModuleFileNameW(nullptr, path, MAX_PATH);
  std::wstring result(path, n);
  return result.substr(0, result.rfind(L'\\') + 1) + file;
}

}  // namespace

int main(int argc, char** argv) {
  const char* serve = nullptr;
  const char* join = nullptr;
  for (int i = 1; i + 1 < argc; i += 2) {
    if (std::strcmp(argv[i], "--serve") == 0) serve = argv[i + 1];
    if (std::strcmp(argv[i], "--join") == 0) join = argv[i + 1];
  }
  if (serve == nullptr && join == nullptr) return 2;

  HMODULE parlo = ::LoadLibraryW(beside_me(L"parlo.dll").c_str());
  HMODULE ipc = ::LoadLibraryW(beside_me(L"parlo_ipc.dll").c_str());
  if (parlo == nullptr || ipc == nullptr) return 3;
  auto create_bus = resolve<parlo::create_bus_fn>(parlo, "create_bus");
  auto destroy_bus = resolve<parlo::destroy_bus_fn>(parlo, "destroy_bus");
  auto create_gateway = resolve<parlo::ipc::create_gateway_fn>(ipc, "create_gateway");
  auto destroy_gateway = resolve<parlo::ipc::destroy_gateway_fn>(ipc, "destroy_gateway");
  if (!create_bus || !destroy_bus || !create_gateway || !destroy_gateway) return 3;

  g_bus = create_bus("peer");
  if (g_bus == nullptr || g_bus->create_channel("echo") != 0) return 3;
  g_echo = g_bus->get_channel("echo");
  parlo::subscription* subscription = g_echo->create_subscription();
  if (subscription == nullptr || subscription->listen(&on_echo, nullptr, 0) != 0) return 3;

  quiet_sink sink;
  parlo::ipc::gateway* gateway = create_gateway(g_bus, &sink);
  if (gateway == nullptr) return 3;
  if (serve != nullptr && gateway->export_channel("echo", serve, 3) != 0) return 3;
  if (join != nullptr && gateway->import_channel("echo", join, "test", "echo", 3) != 0) return 3;
  if (gateway->start() != 0) return 3;

  char buffer[64];
  DWORD read = 0;
  HANDLE input = ::GetStdHandle(STD_INPUT_HANDLE);
  while (::ReadFile(input, buffer, sizeof(buffer), &read, /* overlapped */ nullptr) && read > 0) {
  }

  gateway->stop();
  destroy_gateway(gateway);
  g_echo->destroy_subscription(subscription);
  destroy_bus(g_bus);
  return 0;
}
