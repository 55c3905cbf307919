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

// An exception's text for a person, as one line (system messages end in a
// line break).
std::wstring exception_text(const std::exception& e) {
  const std::string what = e.what();
  std::wstring text(what.begin(), what.end());
  while (!text.empty() && (text.back() == L'\r' || text.back() == L'\n' || text.back() == L' ')) text.pop_back();
  return text;
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

std::optional<std::uint32_t> get_pipe_security(const pipe_security_map& map, HANDLE pipe, std::string* name_out) {
  std::error_code code;
  const std::wstring name = winapi::query_file_name(pipe, code);
  if (name.empty()) {
    logger_stream(level_info, L"get_pipe_security") << L"failed get pipe name for handle=" << pipe;
    return std::nullopt;
  }
  logger_stream(level_info, L"get_pipe_security") << L"pipe=" << pipe << L" " << name;
  const std::string utf8 = winapi::utf16_to_utf8(name, code);
  if (code) return std::nullopt;
  if (name_out != nullptr) *name_out = utf8;
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

void gateway_observer::post_decision(const admission_facts& facts, HANDLE pipe, gateway_event connected) {
  // Built before anything is posted; the admission observers hear of the
  // decision before the connection's own tasks.
  std::function<void()> told = make_admission_notification(context_->observers, facts);
  if (!facts.allowed) {
    context_->pool.post(std::move(told));
    return;
  }
  // The name was read while deciding: the handle is the library's, closed
  // soon after the disconnect.
  post_pair(
      [told = std::move(told), insert = make_connection_insert(&context_->connections, pipe, facts.pipe, facts.pid)] {
        told();
        insert();
      },
      event_task(connected, pipe, facts.pid));
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
  admission_facts facts;
  facts.side = gateway_admission_side::local;
  const bool allowed = is_allowed(pipe, pid, facts);
  if (allowed) apply_security(pipe);
  post_decision(facts, pipe, gateway_event::local_connect);
  return allowed;
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
  admission_facts facts;
  facts.side = gateway_admission_side::remote;
  const bool allowed = is_allowed(pipe, pid, facts);
  post_decision(facts, pipe, gateway_event::remote_connect);
  return allowed;
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

bool gateway_observer::is_allowed(HANDLE pipe, std::uint32_t pid, admission_facts& facts) {
  const bool remote = facts.side == gateway_admission_side::remote;
  facts.pid = pid;
  facts.own_signer = signature_checker_.signer_name();
  if (!signature_checker_.has_signature()) {
    if (!remote || !remote_deny_all_said_.exchange(true)) {
      logger_stream(level_info, L"gateway_observer::is_allowed")
          << L"current process signature is invalid => DENY ALL";
    }
    facts.pipe = get_pipe_name(pipe);
    facts.reason = gateway_admission_reason::no_own_signer;
    write_admission_line(facts);
    return false;
  }
  const std::optional<std::uint32_t> level = get_pipe_security(pipe_security_, pipe, &facts.pipe);
  if (!level) {
    logger_stream(level_info, L"gateway_observer::is_allowed")
        << L"DENY pid=" << pid << L" reason: can't find the pipe in config";
    facts.reason = gateway_admission_reason::pipe_not_configured;
    write_admission_line(facts);
    return false;
  }
  const bool allowed = judge_process(pid, *level, trust_cache_use::read_and_add, facts);
  if (!allowed) {
    logger_stream(level_info, L"gateway_observer::is_allowed")
        << L"DENY pid=" << pid << L" reason: check process security failed";
  }
  write_admission_line(facts);
  return allowed;
}

bool gateway_observer::is_allowed_process(std::uint32_t pid, std::uint32_t level) {
  admission_facts facts;
  return judge_process(pid, level, trust_cache_use::read_and_add, facts);
}

admission_facts gateway_observer::explain_process(std::uint32_t pid, std::uint32_t level) {
  admission_facts facts;
  facts.side = gateway_admission_side::explanation;
  facts.pid = pid;
  facts.level = level;
  facts.own_signer = signature_checker_.signer_name();
  if (signature_checker_.has_signature()) {
    judge_process(pid, level, trust_cache_use::none, facts);
  } else {
    facts.reason = gateway_admission_reason::no_own_signer;
  }
  write_admission_line(facts);
  return facts;
}

admission_facts gateway_observer::explain_image(const std::wstring& path, std::uint32_t level) {
  admission_facts facts;
  facts.side = gateway_admission_side::explanation;
  facts.level = level;
  facts.image = path;
  facts.own_signer = signature_checker_.signer_name();
  if (!signature_checker_.has_signature()) {
    facts.reason = gateway_admission_reason::no_own_signer;
    write_admission_line(facts);
    return facts;
  }
  std::error_code code;
  const winapi::unique_handle file = open_image(path, code);
  if (!file) {
    logger_stream(level_info, L"gateway_observer::is_allowed_process")
        << L"cannot open image " << std::quoted(path) << L" err=" << code.value();
    facts.reason = gateway_admission_reason::image_not_judged;
    facts.detail = L"cannot open it, err=" + std::to_wstring(code.value());
  } else {
    std::optional<image_identity> image;
    trust_evidence evidence;
    gateway_admission_source source = gateway_admission_source::judged;
    const trust_level trust = judge_image(file.get(), path, trust_cache_use::none, image, evidence, source);
    facts.judged(trust, evidence, source, admits(trust, level));
  }
  write_admission_line(facts);
  return facts;
}

bool gateway_observer::judge_process(std::uint32_t pid, std::uint32_t level, trust_cache_use cache,
                                     admission_facts& facts) {
  logging::trace_scope trace(L"gateway_observer::is_allowed_process");
  facts.pid = pid;
  facts.level = level;
  facts.allowed = false;
  try {
    // One handle for everything: while it is open the pid cannot name
    // another process.
    winapi::unique_handle process = winapi::open_process(process_query_and_wait, pid);
    const process_info info = get_process_info(pid, process.get());
    facts.image = info.image_path.wstring();
    trust_evidence evidence;
    if (cache == trust_cache_use::read_and_add) {
      const trust_level cached = trust_cache_.find(info, &evidence);
      if (cached != trust_level::unknown) {
        logger_stream(level_info, L"gateway_observer::is_allowed_process")
            << L"found it in cache, trust=" << trust_level_name(cached);
        facts.judged(cached, evidence, gateway_admission_source::cached_process, admits(cached, level));
        return facts.allowed;
      }
    }
    std::optional<image_identity> image;
    gateway_admission_source source = gateway_admission_source::judged;
    const std::optional<trust_level> trust = classify(info, process.get(), cache, image, evidence, source, facts);
    if (!trust) return false;
    if (cache == trust_cache_use::read_and_add) cache_process(info, std::move(process), *trust, image, evidence);
    facts.judged(*trust, evidence, source, admits(*trust, level));
    return facts.allowed;
  } catch (const std::system_error& e) {
    logger_stream(level_info, L"gateway_observer::is_allowed_process")
        << L"get_process_info failed err=" << e.code().category().name() << L":" << std::hex
        << e.code().value() << L" " << e.what();
    facts.allowed = false;
    facts.reason = gateway_admission_reason::process_not_inspected;
    facts.detail = exception_text(e);
    return false;
  } catch (const std::exception& e) {
    logger_stream(level_info, L"gateway_observer::is_allowed_process")
        << L"get_process_info failed err=" << e.what();
    facts.allowed = false;
    facts.reason = gateway_admission_reason::process_not_inspected;
    facts.detail = exception_text(e);
    return false;
  }
}

std::optional<trust_level> gateway_observer::classify(const process_info& info, HANDLE process, trust_cache_use cache,
                                                      std::optional<image_identity>& image, trust_evidence& evidence,
                                                      gateway_admission_source& source, admission_facts& facts) {
  const wchar_t* const function = L"gateway_observer::is_allowed_process";
  const std::wstring path = info.image_path.wstring();
  // Every check below looks at this one file: while it is open nobody can
  // write, rename or delete it.
  std::error_code code;
  const winapi::unique_handle file = open_image(path, code);
  if (!file) {
    logger_stream(level_info, function) << L"cannot open image " << std::quoted(path) << L" err=" << code.value();
    facts.reason = gateway_admission_reason::image_not_judged;
    facts.detail = L"cannot open it, err=" + std::to_wstring(code.value());
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
      facts.reason = gateway_admission_reason::image_not_judged;
      facts.detail = L"cannot tell whether the process runs it, err=" + std::to_wstring(code.value());
      return std::nullopt;
    }
    if (match == running_image::different) {
      logger_stream(level_warning, function)
          << L"pid=" << info.pid << L" does not run " << std::quoted(path) << L", the file now at its image's path";
      evidence.untrusted_by = trust_evidence::finding::other_file;
      return trust_level::untrusted;
    }
  }
  if (protected_image_paths_) {
    std::wstring where;
    if (!is_protected_image_path(process, path, where, code)) {
      if (code) {
        logger_stream(level_info, function)
            << L"cannot tell whether the image path of pid=" << info.pid << L" is protected err=" << code.value();
        facts.reason = gateway_admission_reason::image_not_judged;
        facts.detail = L"cannot tell whether its path is protected, err=" + std::to_wstring(code.value());
        return std::nullopt;
      }
      logger_stream(level_warning, function)
          << L"the user of pid=" << info.pid << L" may change the image path: " << where;
      evidence.untrusted_by = trust_evidence::finding::unprotected_path;
      facts.detail = where;
      return trust_level::untrusted;
    }
  }
  return judge_image(file.get(), path, cache, image, evidence, source);
}

trust_level gateway_observer::judge_image(HANDLE file, const std::wstring& path, trust_cache_use cache,
                                          std::optional<image_identity>& image, trust_evidence& evidence,
                                          gateway_admission_source& source) {
  const wchar_t* const function = L"gateway_observer::is_allowed_process";
  std::error_code code;
  image_identity identity;
  if (!read_image_identity(file, identity, code)) return signature_checker_.get_image_trust(file, path, &evidence);
  image = identity;
  const bool use_cache = cache == trust_cache_use::read_and_add;
  trust_level known = use_cache ? trust_cache_.find_image(identity, &evidence) : trust_level::unknown;
  std::unique_lock<srw_mutex> gate(large_image_gate(), std::defer_lock);
  if (known == trust_level::unknown && identity.size >= large_image_size) {
    gate.lock();
    // Another process of the same file may have been verified meanwhile.
    if (use_cache) known = trust_cache_.find_image(identity, &evidence);
  }
  if (known != trust_level::unknown) {
    logger_stream(level_info, function) << L"image verified before, trust=" << trust_level_name(known);
    source = gateway_admission_source::cached_image;
    return known;
  }
  return signature_checker_.get_image_trust(file, path, &evidence);
}

void gateway_observer::cache_process(const process_info& info, winapi::unique_handle process, trust_level trust,
                                     const std::optional<image_identity>& image, const trust_evidence& evidence) {
  trust_cache_.add(info, std::move(process), trust, image, evidence);
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
