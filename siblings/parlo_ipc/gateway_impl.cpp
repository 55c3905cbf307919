// parlo_ipc.dll's gateway: joins channels of a parlo bus with the buses of
// other processes over named pipes.
//
// Calling order: create_gateway; export_channel / import_channel any number
// of times; start; stop; (changes and start again;) destroy_gateway, which
// stops a running gateway.
//
// Results of the slots (Win32 codes; each failure also writes a line):
//   0     success. stop on a gateway that does not run, and start with
//         nothing exported or imported, succeed and do nothing.
//   87    ERROR_INVALID_PARAMETER: a null or empty name; a channel or bus
//         name over 255 bytes or holding a zero byte; a pipe name that is not
//         UTF-8, over 256 characters, or names a pipe on another machine; a
//         link type other than 1, 2 or 3.
//   1247  ERROR_ALREADY_INITIALIZED: start on a running gateway.
//   5023  ERROR_INVALID_STATE: export_channel or import_channel on a running
//         gateway. Channels are fixed from start to stop (a connection's
//         peers agree on them in their hellos); stop, add, start again.
//   1131  ERROR_POSSIBLE_DEADLOCK: a slot called from inside an event of the
//         same gateway, where it would wait for the calling thread itself.
//   1816  ERROR_NOT_ENOUGH_QUOTA: more than 4096 channels on one pipe.
//   8     ERROR_NOT_ENOUGH_MEMORY.
//   start also hands back the code of CreateNamedPipe for a pipe's first
//   instance (5 when another process already owns the name), of parlo_tap,
//   or of starting a thread; nothing is left running then. A server of an
//   imported pipe that is not there is no failure: the client retries.
//
// Link types, a bit set: 1 local posts go out over the pipe, 2 messages from
// the pipe are delivered locally, 3 both (what the component passes).
// Exporting or importing the same channel on the same pipe again keeps one
// entry with the latest link type.
//
// Pipe names: a bare name gets the prefix "\\.\pipe\"; a full local path is
// kept; names differing only in letter case are one pipe. on_listen gets the
// name as it was given to export_channel.
//
// Routing: a message posted locally on an exported channel goes to every
// admitted client of each pipe exporting it (to a client whose hello is in,
// only if it joined the channel); one posted on an imported channel goes to
// the server under the remote channel's name. A message that arrives over a
// pipe is delivered to the local subscriptions only (parlo_inject), never
// sent out over another pipe. A client asking for a channel that the pipe
// does not export gets a line and no join; the other joins stand.
//
// Events, per connection, in this order (the handle stays open and unused
// by another connection until the disconnect event has returned):
//   served pipes:  on_listen(h, name) when instance h starts listening;
//                  on_local_connect(h, client pid) before anything is read
//                  from it - false disconnects the client and h gets no
//                  other event; the connect events of several clients may
//                  run at once; on_local_start_communication(h) when the
//                  client's hello is in; on_local_error(h, err) when the
//                  connection fails (13 a malformed or oversized frame or a
//                  broken protocol, 1816 a client that does not read, or the
//                  I/O code); on_local_disconnect(h) last.
//   opened pipes:  on_remote_connect(h, server pid); false closes it, no
//                  other event; on_remote_start_communication(h) when the
//                  server's hello is in; on_remote_error(h, err);
//                  on_remote_disconnect(h) last. Then the client reconnects
//                  until stop, waiting 20 ms doubling up to 1 s.
//   Nothing is written to a connection before its connect event admitted
//   it, and every message posted on its channels after the event returned
//   reaches it. No event is raised once stop (or destroy_gateway) returned.
//   Every message delivered from a connection carries the blob
//   "parlo_ipc.origin_pid" with the peer's pid as the system reported it
//   (GetNamedPipeClientProcessId, GetNamedPipeServerProcessId), replacing
//   whatever the peer put under that name; a message with no room left for
//   it is dropped with a line.
//
// Threads: one listener per served pipe, one per client connection (at most
// 64 per pipe), one per opened pipe; all end in stop. The tap callback only
// queues frames; connection threads only queue into the bus (parlo_inject).
#include "gateway_impl.h"

#include <new>
#include <system_error>

#include "frame_codec.h"
#include "logging/logger.h"
#include "pipe_client.h"
#include "pipe_server.h"

namespace parlo::ipc::impl {
namespace {

// The gateway whose thread this is, if any.
thread_local const void* t_owner = nullptr;

bool valid_link(std::uint32_t link_type) { return link_type >= link_send && link_type <= link_both; }

}  // namespace

gateway_impl::thread_scope::thread_scope(const gateway_impl& gateway) : previous_(t_owner) {
  t_owner = &gateway;
}

gateway_impl::thread_scope::~thread_scope() { t_owner = previous_; }

bool gateway_impl::on_own_thread() const { return t_owner == this; }

gateway_impl::gateway_impl(parlo::bus* bus, gateway::events* sink) : bus_(bus), sink_(sink) {}

gateway_impl::~gateway_impl() {
  std::lock_guard<srw_mutex> lock(control_mutex_);
  if (running_) {
    stop_locked();
    running_ = false;
  }
}

std::uint32_t gateway_impl::init() {
  if (const std::uint32_t err = api_.bind(); err != 0) return err;
  stop_event_ = make_event(/* manual_reset */ true);
  const DWORD event_err = ::GetLastError();
  if (!stop_event_) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::init")
        << L"CreateEvent err=" << event_err;
    return event_err != 0 ? event_err : ERROR_GEN_FAILURE;
  }
  if (const DWORD err = make_initial_pipe_security(security_descriptor_); err != 0) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::init")
        << L"initial pipe security err=" << err;
    return err;
  }
  security_attributes_.nLength = sizeof(security_attributes_);
  security_attributes_.lpSecurityDescriptor = security_descriptor_.get();
  security_attributes_.bInheritHandle = FALSE;
  return 0;
}

bool gateway_impl::stopping() const {
  return ::WaitForSingleObject(stop_event_.get(), 0) == WAIT_OBJECT_0;
}

bool gateway_impl::wait_stop(DWORD ms) const {
  return ::WaitForSingleObject(stop_event_.get(), ms) == WAIT_OBJECT_0;
}

std::uint32_t gateway_impl::export_channel(const char* channel, const char* pipe,
                                           std::uint32_t link_type) {
  const wchar_t* const function = L"parlo_ipc::gateway::export_channel";
  logging::trace_scope trace(function);
  if (channel == nullptr || pipe == nullptr) {
    logging::logger_stream(logging::level_error, function) << L"channel or pipe is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  std::wstring path;
  if (!frame::valid_name(channel) || !to_pipe_path(pipe, path) || !valid_link(link_type)) {
    logging::logger_stream(logging::level_error, function)
        << L"refused: channel=" << channel << L" pipe=" << pipe << L" link_type=" << link_type;
    return ERROR_INVALID_PARAMETER;
  }
  if (on_own_thread()) {
    logging::logger_stream(logging::level_error, function) << L"called from one of its events";
    return ERROR_POSSIBLE_DEADLOCK;
  }
  std::lock_guard<srw_mutex> lock(control_mutex_);
  if (running_) {
    logging::logger_stream(logging::level_error, function)
        << L"channel=" << channel << L" pipe=" << pipe << L": the gateway runs; stop it first";
    return ERROR_INVALID_STATE;
  }
  try {
    exported_pipe& entry = exports_[pipe_key(path)];
    if (entry.path.empty()) {
      entry.name = pipe;
      entry.path = path;
    }
    if (entry.channels.count(channel) == 0 && entry.channels.size() >= frame::max_hello_channels) {
      logging::logger_stream(logging::level_error, function)
          << L"pipe=" << pipe << L" already carries " << frame::max_hello_channels << L" channels";
      return ERROR_NOT_ENOUGH_QUOTA;
    }
    entry.channels[channel] = link_type;
  } catch (const std::bad_alloc&) {
    logging::logger_stream(logging::level_error, function) << L"out of memory";
    return ERROR_NOT_ENOUGH_MEMORY;
  }
  logging::logger_stream(logging::level_info, function)
      << L"channel=" << channel << L" pipe=" << pipe << L" link_type=" << link_type;
  return 0;
}

std::uint32_t gateway_impl::import_channel(const char* channel, const char* pipe,
                                           const char* bus_name, const char* remote_channel,
                                           std::uint32_t link_type) {
  const wchar_t* const function = L"parlo_ipc::gateway::import_channel";
  logging::trace_scope trace(function);
  if (channel == nullptr || pipe == nullptr || bus_name == nullptr || remote_channel == nullptr) {
    logging::logger_stream(logging::level_error, function)
        << L"channel, pipe, bus_name or remote_channel is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  std::wstring path;
  if (!frame::valid_name(channel) || !frame::valid_name(remote_channel) ||
      !frame::valid_name(bus_name) || !to_pipe_path(pipe, path) || !valid_link(link_type)) {
    logging::logger_stream(logging::level_error, function)
        << L"refused: channel=" << channel << L" pipe=" << pipe << L" bus_name=" << bus_name
        << L" remote_channel=" << remote_channel << L" link_type=" << link_type;
    return ERROR_INVALID_PARAMETER;
  }
  if (on_own_thread()) {
    logging::logger_stream(logging::level_error, function) << L"called from one of its events";
    return ERROR_POSSIBLE_DEADLOCK;
  }
  std::lock_guard<srw_mutex> lock(control_mutex_);
  if (running_) {
    logging::logger_stream(logging::level_error, function)
        << L"channel=" << channel << L" pipe=" << pipe << L": the gateway runs; stop it first";
    return ERROR_INVALID_STATE;
  }
  try {
    imported_pipe& entry = imports_[pipe_key(path)];
    if (entry.path.empty()) {
      entry.name = pipe;
      entry.path = path;
      entry.bus_name = bus_name;
    } else if (entry.bus_name != bus_name) {
      // One connection per pipe reaches one server, hence one bus.
      logging::logger_stream(logging::level_warning, function)
          << L"pipe=" << pipe << L" leads to bus " << entry.bus_name << L", not " << bus_name;
    }
    channel_join* found = nullptr;
    for (channel_join& join : entry.joins) {
      if (join.local == channel && join.remote == remote_channel) found = &join;
    }
    if (found != nullptr) {
      found->link = link_type;
    } else {
      if (entry.joins.size() >= frame::max_hello_channels) {
        logging::logger_stream(logging::level_error, function)
            << L"pipe=" << pipe << L" already carries " << frame::max_hello_channels
            << L" channels";
        return ERROR_NOT_ENOUGH_QUOTA;
      }
      entry.joins.push_back(channel_join{channel, remote_channel, link_type});
    }
  } catch (const std::bad_alloc&) {
    logging::logger_stream(logging::level_error, function) << L"out of memory";
    return ERROR_NOT_ENOUGH_MEMORY;
  }
  logging::logger_stream(logging::level_info, function)
      << L"channel=" << channel << L" pipe=" << pipe << L" bus_name=" << bus_name
      << L" remote_channel=" << remote_channel << L" link_type=" << link_type;
  return 0;
}

std::uint32_t gateway_impl::start() {
  const wchar_t* const function = L"parlo_ipc::gateway::start";
  logging::trace_scope trace(function);
  if (on_own_thread()) {
    logging::logger_stream(logging::level_error, function) << L"called from one of its events";
    return ERROR_POSSIBLE_DEADLOCK;
  }
  std::lock_guard<srw_mutex> lock(control_mutex_);
  if (running_) {
    logging::logger_stream(logging::level_error, function) << L"already started";
    return ERROR_ALREADY_INITIALIZED;
  }
  const std::uint32_t err = start_locked();
  if (err != 0) {
    stop_locked();
    logging::logger_stream(logging::level_error, function) << L"start failed err=" << err;
    return err;
  }
  running_ = true;
  return 0;
}

std::uint32_t gateway_impl::start_locked() {
  const wchar_t* const function = L"parlo_ipc::gateway::start";
  ::ResetEvent(stop_event_.get());
  try {
    for (const auto& [key, config] : exports_) {
      if (config.channels.empty()) continue;
      servers_.push_back(std::make_unique<pipe_server>(*this, config));
      if (const DWORD err = servers_.back()->open(); err != 0) return err;
      for (const auto& [channel, link] : config.channels) {
        if ((link & link_send) != 0) routes_[channel].servers.push_back(servers_.back().get());
      }
    }
    for (const auto& [key, config] : imports_) {
      if (config.joins.empty()) continue;
      clients_.push_back(std::make_unique<pipe_client>(*this, config));
      for (const channel_join& join : config.joins) {
        if ((join.link & link_send) != 0) {
          routes_[join.local].clients.emplace_back(clients_.back().get(), join.remote);
        }
      }
    }
    // Messages from the pipes need their local channel; bytes from a peer
    // never create one.
    auto ensure_channel = [&](const std::string& channel) {
      if (const std::uint32_t err = bus_->create_channel(channel.c_str()); err != 0) {
        logging::logger_stream(logging::level_warning, function)
            << L"create_channel " << channel << L" err=" << err;
      }
    };
    for (const auto& server : servers_) {
      for (const auto& [channel, link] : server->config().channels) {
        if ((link & link_receive) != 0) ensure_channel(channel);
      }
    }
    for (const auto& client : clients_) {
      for (const channel_join& join : client->config().joins) {
        if ((join.link & link_receive) != 0) ensure_channel(join.local);
      }
    }
    // Taps before threads: from the first connection on, every local post
    // is seen.
    for (const auto& [channel, where] : routes_) {
      std::uint64_t id = 0;
      const std::uint32_t err = api_.tap(bus_, channel.c_str(), &gateway_impl::tap_callback, this, &id);
      if (err != 0) {
        logging::logger_stream(logging::level_error, function)
            << L"parlo_tap " << channel << L" err=" << err;
        return err;
      }
      taps_.push_back(id);
    }
    for (const auto& server : servers_) server->start();
    for (const auto& client : clients_) client->start();
  } catch (const std::system_error& e) {
    logging::logger_stream(logging::level_error, function) << L"cannot start: " << e.what();
    const int code = e.code().value();
    return code != 0 ? static_cast<std::uint32_t>(code) : ERROR_GEN_FAILURE;
  } catch (const std::bad_alloc&) {
    logging::logger_stream(logging::level_error, function) << L"out of memory";
    return ERROR_NOT_ENOUGH_MEMORY;
  }
  logging::logger_stream(logging::level_info, function)
      << L"serving " << servers_.size() << L" pipes, opening " << clients_.size() << L" pipes";
  return 0;
}

std::uint32_t gateway_impl::stop() {
  const wchar_t* const function = L"parlo_ipc::gateway::stop";
  logging::trace_scope trace(function);
  if (on_own_thread()) {
    logging::logger_stream(logging::level_error, function) << L"called from one of its events";
    return ERROR_POSSIBLE_DEADLOCK;
  }
  std::lock_guard<srw_mutex> lock(control_mutex_);
  if (!running_) {
    logging::logger_stream(logging::level_info, function) << L"not running";
    return 0;
  }
  stop_locked();
  running_ = false;
  return 0;
}

void gateway_impl::stop_locked() {
  // No tap runs once parlo_untap has returned, so the routes may go.
  for (const std::uint64_t id : taps_) {
    if (const std::uint32_t err = api_.untap(bus_, id); err != 0) {
      logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::stop")
          << L"parlo_untap err=" << err;
    }
  }
  taps_.clear();
  ::SetEvent(stop_event_.get());
  for (const auto& server : servers_) server->join();
  for (const auto& client : clients_) client->join();
  routes_.clear();
  servers_.clear();
  clients_.clear();
}

void gateway_impl::tap_callback(const char* channel, const void* bytes, std::uint64_t size,
                                void* context) {
  if (channel == nullptr || bytes == nullptr || context == nullptr) return;
  static_cast<gateway_impl*>(context)->on_local_post(channel, bytes, size);
}

void gateway_impl::on_local_post(const char* channel, const void* bytes, std::uint64_t size) {
  const auto found = routes_.find(std::string_view(channel));
  if (found == routes_.end()) return;
  const route& where = found->second;
  try {
    auto encode = [&](const std::string& name) -> frame_ptr {
      auto frame = std::make_shared<std::vector<unsigned char>>();
      const frame::status status = frame::encode_message(name, bytes, size, *frame);
      if (status != frame::status::ok) {
        logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::on_local_post")
            << L"channel=" << name << L" message of " << size
            << L" bytes not sent: " << frame::status_text(status);
        return nullptr;
      }
      return frame;
    };
    if (!where.servers.empty()) {
      if (frame_ptr frame = encode(found->first)) {
        for (pipe_server* server : where.servers) server->forward(found->first, frame);
      }
    }
    for (const auto& [client, remote] : where.clients) {
      if (frame_ptr frame = encode(remote)) client->forward(frame);
    }
  } catch (const std::bad_alloc&) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::on_local_post")
        << L"channel=" << channel << L" out of memory: message not sent";
  }
}

// --- events ------------------------------------------------------------------

namespace {

template <typename Call>
void guarded(const wchar_t* event, HANDLE pipe, Call&& call) {
  try {
    call();
  } catch (...) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::gateway::raise")
        << event << L" handle=" << pipe << L": the sink threw";
  }
}

}  // namespace

void gateway_impl::raise_listen(HANDLE pipe, const char* name) {
  guarded(L"on_listen", pipe, [&] { sink_->on_listen(pipe, name); });
}

bool gateway_impl::raise_local_connect(HANDLE pipe, std::uint32_t pid) {
  bool admitted = false;
  guarded(L"on_local_connect", pipe, [&] { admitted = sink_->on_local_connect(pipe, pid); });
  return admitted;
}

void gateway_impl::raise_local_disconnect(HANDLE pipe) {
  guarded(L"on_local_disconnect", pipe, [&] { sink_->on_local_disconnect(pipe); });
}

void gateway_impl::raise_local_start_communication(HANDLE pipe) {
  guarded(L"on_local_start_communication", pipe,
          [&] { sink_->on_local_start_communication(pipe); });
}

void gateway_impl::raise_local_error(HANDLE pipe, std::uint32_t err) {
  guarded(L"on_local_error", pipe, [&] { sink_->on_local_error(pipe, err); });
}

bool gateway_impl::raise_remote_connect(HANDLE pipe, std::uint32_t pid) {
  bool accepted = false;
  guarded(L"on_remote_connect", pipe, [&] { accepted = sink_->on_remote_connect(pipe, pid); });
  return accepted;
}

void gateway_impl::raise_remote_disconnect(HANDLE pipe) {
  guarded(L"on_remote_disconnect", pipe, [&] { sink_->on_remote_disconnect(pipe); });
}

void gateway_impl::raise_remote_start_communication(HANDLE pipe) {
  guarded(L"on_remote_start_communication", pipe,
          [&] { sink_->on_remote_start_communication(pipe); });
}

void gateway_impl::raise_remote_error(HANDLE pipe, std::uint32_t err) {
  guarded(L"on_remote_error", pipe, [&] { sink_->on_remote_error(pipe, err); });
}

}  // namespace parlo::ipc::impl
