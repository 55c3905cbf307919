// The bus registry: the one object a host gets from QmCreateObject("vorbel").
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/ibus_configuration.h>
#include <vorbel/igateway.h>
#include <vorbel/qm_base.h>

// {B06721F0-7355-AA61-DF48-22BA12BD27FE}
inline constexpr GUID IID_ivorbel = {
    0xB06721F0, 0x7355, 0xAA61, {0xDF, 0x48, 0x22, 0xBA, 0x12, 0xBD, 0x27, 0xFE}};

// Any host thread may call any operation, from inside a bus or gateway
// notification too. A bus build holds the registry's lock, so the other
// calls wait for it, but it waits for no notification; a teardown runs
// outside the lock. The name of a bus being torn down is gone at once:
// get_bus and get_gateway give null, destroy_bus does not find it, and
// create_bus refuses it until the teardown has ended, rather than wait for
// it. The last destroy_bus of a bus waits for that bus's and its gateway's
// notifications in progress, so a notification must not make it for its
// own bus: that ends the process.
struct ivorbel : IQmBaseInterface {
  // Returns the bus `name`, building it from `provider` when it does not exist
  // yet (the provider is not consulted otherwise). Every successful call must
  // be paired with one destroy_bus. Null, with a line in the log, when the
  // bus cannot be built, when memory runs out, or while a bus of that name
  // is being torn down.
  virtual ibus* create_bus(const char* name, ibus_configuration* provider) = 0;
  // Gives back one use of `name`; the last one tears the bus down and
  // returns once it is gone.
  virtual void destroy_bus(const char* name) = 0;
  // The bus `name` (null: the default bus), without counting a use.
  virtual ibus* get_bus(const char* name) = 0;
  // The gateway of bus `name` (null: the default bus), or null when the bus
  // has none. Does not count a use.
  virtual igateway* get_gateway(const char* name) = 0;
};
