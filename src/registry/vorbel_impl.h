// The bus registry: the one component object of a process.
//
// Owns every bus of the process by name, with reference counts, and each
// bus's gateway. Created and destroyed by the component factory; any host
// thread calls its operations, which serialise on `mutex` (held through whole
// bus builds and teardowns, so nothing called under it may call back into the
// registry).
#pragma once

#include <vorbel/ivorbel.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "platform/srw_sync.h"
#include "registry/bus_builder.h"

class vorbel_impl final : public ivorbel {
 public:
  vorbel_impl();
  // For tests: builds buses and gateways through `builder`.
  explicit vorbel_impl(std::unique_ptr<bus_builder> builder);
  vorbel_impl(const vorbel_impl&) = delete;
  vorbel_impl& operator=(const vorbel_impl&) = delete;
  ~vorbel_impl();

  void* GetInterface(GUID iid) override;
  ibus* create_bus(const char* name, ibus_configuration* provider) override;
  void destroy_bus(const char* name) override;
  ibus* get_bus(const char* name) override;
  igateway* get_gateway(const char* name) override;

 private:
  struct bus_entry {
    // Declared bus first so that the map's own teardown destroys the gateway
    // before its bus.
    std::unique_ptr<owned_bus> bus;
    std::unique_ptr<owned_gateway> gateway;
    std::uint32_t ref_count = 1;
  };
  using bus_map = std::unordered_map<std::string, bus_entry>;

  bus_map::iterator find_locked(const char* name);
  static void tear_down(bus_entry& entry);

  std::unique_ptr<bus_builder> builder_;
  std::string default_bus_name_;
  bus_map buses_;
  srw_mutex mutex_;
};
