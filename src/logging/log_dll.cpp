#include "logging/log_dll.h"

#include <memory>
#include <string>
#include <new>
#include <vector>

namespace logging {
namespace {

// Process-wide state. The spin flag is also DllMain's guard.
volatile long g_spin = 0;
CLogDLL* g_instance = nullptr;
volatile long g_count = 0;
// Set by a detach during process termination: the loader may already have
// detached scribo.dll, so no later line may bind it again.
bool g_process_ending = false;

class spin_guard {
 public:
  spin_guard() {
    while (::InterlockedExchange(&g_spin, 1) != 0) ::Sleep(1);
  }
  ~spin_guard() { ::InterlockedExchange(&g_spin, 0); }
  spin_guard(const spin_guard&) = delete;
  spin_guard& operator=(const spin_guard&) = delete;
};

template <typename T>
T resolve(HMODULE module, const char* name) {
  return reinterpret_cast<T>(reinterpret_cast<void*>(::GetProcAddress(module, name)));
}

// An address inside this component, to find its own module by.
void anchor() {}

HMODULE find_library() {
  HMODULE module = nullptr;
  // Flags 0: a counted reference on a copy the host already loaded.
  if (::GetModuleHandleExW(0, L"scribo.dll", &module) && module != nullptr) return module;

  HMODULE self = nullptr;
  if (!::GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS |
                                GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                            reinterpret_cast<LPCWSTR>(&anchor), &self)) {
    return nullptr;
  }
  constexpr DWORD capacity = 32767;
  std::vector<wchar_t> path(capacity, L'\0');
  const DWORD n = ::GetModuleFileNameW(self, path.data(), capacity);
  if (n == 0) return nullptr;
  std::size_t slash = std::wstring::npos;
  for (std::size_t i = 0; i < n && i < capacity; ++i) {
    if (path[i] == L'\\') slash = i;
  }
  if (slash == std::wstring::npos) return nullptr;
  const wchar_t tail[] = L"\\scribo.dll";
  std::size_t i = slash;
  for (const wchar_t* t = tail; *t != L'\0' && i + 1 < capacity; ++t, ++i) path[i] = *t;
  path[i] = L'\0';
  return ::LoadLibraryW(path.data());
}

CLogDLL* make_instance() {
  auto* log = new (std::nothrow) CLogDLL{};
  if (log == nullptr) return nullptr;
  if (g_process_ending) {
    log->LogWrite = &noop_log_write;
  } else {
    bind(*log);
  }
  return log;
}

void destroy_instance(CLogDLL* log, bool library_gone) {
  if (log == nullptr) return;
  unbind(*log, library_gone);
  delete log;
}

}  // namespace

std::int32_t noop_log_write(std::int16_t, const std::uint32_t*, HMODULE, const wchar_t*,
                            const wchar_t*, ...) {
  return static_cast<std::int32_t>(0x80004002u);  // E_NOINTERFACE
}

void bind(CLogDLL& log) {
  log = CLogDLL{};
  log.module = find_library();
  if (log.module == nullptr) {
    log.LogWrite = &noop_log_write;
    return;
  }
  if (auto init = resolve<LogVoid_fn>(log.module, "LogInit")) init();
  log.LogApplySettings = resolve<LogUnused_fn>(log.module, "LogApplySettings");
  log.LogSetSettingsFile = resolve<LogUnused_fn>(log.module, "LogSetSettingsFile");
  log.LogEnable = resolve<LogUnused_fn>(log.module, "LogEnable");
  log.LogSetLevel = resolve<LogUnused_fn>(log.module, "LogSetLevel");
  log.LogSetPath = resolve<LogUnused_fn>(log.module, "LogSetPath");
  log.LogSetType = resolve<LogUnused_fn>(log.module, "LogSetType");
  log.LogSetMode = resolve<LogUnused_fn>(log.module, "LogSetMode");
  log.LogSetMaxSize = resolve<LogUnused_fn>(log.module, "LogSetMaxSize");
  log.LogSetDepth = resolve<LogUnused_fn>(log.module, "LogSetDepth");
  log.LogWrite = resolve<LogWrite_fn>(log.module, "LogWrite");
  log.LogIsEnabled = resolve<LogUnused_fn>(log.module, "LogIsEnabled");
  log.LogMonitorSettings = resolve<LogUnused_fn>(log.module, "LogMonitorSettings");
  log.LogGetLevel = resolve<LogUnused_fn>(log.module, "LogGetLevel");
  log.LogUninitMetrics = resolve<LogVoid_fn>(log.module, "LogUninitMetrics");
  log.LogTrackEvent = resolve<LogUnused_fn>(log.module, "LogTrackEvent");
  log.LogTrackEventData = resolve<LogUnused_fn>(log.module, "LogTrackEventData");
  log.LogRemoveModule = resolve<LogRemoveModule_fn>(log.module, "LogRemoveModule");
  if (log.LogWrite == nullptr) log.LogWrite = &noop_log_write;
}

void unbind(CLogDLL& log, bool library_gone) {
  if (log.module != nullptr && !library_gone) {
    if (auto deinit = resolve<LogVoid_fn>(log.module, "LogDeinit")) deinit();
    if (log.LogUninitMetrics != nullptr) log.LogUninitMetrics();
    if (log.LogRemoveModule != nullptr) log.LogRemoveModule("logging::CLogDLL::~CLogDLL");
    ::FreeLibrary(log.module);
  }
  log = CLogDLL{};
}

std::int32_t reference_count() { return g_count; }

CLogDLL* current_instance() {
  spin_guard guard;
  return g_instance;
}

CLogDLL* add_reference() {
  spin_guard guard;
  if (g_count == 0) g_instance = make_instance();
  ++g_count;
  return g_instance;
}

void release_reference() {
  spin_guard guard;
  if (g_count >= 1) --g_count;
  if (g_instance != nullptr && g_count == 0) {
    // Unbinding runs under the flag so that a new binding cannot overlap the
    // old one's LogDeinit.
    destroy_instance(g_instance, /* library_gone */ false);
    g_instance = nullptr;
  }
}

void process_attach() {
  spin_guard guard;
  if (g_count == 0) {
    destroy_instance(g_instance, /* library_gone */ false);
    g_instance = make_instance();
  }
  ++g_count;
}

void process_detach(bool process_terminating) {
  spin_guard guard;
  if (process_terminating) g_process_ending = true;
  if (g_count >= 1) --g_count;
  if (g_instance != nullptr && g_count == 0) {
    destroy_instance(g_instance, /* library_gone */ process_terminating);
    g_instance = nullptr;
  }
}

CLogDLL* logger_ref::acquire() {
  log_ = add_reference();
  ::InterlockedIncrement(&count_);
  return log_;
}

void logger_ref::release() {
  while (count_ > 0) {
    ::InterlockedDecrement(&count_);
    release_reference();
  }
  log_ = nullptr;
}

}  // namespace logging
