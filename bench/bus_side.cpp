#include "bus_side.h"

#include <cstdio>
#include <cstring>

namespace bench {

bus_side::~bus_side() {
  for (const subscription_entry& entry : subscriptions_) {
    entry.channel->destroy_subscription(entry.subscription);
  }
  if (bus_ != nullptr) registry_.destroy_bus(bench_bus);
}

bool bus_side::serve(const std::string& pipe) {
  fixed_configuration configuration;
  configuration.local = {bench_channel};
  configuration.exports = {{bench_channel, pipe}};
  return build(std::move(configuration));
}

bool bus_side::join(const std::string& pipe) {
  fixed_configuration configuration;
  configuration.local = {bench_channel};
  configuration.imports = {{bench_channel, pipe, bench_bus}};
  return build(std::move(configuration));
}

bool bus_side::build(fixed_configuration configuration) {
  configuration_ = std::move(configuration);
  bus_ = registry_.create_bus(bench_bus, &configuration_);
  if (bus_ == nullptr) {
    std::fprintf(stderr, "vorbel_bench: create_bus failed\n");
    return false;
  }
  return true;
}

parlo::bus* bus_side::messaging() const {
  return bus_ != nullptr ? static_cast<parlo::bus*>(bus_->get_messaging_bus()) : nullptr;
}

parlo::channel* bus_side::channel(const char* name) const {
  parlo::bus* library_bus = messaging();
  return library_bus != nullptr ? library_bus->get_channel(name) : nullptr;
}

bool bus_side::subscribe(const char* channel_name, parlo::message_callback callback, void* context) {
  parlo::channel* target = channel(channel_name);
  if (target == nullptr) return false;
  parlo::subscription* subscription = target->create_subscription();
  if (subscription == nullptr) return false;
  if (subscription->listen(callback, context, 0) != 0) {
    target->destroy_subscription(subscription);
    return false;
  }
  subscriptions_.push_back({target, subscription});
  return true;
}

std::uint32_t bus_side::post(std::uint32_t id, const std::string& payload) {
  parlo::channel* target = channel(bench_channel);
  parlo::message* message = messaging()->create_message(0);
  if (target == nullptr || message == nullptr) return ERROR_NOT_FOUND;
  message->set_message_id(id);
  message->set_blob("payload", payload.data(), payload.size());
  const std::uint32_t posted = target->post(message);
  message->release();
  return posted;
}

std::uint64_t payload_sequence(parlo::message* message) {
  std::uint64_t size = 0;
  const void* bytes = message->get_blob("payload", &size);
  std::uint64_t sequence = 0;
  if (bytes != nullptr && size >= sizeof(sequence)) std::memcpy(&sequence, bytes, sizeof(sequence));
  return sequence;
}

std::string make_payload(std::size_t size, std::uint64_t sequence) {
  std::string payload(std::max(size, sizeof(sequence)), '\x5a');
  std::memcpy(&payload[0], &sequence, sizeof(sequence));
  return payload;
}

}  // namespace bench
