#include "pipe_client.h"

#include <algorithm>
#include <set>
#include <string>

#include "gateway_impl.h"
#include "logging/logger.h"
#include "platform/win_error.h"

namespace parlo::ipc::impl {
namespace {

// Reconnection delays: doubled after each attempt that did not get as far
// as the server's hello, back to the first after one that did.
constexpr DWORD first_retry_ms = 20;
constexpr DWORD max_retry_ms = 1000;

DWORD next_retry(DWORD current) { return std::min<DWORD>(current * 2, max_retry_ms); }

}  // namespace

// --- client_connection -------------------------------------------------------

client_connection::client_connection(gateway_impl& gateway, winapi::unique_handle pipe,
                                     pipe_client& client)
    : connection(gateway, std::move(pipe), client.config().name, /* local */ false),
      client_(client) {}

std::uint32_t client_connection::on_hello(const frame::hello& hello) {
  const imported_pipe& config = client_.config();
  if (hello.bus_name != config.bus_name) {
    logging::logger_stream(logging::level_warning, L"parlo_ipc::client_connection::on_hello")
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" the server is bus "
        << hello.bus_name << L", not bus " << config.bus_name;
  }
  const std::set<std::string> offered(hello.channels.begin(), hello.channels.end());
  for (const channel_join& join : config.joins) {
    if (offered.count(join.remote) == 0) {
      logging::logger_stream(logging::level_warning, L"parlo_ipc::client_connection::on_hello")
          << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << join.remote
          << L" is not exported by the server: channel=" << join.local << L" stays unjoined";
    }
  }
  return 0;
}

std::uint32_t client_connection::on_message(const frame::message_view& message) {
  bool delivered = false;
  for (const channel_join& join : client_.config().joins) {
    if ((join.link & link_receive) == 0 || join.remote != message.channel) continue;
    delivered = true;
    if (const std::uint32_t err = inject(join.local, message); err != 0) return err;
  }
  if (!delivered) {
    // Until our hello is in, the server sends every channel it exports.
    logging::logger_stream(logging::level_info, L"parlo_ipc::client_connection::on_message")
        << L"pipe=" << pipe_name_ << L" channel=" << message.channel
        << L" is not joined over this pipe: dropped";
  }
  return 0;
}

// --- pipe_client -------------------------------------------------------------

pipe_client::pipe_client(gateway_impl& gateway, const imported_pipe& config)
    : gateway_(gateway), config_(config) {
  frame::hello hello;
  hello.bus_name = config_.bus_name;
  std::set<std::string> wanted;
  for (const channel_join& join : config_.joins) {
    if ((join.link & link_receive) != 0 && wanted.insert(join.remote).second) {
      hello.channels.push_back(join.remote);
    }
  }
  auto bytes = std::make_shared<std::vector<unsigned char>>();
  if (frame::encode_hello(hello, *bytes) == frame::status::ok) hello_ = std::move(bytes);
}

pipe_client::~pipe_client() { join(); }

void pipe_client::start() {
  if (!hello_) {
    // import_channel checked every name and the count: not reached.
    winapi::throw_win_error(ERROR_INVALID_PARAMETER, "the hello cannot be encoded");
  }
  thread_ = std::thread([this] { run(); });
}

void pipe_client::join() {
  if (thread_.joinable()) thread_.join();
}

void pipe_client::forward(const frame_ptr& frame) {
  std::lock_guard<srw_mutex> lock(mutex_);
  if (current_) current_->enqueue(frame);
}

void pipe_client::run() {
  gateway_impl::thread_scope mark(gateway_);
  DWORD retry_ms = first_retry_ms;
  DWORD last_err = 0;
  while (!gateway_.stopping()) {
    // SECURITY_IDENTIFICATION: the server may learn who we are but can never
    // act as us. FILE_WRITE_DATA rather than GENERIC_WRITE, which would ask
    // for FILE_CREATE_PIPE_INSTANCE too: a pipe's DACL grants clients the
    // right to talk, not the right to serve the name.
    HANDLE opened = ::CreateFileW(
        config_.path.c_str(), GENERIC_READ | FILE_WRITE_DATA | FILE_WRITE_ATTRIBUTES, /* share_mode */ 0,
        /* security */ nullptr, OPEN_EXISTING,
        /* flags */ FILE_FLAG_OVERLAPPED | SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION,
        /* template_file */ nullptr);
    const DWORD open_err = ::GetLastError();
    if (opened == INVALID_HANDLE_VALUE) {
      // One line per change of cause, not one per attempt.
      if (open_err != last_err) {
        logging::logger_stream(logging::level_info, L"parlo_ipc::pipe_client::run")
            << L"pipe=" << config_.name << L" cannot be opened err=" << open_err
            << L", retrying";
        last_err = open_err;
      }
      if (gateway_.wait_stop(retry_ms)) break;
      retry_ms = next_retry(retry_ms);
      continue;
    }
    last_err = 0;
    winapi::unique_handle pipe(opened);
    ULONG pid = 0;
    if (!::GetNamedPipeServerProcessId(pipe.get(), &pid)) {
      const DWORD err = ::GetLastError();
      logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_client::run")
          << L"pipe=" << config_.name << L" GetNamedPipeServerProcessId err=" << err;
      pipe.reset();
      if (gateway_.wait_stop(retry_ms)) break;
      retry_ms = next_retry(retry_ms);
      continue;
    }

    std::shared_ptr<client_connection> link;
    try {
      link = std::make_shared<client_connection>(gateway_, std::move(pipe), *this);
      link->set_peer_pid(pid);
      link->enqueue(hello_);
    } catch (const std::bad_alloc&) {
      logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_client::run")
          << L"pipe=" << config_.name << L" out of memory";
      if (gateway_.wait_stop(max_retry_ms)) break;
      continue;
    }
    // Routed before the event: whatever is posted once on_remote_connect
    // has returned goes to this server.
    {
      std::lock_guard<srw_mutex> lock(mutex_);
      current_ = link;
    }
    const bool accepted = gateway_.raise_remote_connect(link->handle(), pid);
    if (accepted) {
      logging::logger_stream(logging::level_info, L"parlo_ipc::pipe_client::run")
          << L"pipe=" << config_.name << L" handle=" << link->handle() << L" connected to pid="
          << pid;
      link->run();
    } else {
      logging::logger_stream(logging::level_info, L"parlo_ipc::pipe_client::run")
          << L"pipe=" << config_.name << L" handle=" << link->handle()
          << L" the sink turned down server pid=" << pid;
    }
    {
      std::lock_guard<srw_mutex> lock(mutex_);
      current_.reset();
    }
    link->close_queue();
    if (accepted) gateway_.raise_remote_disconnect(link->handle());
    const bool communicated = link->communicated();
    link->close_handle();
    retry_ms = communicated ? first_retry_ms : next_retry(retry_ms);
    if (gateway_.wait_stop(retry_ms)) break;
  }
}

}  // namespace parlo::ipc::impl
