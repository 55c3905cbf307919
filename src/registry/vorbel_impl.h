// The bus registry: the one component object of a process.
//
// Owns every bus of the process by name, with reference counts, and each
// bus's gateway. Created and destroyed by the component factory; any host
// thread calls its operations, notifications included. `mutex_` guards the
// map and the default name; it is held through whole bus builds (which call
// nothing that waits for a notification) but never through a teardown: the
// last destroy_bus, and the registry's destruction, take the bus out under
// the lock and tear it down after leaving it, since a teardown waits for the
// bus's and the gateway's notifications, which may call the registry. A
// name being torn down stays in the map, marked retiring, until its teardown
// has ended: every lookup passes it over, and create_bus refuses it, so two
// buses never serve one name's pipes at once.
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
    // The last use has gone and the teardown runs outside the lock: the name
    // is gone for every caller, and is not free yet.
    bool retiring = false;
  };
  using bus_map = std::unordered_map<std::string, bus_entry>;

  // The live entry of `name` (null: the default bus), or end().
  bus_map::iterator find_locked(const char* name);
  // Runs without the lock, on buses already taken out of the map.
  static void tear_down(std::unique_ptr<owned_gateway> gateway, std::unique_ptr<owned_bus> bus);

  std::unique_ptr<bus_builder> builder_;
  std::string default_bus_name_;
  bus_map buses_;
  // Set when the registry's destruction begins: nothing is built any more.
  bool closing_ = false;
  srw_mutex mutex_;
};
