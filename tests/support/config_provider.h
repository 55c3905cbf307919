// A configuration provider for tests: fixed lists of channels, and a record
// of every call the component made.
#pragma once

#include <vorbel/ibus_configuration.h>

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "platform/srw_sync.h"

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
  bool write_link_and_security = true;
  std::uint32_t link_type = 3;
  std::uint32_t security = 0;
};

struct provider_call {
  std::string what;      // "is_default_bus", "local", "exported", "imported"
  std::uint64_t cursor;  // the cursor as the component passed it
  bool delivered;
  std::uint32_t link_type_in = 0;
  std::uint32_t security_in = 0;
};

class config_provider final : public ibus_configuration {
 public:
  bool is_default = false;
  std::vector<std::string> local;
  std::vector<exported> exports;
  std::vector<imported> imports;

  void* GetInterface(GUID) override { return nullptr; }

  bool is_default_bus() override {
    record({"is_default_bus", 0, is_default});
    return is_default;
  }

  bool next_local_channel(std::uint64_t* cursor, const char** channel_name) override {
    const bool more = *cursor < local.size();
    record({"local", *cursor, more});
    if (!more) return false;
    *channel_name = local[(*cursor)++].c_str();
    return true;
  }

  bool next_exported_channel(std::uint64_t* cursor, const char** channel_name,
                             const char** pipe_name, std::uint32_t* link_type,
                             std::uint32_t* security) override {
    const bool more = *cursor < exports.size();
    record({"exported", *cursor, more, *link_type, *security});
    if (!more) return false;
    const exported& e = exports[(*cursor)++];
    *channel_name = e.channel.c_str();
    *pipe_name = e.pipe.c_str();
    if (e.write_link_and_security) {
      *link_type = e.link_type;
      *security = e.security;
    }
    return true;
  }

  bool next_imported_channel(std::uint64_t* cursor, const char** channel_name,
                             const char** pipe_name, std::uint32_t* link_type,
                             std::uint32_t* security, const char** remote_channel_name,
                             const char** remote_bus_name) override {
    const bool more = *cursor < imports.size();
    record({"imported", *cursor, more, *link_type, *security});
    if (!more) return false;
    const imported& i = imports[(*cursor)++];
    *channel_name = i.channel.c_str();
    *pipe_name = i.pipe.c_str();
    *remote_channel_name = i.remote_channel.c_str();
    *remote_bus_name = i.remote_bus.c_str();
    if (i.write_link_and_security) {
      *link_type = i.link_type;
      *security = i.security;
    }
    return true;
  }

  std::vector<provider_call> calls() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return calls_;
  }
  std::vector<provider_call> calls_of(const std::string& what) {
    std::vector<provider_call> out;
    for (const auto& c : calls()) {
      if (c.what == what) out.push_back(c);
    }
    return out;
  }

 private:
  void record(provider_call call) {
    std::lock_guard<srw_mutex> lock(mutex_);
    calls_.push_back(std::move(call));
  }
  srw_mutex mutex_;
  std::vector<provider_call> calls_;
};

}  // namespace test_support
