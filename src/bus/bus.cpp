#include "bus/bus.h"

#include <vorbel/igateway_admission.h>
#include <windows.h>

#include <algorithm>
#include <iterator>
#include <system_error>
#include <utility>

#include "bus/parlo/parlo.h"
#include "logging/logger.h"
#include "platform/win_api.h"

using logging::level_critical;
using logging::level_error;
using logging::level_warning;
using logging::logger_stream;

namespace {

// Loads parlo.dll from this component's own folder.
template <typename Record>
std::unique_ptr<Record> load_messaging_library() {
  const std::wstring path = winapi::module_directory(winapi::current_module()) + L"parlo.dll";
  auto record = std::make_unique<Record>();
  record->module = winapi::load_library(path.c_str());
  record->create_bus =
      winapi::get_proc_address_as<decltype(record->create_bus)>(record->module.get(), "create_bus");
  record->destroy_bus =
      winapi::get_proc_address_as<decltype(record->destroy_bus)>(record->module.get(), "destroy_bus");
  return record;
}

template <typename Record>
parlo::bus* make_messaging_bus(const Record& library, const char* name) {
  parlo::bus* created = library.create_bus(name);
  if (created == nullptr) {
    logger_stream(level_critical, L"make_messaging_bus") << L"create_bus fail";
    // The library record unloads the module as the constructor unwinds.
    winapi::throw_win_error(winapi::gen_failure, "create_bus failed");
  }
  return created;
}

// The length of `text`, or `limit` + 1 when it is longer: a hostile string
// is read no further than that.
std::size_t bounded_length(const char* text, std::size_t limit) {
  const char* end = text;
  while (end != text + limit + 1 && *end != '\0') ++end;
  return static_cast<std::size_t>(end - text);
}

listener_list difference(const listener_list& a, const listener_list& b) {
  listener_list out;
  std::set_difference(a.begin(), a.end(), b.begin(), b.end(), std::back_inserter(out));
  return out;
}

}  // namespace

bus::bus(const char* name)
    : library_(load_messaging_library<library_record>()),
      messaging_bus_(make_messaging_bus(*library_, name),
                     messaging_bus_deleter{library_->destroy_bus}),
      pid_(::GetCurrentProcessId()),
      observer_list_(&observer_list()),
      publisher_([this] { return send_table(); }) {}

bus::~bus() {
  // The publisher stops first: it takes the changes under the mutex and
  // posts on the service channel.
  publisher_.stop();
  // Then the notifier: the notification in progress may call back into this
  // bus (an observer may register a listener), so it finishes while
  // everything is in place; the queued ones are dropped.
  notifier_.stop();
  // Then the service channel: until its subscription is released a delivery
  // thread may still hand a message to this bus, which would use the table.
  service_channel_.reset();
  // Then, by declaration order: the mutex and the table, the stopped
  // notifier, the messaging bus, the library, the observers.
}

void* bus::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_IQmBaseInterface) || qm::same_iid(iid, IID_ibus_base) ||
      qm::same_iid(iid, IID_ibus)) {
    return static_cast<ibus*>(this);
  }
  if (qm::same_iid(iid, IID_igateway_observer_base) || qm::same_iid(iid, IID_igateway_observer)) {
    return static_cast<igateway_observer*>(this);
  }
  // The gateway asks each of its observers, the bus among them, at every
  // admission decision: no face, and nothing to warn about.
  if (qm::same_iid(iid, IID_igateway_admission_observer)) return nullptr;
  const qm::iid_halves h = qm::split_iid(iid);
  logger_stream(level_warning, L"bus::GetInterface")
      << L"unknown interface " << static_cast<unsigned long long>(h.first + h.last);
  return nullptr;
}

void* bus::get_messaging_bus() { return messaging_bus_.get(); }

std::uint32_t bus::register_listener(const char* channel, const char* id) try {
  logging::trace_scope trace(L"bus::register_listener");
  if (channel == nullptr) {
    logger_stream(level_error, L"bus::register_listener") << L"channel is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  if (id == nullptr) {
    logger_stream(level_error, L"bus::register_listener") << L"id is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  const std::size_t channel_size = bounded_length(channel, ibus_max_listener_name);
  const std::size_t id_size = bounded_length(id, ibus_max_listener_name);
  if (channel_size > ibus_max_listener_name || id_size > ibus_max_listener_name) {
    logger_stream(level_error, L"bus::register_listener")
        << (channel_size > ibus_max_listener_name ? L"channel" : L"id") << L" longer than "
        << ibus_max_listener_name << L" bytes";
    return ERROR_INVALID_PARAMETER;
  }
  const std::uint64_t adds = comm::listener_encoded_bound(channel_size, id_size);
  std::uint64_t table_bytes = 0;
  std::size_t table_count = 0;
  {
    std::unique_lock<srw_mutex> lock(mutex_);
    table_bytes = own_bytes_;
    table_count = own_count_;
    if (table_bytes + adds <= comm::max_listeners_message_size &&
        table_count < comm::max_listeners_per_process) {
      // Everything that may run out of memory comes before the first
      // change: the table, its notification and the publisher's list of
      // changes must not disagree.
      own_change change{/* added */ true,
                        listener{std::string(channel, channel_size), std::string(id, id_size)}};
      reserve_change_locked();
      const auto entry = own_.try_emplace(change.item, 0).first;
      try {
        post_new_listener(notifier_, observer_list_, pid_, change.item);
      } catch (...) {
        if (entry->second == 0) own_.erase(entry);
        throw;
      }
      ++entry->second;
      ++own_count_;
      own_bytes_ += adds;
      log_change_locked(std::move(change));
      lock.unlock();
      // Marked once the lock is free, so that the publisher does not wake
      // only to wait for it. A publication that took the change already
      // is followed by one more, with the same table.
      publisher_.mark_changed();
      return 0;
    }
  }
  // Accepted, it could never be published, or its peers would refuse the
  // table: every later change of this process's table would be lost on them.
  logger_stream line(level_error, L"bus::register_listener");
  if (table_count >= comm::max_listeners_per_process) {
    line << L"listener refused: this process has " << table_count
         << L" listeners, the most its peers take from one process";
  } else {
    line << L"listener refused: the table would take more than " << comm::max_listeners_message_size
         << L" bytes in one message (" << table_bytes << L" now, " << adds << L" more)";
  }
  return ERROR_INVALID_PARAMETER;
} catch (...) {
  logging::log_current_exception(L"bus::register_listener");
  return ERROR_OUTOFMEMORY;
}

std::uint32_t bus::unregister_listener(const char* channel, const char* id) try {
  logging::trace_scope trace(L"bus::unregister_listener");
  if (channel == nullptr) {
    logger_stream(level_error, L"bus::unregister_listener") << L"channel is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  if (id == nullptr) {
    logger_stream(level_error, L"bus::unregister_listener") << L"listener_id is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  own_change change{/* added */ false, listener{channel, id}};
  std::unique_lock<srw_mutex> lock(mutex_);
  auto found = own_.find(change.item);
  if (found == own_.end()) return 0;
  // As in register_listener: what may throw comes before the first change.
  reserve_change_locked();
  post_listener_removed(notifier_, observer_list_, pid_, change.item);
  own_bytes_ -= comm::listener_encoded_bound(change.item.channel.size(), change.item.id.size());
  --own_count_;
  if (--found->second == 0) own_.erase(found);
  log_change_locked(std::move(change));
  lock.unlock();
  publisher_.mark_changed();
  return 0;
} catch (...) {
  logging::log_current_exception(L"bus::unregister_listener");
  return ERROR_OUTOFMEMORY;
}

void bus::reserve_change_locked() {
  if (own_changes_.size() < own_changes_.capacity()) return;
  own_changes_.reserve(std::max<std::size_t>(64, 2 * own_changes_.capacity()));
}

void bus::log_change_locked(own_change change) noexcept {
  if (!keeps_changes_) return;
  if (!own_changes_.empty() && own_changes_.back().added != change.added &&
      own_changes_.back().item == change.item) {
    own_changes_.pop_back();
    return;
  }
  own_changes_.push_back(std::move(change));  // room reserved: nothing is allocated
}

bool bus::is_registered_listener(const char* channel, const char* id) try {
  if (channel == nullptr) {
    logger_stream(level_error, L"bus::is_registered_listener") << L"channel is nullptr";
    return false;
  }
  if (id == nullptr) {
    logger_stream(level_error, L"bus::is_registered_listener") << L"listener_id is nullptr";
    return false;
  }
  const listener item{channel, id};
  std::lock_guard<srw_mutex> lock(mutex_);
  if (own_.count(item) != 0) return true;
  for (const auto& [pid, list] : listeners_) {
    if (std::find(list.begin(), list.end(), item) != list.end()) return true;
  }
  return false;
} catch (...) {
  logging::log_current_exception(L"bus::is_registered_listener");
  return false;
}

publisher::outcome bus::send_table() {
  // Only the hand-over of the changes runs under the lock: the host's calls
  // never wait for an encoding.
  taken_changes_.clear();
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    taken_changes_.swap(own_changes_);
  }
  for (std::size_t i = 0; i < taken_changes_.size(); ++i) {
    own_change& change = taken_changes_[i];
    if (!change.added) {
      const auto found = published_.find(change.item);
      if (found != published_.end()) published_.erase(found);
      continue;
    }
    try {
      published_.insert(std::move(change.item));
    } catch (...) {
      // Out of memory: the changes not applied go back in front of the
      // newer ones, and the publisher tries again later.
      std::lock_guard<srw_mutex> lock(mutex_);
      own_changes_.insert(own_changes_.begin(), std::make_move_iterator(taken_changes_.begin() + i),
                          std::make_move_iterator(taken_changes_.end()));
      throw;
    }
  }
  const comm::listeners_encoder::bytes encoded = encoder_.encode(pid_, published_);
  return publisher::outcome{service_channel_->publish_listeners(encoded.data, encoded.size), encoded.size};
}

// Marks the table changed rather than encoding at once: however often peers
// ask, the publisher sends at its own pace.
std::uint32_t bus::on_listeners_requested() {
  publisher_.mark_changed();
  return 0;
}

void bus::on_remote_listeners(const std::uint32_t& pid, listener_list received, std::uint32_t origin) {
  if (pid == pid_) return;
  std::unique_lock<srw_mutex> lock(mutex_);
  if (departed_.count(pid) != 0) {
    lock.unlock();  // no lock is held while a line is written
    logger_stream(logging::level_info, L"bus::on_remote_listeners")
        << L"listeners of pid=" << pid << L" dropped: the process has disconnected";
    return;
  }
  // Only a process connected to us has listeners here: a list for any other
  // pid would stay for good, since no disconnect ever drops it. A list the
  // IPC library delivered from the process's own connection proves one (its
  // connect event may still be on its way to us); a list of unknown origin
  // needs a connection this bus has heard of (and one that came before its
  // connect event is asked for again once the connection is known).
  if (origin == 0 && connections_.count(pid) == 0) {
    lock.unlock();
    logger_stream(logging::level_info, L"bus::on_remote_listeners")
        << L"listeners of pid=" << pid << L" dropped: no connection from that process";
    return;
  }
  auto entry = listeners_.find(pid);
  if (entry == listeners_.end() || entry->second.empty()) {
    post_new_listeners(notifier_, observer_list_, pid, received);
    listeners_[pid] = std::move(received);
    return;
  }
  if (received.empty()) {
    post_listeners_removed(notifier_, observer_list_, pid, std::exchange(entry->second, {}));
    return;
  }
  post_new_listeners(notifier_, observer_list_, pid, difference(received, entry->second));
  post_listeners_removed(notifier_, observer_list_, pid, difference(entry->second, received));
  entry->second = std::move(received);
}

void bus::mark_departed_locked(std::uint32_t pid) {
  // A list in flight arrives within moments of its sender's end; the most
  // recent departures are enough to catch it, and the set stays bounded.
  constexpr std::size_t max_departed = 1024;
  if (!departed_.insert(pid).second) return;
  departed_order_.push_back(pid);
  while (departed_order_.size() > max_departed) {
    departed_.erase(departed_order_.front());
    departed_order_.pop_front();
  }
}

void bus::drop_process(std::uint32_t pid) {
  if (pid == pid_) return;
  std::lock_guard<srw_mutex> lock(mutex_);
  // A disconnect whose connect came before this bus observed the gateway
  // finds no count: that was the process's last known connection too.
  auto count = connections_.find(pid);
  // With another connection left the process is still there, and it will
  // not publish its list again: its listeners stay.
  if (count != connections_.end() && --count->second != 0) return;
  if (count != connections_.end()) connections_.erase(count);
  mark_departed_locked(pid);
  auto entry = listeners_.find(pid);
  if (entry == listeners_.end()) return;
  listener_list gone = std::move(entry->second);
  listeners_.erase(entry);
  post_listeners_removed(notifier_, observer_list_, pid, std::move(gone));
}

void bus::on_connect(std::uint32_t pid) {
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (pid != pid_) {
      ++connections_[pid];
      if (departed_.erase(pid) != 0) {
        departed_order_.erase(std::find(departed_order_.begin(), departed_order_.end(), pid));
      }
    }
  }
  if (!service_channel_) return;
  publisher_.mark_changed();
  // Asked once the process counts as connected, so its answer is taken.
  service_channel_->request_remote_listeners();
}

void bus::on_listen(const char*) {}
void bus::on_local_connect(const char*, std::uint32_t pid) { on_connect(pid); }
void bus::on_local_disconnect(const char*, std::uint32_t pid) { drop_process(pid); }
void bus::on_local_start_communication(const char*, std::uint32_t) {}
void bus::on_local_error(const char*, std::uint32_t, std::uint32_t) {}
void bus::on_remote_connect(const char*, std::uint32_t pid) { on_connect(pid); }
void bus::on_remote_disconnect(const char*, std::uint32_t pid) { drop_process(pid); }
void bus::on_remote_start_communication(const char*, std::uint32_t) {}
void bus::on_remote_error(const char*, std::uint32_t, std::uint32_t) {}

void bus::subscribe() {
  service_channel_ = comm::make_service_channel(this);
  if (!service_channel_) {
    stop_keeping_changes();
    return;
  }
  service_channel_->subscribe(this);
  // From here the publisher's thread reads `service_channel_`.
  publisher_.enable();
}

void bus::unsubscribe() {
  publisher_.stop();
  stop_keeping_changes();
  service_channel_.reset();
}

void bus::stop_keeping_changes() {
  std::lock_guard<srw_mutex> lock(mutex_);
  keeps_changes_ = false;
  own_changes_.clear();
}
