// Diagnostic lines of parlo.dll. They go to the callback installed with
// parlo_set_log, or to OutputDebugString when there is none.
//
//   log_line(level_error, "parlo::channel::post") << "message is nullptr";
//
// Any thread may write; a line is handed over when the statement ends.
#pragma once

#include <cstdint>
#include <sstream>

#include "bus/parlo/parlo_ext.h"

namespace parlo::impl {

enum : std::uint32_t {
  level_error = 4,
  level_warning = 8,
  level_info = 16,
};

void set_log(ext::log_callback callback, void* context);

class log_line : public std::ostringstream {
 public:
  log_line(std::uint32_t level, const char* function) : level_(level), function_(function) {}
  log_line(const log_line&) = delete;
  log_line& operator=(const log_line&) = delete;
  ~log_line() override;

 private:
  std::uint32_t level_;
  const char* function_;
};

}  // namespace parlo::impl
