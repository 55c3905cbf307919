#include "gateway/gateway_observer.h"

#include <mutex>
#include <system_error>

#include "logging/logger.h"
#include "platform/srw_sync.h"
#include "platform/win_api.h"
#include "security/signature.h"

using logging::level_info;
using logging::level_warning;
using logging::logger_stream;

namespace {

constexpr DWORD process_query_and_read = PROCESS_QUERY_INFORMATION | PROCESS_VM_READ;  // 0x410
constexpr std::size_t pipe_prefix_length = 8;  // "\\.\PIPE"

// The checker holds the current process's signature only when it was read
// without error and names a signer.
std::optional<signature> current_signature_for_checker() {
  std::optional<signature> current = get_current_signature();
  if (current && current->subject.empty()) current.reset();
  return current;
}

bool has_pipe_prefix(const std::string& name) {
  if (name.size() < pipe_prefix_length) return false;
  if (name.compare(0, 4, "\\\\.\\") != 0) return false;
  // "\\.\pipe" is how Windows documents it; the prefix is matched in any
  // letter case so that a pipe configured that way is still found.
  static const char upper[] = "PIPE";
  for (std::size_t i = 0; i < 4; ++i) {
    const char c = name[4 + i];
    const char folded = (c >= 'a' && c <= 'z') ? static_cast<char>(c - 'a' + 'A') : c;
    if (folded != upper[i]) return false;
  }
  return true;
}

}  // namespace

std::optional<std::uint32_t> get_pipe_security(const pipe_security_map& map, HANDLE pipe) {
  std::error_code code;
  const std::wstring name = winapi::query_file_name(pipe, code);
  if (name.empty()) {
    logger_stream(level_info, L"get_pipe_security") << L"failed get pipe name for handle=" << pipe;
    return std::nullopt;
  }
  logger_stream(level_info, L"get_pipe_security") << L"pipe=" << pipe << L" " << name;
  const std::string utf8 = winapi::utf16_to_utf8(name, code);
  if (code) return std::nullopt;
  auto found = map.find(utf8);
  if (found == map.end()) return std::nullopt;
  return found->second;
}

pipe_security_map make_pipe_security_map(const std::map<std::string, std::uint32_t>& pipes) {
  pipe_security_map map;
  for (const auto& [name, level] : pipes) {
    map.emplace(has_pipe_prefix(name) ? name.substr(pipe_prefix_length) : name, level);
  }
  return map;
}

gateway_observer::gateway_observer(gateway_observer_list* observers)
    : context_(std::make_unique<notify_context>(observers)),
      signature_checker_(current_signature_for_checker()),
      pipes_security_descriptor_(make_pipes_security_descriptor()) {
  std::error_code ignored;
  adjust_process_priviledges(ignored);
}

gateway_observer::~gateway_observer() = default;

void gateway_observer::apply_security(HANDLE pipe) {
  if (!pipes_security_descriptor_) return;
  std::error_code ignored;  // a failure is logged; the event goes on
  apply_pipe_security(pipe, pipes_security_descriptor_, ignored);
}

std::function<void()> gateway_observer::event_task(gateway_event event, HANDLE pipe,
                                                   std::uint32_t pid, std::uint32_t err) {
  return make_event_notification(event, context_->observers, &context_->connections, pipe, pid,
                                 err);
}

void gateway_observer::post_event(gateway_event event, HANDLE pipe, std::uint32_t pid,
                                  std::uint32_t err) {
  context_->pool.post(event_task(event, pipe, pid, err));
}

void gateway_observer::post_pair(std::function<void()> first, std::function<void()> second) {
  context_->pool.post([first = std::move(first), second = std::move(second)] {
    first();
    second();
  });
}

void gateway_observer::on_listen(parlo::ipc::pipe_handle pipe, const char* name) try {
  logging::trace_scope trace(L"gateway_observer::on_listen");
  logger_stream(level_info, L"gateway_observer::on_listen")
      << L"name=" << (name != nullptr ? name : "") << L" handle=" << pipe;
  apply_security(pipe);
  context_->pool.post(make_listen_notification(context_->observers, name != nullptr ? name : ""));
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_listen");
}

bool gateway_observer::on_local_connect(parlo::ipc::pipe_handle pipe, std::uint32_t pid) try {
  logging::trace_scope trace(L"gateway_observer::on_local_connect");
  logger_stream(level_info, L"gateway_observer::on_local_connect")
      << L"pid=" << pid << L" handle=" << pipe;
  if (!is_allowed(pipe, pid)) return false;
  apply_security(pipe);
  // The name is read now: the handle is the library's, closed soon after the
  // disconnect.
  post_pair(make_connection_insert(&context_->connections, pipe, get_pipe_name(pipe), pid),
            event_task(gateway_event::local_connect, pipe, pid));
  return true;
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_local_connect");
  return false;
}

void gateway_observer::on_local_disconnect(parlo::ipc::pipe_handle pipe) try {
  logging::trace_scope trace(L"gateway_observer::on_local_disconnect");
  logger_stream(level_info, L"gateway_observer::on_local_disconnect") << L"handle=" << pipe;
  if (pipe == nullptr) return;
  // The notification first: it still reads the connection's name and pid.
  post_pair(event_task(gateway_event::local_disconnect, pipe),
            make_connection_removal(&context_->connections, pipe));
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_local_disconnect");
}

void gateway_observer::on_local_start_communication(parlo::ipc::pipe_handle pipe) try {
  logging::trace_scope trace(L"gateway_observer::on_local_start_communication");
  logger_stream(level_info, L"gateway_observer::on_local_start_communication") << L"handle=" << pipe;
  if (pipe == nullptr) return;
  post_event(gateway_event::local_start_communication, pipe);
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_local_start_communication");
}

void gateway_observer::on_local_error(parlo::ipc::pipe_handle pipe, std::uint32_t err) try {
  logging::trace_scope trace(L"gateway_observer::on_local_error");
  logger_stream(level_info, L"gateway_observer::on_local_error")
      << L"handle=" << pipe << L" err=" << err;
  if (pipe == nullptr) return;
  post_event(gateway_event::local_error, pipe, 0, err);
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_local_error");
}

bool gateway_observer::on_remote_connect(parlo::ipc::pipe_handle pipe, std::uint32_t pid) try {
  logging::trace_scope trace(L"gateway_observer::on_remote_connect");
  logger_stream(level_info, L"gateway_observer::on_remote_connect")
      << L"pid=" << pid << L" handle=" << pipe;
  post_pair(make_connection_insert(&context_->connections, pipe, get_pipe_name(pipe), pid),
            event_task(gateway_event::remote_connect, pipe, pid));
  return true;
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_remote_connect");
  return false;
}

void gateway_observer::on_remote_disconnect(parlo::ipc::pipe_handle pipe) try {
  logging::trace_scope trace(L"gateway_observer::on_remote_disconnect");
  logger_stream(level_info, L"gateway_observer::on_remote_disconnect") << L"handle=" << pipe;
  if (pipe == nullptr) return;
  post_pair(event_task(gateway_event::remote_disconnect, pipe),
            make_connection_removal(&context_->connections, pipe));
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_remote_disconnect");
}

void gateway_observer::on_remote_start_communication(parlo::ipc::pipe_handle pipe) try {
  logging::trace_scope trace(L"gateway_observer::on_remote_start_communication");
  logger_stream(level_info, L"gateway_observer::on_remote_start_communication") << L"handle=" << pipe;
  if (pipe == nullptr) return;
  post_event(gateway_event::remote_start_communication, pipe);
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_remote_start_communication");
}

void gateway_observer::on_remote_error(parlo::ipc::pipe_handle pipe, std::uint32_t err) try {
  logging::trace_scope trace(L"gateway_observer::on_remote_error");
  logger_stream(level_info, L"gateway_observer::on_remote_error")
      << L"handle=" << pipe << L" err=" << err;
  if (pipe == nullptr) return;
  post_event(gateway_event::remote_error, pipe, 0, err);
} catch (...) {
  logging::log_current_exception(L"gateway_observer::on_remote_error");
}

bool gateway_observer::is_allowed(HANDLE pipe, std::uint32_t pid) {
  if (!signature_checker_.has_signature()) {
    logger_stream(level_info, L"gateway_observer::is_allowed")
        << L"current process signature is invalid => DENY ALL";
    return false;
  }
  const std::optional<std::uint32_t> level = get_pipe_security(pipe_security_, pipe);
  if (!level) {
    logger_stream(level_info, L"gateway_observer::is_allowed")
        << L"DENY pid=" << pid << L" reason: can't find the pipe in config";
    return false;
  }
  if (!is_allowed_process(pid, *level)) {
    logger_stream(level_info, L"gateway_observer::is_allowed")
        << L"DENY pid=" << pid << L" reason: check process security failed";
    return false;
  }
  return true;
}

bool gateway_observer::is_allowed_process(std::uint32_t pid, std::uint32_t level) {
  logging::trace_scope trace(L"gateway_observer::is_allowed_process");
  try {
    process_info info;
    {
      winapi::unique_handle process = winapi::open_process(process_query_and_read, pid);
      info = get_process_info(pid, process.get());
    }
    const trust_level cached = trust_cache_.find(info);
    if (cached != trust_level::unknown) {
      logger_stream(level_info, L"gateway_observer::is_allowed_process")
          << L"found it in cache, trust=" << trust_level_name(cached);
      if (cached == trust_level::untrusted) return false;
      if (level == 1) return cached == trust_level::low_trust || cached == trust_level::high_trust;
      return cached == trust_level::high_trust;
    }
    const trust_level trust = signature_checker_.get_process_trust(info.image_path.wstring());
    cache_process(info, trust);
    switch (trust) {
      case trust_level::untrusted: return false;
      case trust_level::high_trust: return true;
      case trust_level::low_trust: return level != 0;
      default: return false;
    }
  } catch (const std::system_error& e) {
    logger_stream(level_info, L"gateway_observer::is_allowed_process")
        << L"get_process_info failed err=" << e.code().category().name() << L":" << std::hex
        << e.code().value() << L" " << e.what();
    return false;
  } catch (const std::exception& e) {
    logger_stream(level_info, L"gateway_observer::is_allowed_process")
        << L"get_process_info failed err=" << e.what();
    return false;
  }
}

void gateway_observer::cache_process(const process_info& info, trust_level trust) {
  HANDLE process = ::OpenProcess(SYNCHRONIZE, /* inherit */ FALSE, info.pid);
  if (process == nullptr) {
    const DWORD err = ::GetLastError();
    logger_stream(level_warning, L"gateway_observer::cache_process")
        << L"failed open for synchronize err=0x" << err << L" "
        << winapi::make_win_error(err).message();
    return;
  }
  trust_cache_.add(info, winapi::unique_handle(process), trust);
}

void gateway_observer::run_on_worker(const std::function<void(connections_cache&)>& probe) {
  srw_mutex mutex;
  srw_condition_variable done_signal;
  bool done = false;
  context_->pool.post([&] {
    probe(context_->connections);
    std::lock_guard<srw_mutex> lock(mutex);
    done = true;
    done_signal.notify_one();
  });
  std::unique_lock<srw_mutex> lock(mutex);
  done_signal.wait(lock, [&] { return done; });
}
