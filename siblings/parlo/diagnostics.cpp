#include "diagnostics.h"

#include <windows.h>

#include <mutex>
#include <shared_mutex>
#include <string>

namespace parlo::impl {
namespace {

// The installed callback. Writers hold the lock shared while the callback
// runs, so that set_log, which takes it exclusively, returns only when the
// previous callback is no longer running.
struct log_sink {
  std::shared_mutex mutex;
  ext::log_callback callback = nullptr;
  void* context = nullptr;
};

log_sink& sink() {
  static log_sink instance;
  return instance;
}

}  // namespace

void set_log(ext::log_callback callback, void* context) {
  log_sink& s = sink();
  std::unique_lock<std::shared_mutex> lock(s.mutex);
  s.callback = callback;
  s.context = context;
}

log_line::~log_line() {
  try {
    const std::string text = str();
    log_sink& s = sink();
    std::shared_lock<std::shared_mutex> lock(s.mutex);
    if (s.callback != nullptr) {
      s.callback(level_, function_, text.c_str(), s.context);
      return;
    }
    const std::string line = std::string(function_) + ": " + text + "\n";
    ::OutputDebugStringA(line.c_str());
  } catch (...) {
    // A line that cannot be built is lost; the caller's result stands.
  }
}

}  // namespace parlo::impl
