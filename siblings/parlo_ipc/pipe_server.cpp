#include "pipe_server.h"

#include <algorithm>
#include <system_error>

#include "gateway_impl.h"
#include "logging/logger.h"
#include "pipe_support.h"

namespace parlo::ipc::impl {
namespace {

constexpr DWORD pipe_buffer_size = 64 * 1024;
// A next instance that cannot be created is retried this often.
constexpr DWORD instance_retry_ms = 100;

}  // namespace

// --- server_connection -------------------------------------------------------

server_connection::server_connection(gateway_impl& gateway, winapi::unique_handle pipe,
                                     pipe_server& server)
    : connection(gateway, std::move(pipe), server.config().name, /* local */ true),
      server_(server) {}

bool server_connection::wants(const std::string& channel) {
  std::lock_guard<srw_mutex> lock(filter_mutex_);
  return !filtered_ || joined_.count(channel) != 0;
}

std::uint32_t server_connection::on_hello(const frame::hello& hello) {
  const exported_pipe& config = server_.config();
  const char* own_bus = gateway_.bus()->name();
  if (own_bus == nullptr || hello.bus_name != own_bus) {
    logging::logger_stream(logging::level_warning, L"parlo_ipc::server_connection::on_hello")
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" the client asks for bus "
        << hello.bus_name << L", this is bus " << (own_bus != nullptr ? own_bus : "");
  }
  std::set<std::string> joined;
  for (const std::string& channel : hello.channels) {
    const auto found = config.channels.find(channel);
    if (found == config.channels.end()) {
      // Not fatal: the client keeps the joins this pipe can honour.
      logging::logger_stream(logging::level_warning, L"parlo_ipc::server_connection::on_hello")
          << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
          << L" is not exported on this pipe: join refused";
      continue;
    }
    if ((found->second & link_send) != 0) joined.insert(channel);
  }
  std::lock_guard<srw_mutex> lock(filter_mutex_);
  joined_ = std::move(joined);
  filtered_ = true;
  return 0;
}

std::uint32_t server_connection::on_message(const frame::message_view& message) {
  const std::string channel(message.channel);
  const exported_pipe& config = server_.config();
  const auto found = config.channels.find(channel);
  if (found == config.channels.end() || (found->second & link_receive) == 0) {
    logging::logger_stream(logging::level_warning, L"parlo_ipc::server_connection::on_message")
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
        << L" does not take messages from this pipe: dropped";
    return 0;
  }
  return inject(channel, message);
}

// --- pipe_server -------------------------------------------------------------

pipe_server::pipe_server(gateway_impl& gateway, const exported_pipe& config)
    : gateway_(gateway), config_(config) {
  frame::hello hello;
  hello.bus_name = gateway_.bus()->name() != nullptr ? gateway_.bus()->name() : "";
  for (const auto& [channel, link] : config_.channels) hello.channels.push_back(channel);
  auto bytes = std::make_shared<std::vector<unsigned char>>();
  if (frame::encode_hello(hello, *bytes) == frame::status::ok) hello_ = std::move(bytes);
}

pipe_server::~pipe_server() { join(); }

DWORD pipe_server::create_instance(bool first, winapi::unique_handle& instance) {
  DWORD open_mode = PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED | WRITE_DAC;
  if (first) open_mode |= FILE_FLAG_FIRST_PIPE_INSTANCE;
  HANDLE created = ::CreateNamedPipeW(
      config_.path.c_str(), open_mode,
      /* pipe_mode */ PIPE_TYPE_BYTE | PIPE_READMODE_BYTE | PIPE_WAIT | PIPE_REJECT_REMOTE_CLIENTS,
      /* max_instances */ PIPE_UNLIMITED_INSTANCES,
      /* out_buffer_size */ pipe_buffer_size,
      /* in_buffer_size */ pipe_buffer_size,
      /* default_timeout_ms */ 0,
      /* security */ gateway_.pipe_security());
  const DWORD err = ::GetLastError();
  if (created == INVALID_HANDLE_VALUE) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::create_instance")
        << L"pipe=" << config_.name << (first ? L" first" : L" next")
        << L" instance: CreateNamedPipe err=" << err;
    return err != 0 ? err : ERROR_GEN_FAILURE;
  }
  instance.reset(created);
  return 0;
}

DWORD pipe_server::open() {
  if (!hello_) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::open")
        << L"pipe=" << config_.name << L" its hello cannot be encoded";
    return ERROR_INVALID_PARAMETER;
  }
  return create_instance(/* first */ true, first_);
}

void pipe_server::start() { listener_ = std::thread([this] { listen(); }); }

void pipe_server::join() {
  if (listener_.joinable()) listener_.join();
  // Without a listener thread (start failed) the workers list is empty.
  first_.reset();
}

void pipe_server::forward(const std::string& channel, const frame_ptr& frame) {
  std::lock_guard<srw_mutex> lock(mutex_);
  for (const std::shared_ptr<server_connection>& link : routed_) {
    if (link->wants(channel)) link->enqueue(frame);
  }
}

void pipe_server::unroute(const std::shared_ptr<server_connection>& link) {
  std::lock_guard<srw_mutex> lock(mutex_);
  routed_.erase(std::remove(routed_.begin(), routed_.end(), link), routed_.end());
}

std::size_t pipe_server::reap() {
  std::size_t running = 0;
  for (auto it = workers_.begin(); it != workers_.end();) {
    if (it->done.load()) {
      if (it->thread.joinable()) it->thread.join();
      it = workers_.erase(it);
    } else {
      ++running;
      ++it;
    }
  }
  return running;
}

void pipe_server::listen() {
  gateway_impl::thread_scope mark(gateway_);
  winapi::unique_handle instance = std::move(first_);
  winapi::unique_handle connect_event = make_event(/* manual_reset */ true);
  const DWORD event_err = ::GetLastError();
  if (!connect_event) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::listen")
        << L"pipe=" << config_.name << L" CreateEvent err=" << event_err;
  }
  bool announced = false;
  while (connect_event && !gateway_.stopping()) {
    if (!instance) {
      // The next instance could not be created after the last client came.
      if (create_instance(/* first */ false, instance) != 0) {
        if (gateway_.wait_stop(instance_retry_ms)) break;
        continue;
      }
      announced = false;
    }
    if (!announced) {
      gateway_.raise_listen(instance.get(), config_.name.c_str());
      announced = true;
    }
    OVERLAPPED ov{};
    ov.hEvent = connect_event.get();
    bool connected = false;
    DWORD err = 0;
    if (::ConnectNamedPipe(instance.get(), &ov)) {
      connected = true;
    } else {
      err = ::GetLastError();
      if (err == ERROR_PIPE_CONNECTED) {
        connected = true;
      } else if (err == ERROR_IO_PENDING) {
        HANDLE waits[2] = {gateway_.stop_event(), connect_event.get()};
        const DWORD woke = ::WaitForMultipleObjects(2, waits, /* wait_all */ FALSE, INFINITE);
        const DWORD wait_err = ::GetLastError();
        if (woke != WAIT_OBJECT_0 + 1) {
          ::CancelIoEx(instance.get(), &ov);
          DWORD ignored = 0;
          ::GetOverlappedResult(instance.get(), &ov, &ignored, /* wait */ TRUE);
          if (woke == WAIT_OBJECT_0) break;
          err = wait_err;
          logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::listen")
              << L"pipe=" << config_.name << L" wait err=" << err;
          if (gateway_.wait_stop(instance_retry_ms)) break;
          continue;
        }
        DWORD ignored = 0;
        if (::GetOverlappedResult(instance.get(), &ov, &ignored, /* wait */ FALSE)) {
          connected = true;
        } else {
          err = ::GetLastError();
        }
      }
    }
    if (!connected) {
      // ERROR_NO_DATA: the client came and went before we saw it. Either
      // way the instance is made ready for the next client.
      if (err != ERROR_NO_DATA) {
        logging::logger_stream(logging::level_warning, L"parlo_ipc::pipe_server::listen")
            << L"pipe=" << config_.name << L" ConnectNamedPipe err=" << err;
      }
      ::DisconnectNamedPipe(instance.get());
      if (err != ERROR_NO_DATA && gateway_.wait_stop(instance_retry_ms)) break;
      continue;
    }
    // The name must never be free between clients: the next instance
    // listens before this client is looked at.
    winapi::unique_handle next;
    create_instance(/* first */ false, next);
    accept(std::move(instance));
    instance = std::move(next);
    announced = false;
  }
  instance.reset();
  // The stop event is set: every connection thread is on its way out.
  for (worker& work : workers_) {
    if (work.thread.joinable()) work.thread.join();
  }
  workers_.clear();
}

void pipe_server::accept(winapi::unique_handle instance) {
  if (reap() >= max_clients_per_pipe) {
    logging::logger_stream(logging::level_warning, L"parlo_ipc::pipe_server::accept")
        << L"pipe=" << config_.name << L" already serves " << max_clients_per_pipe
        << L" clients: a new client is turned away";
    ::DisconnectNamedPipe(instance.get());
    return;
  }
  std::shared_ptr<server_connection> link;
  bool routed = false;
  try {
    link = std::make_shared<server_connection>(gateway_, std::move(instance), *this);
    // The hello goes first; frames the tap queues from now on follow it but
    // wait until the client is admitted.
    link->enqueue(hello_);
    {
      std::lock_guard<srw_mutex> lock(mutex_);
      routed_.push_back(link);
    }
    routed = true;
    workers_.emplace_back();
    workers_.back().link = link;
    worker& work = workers_.back();
    try {
      work.thread = std::thread([this, &work] { serve(work); });
    } catch (...) {
      workers_.pop_back();
      throw;
    }
  } catch (const std::exception& e) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::accept")
        << L"pipe=" << config_.name << L" a client cannot be served: " << e.what();
    if (routed) unroute(link);
    // No event was raised for it: the client just sees its pipe closed.
    if (link) link->close_handle();
  }
}

void pipe_server::serve(worker& work) {
  gateway_impl::thread_scope mark(gateway_);
  server_connection& link = *work.link;
  ULONG pid = 0;
  bool admitted = false;
  if (!::GetNamedPipeClientProcessId(link.handle(), &pid)) {
    const DWORD err = ::GetLastError();
    logging::logger_stream(logging::level_error, L"parlo_ipc::pipe_server::serve")
        << L"pipe=" << config_.name << L" handle=" << link.handle()
        << L" GetNamedPipeClientProcessId err=" << err;
  } else {
    link.set_peer_pid(pid);
    admitted = gateway_.raise_local_connect(link.handle(), pid);
  }
  if (!admitted) {
    // Nothing was read from the client and nothing reaches it.
    logging::logger_stream(logging::level_info, L"parlo_ipc::pipe_server::serve")
        << L"pipe=" << config_.name << L" handle=" << link.handle() << L" pid=" << pid
        << L" refused";
    unroute(work.link);
    link.close_queue();
    link.close_handle();
    work.done = true;
    return;
  }
  logging::logger_stream(logging::level_info, L"parlo_ipc::pipe_server::serve")
      << L"pipe=" << config_.name << L" handle=" << link.handle() << L" pid=" << pid
      << L" admitted";
  link.run();
  unroute(work.link);
  link.close_queue();
  ::DisconnectNamedPipe(link.handle());
  gateway_.raise_local_disconnect(link.handle());
  link.close_handle();
  work.done = true;
}

}  // namespace parlo::ipc::impl
