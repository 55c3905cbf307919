#include "bus/comm/service_channel.h"

#include <windows.h>

#include <vorbel/ibus.h>

#include "bus/comm/listeners_codec.h"
#include "bus/parlo/parlo.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "logging/logger.h"

namespace comm {
namespace {

using logging::level_error;
using logging::level_info;
using logging::logger_stream;

constexpr const char* params_blob = listeners_blob_name;

// The process a message came from, when the IPC library delivered it from a
// pipe: 0 for a message posted in this process (or by a library that cannot
// say). A blob of another size is no origin the library wrote.
bool read_origin(parlo::message* message, std::uint32_t& origin) {
  std::uint64_t size = 0;
  const auto* bytes = static_cast<const std::uint8_t*>(message->get_blob(parlo::ipc::origin_pid_blob, &size));
  origin = 0;
  if (bytes == nullptr) return true;
  if (size != 4) return false;
  origin = static_cast<std::uint32_t>(bytes[0]) | (static_cast<std::uint32_t>(bytes[1]) << 8) |
           (static_cast<std::uint32_t>(bytes[2]) << 16) | (static_cast<std::uint32_t>(bytes[3]) << 24);
  return true;
}

void on_service_message(parlo::message* message, void* context) {
  if (message == nullptr || context == nullptr) return;
  static_cast<service_channel*>(context)->on_message(message);
}

parlo::bus* messaging_bus_of(ibus* bus) {
  return static_cast<parlo::bus*>(bus->get_messaging_bus());
}

}  // namespace

std::unique_ptr<service_channel> make_service_channel(ibus* bus) {
  parlo::bus* messaging = messaging_bus_of(bus);
  const std::uint32_t created = messaging->create_channel(service_channel_name);
  if (created != 0) {
    logger_stream(level_error, L"comm::make_service_channel") << L"create_channel err=" << created;
    return nullptr;
  }
  parlo::channel* channel = messaging->get_channel(service_channel_name);
  if (channel == nullptr) {
    logger_stream(level_error, L"comm::make_service_channel") << L"get_channel failed";
    return nullptr;
  }
  return std::make_unique<service_channel>(bus, channel);
}

service_channel::service_channel(ibus* bus, parlo::channel* channel)
    : bus_(bus), channel_(channel), own_pid_(::GetCurrentProcessId()) {}

service_channel::~service_channel() { release_subscription(); }

void service_channel::release_subscription() {
  if (subscription_ == nullptr) return;
  if (parlo::channel* channel = subscription_->get_subscription_channel()) {
    channel->destroy_subscription(subscription_);
  }
  subscription_ = nullptr;
}

void service_channel::subscribe(iservice_channel_observer* observer) {
  parlo::subscription* subscription = channel_->create_subscription();
  if (subscription == nullptr) {
    logger_stream(level_error, L"comm::service_channel::subscribe") << L"subscribe failed";
    return;
  }
  // Fixed before listen: the delivery threads read it without a lock.
  observer_ = observer;
  const std::uint32_t listening = subscription->listen(&on_service_message, this, 0);
  if (listening != 0) {
    logger_stream(level_error, L"comm::service_channel::subscribe")
        << L"subscription listen err=" << listening;
    observer_ = nullptr;
    if (parlo::channel* channel = subscription->get_subscription_channel()) {
      channel->destroy_subscription(subscription);
    }
    return;
  }
  subscription_ = subscription;
}

std::uint32_t service_channel::export_channel(parlo::ipc::gateway* ipc, const char* pipe) {
  if (exported_pipes_.count(pipe) != 0) {
    logger_stream(level_info, L"comm::service_channel::export_channel")
        << L"already exported on pipe=" << pipe;
    return 0;
  }
  const std::uint32_t result = ipc->export_channel(service_channel_name, pipe, /* link_type */ 3);
  if (result != 0) {
    // Not recorded: a later export on this pipe tries again.
    logger_stream(level_error, L"comm::service_channel::export_channel")
        << L"export_channel service on pipe=" << pipe << L" err=" << result;
    return result;
  }
  exported_pipes_.insert(pipe);
  return 0;
}

std::uint32_t service_channel::import_channel(parlo::ipc::gateway* ipc, const char* bus_name,
                                              const char* pipe) {
  if (imported_pipes_.count(pipe) != 0) {
    logger_stream(level_info, L"comm::service_channel::import_channel")
        << L"already imported on pipe=" << pipe;
    return 0;
  }
  const std::uint32_t result =
      ipc->import_channel(service_channel_name, pipe, bus_name,
                          /* remote_channel */ service_channel_name, /* link_type */ 3);
  if (result != 0) {
    logger_stream(level_error, L"comm::service_channel::import_channel")
        << L"import_channel service on pipe=" << pipe << L" err=" << result;
    return result;
  }
  imported_pipes_.insert(pipe);
  return 0;
}

parlo::message* service_channel::new_message(const wchar_t* function,
                                             service_channel_messages_id id) {
  parlo::message* message = messaging_bus_of(bus_)->create_message(0);
  if (message == nullptr) {
    logger_stream(level_error, function) << L"create_message failed";
    return nullptr;
  }
  message->set_message_id(static_cast<std::uint32_t>(id));
  return message;
}

std::uint32_t service_channel::request_remote_listeners() {
  parlo::message* message = new_message(L"comm::service_channel::request_remote_listeners",
                                        service_channel_messages_id::publish_listeners);
  if (message == nullptr) return ERROR_OUTOFMEMORY;
  message->seal();
  const std::uint32_t posted = channel_->post(message);
  message->release();
  if (posted != 0) {
    logger_stream(level_error, L"comm::service_channel::request_remote_listeners")
        << L"post publish listeners message err=" << posted;
  }
  return posted;
}

std::uint32_t service_channel::publish_listeners(const std::uint8_t* bytes, std::size_t size) {
  const wchar_t* const function = L"comm::service_channel::publish_listeners";
  parlo::message* message = new_message(function, service_channel_messages_id::listeners);
  if (message == nullptr) return ERROR_OUTOFMEMORY;
  // A message without its blob would reach the peers as an empty
  // publication they cannot read: it is not posted at all.
  const std::uint32_t set = message->set_blob(params_blob, bytes, size);
  if (set != 0) {
    message->release();
    logger_stream(level_error, function) << L"set_blob listeners message size=" << size << L" err=" << set;
    return set;
  }
  message->seal();
  const std::uint32_t posted = channel_->post(message);
  message->release();
  if (posted != 0) {
    logger_stream(level_error, function) << L"post listeners message err=" << posted;
  }
  return posted;
}

// Runs on the messaging library's delivery thread: nothing may escape it.
void service_channel::on_message(parlo::message* message) try {
  const std::uint32_t id = message->message_id();
  if (id == static_cast<std::uint32_t>(service_channel_messages_id::publish_listeners)) {
    observer_->on_listeners_requested();
    return;
  }
  if (id != static_cast<std::uint32_t>(service_channel_messages_id::listeners)) return;

  std::uint64_t size = 0;
  const void* bytes = message->get_blob(params_blob, &size);
  if (bytes == nullptr || size == 0) {
    logger_stream line(level_error, L"comm::service_channel::on_message");
    line << L"unexpected service_channel_messages_id::listeners params blob: ";
    if (bytes == nullptr) line << L" buf is nullptr, ";
    if (size == 0) line << L"size=0";
    return;
  }
  const auto* data = static_cast<const std::uint8_t*>(bytes);
  std::uint32_t pid = 0;
  // A buffer that fails verification is dropped without a line: a peer could
  // otherwise flood the log.
  if (!verify_listeners(data, static_cast<std::size_t>(size), pid)) return;
  // This process's own publication comes back on its own subscription; it is
  // dropped before the list is built.
  if (pid == own_pid_) return;
  // A peer speaks for itself only: the pid in the list is what it claims,
  // the origin is what the system said about its connection.
  std::uint32_t origin = 0;
  if (!read_origin(message, origin) || (origin != 0 && origin != pid)) {
    logger_stream(logging::level_warning, L"comm::service_channel::on_message")
        << L"listeners message of pid=" << pid << L" refused: it came from pid=" << origin;
    return;
  }
  const std::size_t count = count_listeners(data);
  if (count > max_listeners_per_process) {
    logger_stream(logging::level_warning, L"comm::service_channel::on_message")
        << L"listeners message of pid=" << pid << L" refused: " << count << L" listeners, more than "
        << max_listeners_per_process << L" per process";
    return;
  }
  try {
    observer_->on_remote_listeners(pid, read_listeners(data), origin);
  } catch (const std::exception& e) {
    logger_stream(level_error, L"comm::service_channel::on_message")
        << L"listeners message of pid=" << pid << L" dropped: " << e.what();
  }
} catch (...) {
  logging::log_current_exception(L"comm::service_channel::on_message");
}

}  // namespace comm
