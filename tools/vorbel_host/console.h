// Serialised output of the host program.
//
// One console object per run, shared by the command thread and the
// component's notifier threads. Every call writes complete lines under one
// mutex and flushes before it returns, so lines never interleave and a
// reader on the other end of a pipe sees each line as soon as it exists.
// Standard output carries events and command results, as text or as one JSON
// object per line; standard error carries messages for a person, always text.
#pragma once

#include <nlohmann/json.hpp>

#include <mutex>
#include <string>

namespace vorbel_host {

class console {
 public:
  enum class format { text, json };

  explicit console(format how);
  console(const console&) = delete;
  console& operator=(const console&) = delete;

  bool json() const { return format_ == format::json; }

  // One result or event: `text` (one or more lines, without the final line
  // break) in text mode, `object` on one line in JSON mode.
  void emit(const std::string& text, const nlohmann::ordered_json& object);
  // A line (or block) on standard output whatever the format: help text.
  void out(const std::string& text);
  // "vorbel_host: <message>" on standard error.
  void error(const std::string& message);
  void warning(const std::string& message);

 private:
  void write_locked(int fd, const std::string& text);

  const format format_;
  std::mutex mutex_;
};

// Serialises an object on one line; invalid UTF-8 from a peer's names is
// replaced, never thrown on.
std::string one_line(const nlohmann::ordered_json& object);

}  // namespace vorbel_host
