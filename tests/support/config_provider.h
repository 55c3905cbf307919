// A configuration provider for tests: fixed lists of channels, and what the
// component asked of it. The component calls it on the creating thread only.
#pragma once

#include <vorbel/ibus_configuration.h>

#include <cstdint>
#include <string>
#include <vector>

namespace test_support {

struct exported {
  std::string channel;
  std::string pipe;
  // When false the provider leaves link type and security as it found them.
  bool write_link_and_security = true;
  std::uint32_t link_type = 3;
  std::uint32_t security = 0;
};

struct imported {
  std::string channel;
  std::string pipe;
  std::string remote_channel;
  std::string remote_bus;
  std::uint32_t security = 0;
};

class config_provider final : public ibus_configuration, public ibus_trust_policy {
 public:
  bool is_default = false;
  // When true the provider offers ibus_trust_policy asking for it.
  bool protected_image_paths = false;
  std::vector<std::string> local;
  std::vector<exported> exports;
  std::vector<imported> imports;

  int default_asked = 0;            // is_default_bus calls
  std::string exported_cursors;     // the cursor of each next_exported_channel call, a digit each

  void* GetInterface(GUID iid) override {
    return protected_image_paths && qm::same_iid(iid, IID_ibus_trust_policy) ? static_cast<ibus_trust_policy*>(this)
                                                                             : nullptr;
  }
  bool protected_image_paths_only() override { return protected_image_paths; }

  bool is_default_bus() override {
    ++default_asked;
    return is_default;
  }

  bool next_local_channel(std::uint64_t* cursor, const char** channel_name) override {
    if (*cursor >= local.size()) return false;
    *channel_name = local[(*cursor)++].c_str();
    return true;
  }

  bool next_exported_channel(std::uint64_t* cursor, const char** channel_name, const char** pipe_name,
                             std::uint32_t* link_type, std::uint32_t* security) override {
    exported_cursors += std::to_string(*cursor);
    if (*cursor >= exports.size()) return false;
    const exported& e = exports[(*cursor)++];
    *channel_name = e.channel.c_str();
    *pipe_name = e.pipe.c_str();
    if (e.write_link_and_security) {
      *link_type = e.link_type;
      *security = e.security;
    }
    return true;
  }

  bool next_imported_channel(std::uint64_t* cursor, const char** channel_name, const char** pipe_name,
                             std::uint32_t* link_type, std::uint32_t* security,
                             const char** remote_channel_name, const char** remote_bus_name) override {
    if (*cursor >= imports.size()) return false;
    const imported& i = imports[(*cursor)++];
    *channel_name = i.channel.c_str();
    *pipe_name = i.pipe.c_str();
    *remote_channel_name = i.remote_channel.c_str();
    *remote_bus_name = i.remote_bus.c_str();
    *link_type = 3;
    *security = i.security;
    return true;
  }
};

}  // namespace test_support
