#include "gateway/gateway_observer.h"

#include <iomanip>
#include <mutex>
#include <system_error>

#include "logging/logger.h"
#include "platform/srw_sync.h"
#include "platform/win_api.h"
#include "security/image_file.h"
#include "security/signature.h"

using logging::level_info;
using logging::level_warning;
using logging::logger_stream;

namespace {

// The peer as the kernel knows it (creation time, image path), and a handle
// the trust cache can wait on until it exits. Nothing is read from the peer's
// own memory.
constexpr DWORD process_query_and_wait = PROCESS_QUERY_LIMITED_INFORMATION | SYNCHRONIZE;  // 0x101000
constexpr std::size_t pipe_prefix_length = 8;  // "\\.\PIPE"

// Images at least this large are verified one at a time, process-wide.
// Hashing a few hundred MiB takes seconds of a core; many at once (a crowd
// of large images connecting together) would leave a genuine peer's small
// image a sliver of the processors for as long as they last. Smaller images
// are verified at once, in parallel with everything. (Lowering the
// verifying thread's priority would do on Windows; Wine ignores thread
// priorities.)
constexpr std::uint64_t large_image_size = std::uint64_t{32} << 20;
srw_mutex& large_image_gate() {
  static srw_mutex gate;
  return gate;
}

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

bool admits(trust_level trust, std::uint32_t level) {
  switch (level) {
    case 0:
      return trust == trust_level::high_trust;
    case 1:
      return trust == trust_level::high_trust || trust == trust_level::low_trust;
    default:
      return false;
  }
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
      pipes_security_descriptor_(make_pipes_security_descriptor()),
      running_image_checked_(running_image_check_supported()) {
  std::error_code ignored;
  adjust_process_priviledges(ignored);
  if (!running_image_checked_) {
    logger_stream(level_warning, L"gateway_observer::gateway_observer")
        << L"this system cannot tell whether a peer's image file is the file it runs: a peer that swaps its "
           L"image file for another is not detected";
  }
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
  if (!is_allowed(pipe, pid, /* remote */ false)) return false;
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
  // The server we joined is judged like a client of ours: a process of
  // another signer may serve the name first, or as one more instance.
  if (!is_allowed(pipe, pid, /* remote */ true)) return false;
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

bool gateway_observer::is_allowed(HANDLE pipe, std::uint32_t pid, bool remote) {
  if (!signature_checker_.has_signature()) {
    if (!remote || !remote_deny_all_said_.exchange(true)) {
      logger_stream(level_info, L"gateway_observer::is_allowed")
          << L"current process signature is invalid => DENY ALL";
    }
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
    // One handle for everything: while it is open the pid cannot name
    // another process.
    winapi::unique_handle process = winapi::open_process(process_query_and_wait, pid);
    const process_info info = get_process_info(pid, process.get());
    const trust_level cached = trust_cache_.find(info);
    if (cached != trust_level::unknown) {
      logger_stream(level_info, L"gateway_observer::is_allowed_process")
          << L"found it in cache, trust=" << trust_level_name(cached);
      return admits(cached, level);
    }
    std::optional<image_identity> image;
    const std::optional<trust_level> trust = classify(info, process.get(), image);
    if (!trust) return false;
    cache_process(info, std::move(process), *trust, image);
    return admits(*trust, level);
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

std::optional<trust_level> gateway_observer::classify(const process_info& info, HANDLE process,
                                                      std::optional<image_identity>& image) {
  const wchar_t* const function = L"gateway_observer::is_allowed_process";
  const std::wstring path = info.image_path.wstring();
  // Every check below looks at this one file: while it is open nobody can
  // write, rename or delete it.
  std::error_code code;
  const winapi::unique_handle file = open_image(path, code);
  if (!file) {
    logger_stream(level_info, function) << L"cannot open image " << std::quoted(path) << L" err=" << code.value();
    return std::nullopt;
  }
  if (running_image_checked_) {
    // A query right of its own: the kernel answers only with it. The pid
    // still names our process: `process` is open.
    winapi::unique_handle query(::OpenProcess(PROCESS_QUERY_INFORMATION, /* inherit */ FALSE, info.pid));
    const DWORD open_err = ::GetLastError();
    const running_image match = query ? check_running_image(query.get(), file.get(), code)
                                      : running_image::failed;
    if (!query) code = winapi::make_win_error(open_err);
    if (match == running_image::failed) {
      logger_stream(level_info, function)
          << L"cannot tell whether pid=" << info.pid << L" runs " << std::quoted(path) << L" err=" << code.value();
      return std::nullopt;
    }
    if (match == running_image::different) {
      logger_stream(level_warning, function)
          << L"pid=" << info.pid << L" does not run " << std::quoted(path) << L", the file now at its image's path";
      return trust_level::untrusted;
    }
  }
  if (protected_image_paths_) {
    std::wstring where;
    if (!is_protected_image_path(process, path, where, code)) {
      if (code) {
        logger_stream(level_info, function)
            << L"cannot tell whether the image path of pid=" << info.pid << L" is protected err=" << code.value();
        return std::nullopt;
      }
      logger_stream(level_warning, function)
          << L"the user of pid=" << info.pid << L" may change the image path: " << where;
      return trust_level::untrusted;
    }
  }
  image_identity identity;
  if (!read_image_identity(file.get(), identity, code)) return signature_checker_.get_image_trust(file.get(), path);
  image = identity;
  trust_level known = trust_cache_.find_image(identity);
  std::unique_lock<srw_mutex> gate(large_image_gate(), std::defer_lock);
  if (known == trust_level::unknown && identity.size >= large_image_size) {
    gate.lock();
    // Another process of the same file may have been verified meanwhile.
    known = trust_cache_.find_image(identity);
  }
  if (known != trust_level::unknown) {
    logger_stream(level_info, function) << L"image verified before, trust=" << trust_level_name(known);
    return known;
  }
  return signature_checker_.get_image_trust(file.get(), path);
}

void gateway_observer::cache_process(const process_info& info, winapi::unique_handle process, trust_level trust,
                                     const std::optional<image_identity>& image) {
  trust_cache_.add(info, std::move(process), trust, image);
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
