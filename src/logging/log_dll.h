// Binding to the logging library scribo.dll, shared by the whole process.
//
// One CLogDLL exists per process at a time. It is reference-counted: process
// attach of vorbel.dll takes one reference for the process, and every line
// written takes one more for the length of its LogWrite call. A process-wide
// spin flag serialises the count, the instance pointer, binding and
// unbinding. When scribo.dll cannot be found the binding still exists, with a
// writer that drops every line.
#pragma once

#include <windows.h>

#include <cstdint>

namespace logging {

// LogWrite(depth step, &level, this module, function, format, ...).
typedef std::int32_t (*LogWrite_fn)(std::int16_t depth, const std::uint32_t* level, HMODULE module,
                                    const wchar_t* function, const wchar_t* format, ...);
typedef void (*LogVoid_fn)();
typedef void (*LogRemoveModule_fn)(const char* who);
typedef void* LogUnused_fn;  // resolved and kept, never called

// Accepts LogWrite's arguments and drops them.
std::int32_t noop_log_write(std::int16_t depth, const std::uint32_t* level, HMODULE module,
                            const wchar_t* function, const wchar_t* format, ...);

// Members in the order the binding fills them; null when an export is missing.
struct CLogDLL {
  HMODULE module;
  LogUnused_fn LogApplySettings;
  LogUnused_fn LogSetSettingsFile;
  LogUnused_fn LogEnable;
  LogUnused_fn LogSetLevel;
  LogUnused_fn LogSetPath;
  LogUnused_fn LogSetType;
  LogUnused_fn LogSetMode;
  LogUnused_fn LogSetMaxSize;
  LogUnused_fn LogSetDepth;
  LogWrite_fn LogWrite;  // never null once bound
  LogUnused_fn LogIsEnabled;
  LogUnused_fn LogMonitorSettings;
  LogVoid_fn LogUninitMetrics;
  LogUnused_fn LogTrackEvent;
  LogUnused_fn LogTrackEventData;
  LogRemoveModule_fn LogRemoveModule;
  LogUnused_fn LogGetLevel;
};

// Binds a zero-filled structure: finds scribo.dll already loaded in the
// process, or loads it from this component's folder; calls LogInit and
// resolves the exports.
void bind(CLogDLL& log);
// Calls LogDeinit, LogUninitMetrics and LogRemoveModule, then frees the
// library. With `library_gone` (process termination) it only forgets it.
void unbind(CLogDLL& log, bool library_gone);

// The process-wide reference count (read without the spin flag).
std::int32_t reference_count();
// The current instance, or null.
CLogDLL* current_instance();

// Takes one reference, binding a new instance when the count is 0. Returns the
// instance; null when it could not be allocated (the reference still counts).
CLogDLL* add_reference();
// Gives one reference back; the last one unbinds and frees the instance.
void release_reference();

// DllMain's process attach: drops any stale instance when the count is 0,
// binds a fresh one and counts the process's reference.
void process_attach();
// DllMain's process detach. `process_terminating` (the loader's reserved
// pointer was not null): the library may already be detached, so the
// instance is freed without calling into it, and from then on a reference
// that finds no binding gets the dropping writer instead of loading the
// library again.
void process_detach(bool process_terminating);

// Holder of the references taken for one use (one LogWrite call).
class logger_ref {
 public:
  logger_ref() = default;
  logger_ref(const logger_ref&) = delete;
  logger_ref& operator=(const logger_ref&) = delete;
  ~logger_ref() { release(); }

  CLogDLL* acquire();
  void release();
  CLogDLL* get() const { return log_; }

 private:
  CLogDLL* log_ = nullptr;
  volatile long count_ = 0;
};

}  // namespace logging
