// The exports of parlo.dll: the bus's life (parlo.h) and the extension for
// the IPC library and diagnostics (parlo_ext.h). Each checks its bus against
// the live buses before touching it.
#include <cstdint>
#include <type_traits>

#include "bus/parlo/parlo.h"
#include "bus/parlo/parlo_ext.h"
#include "bus_impl.h"
#include "diagnostics.h"

using parlo::impl::bus_impl;
using parlo::impl::level_error;
using parlo::impl::log_line;

namespace {

// The live bus, or null with a line under `function`.
bus_impl* live_bus(parlo::bus* bus, const char* function) {
  if (bus == nullptr) {
    log_line(level_error, function) << "bus is nullptr";
    return nullptr;
  }
  bus_impl* found = bus_impl::find_live(bus);
  if (found == nullptr) log_line(level_error, function) << "not a live bus";
  return found;
}

}  // namespace

extern "C" {

parlo::bus* create_bus(const char* name) { return bus_impl::create(name); }

void destroy_bus(parlo::bus* bus) {
  if (bus == nullptr) {
    log_line(level_error, "parlo::destroy_bus") << "bus is nullptr";
    return;
  }
  if (!bus_impl::destroy(bus)) log_line(level_error, "parlo::destroy_bus") << "not a live bus";
}

std::uint32_t parlo_tap(parlo::bus* bus, const char* channel, parlo::ext::tap_callback callback,
                        void* context, std::uint64_t* tap_id) {
  bus_impl* target = live_bus(bus, "parlo_tap");
  if (target == nullptr) {
    if (tap_id != nullptr) *tap_id = 0;
    return parlo::error_invalid_parameter;
  }
  return target->tap(channel, callback, context, tap_id);
}

std::uint32_t parlo_untap(parlo::bus* bus, std::uint64_t tap_id) {
  bus_impl* target = live_bus(bus, "parlo_untap");
  return target == nullptr ? parlo::error_invalid_parameter : target->untap(tap_id);
}

std::uint32_t parlo_inject(parlo::bus* bus, const char* channel, const void* bytes,
                           std::uint64_t size) {
  bus_impl* target = live_bus(bus, "parlo_inject");
  return target == nullptr ? parlo::error_invalid_parameter : target->inject(channel, bytes, size);
}

void parlo_set_log(parlo::ext::log_callback callback, void* context) {
  parlo::impl::set_log(callback, context);
}

}  // extern "C"

// The exports must keep the types the headers give their callers.
static_assert(std::is_same_v<decltype(&create_bus), parlo::create_bus_fn>);
static_assert(std::is_same_v<decltype(&destroy_bus), parlo::destroy_bus_fn>);
static_assert(std::is_same_v<decltype(&parlo_tap), parlo::ext::tap_fn>);
static_assert(std::is_same_v<decltype(&parlo_untap), parlo::ext::untap_fn>);
static_assert(std::is_same_v<decltype(&parlo_inject), parlo::ext::inject_fn>);
static_assert(std::is_same_v<decltype(&parlo_set_log), parlo::ext::set_log_fn>);
