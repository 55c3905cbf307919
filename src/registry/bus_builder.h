// What the registry needs of the buses and gateways it owns, and the seam
// through which it builds them from a host's configuration provider.
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/ibus_configuration.h>
#include <vorbel/igateway.h>

#include <cstdint>
#include <memory>

// A bus owned by the registry. Destroying it destroys the bus.
struct owned_bus {
  virtual ~owned_bus() = default;
  // The face handed to hosts.
  virtual ibus* face() = 0;
  // Ends the service channel's subscription and destroys the service channel.
  virtual void unsubscribe() = 0;
};

// A bus's gateway owned by the registry. Destroying it destroys the gateway.
struct owned_gateway {
  virtual ~owned_gateway() = default;
  virtual igateway* face() = 0;
  // 0 on success.
  virtual std::uint32_t start() = 0;
  virtual std::uint32_t stop() = 0;
};

// Builds buses and gateways. Called only under the registry's mutex, on the
// thread of the create_bus call that brought the provider.
struct bus_builder {
  virtual ~bus_builder() = default;
  // A new bus with its service channel and local channels, or null.
  virtual std::unique_ptr<owned_bus> build_bus(const char* name, ibus_configuration* provider) = 0;
  // A gateway for `bus` with every exported and imported channel set up, not
  // started; null when the configuration exports and imports nothing or the
  // gateway cannot be built.
  virtual std::unique_ptr<owned_gateway> build_gateway(owned_bus& bus,
                                                       ibus_configuration* provider) = 0;
};

// The builder of the real component: buses over parlo.dll, gateways over
// parlo_ipc.dll.
std::unique_ptr<bus_builder> make_default_bus_builder();
