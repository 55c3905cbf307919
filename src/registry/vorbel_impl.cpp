#include "registry/vorbel_impl.h"

#include <string>
#include <utility>

#include "logging/logger.h"

using logging::level_error;
using logging::level_info;
using logging::level_warning;
using logging::logger_stream;

vorbel_impl::vorbel_impl() : vorbel_impl(make_default_bus_builder()) {}

vorbel_impl::vorbel_impl(std::unique_ptr<bus_builder> builder)
    : builder_(std::move(builder)), buses_(8) {
  buses_.max_load_factor(1.0f);
}

vorbel_impl::~vorbel_impl() {
  // Every name goes at once, under the lock, and nothing is built any more:
  // a notification of a bus being torn down below finds none of them. The
  // teardowns run after the lock is left, as they wait for notifications.
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    closing_ = true;
    default_bus_name_.clear();
    for (auto& [name, entry] : buses_) entry.retiring = true;
  }
  if (buses_.empty()) return;
  // Lookups may still read the map meanwhile; nothing changes its shape.
  logger_stream(level_warning, L"vorbel_impl::~vorbel_impl") << L"Leaked buses:";
  for (auto& [name, entry] : buses_) {
    logger_stream(level_warning, L"vorbel_impl::~vorbel_impl") << L"leak bus name: " << name;
    if (entry.gateway) {
      tear_down(std::move(entry.gateway), std::move(entry.bus));
    } else {
      // Here rather than with the map, while lookups still find it retiring.
      entry.bus.reset();
    }
  }
}

void* vorbel_impl::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_IQmBaseInterface) || qm::same_iid(iid, IID_ivorbel)) {
    return static_cast<ivorbel*>(this);
  }
  const qm::iid_halves h = qm::split_iid(iid);
  logger_stream(level_warning, L"vorbel_impl::GetInterface")
      << L"unknown interface " << static_cast<unsigned long long>(h.first + h.last);
  return nullptr;
}

vorbel_impl::bus_map::iterator vorbel_impl::find_locked(const char* name) {
  bus_map::iterator found = buses_.end();
  if (name != nullptr) {
    found = buses_.find(name);
  } else if (!default_bus_name_.empty()) {
    found = buses_.find(default_bus_name_);
  }
  if (found != buses_.end() && found->second.retiring) return buses_.end();
  return found;
}

// Stops the gateway before the service channel goes, so no pipe event reaches
// a bus that is being torn down; then destroys the gateway before its bus.
void vorbel_impl::tear_down(std::unique_ptr<owned_gateway> gateway, std::unique_ptr<owned_bus> bus) {
  if (gateway) gateway->stop();
  if (bus) bus->unsubscribe();
  gateway.reset();
  bus.reset();
}

ibus* vorbel_impl::create_bus(const char* name, ibus_configuration* provider) try {
  logging::trace_scope trace(L"vorbel_impl::create_bus");
  if (name == nullptr) {
    logger_stream(level_error, L"vorbel_impl::create_bus") << L"bus name is nullptr";
    return nullptr;
  }
  logger_stream(level_info, L"vorbel_impl::create_bus") << L"bus name: " << name;

  std::unique_lock<srw_mutex> lock(mutex_);
  auto found = buses_.find(name);
  const bool closing = closing_;
  if (closing || (found != buses_.end() && found->second.retiring)) {
    // Waiting for the teardown could wait for the very notification that
    // asks; building beside it would put two buses on the same pipes.
    lock.unlock();
    logger_stream(level_error, L"vorbel_impl::create_bus")
        << L"bus name: " << name << (closing ? L" refused: the registry" : L" refused: the bus")
        << L" is being torn down";
    return nullptr;
  }
  if (found != buses_.end()) {
    ++found->second.ref_count;
    return found->second.bus->face();
  }
  if (provider == nullptr) {
    lock.unlock();
    logger_stream(level_error, L"vorbel_impl::create_bus") << L"configuration is nullptr";
    return nullptr;
  }

  std::unique_ptr<owned_bus> new_bus = builder_->build_bus(name, provider);
  if (!new_bus) return nullptr;

  std::unique_ptr<owned_gateway> gateway = builder_->build_gateway(*new_bus, provider);
  std::unique_ptr<owned_gateway> failed_gateway;
  if (gateway && gateway->start() != 0) failed_gateway = std::move(gateway);

  const bool is_default = provider->is_default_bus();
  // Everything that may fail comes before the insertion: a bus that is in
  // the map has been handed out.
  std::string new_default = is_default && default_bus_name_.empty() ? name : "";
  ibus* face = new_bus->face();
  bus_entry entry;
  entry.bus = std::move(new_bus);
  entry.gateway = std::move(gateway);
  buses_.emplace(name, std::move(entry));
  if (!new_default.empty()) default_bus_name_.swap(new_default);
  lock.unlock();
  failed_gateway.reset();
  return face;
} catch (const std::exception& e) {
  logger_stream(level_error, L"vorbel_impl::create_bus") << L"failed: " << e.what();
  return nullptr;
}

void vorbel_impl::destroy_bus(const char* name) try {
  logging::trace_scope trace(L"vorbel_impl::destroy_bus");
  if (name == nullptr) {
    logger_stream(level_error, L"vorbel_impl::destroy_bus") << L"bus name is nullptr";
    return;
  }
  logger_stream(level_info, L"vorbel_impl::destroy_bus") << L"bus name: " << name;

  std::string key;
  std::unique_ptr<owned_bus> doomed_bus;
  std::unique_ptr<owned_gateway> doomed_gateway;
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    auto found = find_locked(name);
    if (found != buses_.end() && found->second.ref_count >= 2) {
      --found->second.ref_count;
      return;
    }
    if (found != buses_.end()) {
      key = found->first;  // before anything changes: it may fail
      found->second.retiring = true;
      if (found->first == default_bus_name_) default_bus_name_.clear();
      doomed_bus = std::move(found->second.bus);
      doomed_gateway = std::move(found->second.gateway);
    }
  }
  if (!doomed_bus) {
    logger_stream(level_warning, L"vorbel_impl::destroy_bus") << L"bud not found";
    return;
  }
  // Outside the lock: the teardown waits for the bus's and the gateway's
  // notifications, which may call the registry.
  tear_down(std::move(doomed_gateway), std::move(doomed_bus));
  std::lock_guard<srw_mutex> lock(mutex_);
  buses_.erase(key);
} catch (const std::exception& e) {
  logger_stream(level_error, L"vorbel_impl::destroy_bus") << L"failed: " << e.what();
}

ibus* vorbel_impl::get_bus(const char* name) try {
  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  return found == buses_.end() ? nullptr : found->second.bus->face();
} catch (const std::exception& e) {
  logger_stream(level_error, L"vorbel_impl::get_bus") << L"failed: " << e.what();
  return nullptr;
}

igateway* vorbel_impl::get_gateway(const char* name) try {
  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  if (found == buses_.end() || !found->second.gateway) return nullptr;
  return found->second.gateway->face();
} catch (const std::exception& e) {
  logger_stream(level_error, L"vorbel_impl::get_gateway") << L"failed: " << e.what();
  return nullptr;
}
