// parlo_ipc.dll over real pipes: real parlo.dll buses joined by gateways in
// this process and in a child process (parlo_ipc_peer.exe), observed through
// a recording event sink, the buses' subscriptions and raw pipe clients.
#include <gtest/gtest.h>
#include <windows.h>
#include <tlhelp32.h>

#include <algorithm>
#include <atomic>
#include <chrono>
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
using ids = std::vector<std::uint32_t>;
using byte_vector = std::vector<unsigned char>;

constexpr auto bound = 10s;

std::wstring folder() { return winapi::module_directory(winapi::current_module()); }
std::wstring widen(const std::string& text) { return std::wstring(text.begin(), text.end()); }

template <typename Fn>
Fn from(const winapi::unique_module& module, const char* name) {
  return winapi::get_proc_address_as<Fn>(module.get(), name);
}

struct libraries {
  winapi::unique_module parlo = winapi::load_library((folder() + L"parlo.dll").c_str());
  winapi::unique_module ipc = winapi::load_library((folder() + L"parlo_ipc.dll").c_str());
  parlo::create_bus_fn create_bus = from<parlo::create_bus_fn>(parlo, "create_bus");
  parlo::destroy_bus_fn destroy_bus = from<parlo::destroy_bus_fn>(parlo, "destroy_bus");
  parlo::ipc::create_gateway_fn create_gateway =
      from<parlo::ipc::create_gateway_fn>(ipc, "create_gateway");
  parlo::ipc::destroy_gateway_fn destroy_gateway =
      from<parlo::ipc::destroy_gateway_fn>(ipc, "destroy_gateway");
};

libraries& lib() {
  static libraries instance;
  return instance;
}

// A pipe name no other test (or run) uses.
std::string unique_pipe() {
  static std::atomic<int> counter{0};
  return "parlo_ipc_test_" + std::to_string(::GetCurrentProcessId()) + "_" +
         std::to_string(++counter);
}

// --- recording sink ----------------------------------------------------------

struct event {
  std::string kind;  // the slot's name without "on_", "local_start" for start_communication
  pipe_handle pipe;
  std::uint32_t value;  // pid or err
  bool admitted;        // local_connect: the sink's answer
  std::string name;     // listen: the pipe's name
};

class recording_sink final : public parlo::ipc::gateway::events {
 public:
  std::function<bool()> admit = [] { return true; };
  std::function<void()> on_remote;    // runs inside on_remote_connect
  std::function<void()> on_listened;  // runs inside on_listen
  std::atomic<bool> closed{false};    // set once destroy_gateway returned
  std::atomic<int> late{0};           // events after that

  void on_listen(pipe_handle p, const char* name) override {
    record("listen", p, 0, true, name != nullptr ? name : "<null>");
    if (on_listened) on_listened();
  }
  bool on_local_connect(pipe_handle p, std::uint32_t pid) override {
    const bool result = admit();
    record("local_connect", p, pid, result);
    return result;
  }
  void on_local_disconnect(pipe_handle p) override { record("local_disconnect", p); }
  void on_local_start_communication(pipe_handle p) override { record("local_start", p); }
  void on_local_error(pipe_handle p, std::uint32_t err) override { record("local_error", p, err); }
  bool on_remote_connect(pipe_handle p, std::uint32_t pid) override {
    record("remote_connect", p, pid);
    if (on_remote) on_remote();
    return true;
  }
  void on_remote_disconnect(pipe_handle p) override { record("remote_disconnect", p); }
  void on_remote_start_communication(pipe_handle p) override { record("remote_start", p); }
  void on_remote_error(pipe_handle p, std::uint32_t err) override {
    record("remote_error", p, err);
  }

  std::vector<event> events() {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }
  std::size_t count(const std::string& kind) {
    const std::vector<event> all = events();
    return std::count_if(all.begin(), all.end(), [&](const event& e) { return e.kind == kind; });
  }
  bool wait_count(const std::string& kind, std::size_t n) {
    return wait_until([&] { return count(kind) >= n; }, bound);
  }
  // The last event of `kind`.
  event last(const std::string& kind) {
    event found{};
    for (const event& e : events()) found = e.kind == kind ? e : found;
    return found;
  }
  // Kinds of the events of the connection opened by the last local connect
  // (admitted or, with `refused`, not), or by `events()[first]`, up to the
  // handle's reuse, joined by blanks.
  std::string connection(std::size_t first) {
    const std::vector<event> all = events();
    std::string text = all.at(first).kind;
    for (std::size_t i = first + 1; i < all.size(); ++i) {
      if (all[i].pipe != all[first].pipe) continue;
      if (all[i].kind == "listen" || all[i].kind == "remote_connect") break;
      text += " " + all[i].kind;
    }
    return text;
  }
  std::string last_local_connection(bool refused = false) {
    const std::vector<event> all = events();
    std::size_t found = all.size();
    for (std::size_t i = 0; i < all.size(); ++i)
      if (all[i].kind == "local_connect" && all[i].admitted != refused) found = i;
    return connection(found);
  }

 private:
  void record(const char* kind, pipe_handle p, std::uint32_t value = 0, bool admitted = true,
              std::string name = {}) {
    if (closed) ++late;
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back(event{kind, p, value, admitted, std::move(name)});
  }

  std::mutex mutex_;
  std::vector<event> events_;
};

// Each connection's events come as listen -> connect -> [start] -> [error]
// -> disconnect; a refused connect ends its connection.
void expect_well_ordered(recording_sink& sink) {
  enum state { none, listening, connected, started, failed };
  std::map<pipe_handle, state> states;
  for (const event& e : sink.events()) {
    state& s = states[e.pipe];
    const std::string& k = e.kind;
    bool ok = true;
    if (k == "listen") {
      // An instance that never had a client is closed at stop without an
      // event, and its handle value may come back.
      ok = s == none || s == listening;
      s = listening;
    } else if (k == "local_connect" || k == "remote_connect") {
      ok = s == (k == "local_connect" ? listening : none);
      s = e.admitted ? connected : none;
    } else if (k == "local_start" || k == "remote_start") {
      ok = s == connected;
      s = started;
    } else if (k == "local_error" || k == "remote_error") {
      ok = s == connected || s == started;
      s = failed;
    } else {
      ok = s == connected || s == started || s == failed;
      s = none;
    }
    EXPECT_TRUE(ok) << k << " out of order for handle " << e.pipe;
  }
}

// --- buses and gateways ------------------------------------------------------

class test_bus {
 public:
  explicit test_bus(const char* name) : bus_(lib().create_bus(name)) {}
  ~test_bus() { lib().destroy_bus(bus_); }
  parlo::bus* get() const { return bus_; }

  // Posts a message with `id` and the blob "text".
  void post(const char* channel, std::uint32_t id, const std::string& text = "payload") {
    bus_->create_channel(channel);
    parlo::message* message = bus_->create_message(0);
    message->set_message_id(id);
    message->set_blob("text", text.data(), text.size());
    EXPECT_EQ(bus_->get_channel(channel)->post(message), 0u);
    message->release();
  }

 private:
  parlo::bus* bus_;
};

// What arrives on one channel of a bus: ids and texts, in arrival order.
class inbox {
 public:
  inbox(test_bus& bus, const char* channel) {
    bus.get()->create_channel(channel);
    channel_ = bus.get()->get_channel(channel);
    subscription_ = channel_->create_subscription();
    EXPECT_EQ(subscription_->listen(&inbox::deliver, this, 0), 0u);
  }
  ~inbox() { channel_->destroy_subscription(subscription_); }

  bool wait_for(std::uint32_t id) {
    return wait_until([&] { return !text_of(id).empty(); }, bound);
  }
  ids received() {
    std::lock_guard<std::mutex> lock(mutex_);
    ids result;
    for (const auto& [id, text] : messages_) result.push_back(id);
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
    const auto* bytes = static_cast<const char*>(message->get_blob("text", &size));
    std::lock_guard<std::mutex> lock(self->mutex_);
    self->messages_.emplace_back(message->message_id(), std::string(bytes, size));
  }

  parlo::channel* channel_ = nullptr;
  parlo::subscription* subscription_ = nullptr;
  std::mutex mutex_;
  std::vector<std::pair<std::uint32_t, std::string>> messages_;
};

// A gateway with its recording sink, which outlives it.
class test_gateway {
 public:
  explicit test_gateway(test_bus& bus) : gateway_(lib().create_gateway(bus.get(), &sink)) {}
  ~test_gateway() { destroy(); }
  parlo::ipc::gateway* operator->() const { return gateway_; }
  void destroy() {
    if (gateway_ != nullptr) lib().destroy_gateway(gateway_);
    gateway_ = nullptr;
    sink.closed = true;
  }

  recording_sink sink;

 private:
  parlo::ipc::gateway* gateway_;
};

// Bus "server" exporting "alpha" on a pipe of its own, started.
struct served_pipe {
  std::string pipe = unique_pipe();
  test_bus bus{"server"};
  inbox alpha{bus, "alpha"};
  test_gateway gateway{bus};
  served_pipe() {
    EXPECT_EQ(gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
    EXPECT_EQ(gateway->start(), 0u);
  }
};

// A bus importing "alpha" of bus "server" over `pipe`, started.
struct joined_client {
  test_bus bus;
  inbox alpha;
  test_gateway gateway{bus};
  joined_client(const std::string& pipe, const char* name) : bus(name), alpha(bus, "alpha") {
    EXPECT_EQ(gateway->import_channel("alpha", pipe.c_str(), "server", "alpha", 3), 0u);
    EXPECT_EQ(gateway->start(), 0u);
  }
  bool wait_joined() { return gateway.sink.wait_count("remote_start", 1); }
};

// --- processes, threads, raw clients ----------------------------------------

// parlo_ipc_peer.exe; it exits when its standard input (our pipe) closes.
class peer_process {
 public:
  explicit peer_process(const std::string& arguments) {
    SECURITY_ATTRIBUTES inherit{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
    HANDLE read_end = nullptr, write_end = nullptr;
    EXPECT_TRUE(::CreatePipe(&read_end, &write_end, &inherit, 0));
    winapi::unique_handle child_input(read_end);
    input_.reset(write_end);
    ::SetHandleInformation(write_end, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = read_end;
    std::wstring command = L"\"" + folder() + L"parlo_ipc_peer.exe\" " + widen(arguments);
    PROCESS_INFORMATION info{};
    EXPECT_TRUE(::CreateProcessW(nullptr, command.data(), nullptr, nullptr,
                                 /* inherit_handles */ TRUE, 0, nullptr, nullptr, &startup, &info));
    process_.reset(info.hProcess);
    ::CloseHandle(info.hThread);
    pid = info.dwProcessId;
  }
  ~peer_process() {
    input_.reset();
    if (::WaitForSingleObject(process_.get(), 10000) != WAIT_OBJECT_0) kill();
  }
  void kill() {
    ::TerminateProcess(process_.get(), 9);
    ::WaitForSingleObject(process_.get(), 10000);
  }

  DWORD pid = 0;

 private:
  winapi::unique_handle input_, process_;
};

std::size_t thread_count() {
  winapi::unique_handle snapshot(::CreateToolhelp32Snapshot(TH32CS_SNAPTHREAD, 0));
  THREADENTRY32 entry{};
  entry.dwSize = sizeof(entry);
  std::size_t n = 0;
  for (BOOL more = ::Thread32First(snapshot.get(), &entry); more;
       more = ::Thread32Next(snapshot.get(), &entry)) {
    n += entry.th32OwnerProcessID == ::GetCurrentProcessId() ? 1 : 0;
  }
  return n;
}

// A client that speaks the protocol by hand, with plain blocking writes.
class raw_client {
 public:
  explicit raw_client(const std::string& pipe) {
    const std::wstring path = L"\\\\.\\pipe\\" + widen(pipe);
    EXPECT_TRUE(wait_until([&] {
      HANDLE h = ::CreateFileW(path.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                               OPEN_EXISTING, 0, nullptr);
      if (h != INVALID_HANDLE_VALUE) handle_.reset(h);
      return h != INVALID_HANDLE_VALUE;
    }, bound));
  }
  void write(const byte_vector& bytes) {
    DWORD written = 0;
    ::WriteFile(handle_.get(), bytes.data(), static_cast<DWORD>(bytes.size()), &written, nullptr);
  }
  // Reads what the server sends until it closes the pipe.
  bool wait_closed_by_server() {
    return wait_until([&] {
      DWORD available = 0;
      if (!::PeekNamedPipe(handle_.get(), nullptr, 0, nullptr, &available, nullptr)) return true;
      std::vector<char> buffer(available);
      DWORD got = 0;
      if (available > 0) ::ReadFile(handle_.get(), buffer.data(), available, &got, nullptr);
      return false;
    }, bound);
  }

 private:
  winapi::unique_handle handle_;
};

// --- tests -------------------------------------------------------------------

TEST(parlo_ipc, messages_cross_both_ways_each_to_its_joined_channel_only) {
  test_support::clear_log();
  const std::string pipe = unique_pipe();
  test_bus server("server"), client("client");
  inbox server_alpha(server, "alpha"), server_beta(server, "beta");
  inbox client_alpha(client, "a_local"), client_beta(client, "beta");
  test_gateway server_gateway(server), client_gateway(client);
  ASSERT_EQ(server_gateway->export_channel("alpha", pipe.c_str(), 3), 0u);
  ASSERT_EQ(server_gateway->export_channel("beta", pipe.c_str(), 3), 0u);
  // A full path in other letters names the same pipe: one connection.
  const std::string full = "\\\\.\\PIPE\\" + pipe;
  ASSERT_EQ(client_gateway->import_channel("a_local", full.c_str(), "server", "alpha", 3), 0u);
  ASSERT_EQ(client_gateway->import_channel("beta", pipe.c_str(), "server", "beta", 3), 0u);
  // A join the server cannot honour is refused alone.
  ASSERT_EQ(client_gateway->import_channel("ghost", pipe.c_str(), "server", "missing", 3), 0u);
  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);

  // Posted as soon as each connect event is seen, before any hello.
  ASSERT_TRUE(client_gateway.sink.wait_count("remote_connect", 1));
  client.post("a_local", 1, "from the client");
  ASSERT_TRUE(server_gateway.sink.wait_count("local_connect", 1));
  server.post("alpha", 2, "from the server");
  server.post("beta", 3);
  client.post("beta", 4);
  const struct {
    inbox* box;
    std::uint32_t first;
  } expected[] = {{&server_alpha, 1}, {&client_alpha, 1}, {&server_beta, 3}, {&client_beta, 3}};
  for (const auto& e : expected) {
    ASSERT_TRUE(e.box->wait_for(e.first) && e.box->wait_for(e.first + 1));
    ids got = e.box->received();  // a local post races the one from the pipe
    std::sort(got.begin(), got.end());
    EXPECT_EQ(got, (ids{e.first, e.first + 1}));
  }
  EXPECT_EQ(server_alpha.text_of(1), "from the client");
  EXPECT_EQ(client_alpha.text_of(2), "from the server");

  ASSERT_TRUE(server_gateway.sink.wait_count("local_start", 1));
  EXPECT_TRUE(test_support::wait_for_line(L"parlo_ipc::server_connection::on_hello",
                                          L"channel=missing is not exported on this pipe"));
  EXPECT_EQ(server_gateway.sink.last("listen").name, pipe);
  client_gateway.destroy();
  ASSERT_TRUE(server_gateway.sink.wait_count("local_disconnect", 1));
  server_gateway.destroy();
  EXPECT_EQ(client_gateway.sink.count("remote_connect"), 1u);
  EXPECT_EQ(server_gateway.sink.count("local_connect"), 1u);
  EXPECT_EQ(server_gateway.sink.count("local_error") + client_gateway.sink.count("remote_error"),
            0u);
  expect_well_ordered(server_gateway.sink);
  expect_well_ordered(client_gateway.sink);
}

TEST(parlo_ipc, link_types_pick_the_ways_a_channel_crosses) {
  const std::string pipe = unique_pipe();
  test_bus server("server"), client("client");
  inbox server_out(server, "out"), server_in(server, "in");
  inbox client_out(client, "out"), client_in(client, "in");
  test_gateway server_gateway(server), client_gateway(client);
  ASSERT_EQ(server_gateway->export_channel("out", pipe.c_str(), 1), 0u);  // send only
  ASSERT_EQ(server_gateway->export_channel("in", pipe.c_str(), 2), 0u);   // receive only
  ASSERT_EQ(client_gateway->import_channel("out", pipe.c_str(), "server", "out", 3), 0u);
  ASSERT_EQ(client_gateway->import_channel("in", pipe.c_str(), "server", "in", 3), 0u);
  ASSERT_EQ(server_gateway->start(), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);
  ASSERT_TRUE(client_gateway.sink.wait_count("remote_start", 1));
  ASSERT_TRUE(server_gateway.sink.wait_count("local_start", 1));

  // 1 and 2 must not cross; 3 and 4 follow them on the same connection.
  client.post("out", 1);
  server.post("in", 2);
  client.post("in", 3);
  server.post("out", 4);
  ASSERT_TRUE(server_in.wait_for(3) && client_out.wait_for(4));
  ASSERT_TRUE(server_in.wait_for(2) && client_out.wait_for(1));
  EXPECT_EQ(server_out.received(), ids{4});
  EXPECT_EQ(client_in.received(), ids{3});
}

TEST(parlo_ipc, a_refused_client_is_not_read_and_its_connection_gets_no_more_events) {
  served_pipe server;
  std::atomic<int> connects{0};
  server.gateway.sink.admit = [&] { return ++connects > 1; };  // refuses the first
  test_bus client("client");
  test_gateway client_gateway(client);
  // Posted inside on_remote_connect: queued and written to the pipe, where
  // the server that refuses the connection never reads it.
  std::atomic<std::uint32_t> next_id{1};
  client_gateway.sink.on_remote = [&] { client.post("alpha", next_id++); };
  ASSERT_EQ(client_gateway->import_channel("alpha", server.pipe.c_str(), "server", "alpha", 3), 0u);
  ASSERT_EQ(client_gateway->start(), 0u);

  ASSERT_TRUE(server.alpha.wait_for(2));
  EXPECT_EQ(server.alpha.received(), ids{2});
  EXPECT_EQ(server.gateway.sink.last_local_connection(/* refused */ true), "local_connect");
  EXPECT_EQ(client_gateway.sink.connection(0), "remote_connect remote_disconnect");
  expect_well_ordered(server.gateway.sink);
  expect_well_ordered(client_gateway.sink);
}

TEST(parlo_ipc, clients_share_a_pipe_that_always_listens_and_nothing_is_relayed_between_them) {
  served_pipe server;
  const std::wstring path = L"\\\\.\\pipe\\" + widen(server.pipe);
  std::vector<std::unique_ptr<joined_client>> clients;
  for (std::size_t i = 0; i < 4; ++i) {
    if (i == 3) {
      // A client leaving frees its instance, not the name.
      clients[1]->gateway.destroy();
      ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", 1));
      EXPECT_TRUE(::WaitNamedPipeW(path.c_str(), 1000));
    }
    clients.push_back(std::make_unique<joined_client>(server.pipe, "client"));
    ASSERT_TRUE(clients.back()->wait_joined());
    // The next instance listens before the client is even looked at.
    ASSERT_TRUE(server.gateway.sink.wait_count("listen", i + 2));
    EXPECT_TRUE(::WaitNamedPipeW(path.c_str(), 1000)) << ::GetLastError();
  }
  clients[0]->bus.post("alpha", 1);
  ASSERT_TRUE(server.alpha.wait_for(1));
  // A message from a pipe is never sent out again: the server's own post
  // follows the injected one through the same delivery thread and taps, so
  // had 1 gone out it would be ahead of 7.
  server.bus.post("alpha", 7);
  for (std::size_t i : {0, 2, 3}) ASSERT_TRUE(clients[i]->alpha.wait_for(7));
  EXPECT_EQ(clients[2]->alpha.received(), ids{7});
  EXPECT_EQ(clients[0]->alpha.received(), (ids{1, 7}));  // its own post, locally, and no echo
  EXPECT_EQ(server.gateway.sink.count("local_connect"), 4u);
  EXPECT_EQ(server.gateway.sink.count("listen"), 5u);
  clients.clear();
  server.gateway.destroy();
  expect_well_ordered(server.gateway.sink);
}

// The client starts before its server exists, and keeps knocking; a server
// killed and started again under the name is rejoined.
TEST(parlo_ipc, connect_events_carry_the_peer_process_and_a_lost_server_is_rejoined) {
  test_support::clear_log();
  const std::string peer_pipe = unique_pipe(), own_pipe = unique_pipe();
  test_bus bus("test");
  inbox echo(bus, "echo");
  test_gateway gateway(bus);
  ASSERT_EQ(gateway->export_channel("echo", own_pipe.c_str(), 3), 0u);
  ASSERT_EQ(gateway->import_channel("echo", peer_pipe.c_str(), "peer", "echo", 3), 0u);
  ASSERT_EQ(gateway->start(), 0u);
  EXPECT_TRUE(
      test_support::wait_for_line(L"parlo_ipc::pipe_client::run", L"cannot be opened err=2"));

  peer_process first("--serve " + peer_pipe + " --join " + own_pipe);
  ASSERT_TRUE(gateway.sink.wait_count("remote_start", 1));
  ASSERT_TRUE(gateway.sink.wait_count("local_start", 1));
  EXPECT_EQ(gateway.sink.last("local_connect").value, first.pid);   // the client's pid
  EXPECT_EQ(gateway.sink.last("remote_connect").value, first.pid);  // the server's pid
  bus.post("echo", 5);  // to the peer and back
  ASSERT_TRUE(echo.wait_for(1005));

  first.kill();
  ASSERT_TRUE(gateway.sink.wait_count("remote_disconnect", 1));
  ASSERT_TRUE(gateway.sink.wait_count("local_disconnect", 1));
  peer_process second("--serve " + peer_pipe);
  ASSERT_TRUE(gateway.sink.wait_count("remote_start", 2));
  EXPECT_EQ(gateway.sink.last("remote_connect").value, second.pid);
  bus.post("echo", 6);
  ASSERT_TRUE(echo.wait_for(1006));
  expect_well_ordered(gateway.sink);
}

TEST(parlo_ipc, broken_frames_close_the_connection_with_an_error_and_a_disconnect) {
  using namespace parlo::ipc::frame;
  auto header = [](std::uint32_t length, unsigned char type, byte_vector payload = {}) {
    byte_vector out = {static_cast<unsigned char>(length), static_cast<unsigned char>(length >> 8),
                       static_cast<unsigned char>(length >> 16),
                       static_cast<unsigned char>(length >> 24), type};
    out.insert(out.end(), payload.begin(), payload.end());
    return out;
  };
  auto message = [](const byte_vector& wire) {
    byte_vector out;
    encode_message("alpha", wire.data(), wire.size(), out);
    return out;
  };
  hello ours;
  ours.bus_name = "server";
  ours.channels = {"alpha"};
  byte_vector hello_frame;
  encode_hello(ours, hello_frame);

  const struct {
    const char* what;
    bool hello_first;
    byte_vector bytes;
  } cases[] = {
      {"oversized length", false, header(max_frame_length + 1, 2)},
      {"oversized after the hello", true, header(0xFFFFFFFFu, 2)},
      {"empty frame", true, header(0, 2)},
      {"unknown type", true, header(1, 77)},
      // A real wire form of message id 1 without fields.
      {"message before the hello", false, message({'P', 'R', 'L', '1', 1, 0, 0, 0, 0, 0, 0, 0})},
      {"hello of another version", false, header(8, 1, {2, 0, 1, 0, 'b', 0, 0})},
      {"second hello", true, hello_frame},
      {"undecodable message", true, message({'n', 'o', 't', ' ', 'p', 'a', 'r', 'l', 'o'})},
  };
  served_pipe server;
  std::size_t connects = 0;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    raw_client client(server.pipe);
    ASSERT_TRUE(server.gateway.sink.wait_count("local_connect", ++connects));
    if (c.hello_first) client.write(hello_frame);
    client.write(c.bytes);
    EXPECT_TRUE(client.wait_closed_by_server());
    ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", connects));
    EXPECT_EQ(server.gateway.sink.last_local_connection(),
              c.hello_first ? "local_connect local_start local_error local_disconnect"
                            : "local_connect local_error local_disconnect");
    EXPECT_EQ(server.gateway.sink.last("local_error").value, 13u);
  }
  // Nothing they sent was delivered, and well-behaved clients are served.
  joined_client good(server.pipe, "client");
  ASSERT_TRUE(good.wait_joined());
  server.bus.post("alpha", 1);
  ASSERT_TRUE(good.alpha.wait_for(1) && server.alpha.wait_for(1));
  EXPECT_EQ(server.alpha.received(), ids{1});
  expect_well_ordered(server.gateway.sink);
}

TEST(parlo_ipc, a_client_that_does_not_read_is_dropped_at_the_queue_limit) {
  served_pipe server;
  raw_client idle(server.pipe);
  ASSERT_TRUE(server.gateway.sink.wait_count("local_connect", 1));
  // The third 12 MiB message passes one largest frame and 16 MiB.
  const std::string big(12u << 20, 'x');
  for (std::uint32_t id = 1; id <= 3; ++id) server.bus.post("alpha", id, big);
  ASSERT_TRUE(server.gateway.sink.wait_count("local_disconnect", 1));
  EXPECT_EQ(server.gateway.sink.last("local_error").value,
            static_cast<std::uint32_t>(ERROR_NOT_ENOUGH_QUOTA));
  expect_well_ordered(server.gateway.sink);
}

TEST(parlo_ipc, no_event_reaches_the_sink_once_destroy_gateway_returned) {
  test_support::clear_log();
  served_pipe server;
  joined_client client(server.pipe, "client");
  ASSERT_TRUE(client.wait_joined());
  for (std::uint32_t id = 1; id <= 50; ++id) {  // traffic in flight both ways
    server.bus.post("alpha", id);
    client.bus.post("alpha", 100 + id);
  }
  server.gateway.destroy();
  ASSERT_TRUE(client.gateway.sink.wait_count("remote_disconnect", 1));
  // Destroyed while it keeps knocking on the vanished pipe.
  EXPECT_TRUE(
      test_support::wait_for_line(L"parlo_ipc::pipe_client::run", L"cannot be opened err=2"));
  client.gateway.destroy();
  std::this_thread::sleep_for(100ms);  // room for a stray event to show
  EXPECT_EQ(server.gateway.sink.late + client.gateway.sink.late, 0);
  expect_well_ordered(server.gateway.sink);
  expect_well_ordered(client.gateway.sink);
}

TEST(parlo_ipc, stop_and_start_cycles_leave_no_thread_and_no_handle_behind) {
  served_pipe server;
  joined_client client(server.pipe, "client");
  // Cycle 1 warms up: the system starts threads of its own on first use and
  // keeps them, so the counts are taken after it.
  std::size_t threads_before = 0;
  DWORD handles_before = 0, handles_after = 0;
  for (std::uint32_t cycle = 1; cycle <= 6; ++cycle) {
    SCOPED_TRACE(cycle);
    if (cycle > 1) {
      ASSERT_EQ(server.gateway->start(), 0u);
      ASSERT_EQ(client.gateway->start(), 0u);
    }
    ASSERT_TRUE(client.gateway.sink.wait_count("remote_start", cycle));
    ASSERT_TRUE(server.gateway.sink.wait_count("local_start", cycle));
    // Listener, server connection, client: three threads of the library.
    if (cycle > 1) {
      EXPECT_GE(thread_count(), threads_before + 3);
    }
    server.bus.post("alpha", cycle);
    ASSERT_TRUE(client.alpha.wait_for(cycle));
    // Either side may stop first; stop joins every thread.
    ASSERT_EQ((cycle % 2 ? client.gateway : server.gateway)->stop(), 0u);
    ASSERT_EQ((cycle % 2 ? server.gateway : client.gateway)->stop(), 0u);
    if (cycle == 1) {
      threads_before = thread_count();
      ::GetProcessHandleCount(::GetCurrentProcess(), &handles_before);
    }
    EXPECT_EQ(thread_count(), threads_before);
  }
  ::GetProcessHandleCount(::GetCurrentProcess(), &handles_after);
  EXPECT_LE(handles_after, handles_before + 2);  // room for the system's own
  expect_well_ordered(server.gateway.sink);
  expect_well_ordered(client.gateway.sink);
}

TEST(parlo_ipc, slots_refuse_bad_arguments_and_calls_out_of_order) {
  test_bus bus("server");
  test_gateway gateway(bus);
  const std::string pipe = unique_pipe();
  const char* p = pipe.c_str();
  const std::string long_name(256, 'n');
  for (const char* bad_pipe : {static_cast<const char*>(nullptr), "", "\\\\server\\pipe\\x",
                               "\\\\.\\pipe\\", "\xff\xfe"}) {
    EXPECT_EQ(gateway->export_channel("alpha", bad_pipe, 3), 87u);
  }
  for (const char* bad_name : {static_cast<const char*>(nullptr), "", long_name.c_str()}) {
    EXPECT_EQ(gateway->export_channel(bad_name, p, 3), 87u);
    EXPECT_EQ(gateway->import_channel(bad_name, p, "bus", "b", 3), 87u);
    EXPECT_EQ(gateway->import_channel("a", p, bad_name, "b", 3), 87u);
    EXPECT_EQ(gateway->import_channel("a", p, "bus", bad_name, 3), 87u);
  }
  EXPECT_EQ(gateway->export_channel("alpha", p, 0), 87u);
  EXPECT_EQ(gateway->import_channel("a", p, "bus", "b", 4), 87u);

  EXPECT_EQ(gateway->stop(), 0u);   // not running: nothing to do
  EXPECT_EQ(gateway->start(), 0u);  // nothing to carry: runs nothing
  EXPECT_EQ(gateway->start(), 1247u);
  EXPECT_EQ(gateway->export_channel("alpha", p, 3), 5023u);
  EXPECT_EQ(gateway->import_channel("a", p, "bus", "b", 3), 5023u);
  EXPECT_EQ(gateway->stop(), 0u);

  // From inside an event a slot would wait for its own thread.
  std::atomic<std::uint32_t> from_event{0};
  gateway.sink.on_listened = [&] { from_event = gateway->stop(); };
  ASSERT_EQ(gateway->export_channel("alpha", p, 3), 0u);
  ASSERT_EQ(gateway->start(), 0u);
  EXPECT_TRUE(wait_until([&] { return from_event.load() != 0; }, bound));
  EXPECT_EQ(from_event.load(), 1131u);
  EXPECT_EQ(gateway->stop(), 0u);

  recording_sink sink;
  EXPECT_EQ(lib().create_gateway(nullptr, &sink), nullptr);
  EXPECT_EQ(lib().create_gateway(bus.get(), nullptr), nullptr);
  lib().destroy_gateway(nullptr);
  lib().destroy_gateway(reinterpret_cast<parlo::ipc::gateway*>(&sink));  // not one of its own
}

}  // namespace
