#include "registry/vorbel_impl.h"

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
  if (!buses_.empty()) {
    logger_stream(level_warning, L"vorbel_impl::~vorbel_impl") << L"Leaked buses:";
    for (auto& [name, entry] : buses_) {
      logger_stream(level_warning, L"vorbel_impl::~vorbel_impl") << L"leak bus name: " << name;
      if (entry.gateway) tear_down(entry);
    }
  }
  // The map's own teardown destroys what is left: each gateway, then its bus.
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
  if (name != nullptr) return buses_.find(name);
  if (default_bus_name_.empty()) return buses_.end();
  return buses_.find(default_bus_name_);
}

// Stops the gateway before the service channel goes, so no pipe event reaches
// a bus that is being torn down; then destroys the gateway before its bus.
void vorbel_impl::tear_down(bus_entry& entry) {
  if (entry.gateway) entry.gateway->stop();
  if (entry.bus) entry.bus->unsubscribe();
  entry.gateway.reset();
  entry.bus.reset();
}

ibus* vorbel_impl::create_bus(const char* name, ibus_configuration* provider) {
  logging::trace_scope trace(L"vorbel_impl::create_bus");
  if (name == nullptr) {
    logger_stream(level_error, L"vorbel_impl::create_bus") << L"bus name is nullptr";
    return nullptr;
  }
  logger_stream(level_info, L"vorbel_impl::create_bus") << L"bus name: " << name;

  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  if (found != buses_.end()) {
    ++found->second.ref_count;
    return found->second.bus->face();
  }
  if (provider == nullptr) {
    logger_stream(level_error, L"vorbel_impl::create_bus") << L"configuration is nullptr";
    return nullptr;
  }

  std::unique_ptr<owned_bus> new_bus = builder_->build_bus(name, provider);
  if (!new_bus) return nullptr;

  std::unique_ptr<owned_gateway> gateway = builder_->build_gateway(*new_bus, provider);
  std::unique_ptr<owned_gateway> failed_gateway;
  if (gateway && gateway->start() != 0) failed_gateway = std::move(gateway);

  const bool is_default = provider->is_default_bus();
  ibus* face = new_bus->face();
  bus_entry entry;
  entry.bus = std::move(new_bus);
  entry.gateway = std::move(gateway);
  buses_.emplace(name, std::move(entry));
  if (is_default && default_bus_name_.empty()) default_bus_name_ = name;
  failed_gateway.reset();
  return face;
}

void vorbel_impl::destroy_bus(const char* name) {
  logging::trace_scope trace(L"vorbel_impl::destroy_bus");
  if (name == nullptr) {
    logger_stream(level_error, L"vorbel_impl::destroy_bus") << L"bus name is nullptr";
    return;
  }
  logger_stream(level_info, L"vorbel_impl::destroy_bus") << L"bus name: " << name;

  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  if (found == buses_.end()) {
    logger_stream(level_warning, L"vorbel_impl::destroy_bus") << L"bud not found";
    return;
  }
  if (found->second.ref_count >= 2) {
    --found->second.ref_count;
    return;
  }
  bus_entry entry = std::move(found->second);
  if (found->first == default_bus_name_) default_bus_name_.clear();
  buses_.erase(found);
  tear_down(entry);
}

ibus* vorbel_impl::get_bus(const char* name) {
  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  return found == buses_.end() ? nullptr : found->second.bus->face();
}

igateway* vorbel_impl::get_gateway(const char* name) {
  std::lock_guard<srw_mutex> lock(mutex_);
  auto found = find_locked(name);
  if (found == buses_.end() || !found->second.gateway) return nullptr;
  return found->second.gateway->face();
}
