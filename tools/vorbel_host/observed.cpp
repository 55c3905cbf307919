#include "observed.h"

#include "text.h"

#include <cstdio>
#include <cstring>
#include <tuple>

namespace vorbel_host {
namespace {

using nlohmann::ordered_json;

// The component never passes null names, but a null must not take the host
// down if it ever does.
std::string str(const char* text) { return text != nullptr ? std::string(text) : std::string(); }

// Observers run inside the component's notification tasks, where an escaping
// exception would end the process; a line that cannot be recorded (out of
// memory) is lost instead.
template <typename F>
void guarded(F&& f) noexcept {
  try {
    f();
  } catch (...) {
  }
}

std::string listener_text(char sign, std::uint32_t pid, const std::string& channel,
                          const std::string& id) {
  return std::string(1, sign) + " pid=" + std::to_string(pid) + " channel=" + printable(channel) +
         " id=" + printable(id);
}

ordered_json listener_object(const char* event, std::uint32_t pid, const std::string& channel,
                             const std::string& id) {
  return ordered_json{{"event", event}, {"pid", pid}, {"channel", channel}, {"id", id}};
}

const char* side_word(gateway_admission_side side) {
  switch (side) {
    case gateway_admission_side::local:
      return "local";
    case gateway_admission_side::remote:
      return "remote";
    case gateway_admission_side::explanation:
      return "explain";
  }
  return "";
}

const char* trust_word(gateway_admission_trust trust) {
  switch (trust) {
    case gateway_admission_trust::low_trust:
      return "low_trust";
    case gateway_admission_trust::high_trust:
      return "high_trust";
    case gateway_admission_trust::untrusted:
      return "untrusted";
    case gateway_admission_trust::unknown:
      return "unknown";
  }
  return "";
}

const char* source_word(gateway_admission_source source) {
  switch (source) {
    case gateway_admission_source::none:
      return "none";
    case gateway_admission_source::judged:
      return "judged";
    case gateway_admission_source::cached_process:
      return "cached_process";
    case gateway_admission_source::cached_image:
      return "cached_image";
  }
  return "";
}

const char* reason_word(gateway_admission_reason reason) {
  switch (reason) {
    case gateway_admission_reason::admitted:
      return "admitted";
    case gateway_admission_reason::no_own_signer:
      return "no_own_signer";
    case gateway_admission_reason::pipe_not_configured:
      return "pipe_not_configured";
    case gateway_admission_reason::process_not_inspected:
      return "process_not_inspected";
    case gateway_admission_reason::image_not_judged:
      return "image_not_judged";
    case gateway_admission_reason::signature_invalid:
      return "signature_invalid";
    case gateway_admission_reason::image_replaced:
      return "image_replaced";
    case gateway_admission_reason::image_path_unprotected:
      return "image_path_unprotected";
    case gateway_admission_reason::other_signer:
      return "other_signer";
  }
  return "";
}

std::string hex8(std::uint32_t value) {
  char text[11];
  std::snprintf(text, sizeof text, "0x%08x", static_cast<unsigned>(value));
  return text;
}

}  // namespace

std::string admission_text(const char* word, const gateway_admission& a) {
  std::string text = word;
  if (a.side != gateway_admission_side::explanation) text += std::string(" ") + side_word(a.side);
  text += a.allowed ? " ALLOW" : " DENY";
  text += " pid=" + std::to_string(a.pid);
  if (a.side != gateway_admission_side::explanation) text += " pipe=" + printable(str(a.pipe));
  text += " level=" + (a.level == gateway_admission_no_level ? std::string("none") : std::to_string(a.level));
  text += std::string(" trust=") + trust_word(a.trust);
  // TRUST_E_NOSIGNATURE(0x800b0100); a code without a name is its number.
  const std::string name = str(a.verification_name);
  text += " verification=" + printable(name);
  if (a.verification != gateway_admission_not_verified && name.rfind("0x", 0) != 0) {
    text += "(" + hex8(a.verification) + ")";
  }
  text += " signer=" + quoted_word(str(a.signer)) + " own_signer=" + quoted_word(str(a.own_signer));
  text += " image=" + quoted_word(str(a.image));
  text += std::string(" source=") + source_word(a.source);
  text += std::string(" reason=") + reason_word(a.reason) + " " + quoted_word(str(a.reason_text));
  return text;
}

ordered_json admission_object(const char* event, const gateway_admission& a) {
  ordered_json object{{"event", event}};
  if (a.side != gateway_admission_side::explanation) {
    object["side"] = side_word(a.side);
    object["pipe"] = str(a.pipe);
  }
  object["verdict"] = a.allowed ? "ALLOW" : "DENY";
  object["pid"] = a.pid;
  object["level"] = a.level == gateway_admission_no_level ? ordered_json(nullptr) : ordered_json(a.level);
  object["trust"] = trust_word(a.trust);
  object["verification"] =
      a.verification == gateway_admission_not_verified ? ordered_json(nullptr) : ordered_json(a.verification);
  object["verification_name"] = str(a.verification_name);
  object["signer"] = str(a.signer);
  object["own_signer"] = str(a.own_signer);
  object["image"] = str(a.image);
  object["source"] = source_word(a.source);
  object["reason"] = reason_word(a.reason);
  object["reason_text"] = str(a.reason_text);
  return object;
}

void observed_state::listener_added(std::uint32_t pid, const std::string& channel,
                                    const std::string& id) {
  std::lock_guard<std::mutex> lock(mutex_);
  listeners_[pid].emplace(channel, id);
  out_.emit(listener_text('+', pid, channel, id),
            listener_object("new_listener", pid, channel, id));
  changed_.notify_all();
}

void observed_state::listener_removed(std::uint32_t pid, const std::string& channel,
                                      const std::string& id) {
  std::lock_guard<std::mutex> lock(mutex_);
  const auto process = listeners_.find(pid);
  if (process != listeners_.end()) {
    const auto it = process->second.find(listener(channel, id));
    if (it != process->second.end()) process->second.erase(it);
    if (process->second.empty()) listeners_.erase(process);
  }
  out_.emit(listener_text('-', pid, channel, id),
            listener_object("listener_removed", pid, channel, id));
  changed_.notify_all();
}

void observed_state::gateway_event(const char* event, bool local, const std::string& pipe,
                                   std::uint32_t pid, std::optional<std::uint32_t> err) {
  std::lock_guard<std::mutex> lock(mutex_);
  const bool is_listen = std::strcmp(event, "listen") == 0;
  const connection key{local, pipe, pid};
  if (std::strcmp(event, "connect") == 0) {
    connections_.insert(key);
  } else if (std::strcmp(event, "disconnect") == 0) {
    const auto it = connections_.find(key);
    if (it != connections_.end()) connections_.erase(it);
  }

  std::string text = event;
  ordered_json object{{"event", event}};
  if (!is_listen) {
    text += local ? " local" : " remote";
    object["side"] = local ? "local" : "remote";
  }
  text += " pipe=" + printable(pipe);
  object["pipe"] = pipe;
  if (!is_listen) {
    text += " pid=" + std::to_string(pid);
    object["pid"] = pid;
  }
  if (err) {
    text += " err=" + std::to_string(*err);
    object["err"] = *err;
  }
  out_.emit(text, object);
  changed_.notify_all();
}

void observed_state::admission(const gateway_admission& a) {
  std::lock_guard<std::mutex> lock(mutex_);
  out_.emit(admission_text("admission", a), admission_object("admission", a));
}

std::optional<std::uint32_t> observed_state::find_locked(const listener& wanted,
                                                         std::optional<std::uint32_t> pid) const {
  for (const auto& [process, list] : listeners_) {
    if (pid && process != *pid) continue;
    if (list.count(wanted) != 0) return process;
  }
  return std::nullopt;
}

std::optional<std::uint32_t> observed_state::wait_listener(const std::string& channel,
                                                           const std::string& id,
                                                           std::optional<std::uint32_t> pid,
                                                           bool present,
                                                           std::chrono::milliseconds timeout) {
  const listener wanted(channel, id);
  std::unique_lock<std::mutex> lock(mutex_);
  std::optional<std::uint32_t> found;
  const bool done = changed_.wait_for(lock, timeout, [&] {
    found = find_locked(wanted, pid);
    return found.has_value() == present;
  });
  if (!done) return std::nullopt;
  return present ? found : std::optional<std::uint32_t>(0);
}

void observed_state::print_listeners() {
  std::lock_guard<std::mutex> lock(mutex_);
  std::size_t count = 0;
  std::string rows;
  ordered_json processes = ordered_json::array();
  for (const auto& [pid, list] : listeners_) {
    ordered_json entries = ordered_json::array();
    for (const auto& [channel, id] : list) {
      ++count;
      rows += "\n  pid=" + std::to_string(pid) + " channel=" + printable(channel) +
              " id=" + printable(id);
      entries.push_back(ordered_json{{"channel", channel}, {"id", id}});
    }
    processes.push_back(ordered_json{{"pid", pid}, {"listeners", std::move(entries)}});
  }
  out_.emit("list: " + std::to_string(count) + rows,
            ordered_json{{"event", "list"}, {"processes", std::move(processes)}});
}

void observed_state::print_connections(bool has_gateway) {
  std::lock_guard<std::mutex> lock(mutex_);
  std::string text = "connections: " + std::to_string(connections_.size());
  if (!has_gateway) text += " (the bus has no gateway)";
  ordered_json list = ordered_json::array();
  for (const connection& c : connections_) {
    text += std::string("\n  ") + (c.local ? "local" : "remote") + " pipe=" + printable(c.pipe) +
            " pid=" + std::to_string(c.pid);
    list.push_back(
        ordered_json{{"side", c.local ? "local" : "remote"}, {"pipe", c.pipe}, {"pid", c.pid}});
  }
  out_.emit(text, ordered_json{{"event", "connections"},
                               {"gateway", has_gateway},
                               {"connections", std::move(list)}});
}

void* bus_watch::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_ibus_observer) || qm::same_iid(iid, IID_IQmBaseInterface)) {
    return static_cast<ibus_observer*>(this);
  }
  return nullptr;
}

void bus_watch::on_new_listener(std::uint32_t pid, const char* channel, const char* id) {
  guarded([&] { state_.listener_added(pid, str(channel), str(id)); });
}

void bus_watch::on_listener_removed(std::uint32_t pid, const char* channel, const char* id) {
  guarded([&] { state_.listener_removed(pid, str(channel), str(id)); });
}

void* gateway_watch::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_igateway_observer) || qm::same_iid(iid, IID_igateway_observer_base) ||
      qm::same_iid(iid, IID_IQmBaseInterface)) {
    return static_cast<igateway_observer*>(this);
  }
  if (qm::same_iid(iid, IID_igateway_admission_observer)) return static_cast<igateway_admission_observer*>(this);
  return nullptr;
}

void gateway_watch::on_admission(const gateway_admission* admission) {
  if (admission == nullptr) return;
  guarded([&] { state_.admission(*admission); });
}

void gateway_watch::on_listen(const char* name) {
  guarded([&] { state_.gateway_event("listen", true, str(name), 0, std::nullopt); });
}
void gateway_watch::on_local_connect(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("connect", true, str(name), pid, std::nullopt); });
}
void gateway_watch::on_local_disconnect(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("disconnect", true, str(name), pid, std::nullopt); });
}
void gateway_watch::on_local_start_communication(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("start", true, str(name), pid, std::nullopt); });
}
void gateway_watch::on_local_error(const char* name, std::uint32_t pid, std::uint32_t err) {
  guarded([&] { state_.gateway_event("error", true, str(name), pid, err); });
}
void gateway_watch::on_remote_connect(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("connect", false, str(name), pid, std::nullopt); });
}
void gateway_watch::on_remote_disconnect(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("disconnect", false, str(name), pid, std::nullopt); });
}
void gateway_watch::on_remote_start_communication(const char* name, std::uint32_t pid) {
  guarded([&] { state_.gateway_event("start", false, str(name), pid, std::nullopt); });
}
void gateway_watch::on_remote_error(const char* name, std::uint32_t pid, std::uint32_t err) {
  guarded([&] { state_.gateway_event("error", false, str(name), pid, err); });
}

}  // namespace vorbel_host
