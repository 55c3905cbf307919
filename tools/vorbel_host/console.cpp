#include "console.h"

#include <cstdio>

namespace vorbel_host {

console::console(format how) : format_(how) {}

std::string one_line(const nlohmann::ordered_json& object) {
  return object.dump(/* indent */ -1, /* indent_char */ ' ', /* ensure_ascii */ false,
                     nlohmann::ordered_json::error_handler_t::replace);
}

void console::emit(const std::string& text, const nlohmann::ordered_json& object) {
  std::lock_guard<std::mutex> lock(mutex_);
  write_locked(1, (json() ? one_line(object) : text) + "\n");
}

void console::out(const std::string& text) {
  std::lock_guard<std::mutex> lock(mutex_);
  write_locked(1, text + "\n");
}

void console::error(const std::string& message) {
  std::lock_guard<std::mutex> lock(mutex_);
  write_locked(2, "vorbel_host: " + message + "\n");
}

void console::warning(const std::string& message) {
  std::lock_guard<std::mutex> lock(mutex_);
  write_locked(2, "vorbel_host: warning: " + message + "\n");
}

void console::write_locked(int fd, const std::string& text) {
  std::FILE* stream = fd == 2 ? stderr : stdout;
  std::fwrite(text.data(), 1, text.size(), stream);
  std::fflush(stream);
}

}  // namespace vorbel_host
