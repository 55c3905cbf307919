#include "configuration.h"

#include "text.h"

#include <nlohmann/json.hpp>
#include <windows.h>

#include <initializer_list>

namespace vorbel_host {
namespace {

using nlohmann::json;

// A configuration lists a few dozen channels; anything near this size is a
// wrong file, not a configuration.
constexpr std::uint64_t max_file_size = 4u * 1024u * 1024u;

void check_known_fields(const json& object, const std::string& where,
                        std::initializer_list<const char*> known) {
  for (auto it = object.begin(); it != object.end(); ++it) {
    bool found = false;
    std::string list;
    for (const char* name : known) {
      if (it.key() == name) found = true;
      if (!list.empty()) list += ", ";
      list += name;
    }
    if (!found) {
      const std::string field = where.empty() ? it.key() : where + "." + it.key();
      throw config_error(field, "unknown field (known fields: " + list + ")");
    }
  }
}

// Channel, pipe and bus names cross the component's interfaces as
// zero-terminated strings: an embedded NUL would silently cut them short.
std::string name_value(const json& value, const std::string& field) {
  if (!value.is_string()) {
    throw config_error(field, std::string("must be a non-empty string, found ") + value.type_name());
  }
  const std::string& text = value.get_ref<const std::string&>();
  if (text.empty()) throw config_error(field, "must be a non-empty string, found \"\"");
  if (text.find('\0') != std::string::npos) {
    throw config_error(field, "must not contain a NUL character");
  }
  return text;
}

std::string required_name(const json& object, const char* key, const std::string& where) {
  const std::string field = where + "." + key;
  const auto it = object.find(key);
  if (it == object.end()) throw config_error(field, "missing (a non-empty string)");
  return name_value(*it, field);
}

std::uint32_t optional_u32(const json& object, const char* key, const std::string& where,
                           std::uint32_t fallback, std::uint32_t max) {
  const auto it = object.find(key);
  if (it == object.end()) return fallback;
  const std::string field = where + "." + key;
  const std::string range = max == 1 ? std::string("must be 0 or 1")
                                     : "must be a whole number from 0 to " + std::to_string(max);
  if (!it->is_number_integer()) {
    throw config_error(field, range + ", found " + it->dump());
  }
  if (it->is_number_unsigned()) {
    const auto value = it->get<std::uint64_t>();
    if (value <= max) return static_cast<std::uint32_t>(value);
  }
  throw config_error(field, range + ", found " + it->dump());
}

const json& array_field(const json& root, const char* key, const json& empty) {
  const auto it = root.find(key);
  if (it == root.end()) return empty;
  if (!it->is_array()) {
    throw config_error(key, std::string("must be an array, found ") + it->type_name());
  }
  return *it;
}

void require_object(const json& value, const std::string& field) {
  if (!value.is_object()) {
    throw config_error(field, std::string("must be an object, found ") + value.type_name());
  }
}

// Security 0 admits peers signed like this process, 1 also other validly
// signed peers; other values have no defined meaning, so they are refused
// here rather than passed on.
constexpr std::uint32_t max_security = 1;

}  // namespace

bus_config parse_configuration(const std::string& json_text) {
  json root;
  try {
    root = json::parse(json_text);
  } catch (const json::parse_error& e) {
    // what() is "[json.exception.parse_error.101] parse error at line ..."
    std::string text = e.what();
    const auto bracket = text.find("] ");
    if (text.rfind("[json.", 0) == 0 && bracket != std::string::npos) text.erase(0, bracket + 2);
    throw config_error("", "not valid JSON: " + text);
  }
  if (!root.is_object()) {
    throw config_error("", std::string("the configuration must be a JSON object, found ") +
                               root.type_name());
  }
  check_known_fields(root, "",
                     {"bus", "default", "protected_image_paths", "local_channels", "exported_channels",
                      "imported_channels"});

  bus_config config;
  if (const auto it = root.find("bus"); it != root.end()) config.bus = name_value(*it, "bus");
  if (const auto it = root.find("default"); it != root.end()) {
    if (!it->is_boolean()) {
      throw config_error("default", std::string("must be true or false, found ") + it->dump());
    }
    config.is_default = it->get<bool>();
  }
  if (const auto it = root.find("protected_image_paths"); it != root.end()) {
    if (!it->is_boolean()) {
      throw config_error("protected_image_paths", std::string("must be true or false, found ") + it->dump());
    }
    config.protected_image_paths = it->get<bool>();
  }

  const json empty = json::array();
  const json& locals = array_field(root, "local_channels", empty);
  for (std::size_t i = 0; i < locals.size(); ++i) {
    config.local_channels.push_back(
        name_value(locals[i], "local_channels[" + std::to_string(i) + "]"));
  }

  const json& exports = array_field(root, "exported_channels", empty);
  for (std::size_t i = 0; i < exports.size(); ++i) {
    const std::string where = "exported_channels[" + std::to_string(i) + "]";
    const json& item = exports[i];
    require_object(item, where);
    check_known_fields(item, where, {"channel", "pipe", "link_type", "security"});
    exported_channel e;
    e.channel = required_name(item, "channel", where);
    e.pipe = required_name(item, "pipe", where);
    e.link_type = optional_u32(item, "link_type", where, default_link_type, UINT32_MAX);
    e.security = optional_u32(item, "security", where, 0, max_security);
    config.exported_channels.push_back(std::move(e));
  }

  const json& imports = array_field(root, "imported_channels", empty);
  for (std::size_t i = 0; i < imports.size(); ++i) {
    const std::string where = "imported_channels[" + std::to_string(i) + "]";
    const json& item = imports[i];
    require_object(item, where);
    check_known_fields(item, where,
                       {"channel", "pipe", "link_type", "security", "remote_channel", "remote_bus"});
    imported_channel m;
    m.channel = required_name(item, "channel", where);
    m.pipe = required_name(item, "pipe", where);
    m.link_type = optional_u32(item, "link_type", where, default_link_type, UINT32_MAX);
    m.security = optional_u32(item, "security", where, 0, max_security);
    m.remote_channel = required_name(item, "remote_channel", where);
    m.remote_bus = required_name(item, "remote_bus", where);
    config.imported_channels.push_back(std::move(m));
  }
  return config;
}

bus_config load_configuration(const std::wstring& path) {
  HANDLE file = ::CreateFileW(path.c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE,
                              /* security */ nullptr, OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL,
                              /* template */ nullptr);
  if (file == INVALID_HANDLE_VALUE) {
    const DWORD err = ::GetLastError();
    throw config_error("", "cannot open the file: " + describe_error(err));
  }
  // The tool sees only the public headers, so it keeps its one file handle
  // in a guard of its own.
  struct close_on_exit {
    HANDLE handle;
    ~close_on_exit() { ::CloseHandle(handle); }
  } guard{file};

  LARGE_INTEGER size{};
  if (!::GetFileSizeEx(file, &size)) {
    const DWORD err = ::GetLastError();
    throw config_error("", "cannot read the file: " + describe_error(err));
  }
  if (static_cast<std::uint64_t>(size.QuadPart) > max_file_size) {
    throw config_error("", "the file is larger than " + std::to_string(max_file_size) +
                               " bytes; not a configuration");
  }
  std::string text(static_cast<std::size_t>(size.QuadPart), '\0');
  std::size_t done = 0;
  while (done < text.size()) {
    DWORD got = 0;
    if (!::ReadFile(file, &text[done], static_cast<DWORD>(text.size() - done), &got,
                    /* overlapped */ nullptr)) {
      const DWORD err = ::GetLastError();
      throw config_error("", "cannot read the file: " + describe_error(err));
    }
    if (got == 0) break;  // the file shrank while we read it
    done += got;
  }
  text.resize(done);
  return parse_configuration(text);
}

void* json_configuration::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_IQmBaseInterface)) return static_cast<ibus_configuration*>(this);
  if (qm::same_iid(iid, IID_ibus_trust_policy)) return static_cast<ibus_trust_policy*>(this);
  return nullptr;
}

bool json_configuration::protected_image_paths_only() { return config_.protected_image_paths; }

bool json_configuration::is_default_bus() { return config_.is_default; }

bool json_configuration::next_local_channel(std::uint64_t* cursor, const char** channel_name) {
  if (cursor == nullptr || channel_name == nullptr) return false;
  if (*cursor >= config_.local_channels.size()) return false;
  *channel_name = config_.local_channels[static_cast<std::size_t>((*cursor)++)].c_str();
  return true;
}

bool json_configuration::next_exported_channel(std::uint64_t* cursor, const char** channel_name,
                                               const char** pipe_name, std::uint32_t* link_type,
                                               std::uint32_t* security) {
  if (cursor == nullptr || channel_name == nullptr || pipe_name == nullptr ||
      link_type == nullptr || security == nullptr) {
    return false;
  }
  if (*cursor >= config_.exported_channels.size()) return false;
  const exported_channel& e = config_.exported_channels[static_cast<std::size_t>((*cursor)++)];
  *channel_name = e.channel.c_str();
  *pipe_name = e.pipe.c_str();
  *link_type = e.link_type;
  *security = e.security;
  return true;
}

bool json_configuration::next_imported_channel(std::uint64_t* cursor, const char** channel_name,
                                               const char** pipe_name, std::uint32_t* link_type,
                                               std::uint32_t* security,
                                               const char** remote_channel_name,
                                               const char** remote_bus_name) {
  if (cursor == nullptr || channel_name == nullptr || pipe_name == nullptr ||
      link_type == nullptr || security == nullptr || remote_channel_name == nullptr ||
      remote_bus_name == nullptr) {
    return false;
  }
  if (*cursor >= config_.imported_channels.size()) return false;
  const imported_channel& m = config_.imported_channels[static_cast<std::size_t>((*cursor)++)];
  *channel_name = m.channel.c_str();
  *pipe_name = m.pipe.c_str();
  *link_type = m.link_type;
  *security = m.security;
  *remote_channel_name = m.remote_channel.c_str();
  *remote_bus_name = m.remote_bus.c_str();
  return true;
}

}  // namespace vorbel_host
