// Building a bus and its gateway from a host's configuration provider.
// Everything here runs on the thread of the create_bus call that brought the
// provider, under the registry's mutex.
#pragma once

#include <vorbel/ibus_configuration.h>

#include <memory>

#include "registry/bus_builder.h"

class bus;
class gateway;

// The bus with its service channel and every local channel of the provider;
// null (logged) when the messaging library cannot give it.
std::unique_ptr<bus> build_bus(const char* name, ibus_configuration* provider);

// The gateway with every exported and imported channel set up, not started;
// null when the provider exports and imports nothing, or when the gateway
// cannot be built or a channel cannot be set up (the bus then lives on
// without a gateway).
std::unique_ptr<gateway> build_gateway(bus& owner, ibus_configuration* provider);

// True when every element of the enumeration was set up.
bool export_channels(gateway& target, ibus_configuration* provider);
bool import_channels(gateway& target, ibus_configuration* provider);
