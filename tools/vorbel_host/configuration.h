// The bus configuration of the host: read from a JSON file, checked field by
// field, and handed to the component through ibus_configuration.
//
// The parsed bus_config is a plain value owned by main. json_configuration
// only points into it and is called on the thread of the create_bus call
// that receives it, during that call.
#pragma once

#include <vorbel/ibus_configuration.h>

#include <cstdint>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace vorbel_host {

// Link type the component uses when a configuration gives none.
inline constexpr std::uint32_t default_link_type = 3;

struct exported_channel {
  std::string channel;
  std::string pipe;
  std::uint32_t link_type = default_link_type;
  std::uint32_t security = 0;
};

struct imported_channel {
  std::string channel;
  std::string pipe;
  std::uint32_t link_type = default_link_type;
  std::uint32_t security = 0;
  std::string remote_channel;
  std::string remote_bus;
};

struct bus_config {
  std::optional<std::string> bus;
  bool is_default = false;
  // Admit only peers whose image path their user cannot change.
  bool protected_image_paths = false;
  std::vector<std::string> local_channels;
  std::vector<exported_channel> exported_channels;
  std::vector<imported_channel> imported_channels;
};

// A configuration that cannot be used. `field` names the offending member as
// a path ("exported_channels[1].pipe"); empty for a file that is not JSON.
class config_error : public std::runtime_error {
 public:
  config_error(std::string field, const std::string& problem)
      : std::runtime_error(field.empty() ? problem : field + ": " + problem),
        field_(std::move(field)) {}
  const std::string& field() const { return field_; }

 private:
  std::string field_;
};

// Parses the text of a configuration file. Throws config_error.
bus_config parse_configuration(const std::string& json_text);

// Reads and parses a configuration file. Throws config_error (the file
// cannot be read, is too large, or is not a valid configuration).
bus_config load_configuration(const std::wstring& path);

class json_configuration final : public ibus_configuration, public ibus_trust_policy {
 public:
  explicit json_configuration(const bus_config& config) : config_(config) {}

  void* GetInterface(GUID iid) override;
  bool protected_image_paths_only() override;
  bool is_default_bus() override;
  bool next_local_channel(std::uint64_t* cursor, const char** channel_name) override;
  bool next_exported_channel(std::uint64_t* cursor, const char** channel_name,
                             const char** pipe_name, std::uint32_t* link_type,
                             std::uint32_t* security) override;
  bool next_imported_channel(std::uint64_t* cursor, const char** channel_name,
                             const char** pipe_name, std::uint32_t* link_type,
                             std::uint32_t* security, const char** remote_channel_name,
                             const char** remote_bus_name) override;

 private:
  const bus_config& config_;
};

}  // namespace vorbel_host
