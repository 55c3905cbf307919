// One process's side of a cross-process benchmark: the component's registry
// with bus "bench" built from a fixed configuration, and helpers to post on
// and subscribe to the bus's channels through the messaging library.
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/igateway.h>

#include <cstdint>
#include <memory>
#include <string>

#include "bench_support.h"
#include "bus/parlo/parlo.h"
#include "registry/vorbel_impl.h"

namespace bench {

// Owned by one benchmark thread, which builds and tears it down; the
// subscriptions' callbacks run on the messaging library's delivery thread.
class bus_side {
 public:
  bus_side() = default;
  bus_side(const bus_side&) = delete;
  bus_side& operator=(const bus_side&) = delete;
  // Ends the subscriptions, then the bus.
  ~bus_side();

  // Serves channel "bench" on `pipe`.
  bool serve(const std::string& pipe);
  // Joins channel "bench" of bus "bench" in the process serving `pipe`.
  bool join(const std::string& pipe);

  ibus* bus() const { return bus_; }
  igateway* gateway() { return registry_.get_gateway(bench_bus); }
  parlo::bus* messaging() const;
  parlo::channel* channel(const char* name) const;

  // Subscribes to `channel_name`; `callback` runs on the delivery thread.
  bool subscribe(const char* channel_name, parlo::message_callback callback, void* context);

  // Posts a message with `id` and blob "payload" = `payload` on "bench".
  std::uint32_t post(std::uint32_t id, const std::string& payload);

 private:
  bool build(fixed_configuration configuration);

  vorbel_impl registry_;
  fixed_configuration configuration_;
  ibus* bus_ = nullptr;
  struct subscription_entry {
    parlo::channel* channel;
    parlo::subscription* subscription;
  };
  std::vector<subscription_entry> subscriptions_;
};

// The sequence number a benchmark message carries in its first 8 payload
// bytes (0 when the payload is shorter).
std::uint64_t payload_sequence(parlo::message* message);
// A payload of `size` bytes (at least 8) that starts with `sequence`.
std::string make_payload(std::size_t size, std::uint64_t sequence);

}  // namespace bench
