#include "registry/build.h"

#include <exception>

#include "bus/bus.h"
#include "bus/parlo/parlo.h"
#include "gateway/gateway.h"
#include "logging/logger.h"

using logging::level_error;
using logging::level_info;
using logging::logger_stream;

namespace {

// Starting values of an export or import enumeration; a provider that never
// writes link type or security passes these on.
constexpr std::uint32_t default_link_type = 3;
constexpr std::uint32_t default_security = 0;

class bus_owner final : public owned_bus {
 public:
  explicit bus_owner(std::unique_ptr<bus> owned) : bus_(std::move(owned)) {}
  ibus* face() override { return bus_.get(); }
  void unsubscribe() override { bus_->unsubscribe(); }
  bus& get() { return *bus_; }

 private:
  std::unique_ptr<bus> bus_;
};

class gateway_owner final : public owned_gateway {
 public:
  explicit gateway_owner(std::unique_ptr<gateway> owned) : gateway_(std::move(owned)) {}
  igateway* face() override { return gateway_.get(); }
  std::uint32_t start() override { return gateway_->start(); }
  std::uint32_t stop() override { return gateway_->stop(); }

 private:
  std::unique_ptr<gateway> gateway_;
};

class default_bus_builder final : public bus_builder {
 public:
  std::unique_ptr<owned_bus> build_bus(const char* name, ibus_configuration* provider) override {
    std::unique_ptr<bus> built = ::build_bus(name, provider);
    if (!built) return nullptr;
    return std::make_unique<bus_owner>(std::move(built));
  }
  std::unique_ptr<owned_gateway> build_gateway(owned_bus& owner,
                                               ibus_configuration* provider) override {
    std::unique_ptr<gateway> built = ::build_gateway(static_cast<bus_owner&>(owner).get(), provider);
    if (!built) return nullptr;
    return std::make_unique<gateway_owner>(std::move(built));
  }
};

}  // namespace

std::unique_ptr<bus_builder> make_default_bus_builder() {
  return std::make_unique<default_bus_builder>();
}

std::unique_ptr<bus> build_bus(const char* name, ibus_configuration* provider) {
  logging::trace_scope trace(L"build_bus");
  logger_stream(level_info, L"build_bus") << L"build bus name=" << name;
  std::unique_ptr<bus> built;
  try {
    built = std::make_unique<bus>(name);
  } catch (const std::exception& e) {
    logger_stream(level_error, L"build_bus") << e.what();
    return nullptr;
  }
  built->subscribe();
  auto* messaging = static_cast<parlo::bus*>(built->get_messaging_bus());

  std::uint64_t cursor = 0;
  const char* channel_name = nullptr;
  while (provider->next_local_channel(&cursor, &channel_name)) {
    logger_stream(level_info, L"build_bus") << L"create_channel name=" << channel_name;
    const std::uint32_t created = messaging->create_channel(channel_name);
    if (created != 0) {
      logger_stream(level_error, L"build_bus")
          << L"create_channel name=" << channel_name << L" err=" << static_cast<std::int32_t>(created);
      // Destroying the bus releases the library's bus with the channels made
      // so far.
      return nullptr;
    }
  }
  return built;
}

bool export_channels(gateway& target, ibus_configuration* provider) {
  std::uint64_t cursor = 0;
  std::uint32_t link_type = default_link_type;
  std::uint32_t security = default_security;
  const char* channel_name = nullptr;
  const char* pipe_name = nullptr;
  while (provider->next_exported_channel(&cursor, &channel_name, &pipe_name, &link_type, &security)) {
    logger_stream(level_info, L"export_channels")
        << L"export channel name=" << channel_name << L" on pipe=" << pipe_name;
    const std::uint32_t result = target.export_channel(channel_name, pipe_name, link_type, security);
    if (result != 0) {
      logger_stream(level_info, L"export_channels") << L"export channel name=" << channel_name
                                                    << L" on pipe=" << pipe_name << L" err=" << result;
      return false;
    }
  }
  return true;
}

bool import_channels(gateway& target, ibus_configuration* provider) {
  std::uint64_t cursor = 0;
  std::uint32_t link_type = default_link_type;
  std::uint32_t security = default_security;
  const char* channel_name = nullptr;
  const char* pipe_name = nullptr;
  const char* remote_channel_name = nullptr;
  const char* remote_bus_name = nullptr;
  while (provider->next_imported_channel(&cursor, &channel_name, &pipe_name, &link_type, &security,
                                         &remote_channel_name, &remote_bus_name)) {
    logger_stream(level_info, L"import_channels")
        << L"import channel name=" << channel_name << L" on pipe=" << pipe_name;
    const std::uint32_t result = target.import_channel(remote_bus_name, channel_name, pipe_name,
                                                       remote_channel_name, link_type, security);
    if (result != 0) {
      logger_stream(level_info, L"import_channels")
          << L"import channel name=" << channel_name << L" remote channel name="
          << remote_channel_name << L" on pipe=" << pipe_name << L" err=" << result;
      return false;
    }
  }
  return true;
}

std::unique_ptr<gateway> build_gateway(bus& owner, ibus_configuration* provider) {
  logging::trace_scope trace(L"build_gateway");
  {
    // The probe runs on scratch values and a cursor of its own, so the real
    // enumerations below still start from the first element.
    std::uint64_t cursor = 0;
    std::uint32_t link_type = default_link_type;
    std::uint32_t security = default_security;
    const char* channel_name = nullptr;
    const char* pipe_name = nullptr;
    const char* remote_channel_name = nullptr;
    const char* remote_bus_name = nullptr;
    const bool exports =
        provider->next_exported_channel(&cursor, &channel_name, &pipe_name, &link_type, &security);
    cursor = 0;
    const bool imports =
        exports || provider->next_imported_channel(&cursor, &channel_name, &pipe_name, &link_type,
                                                   &security, &remote_channel_name, &remote_bus_name);
    if (!exports && !imports) {
      logger_stream(level_info, L"build_gateway") << L"exported & imported channels are empty";
      return nullptr;
    }
  }
  std::unique_ptr<gateway> built;
  try {
    built = std::make_unique<gateway>(&owner);
  } catch (const std::exception& e) {
    logger_stream(level_error, L"build_gateway") << e.what();
    return nullptr;
  }
  if (!export_channels(*built, provider)) return nullptr;
  if (!import_channels(*built, provider)) return nullptr;
  if (auto* policy = static_cast<ibus_trust_policy*>(provider->GetInterface(IID_ibus_trust_policy))) {
    const bool protected_paths = policy->protected_image_paths_only();
    logger_stream(level_info, L"build_gateway") << L"protected image paths only=" << (protected_paths ? 1 : 0);
    built->events().set_protected_image_paths(protected_paths);
  }
  return built;
}
