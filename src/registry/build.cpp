#include "registry/bus_builder.h"

namespace {

// Until buses can be built over the messaging library, the registry builds
// nothing.
class default_bus_builder final : public bus_builder {
 public:
  std::unique_ptr<owned_bus> build_bus(const char*, ibus_configuration*) override {
    return nullptr;
  }
  std::unique_ptr<owned_gateway> build_gateway(owned_bus&, ibus_configuration*) override {
    return nullptr;
  }
};

}  // namespace

std::unique_ptr<bus_builder> make_default_bus_builder() {
  return std::make_unique<default_bus_builder>();
}
