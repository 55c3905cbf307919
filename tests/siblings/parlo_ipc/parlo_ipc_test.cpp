// parlo_ipc.dll over real pipes: real parlo.dll buses joined by gateways in
// this process and in a child process (parlo_ipc_peer.exe), observed through
// a recording event sink, the buses' subscriptions and raw pipe clients.
#include <gtest/gtest.h>
#include <windows.h>
#include <tlhelp32.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bus/parlo/parlo.h"
#include "frame_codec.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "platform/handles.h"
#include "platform/win_api.h"
#include "support/log_capture.h"

namespace {

using namespace std::chrono_literals;
using parlo::ipc::pipe_handle;
using test_support::wait_until;

constexpr auto bound = 10s;

// --- the libraries -----------------------------------------------------------

struct libraries {
  winapi::unique_module parlo;
  winapi::unique_module ipc;
  parlo::create_bus_fn create_bus;
  parlo::destroy_bus_fn destroy_bus;
  parlo::ipc::create_gateway_fn create_gateway;
  parlo::ipc::destroy_gateway_fn destroy_gateway;

  libraries()
      : parlo(winapi::load_library((folder() + L"parlo.dll").c_str())),
        ipc(winapi::load_library((folder() + L"parlo_ipc.dll").c_str())),
        create_bus(winapi::get_proc_address_as<parlo::create_bus_fn>(parlo.get(), "create_bus")),
        destroy_bus(winapi::get_proc_address_as<parlo::destroy_bus_fn>(parlo.get(), "destroy_bus")),
        create_gateway(winapi::get_proc_address_as<parlo::ipc::create_gateway_fn>(
            ipc.get(), "create_gateway")),
        destroy_gateway(winapi::get_proc_address_as<parlo::ipc::destroy_gateway_fn>(
            ipc.get(), "destroy_gateway")) {}

  static std::wstring folder() { return winapi::module_directory(winapi::current_module()); }
};

libraries& lib() {
  static libraries instance;
  return instance;
}

// A pipe name no other test (or run) uses.
std::string unique_pipe(const char* what) {
  static std::atomic<int> counter{0};
  return std::string("parlo_ipc_test_") + std::to_string(::GetCurrentProcessId()) + "_" + what +
         "_" + std::to_string(++counter);
}

std::wstring widen(const std::string& text) { return std::wstring(text.begin(), text.end()); }

// --- recording sink ----------------------------------------------------------

struct event {
  std::string kind;  // "listen", "local_connect", ... as the slot without "on_"
  pipe_handle pipe;
  std::uint32_t value;  // pid or err
  bool admitted;        // connect events: what the sink answered
};

class recording_sink final : public parlo::ipc::gateway::events {
 public:
  // Decides local connects; admits everyone unless set.
  std::function<bool(pipe_handle, std::uint32_t)> admit;
  // Runs inside on_remote_connect / on_listen, before they return.
  std::function<void(pipe_handle, std::uint32_t)> on_remote;
  std::function<void(pipe_handle)> on_listen_hook;
  // Set by the test once destroy_gateway has returned.
  std::atomic<bool> closed{false};
  std::atomic<int> late{0};

  void on_listen(pipe_handle pipe, const char* name) override {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      listen_name_ = name != nullptr ? name : "(null)";
    }
    record("listen", pipe, 0, true);
    if (on_listen_hook) on_listen_hook(pipe);
  }
  bool on_local_connect(pipe_handle pipe, std::uint32_t pid) override {
    const bool result = admit ? admit(pipe, pid) : true;
    record("local_connect", pipe, pid, result);
    return result;
  }
  void on_local_disconnect(pipe_handle pipe) override { record("local_disconnect", pipe, 0, true); }
  void on_local_start_communication(pipe_handle pipe) override {
    record("local_start", pipe, 0, true);
  }
  void on_local_error(pipe_handle pipe, std::uint32_t err) override {
    record("local_error", pipe, err, true);
  }
  bool on_remote_connect(pipe_handle pipe, std::uint32_t pid) override {
    record("remote_connect", pipe, pid, true);
    if (on_remote) on_remote(pipe, pid);
    return true;
  }
  void on_remote_disconnect(pipe_handle pipe) override {
    record("remote_disconnect", pipe, 0, true);
  }
  void on_remote_start_communication(pipe_handle pipe) override {
    record("remote_start", pipe, 0, true);
  }
  void on_remote_error(pipe_handle pipe, std::uint32_t err) override {
    record("remote_error", pipe, err, true);
  }

  std::vector<event> events() {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }
  std::size_t count(const std::string& kind) {
    std::size_t n = 0;
    for (const event& e : events()) n += e.kind == kind ? 1 : 0;
    return n;
  }
  bool wait_count(const std::string& kind, std::size_t n, std::chrono::milliseconds within = bound) {
    return wait_until([&] { return count(kind) >= n; }, within);
  }
  std::string listen_name() {
    std::lock_guard<std::mutex> lock(mutex_);
    return listen_name_;
  }
  // Every event of the connection that `connect` (an index into events())
  // opened, up to the handle's reuse by a new instance or connection.
  std::vector<event> connection_events(std::size_t connect) {
    const std::vector<event> all = events();
    std::vector<event> result = {all.at(connect)};
    for (std::size_t i = connect + 1; i < all.size(); ++i) {
      if (all[i].pipe != all[connect].pipe) continue;
      if (all[i].kind == "listen" || all[i].kind == "remote_connect") break;
      result.push_back(all[i]);
    }
    return result;
  }

 private:
  void record(const char* kind, pipe_handle pipe, std::uint32_t value, bool admitted) {
    if (closed) ++late;
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back(event{kind, pipe, value, admitted});
  }

  std::mutex mutex_;
  std::vector<event> events_;
  std::string listen_name_;
};

// Kinds of one connection's events, joined by blanks.
std::string kinds(const std::vector<event>& list) {
  std::string text;
  for (const event& e : list) text += (text.empty() ? "" : " ") + e.kind;
  return text;
}

// Every connection's events come as listen -> connect -> [start] ->
// [error] -> disconnect, and a refused connect ends its connection.
void expect_well_ordered(recording_sink& sink) {
  enum class state { none, listening, connected, started, failed };
  std::map<pipe_handle, state> states;
  for (const event& e : sink.events()) {
    state& s = states[e.pipe];
    const std::string k = e.kind;
    bool ok = true;
    if (k == "listen") {
      // An instance that never got a client is closed without an event at
      // stop, and its handle value may come back.
      ok = s == state::none || s == state::listening;
      s = state::listening;
    } else if (k == "local_connect") {
      ok = s == state::listening;
      s = e.admitted ? state::connected : state::none;
    } else if (k == "remote_connect") {
      ok = s == state::none;
      s = state::connected;
    } else if (k == "local_start" || k == "remote_start") {
      ok = s == state::connected;
      s = state::started;
    } else if (k == "local_error" || k == "remote_error") {
      ok = s == state::connected || s == state::started;
      s = state::failed;
    } else {  // a disconnect
      ok = s == state::connected || s == state::started || s == state::failed;
      s = state::none;
    }
    EXPECT_TRUE(ok) << k << " out of order for handle " << e.pipe;
  }
}

// --- buses -------------------------------------------------------------------

class test_bus {
 public:
  explicit test_bus(const char* name) : bus_(lib().create_bus(name)) {}
  ~test_bus() { lib().destroy_bus(bus_); }
  test_bus(const test_bus&) = delete;
  test_bus& operator=(const test_bus&) = delete;

  parlo::bus* get() const { return bus_; }

  // Posts a message with `id` and the blob "text".
  void post(const char* channel, std::uint32_t id, const std::string& text = "payload") {
    ASSERT_EQ(bus_->create_channel(channel), 0u);
    parlo::message* message = bus_->create_message(0);
    ASSERT_NE(message, nullptr);
    message->set_message_id(id);
    message->set_blob("text", text.data(), text.size());
    EXPECT_EQ(bus_->get_channel(channel)->post(message), 0u);
    message->release();
  }

 private:
  parlo::bus* bus_;
};

// What arrives on one channel of a bus.
class inbox {
 public:
  inbox(test_bus& bus, const char* channel) {
    EXPECT_EQ(bus.get()->create_channel(channel), 0u);
    channel_ = bus.get()->get_channel(channel);
    subscription_ = channel_->create_subscription();
    EXPECT_EQ(subscription_->listen(&inbox::deliver, this, 0), 0u);
  }
  ~inbox() { channel_->destroy_subscription(subscription_); }
  inbox(const inbox&) = delete;
  inbox& operator=(const inbox&) = delete;

  bool wait_for(std::uint32_t id, std::chrono::milliseconds within = bound) {
    std::unique_lock<std::mutex> lock(mutex_);
    return arrived_.wait_for(lock, within, [&] {
      for (const auto& [got, text] : messages_)
        if (got == id) return true;
      return false;
    });
  }
  // The ids that arrived, in order of arrival.
  std::vector<std::uint32_t> ids() {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::uint32_t> result;
    for (const auto& [id, text] : messages_) result.push_back(id);
    return result;
  }
  // The same, sorted: where local and piped messages race.
  std::vector<std::uint32_t> sorted_ids() {
    std::vector<std::uint32_t> result = ids();
    std::sort(result.begin(), result.end());
    return result;
  }
  std::string text_of(std::uint32_t id) {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& [got, text] : messages_)
      if (got == id) return text;
    return {};
  }

 private:
  static void deliver(parlo::message* message, void* context) {
    auto* self = static_cast<inbox*>(context);
    std::uint64_t size = 0;
    const void* bytes = message->get_blob("text", &size);
    std::string text = bytes != nullptr ? std::string(static_cast<const char*>(bytes), size) : "";
    std::lock_guard<std::mutex> lock(self->mutex_);
    self->messages_.emplace_back(message->message_id(), std::move(text));
    self->arrived_.notify_all();
  }

  parlo::channel* channel_ = nullptr;
  parlo::subscription* subscription_ = nullptr;
  std::mutex mutex_;
  std::condition_variable arrived_;
  std::vector<std::pair<std::uint32_t, std::string>> messages_;
};

// A gateway with its recording sink; the sink outlives the gateway.
class test_gateway {
 public:
  explicit test_gateway(test_bus& bus) : gateway_(lib().create_gateway(bus.get(), &sink)) {}
  ~test_gateway() { destroy(); }
  test_gateway(const test_gateway&) = delete;
  test_gateway& operator=(const test_gateway&) = delete;

  parlo::ipc::gateway* operator->() const { return gateway_; }
  parlo::ipc::gateway* get() const { return gateway_; }
  void destroy() {
    if (gateway_ != nullptr) lib().destroy_gateway(gateway_);
    gateway_ = nullptr;
    sink.closed = true;
  }

  recording_sink sink;

 private:
  parlo::ipc::gateway* gateway_;
};

// --- processes, threads, raw clients ----------------------------------------

// parlo_ipc_peer.exe, alive until its standard input is closed or killed.
class peer_process {
 public:
  explicit peer_process(const std::string& arguments) {
    SECURITY_ATTRIBUTES inherit{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
    HANDLE read_end = nullptr;
    HANDLE write_end = nullptr;
    EXPECT_TRUE(::CreatePipe(&read_end, &write_end, &inherit, 0));
    stdin_read_.reset(read_end);
    stdin_write_.reset(write_end);
    ::SetHandleInformation(write_end, HANDLE_FLAG_INHERIT, 0);
    nul_.reset(::CreateFileW(L"NUL", GENERIC_WRITE, FILE_SHARE_WRITE, &inherit, OPEN_EXISTING, 0,
                             nullptr));
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = read_end;
    startup.hStdOutput = nul_.get();
    startup.hStdError = nul_.get();
    std::wstring command = L"\"" + libraries::folder() + L"parlo_ipc_peer.exe\" " + widen(arguments);
    PROCESS_INFORMATION info{};
    EXPECT_TRUE(::CreateProcessW(nullptr, command.data(), nullptr, nullptr,
                                 /* inherit_handles */ TRUE, 0, nullptr, nullptr, &startup, &info))
        << ::GetLastError();
    process_.reset(info.hProcess);
    ::CloseHandle(info.hThread);
    pid = info.dwProcessId;
  }
  ~peer_process() {
    stdin_write_.reset();  // the peer stops and exits
    if (process_ && ::WaitForSingleObject(process_.get(), 10000) != WAIT_OBJECT_0) kill();
  }
  void kill() {
    ::TerminateProcess(process_.get(), 9);
    ::WaitForSingleObject(process_.get(), 10000);
  }
  DWORD exit_code() {
    DWORD code = 0;
    ::GetExitCodeProcess(process_.get(), &code);
    return code;
  }

  DWORD pid = 0;

 private:
  winapi::unique_handle stdin_read_, stdin_write_, nul_, process_;
};

std::size_t thread_count() {
  winapi::unique_handle snapshot(::CreateToolhelp32Snapshot(TH32CS_SNAPTHREAD, 0));
  THREADENTRY32 entry{};
  entry.dwSize = sizeof(entry);
  std::size_t n = 0;
  for (BOOL more = ::Thread32First(snapshot.get(), &entry); more;
       more = ::Thread32Next(snapshot.get(), &entry)) {
    if (entry.th32OwnerProcessID == ::GetCurrentProcessId()) ++n;
  }
  return n;
}

// A client that speaks the protocol by hand.
class raw_client {
 public:
  explicit raw_client(const std::string& pipe) {
    const std::wstring path = L"\\\\.\\pipe\\" + widen(pipe);
    wait_until([&] {
      handle_.reset(::CreateFileW(path.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                                  OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr));
      if (handle_.get() == INVALID_HANDLE_VALUE) static_cast<void>(handle_.release());
      return static_cast<bool>(handle_);
    });
    event_.reset(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  }
  bool connected() const { return static_cast<bool>(handle_); }

  bool write(const std::vector<unsigned char>& bytes) {
    OVERLAPPED ov{};
    ov.hEvent = event_.get();
    DWORD written = 0;
    if (!::WriteFile(handle_.get(), bytes.data(), static_cast<DWORD>(bytes.size()), nullptr, &ov) &&
        ::GetLastError() != ERROR_IO_PENDING) {
      return false;
    }
    if (::WaitForSingleObject(event_.get(), 5000) != WAIT_OBJECT_0) {
      ::CancelIoEx(handle_.get(), &ov);
      ::GetOverlappedResult(handle_.get(), &ov, &written, TRUE);
      return false;
    }
    return ::GetOverlappedResult(handle_.get(), &ov, &written, FALSE) && written == bytes.size();
  }
  void write_hello(const char* bus = "server") {
    parlo::ipc::frame::hello hello;
    hello.bus_name = bus;
    hello.channels = {"alpha"};
    std::vector<unsigned char> frame;
    ASSERT_EQ(parlo::ipc::frame::encode_hello(hello, frame), parlo::ipc::frame::status::ok);
    ASSERT_TRUE(write(frame));
  }
  // Reads until the server closes the pipe; false if it stays open.
  bool wait_closed_by_server(std::chrono::milliseconds within = bound) {
    const auto deadline = std::chrono::steady_clock::now() + within;
    std::vector<unsigned char> buffer(64 * 1024);
    while (std::chrono::steady_clock::now() < deadline) {
      OVERLAPPED ov{};
      ov.hEvent = event_.get();
      DWORD got = 0;
      if (!::ReadFile(handle_.get(), buffer.data(), static_cast<DWORD>(buffer.size()), nullptr,
                      &ov)) {
        const DWORD err = ::GetLastError();
        if (err != ERROR_IO_PENDING) return err == ERROR_BROKEN_PIPE || err == ERROR_PIPE_NOT_CONNECTED;
      }
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (::WaitForSingleObject(event_.get(), static_cast<DWORD>(std::max<long long>(left.count(), 1))) !=
          WAIT_OBJECT_0) {
        ::CancelIoEx(handle_.get(), &ov);
        ::GetOverlappedResult(handle_.get(), &ov, &got, TRUE);
        return false;
      }
      if (!::GetOverlappedResult(handle_.get(), &ov, &got, FALSE)) {
        const DWORD err = ::GetLastError();
        return err == ERROR_BROKEN_PIPE || err == ERROR_PIPE_NOT_CONNECTED;
      }
    }
    return false;
  }

 private:
  winapi::unique_handle handle_;
  winapi::unique_handle event_;
};

// A served pipe with one exported channel "alpha" on bus "server".
struct served_pipe {
  std::string pipe = unique_pipe("served");
  test_bus bus{"server"};
  inbox alpha{bus, "alpha"};
  test_gateway gateway{bus};

  served_pipe() {
    EXPECT_EQ(gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
    EXPECT_EQ(gateway->start(), 0u);
  }
};

// A client gateway importing `local` <- "alpha" of bus "server" over `pipe`.
struct joined_client {
  test_bus bus;
  inbox local;
  test_gateway gateway{bus};

  joined_client(const std::string& pipe, const char* name, const char* channel = "alpha")
      : bus(name), local(bus, channel) {
    EXPECT_EQ(gateway->import_channel(channel, pipe.c_str(), "server", "alpha", 3), 0u);
    EXPECT_EQ(gateway->start(), 0u);
  }
  bool wait_joined(std::size_t connections = 1) {
    return gateway.sink.wait_count("remote_start", connections);
  }
};

// --- tests -------------------------------------------------------------------

TEST(parlo_ipc, messages_cross_both_ways_each_to_its_joined_channel_only) {
  test_support::clear_log();
  const std::string pipe = unique_pipe("flow");
  test_bus server("server");
  inbox server_alpha(server, "alpha"), server_beta(server, "beta");
  test_gateway server_gateway(server);
  ASSERT_EQ(server_gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
  ASSERT_EQ(server_gateway->export_channel("beta", pipe.c_str(), 3), 0u);

  test_bus client("client");
  inbox client_alpha(client, "a_local"), client_beta(client, "beta");
  test_gateway client_gateway(client);
  // A full path in other letters names the same pipe.
  const std::string full = "\\\\.\\PIPE\\" + pipe;
  ASSERT_EQ(client_gateway->import_channel("a_local", full.c_str(), "server", "alpha", 3), 0u);
  ASSERT_EQ(client_gateway->import_channel("beta", pipe.c_str(), "server", "beta", 3), 0u);
  // A join the server cannot honour is refused alone.
  ASSERT_EQ(client_gateway->import_channel("ghost", pipe.c_str(), "server", "missing", 3), 0u);

  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);
  ASSERT_TRUE(client_gateway.sink.wait_count("remote_connect", 1));
  // Right after the connect event, without waiting for any hello.
  client.post("a_local", 1, "from the client");
  ASSERT_TRUE(server_gateway.sink.wait_count("local_connect", 1));
  server.post("alpha", 2, "from the server");
  server.post("beta", 3);
  client.post("beta", 4);

  ASSERT_TRUE(server_alpha.wait_for(1));
  EXPECT_EQ(server_alpha.text_of(1), "from the client");
  ASSERT_TRUE(client_alpha.wait_for(2));
  EXPECT_EQ(client_alpha.text_of(2), "from the server");
  ASSERT_TRUE(client_beta.wait_for(3));
  ASSERT_TRUE(server_beta.wait_for(4));
  // Each message reached its joined channel and no other; the sender's own
  // subscription saw its post once, nothing came back over the pipe.
  ASSERT_TRUE(server_beta.wait_for(3));
  ASSERT_TRUE(client_alpha.wait_for(1));
  ASSERT_TRUE(client_beta.wait_for(4));
  EXPECT_EQ(server_alpha.sorted_ids(), (std::vector<std::uint32_t>{1, 2}));
  EXPECT_EQ(server_beta.sorted_ids(), (std::vector<std::uint32_t>{3, 4}));
  EXPECT_EQ(client_alpha.sorted_ids(), (std::vector<std::uint32_t>{1, 2}));
  EXPECT_EQ(client_beta.sorted_ids(), (std::vector<std::uint32_t>{3, 4}));

  ASSERT_TRUE(client_gateway.sink.wait_count("remote_start", 1));
  ASSERT_TRUE(server_gateway.sink.wait_count("local_start", 1));
  EXPECT_TRUE(test_support::wait_for_line(L"parlo_ipc::server_connection::on_hello",
                                          L"channel=missing is not exported on this pipe"));
  EXPECT_EQ(server_gateway.sink.listen_name(), pipe);
  EXPECT_EQ(server_gateway.sink.count("local_error"), 0u);
  EXPECT_EQ(client_gateway.sink.count("remote_error"), 0u);

  client_gateway.destroy();
  ASSERT_TRUE(server_gateway.sink.wait_count("local_disconnect", 1));
  server_gateway.destroy();
  expect_well_ordered(server_gateway.sink);
  expect_well_ordered(client_gateway.sink);
  // The pipe-level connect events agree: one connection carried both channels.
  EXPECT_EQ(client_gateway.sink.count("remote_connect"), 1u);
  EXPECT_EQ(server_gateway.sink.count("local_connect"), 1u);
}

TEST(parlo_ipc, link_types_pick_the_ways_a_channel_crosses) {
  const std::string pipe = unique_pipe("links");
  test_bus server("server");
  inbox server_out(server, "out"), server_in(server, "in");
  test_gateway server_gateway(server);
  ASSERT_EQ(server_gateway->export_channel("out", pipe.c_str(), 1), 0u);  // send only
  ASSERT_EQ(server_gateway->export_channel("in", pipe.c_str(), 2), 0u);   // receive only
  test_bus client("client");
  inbox client_out(client, "out"), client_in(client, "in");
  test_gateway client_gateway(client);
  ASSERT_EQ(client_gateway->import_channel("out", pipe.c_str(), "server", "out", 3), 0u);
  ASSERT_EQ(client_gateway->import_channel("in", pipe.c_str(), "server", "in", 3), 0u);
  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);
  ASSERT_TRUE(client_gateway.sink.wait_count("remote_start", 1));
  ASSERT_TRUE(server_gateway.sink.wait_count("local_start", 1));

  client.post("out", 1);  // must not reach the server
  server.post("in", 2);   // must not reach the client
  client.post("in", 3);   // after 1 on the same connection
  server.post("out", 4);  // after 2 on the same connection
  ASSERT_TRUE(server_in.wait_for(3));
  ASSERT_TRUE(client_out.wait_for(4));
  ASSERT_TRUE(server_in.wait_for(2));
  ASSERT_TRUE(client_out.wait_for(1));
  EXPECT_EQ(server_out.ids(), (std::vector<std::uint32_t>{4}));
  EXPECT_EQ(client_in.ids(), (std::vector<std::uint32_t>{3}));
  EXPECT_EQ(server_in.sorted_ids(), (std::vector<std::uint32_t>{2, 3}));
  EXPECT_EQ(client_out.sorted_ids(), (std::vector<std::uint32_t>{1, 4}));
}

TEST(parlo_ipc, a_message_from_a_pipe_is_never_sent_out_again) {
  served_pipe server;
  joined_client a(server.pipe, "client_a"), b(server.pipe, "client_b");
  ASSERT_TRUE(a.wait_joined());
  ASSERT_TRUE(b.wait_joined());
  ASSERT_TRUE(server.gateway.sink.wait_count("local_start", 2));

  a.bus.post("alpha", 1);
  ASSERT_TRUE(server.alpha.wait_for(1));
  // The server's own post follows the injected one through the same
  // delivery thread and taps: had 1 gone out, it would be in front of 2.
  server.bus.post("alpha", 2);
  ASSERT_TRUE(b.local.wait_for(2));
  ASSERT_TRUE(a.local.wait_for(2));
  EXPECT_EQ(b.local.ids(), (std::vector<std::uint32_t>{2}));
  EXPECT_EQ(a.local.ids(), (std::vector<std::uint32_t>{1, 2}));  // its own post, locally, first
}

TEST(parlo_ipc, a_refused_client_is_not_read_and_its_connection_gets_no_more_events) {
  served_pipe server;
  std::atomic<int> connects{0};
  server.gateway.sink.admit = [&](pipe_handle, std::uint32_t) { return ++connects > 1; };

  test_bus client("client");
  inbox client_alpha(client, "alpha");
  test_gateway client_gateway(client);
  // Posted while on_remote_connect runs: queued for the connection, written
  // to the pipe, never read by the server that refuses it.
  std::atomic<int> remote_connects{0};
  client_gateway.sink.on_remote = [&](pipe_handle, std::uint32_t) {
    const int n = ++remote_connects;
    client.post("alpha", n == 1 ? 1 : 2);
  };
  ASSERT_EQ(client_gateway->import_channel("alpha", server.pipe.c_str(), "server", "alpha", 3), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);

  ASSERT_TRUE(server.alpha.wait_for(2));
  EXPECT_EQ(server.alpha.ids(), (std::vector<std::uint32_t>{2}));
  ASSERT_GE(client_gateway.sink.count("remote_disconnect"), 1u);

  const std::vector<event> all = server.gateway.sink.events();
  std::size_t refused = all.size();
  for (std::size_t i = 0; i < all.size(); ++i) {
    if (all[i].kind == "local_connect" && !all[i].admitted) {
      refused = i;
      break;
    }
  }
  ASSERT_LT(refused, all.size());
  EXPECT_EQ(kinds(server.gateway.sink.connection_events(refused)), "local_connect");
  // The client's first connection saw its server go without a word.
  const std::vector<event> client_events = client_gateway.sink.events();
  EXPECT_EQ(kinds(client_gateway.sink.connection_events(0)), "remote_connect remote_disconnect");
  expect_well_ordered(server.gateway.sink);
  expect_well_ordered(client_gateway.sink);
}

TEST(parlo_ipc, several_clients_share_a_pipe_that_always_has_an_instance_listening) {
  served_pipe server;
  std::vector<std::unique_ptr<joined_client>> clients;
  const std::wstring path = L"\\\\.\\pipe\\" + widen(server.pipe);
  for (int i = 0; i < 3; ++i) {
    clients.push_back(std::make_unique<joined_client>(server.pipe, "client"));
    ASSERT_TRUE(clients.back()->wait_joined());
    ASSERT_TRUE(server.gateway.sink.wait_count("listen", static_cast<std::size_t>(i) + 2));
    // A new instance listens before the client is even looked at.
    EXPECT_TRUE(::WaitNamedPipeW(path.c_str(), 1000)) << ::GetLastError();
  }
  server.bus.post("alpha", 7);
  for (auto& client : clients) ASSERT_TRUE(client->local.wait_for(7));

  // A client leaving frees its instance, not the name.
  clients[1]->gateway.destroy();
  ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", 1));
  EXPECT_TRUE(::WaitNamedPipeW(path.c_str(), 1000)) << ::GetLastError();
  clients.push_back(std::make_unique<joined_client>(server.pipe, "client"));
  ASSERT_TRUE(clients.back()->wait_joined());
  server.bus.post("alpha", 8);
  ASSERT_TRUE(clients.back()->local.wait_for(8));
  ASSERT_TRUE(clients[0]->local.wait_for(8));
  EXPECT_EQ(server.gateway.sink.count("local_connect"), 4u);
  // Every listening instance but one was taken by a client.
  EXPECT_EQ(server.gateway.sink.count("listen"), 5u);
  for (auto& client : clients) client->gateway.destroy();
  server.gateway.destroy();
  expect_well_ordered(server.gateway.sink);
}

TEST(parlo_ipc, a_client_waits_for_its_server_and_rejoins_it_after_a_restart) {
  test_support::clear_log();
  const std::string pipe = unique_pipe("late");
  joined_client client(pipe, "client");  // starts first: no server yet
  EXPECT_TRUE(test_support::wait_for_line(L"parlo_ipc::pipe_client::run", L"cannot be opened err=2"));

  test_bus server("server");
  inbox server_alpha(server, "alpha");
  test_gateway server_gateway(server);
  ASSERT_EQ(server_gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_TRUE(client.wait_joined(1));
  client.bus.post("alpha", 1);
  ASSERT_TRUE(server_alpha.wait_for(1));

  ASSERT_EQ(server_gateway->stop(), 0u);
  ASSERT_TRUE(client.gateway.sink.wait_count("remote_disconnect", 1));
  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_TRUE(client.wait_joined(2));
  ASSERT_TRUE(server_gateway.sink.wait_count("local_connect", 2));
  server.post("alpha", 2);
  ASSERT_TRUE(client.local.wait_for(2));
  client.bus.post("alpha", 3);
  ASSERT_TRUE(server_alpha.wait_for(3));
  expect_well_ordered(client.gateway.sink);
}

TEST(parlo_ipc, connect_events_carry_the_peer_process_and_a_killed_server_is_rejoined) {
  const std::string peer_pipe = unique_pipe("peer_serves");
  const std::string own_pipe = unique_pipe("test_serves");
  // This process serves own_pipe and joins the peer's pipe.
  test_bus bus("test");
  inbox echo(bus, "echo");
  test_gateway gateway(bus);
  ASSERT_EQ(gateway->export_channel("echo", own_pipe.c_str(), 3), 0u);
  ASSERT_EQ(gateway->import_channel("echo", peer_pipe.c_str(), "peer", "echo", 3), 0u);
  ASSERT_EQ(gateway->start(), 0u);

  auto first = std::make_unique<peer_process>("--serve " + peer_pipe + " --join " + own_pipe);
  ASSERT_TRUE(gateway.sink.wait_count("remote_start", 1));
  ASSERT_TRUE(gateway.sink.wait_count("local_start", 1));
  std::uint32_t client_pid = 0, server_pid = 0;
  for (const event& e : gateway.sink.events()) {
    if (e.kind == "local_connect") client_pid = e.value;
    if (e.kind == "remote_connect") server_pid = e.value;
  }
  EXPECT_EQ(client_pid, first->pid);
  EXPECT_EQ(server_pid, first->pid);
  // Over both pipes to the peer and back.
  bus.post("echo", 5);
  ASSERT_TRUE(echo.wait_for(1005));

  first->kill();
  ASSERT_TRUE(gateway.sink.wait_count("remote_disconnect", 1));
  ASSERT_TRUE(gateway.sink.wait_count("local_disconnect", 1));
  auto second = std::make_unique<peer_process>("--serve " + peer_pipe);
  ASSERT_TRUE(gateway.sink.wait_count("remote_start", 2));
  std::uint32_t rejoined_pid = 0;
  for (const event& e : gateway.sink.events()) {
    if (e.kind == "remote_connect") rejoined_pid = e.value;
  }
  EXPECT_EQ(rejoined_pid, second->pid);
  bus.post("echo", 6);
  ASSERT_TRUE(echo.wait_for(1006));
  second.reset();
  EXPECT_EQ(first->exit_code(), 9u);
  expect_well_ordered(gateway.sink);
}

TEST(parlo_ipc, broken_frames_close_the_connection_with_an_error_and_a_disconnect) {
  using namespace parlo::ipc::frame;
  auto header = [](std::uint64_t length, unsigned char type) {
    return std::vector<unsigned char>{static_cast<unsigned char>(length),
                                      static_cast<unsigned char>(length >> 8),
                                      static_cast<unsigned char>(length >> 16),
                                      static_cast<unsigned char>(length >> 24), type};
  };
  std::vector<unsigned char> garbage_message;
  const unsigned char junk[] = {'n', 'o', 't', ' ', 'p', 'a', 'r', 'l', 'o'};
  ASSERT_EQ(encode_message("alpha", junk, sizeof(junk), garbage_message), status::ok);
  std::vector<unsigned char> second_hello;
  hello again;
  again.bus_name = "server";
  ASSERT_EQ(encode_hello(again, second_hello), status::ok);
  std::vector<unsigned char> real_message;
  const unsigned char wire[] = {'P', 'R', 'L', '1', 1, 0, 0, 0, 0, 0, 0, 0};
  ASSERT_EQ(encode_message("alpha", wire, sizeof(wire), real_message), status::ok);
  std::vector<unsigned char> other_version = header(8, 1);
  for (unsigned char b : std::vector<unsigned char>{2, 0, 1, 0, 'b', 0, 0}) other_version.push_back(b);

  struct broken {
    const char* what;
    bool hello_first;
    std::vector<unsigned char> bytes;
  };
  const std::vector<broken> cases = {
      {"oversized length", false, header(max_frame_length + 1, 2)},
      {"oversized after the hello", true, header(0xFFFFFFFFu, 2)},
      {"empty frame", true, header(0, 2)},
      {"unknown type", true, header(1, 77)},
      {"message before the hello", false, real_message},
      {"hello of another version", false, other_version},
      {"second hello", true, second_hello},
      {"undecodable message", true, garbage_message},
  };
  served_pipe server;
  std::size_t expected_connects = 0;
  for (const broken& c : cases) {
    SCOPED_TRACE(c.what);
    raw_client client(server.pipe);
    ASSERT_TRUE(client.connected());
    ++expected_connects;
    ASSERT_TRUE(server.gateway.sink.wait_count("local_connect", expected_connects));
    if (c.hello_first) client.write_hello();
    client.write(c.bytes);
    EXPECT_TRUE(client.wait_closed_by_server());
    ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", expected_connects));
    const std::vector<event> all = server.gateway.sink.events();
    std::size_t connect = 0;
    for (std::size_t i = 0; i < all.size(); ++i)
      if (all[i].kind == "local_connect") connect = i;
    const std::vector<event> mine = server.gateway.sink.connection_events(connect);
    EXPECT_EQ(kinds(mine), c.hello_first ? "local_connect local_start local_error local_disconnect"
                                         : "local_connect local_error local_disconnect");
    for (const event& e : mine) {
      if (e.kind == "local_error") {
        EXPECT_EQ(e.value, 13u);
      }
    }
  }
  // The server still serves well-behaved clients.
  joined_client good(server.pipe, "client");
  ASSERT_TRUE(good.wait_joined());
  server.bus.post("alpha", 1);
  ASSERT_TRUE(good.local.wait_for(1));
  // Nothing the broken clients sent was delivered (one carried id 1 too).
  ASSERT_TRUE(server.alpha.wait_for(1));
  EXPECT_EQ(server.alpha.ids(), (std::vector<std::uint32_t>{1}));
  expect_well_ordered(server.gateway.sink);
}

TEST(parlo_ipc, a_client_that_does_not_read_is_dropped_at_the_queue_limit) {
  served_pipe server;
  raw_client idle(server.pipe);
  ASSERT_TRUE(idle.connected());
  ASSERT_TRUE(server.gateway.sink.wait_count("local_connect", 1));
  // 12 MiB messages: the third passes the limit of one largest frame and
  // 16 MiB.
  const std::string big(12u << 20, 'x');
  for (std::uint32_t id = 1; id <= 3; ++id) server.bus.post("alpha", id, big);
  ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", 1));
  std::uint32_t err = 0;
  for (const event& e : server.gateway.sink.events())
    if (e.kind == "local_error") err = e.value;
  EXPECT_EQ(err, static_cast<std::uint32_t>(ERROR_NOT_ENOUGH_QUOTA));
  expect_well_ordered(server.gateway.sink);
}

TEST(parlo_ipc, no_event_reaches_the_sink_once_destroy_gateway_returned) {
  test_support::clear_log();
  served_pipe server;
  joined_client client(server.pipe, "client");
  ASSERT_TRUE(client.wait_joined());
  // Traffic in flight both ways while the gateways go.
  for (std::uint32_t id = 1; id <= 50; ++id) {
    server.bus.post("alpha", id);
    client.bus.post("alpha", 100 + id);
  }
  server.gateway.destroy();
  ASSERT_TRUE(client.gateway.sink.wait_count("remote_disconnect", 1));
  // The client keeps knocking on the vanished pipe meanwhile.
  EXPECT_TRUE(test_support::wait_for_line(L"parlo_ipc::pipe_client::run", L"cannot be opened err=2"));
  client.gateway.destroy();
  // Room for a stray event to show.
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(server.gateway.sink.late.load(), 0);
  EXPECT_EQ(client.gateway.sink.late.load(), 0);
  expect_well_ordered(server.gateway.sink);
  expect_well_ordered(client.gateway.sink);
}

TEST(parlo_ipc, stop_and_start_cycles_leave_no_thread_and_no_handle_behind) {
  const std::string pipe = unique_pipe("cycles");
  test_bus server("server");
  inbox server_alpha(server, "alpha");
  test_gateway server_gateway(server);
  ASSERT_EQ(server_gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
  test_bus client("client");
  inbox client_alpha(client, "alpha");
  test_gateway client_gateway(client);
  ASSERT_EQ(client_gateway->import_channel("alpha", pipe.c_str(), "server", "alpha", 3), 0u);

  // Cycle 1 warms up: the system starts some threads of its own on first
  // use (and keeps them), so the count is taken after it.
  std::size_t threads_before = 0;
  DWORD handles_before = 0;
  for (std::uint32_t cycle = 1; cycle <= 6; ++cycle) {
    SCOPED_TRACE(cycle);
    ASSERT_EQ(server_gateway->start(), 0u);
    ASSERT_EQ(client_gateway->start(), 0u);
    ASSERT_TRUE(client_gateway.sink.wait_count("remote_start", cycle));
    ASSERT_TRUE(server_gateway.sink.wait_count("local_start", cycle));
    // Listener, server connection, client: three threads of the library.
    if (cycle > 1) {
      EXPECT_GE(thread_count(), threads_before + 3);
    }
    server.post("alpha", cycle);
    ASSERT_TRUE(client_alpha.wait_for(cycle));
    // Either side may stop first.
    if (cycle % 2 == 0) {
      ASSERT_EQ(server_gateway->stop(), 0u);
      ASSERT_EQ(client_gateway->stop(), 0u);
    } else {
      ASSERT_EQ(client_gateway->stop(), 0u);
      ASSERT_EQ(server_gateway->stop(), 0u);
    }
    if (cycle == 1) {
      threads_before = thread_count();
      ::GetProcessHandleCount(::GetCurrentProcess(), &handles_before);
      continue;
    }
    // stop joined every thread: nothing is left to wait for.
    EXPECT_EQ(thread_count(), threads_before);
  }
  DWORD handles_after = 0;
  ::GetProcessHandleCount(::GetCurrentProcess(), &handles_after);
  EXPECT_LE(handles_after, handles_before + 2);  // room for the system's own
  expect_well_ordered(server_gateway.sink);
  expect_well_ordered(client_gateway.sink);
}

TEST(parlo_ipc, slots_refuse_bad_arguments_and_calls_out_of_order) {
  test_bus bus("server");
  test_gateway gateway(bus);
  const std::string pipe = unique_pipe("slots");
  const char* p = pipe.c_str();
  const std::string long_name(256, 'n');
  EXPECT_EQ(gateway->export_channel(nullptr, p, 3), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", nullptr, 3), 87u);
  EXPECT_EQ(gateway->export_channel("", p, 3), 87u);
  EXPECT_EQ(gateway->export_channel(long_name.c_str(), p, 3), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", p, 0), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", p, 4), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", "\\\\server\\pipe\\x", 3), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", "\\\\.\\pipe\\", 3), 87u);
  EXPECT_EQ(gateway->export_channel("alpha", "\xff\xfe", 3), 87u);
  EXPECT_EQ(gateway->import_channel("a", p, "bus", nullptr, 3), 87u);
  EXPECT_EQ(gateway->import_channel("a", p, nullptr, "b", 3), 87u);
  EXPECT_EQ(gateway->import_channel(nullptr, p, "bus", "b", 3), 87u);
  EXPECT_EQ(gateway->import_channel("a", p, "", "b", 3), 87u);

  EXPECT_EQ(gateway->stop(), 0u);  // not running: nothing to do
  EXPECT_EQ(gateway->start(), 0u);  // nothing to carry: runs nothing
  EXPECT_EQ(gateway->start(), 1247u);
  EXPECT_EQ(gateway->export_channel("alpha", p, 3), 5023u);
  EXPECT_EQ(gateway->import_channel("a", p, "bus", "b", 3), 5023u);
  EXPECT_EQ(gateway->stop(), 0u);

  // Slots called from inside an event would join their own thread.
  std::atomic<std::uint32_t> from_event{0};
  gateway.sink.on_listen_hook = [&](pipe_handle) { from_event = gateway->stop(); };
  EXPECT_EQ(gateway->export_channel("alpha", p, 3), 0u);
  EXPECT_EQ(gateway->start(), 0u);
  ASSERT_TRUE(gateway.sink.wait_count("listen", 1));
  EXPECT_TRUE(wait_until([&] { return from_event.load() != 0; }));
  EXPECT_EQ(from_event.load(), 1131u);
  EXPECT_EQ(gateway->stop(), 0u);

  // The exports check what they are given.
  recording_sink sink;
  EXPECT_EQ(lib().create_gateway(nullptr, &sink), nullptr);
  EXPECT_EQ(lib().create_gateway(bus.get(), nullptr), nullptr);
  lib().destroy_gateway(nullptr);
  lib().destroy_gateway(reinterpret_cast<parlo::ipc::gateway*>(&sink));  // not one of its own
}

}  // namespace
