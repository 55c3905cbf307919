#include "security/process_trust.h"

#include <iomanip>
#include <utility>

#include "logging/logger.h"
#include "platform/win_error.h"

const wchar_t* trust_level_name(trust_level level) {
  switch (level) {
    case trust_level::low_trust:
      return L"low_trust";
    case trust_level::high_trust:
      return L"high_trust";
    case trust_level::untrusted:
      return L"untrusted";
    case trust_level::unknown:
      return L"unknown";
  }
  return L"";
}

bool operator<(const process_info& left, const process_info& right) {
  if (left.creation_time.dwHighDateTime != right.creation_time.dwHighDateTime) {
    return left.creation_time.dwHighDateTime < right.creation_time.dwHighDateTime;
  }
  if (left.creation_time.dwLowDateTime != right.creation_time.dwLowDateTime) {
    return left.creation_time.dwLowDateTime < right.creation_time.dwLowDateTime;
  }
  if (left.pid != right.pid) return left.pid < right.pid;
  return left.image_path.compare(right.image_path) < 0;
}

process_info get_process_info(std::uint32_t pid, HANDLE process) {
  FILETIME creation{};
  FILETIME exit{};
  FILETIME kernel{};
  FILETIME user{};
  if (!::GetProcessTimes(process, &creation, &exit, &kernel, &user)) {
    winapi::throw_last_error("GetProcessTimes failed");
  }
  constexpr DWORD path_capacity = 32767;
  std::wstring path(path_capacity, L'\0');
  DWORD length = path_capacity;
  // Flags 0: the Win32 form of the path ("C:\..."), which the file calls take.
  if (!::QueryFullProcessImageNameW(process, /* flags */ 0, path.data(), &length)) {
    winapi::throw_last_error("QueryFullProcessImageName failed");
  }
  path.resize(length);
  return process_info{creation, pid, std::filesystem::path(std::move(path))};
}

// ---------------------------------------------------------------------------
// signature_checker
// ---------------------------------------------------------------------------

namespace {

wchar_t ascii_lower(wchar_t c) { return (c >= L'A' && c <= L'Z') ? static_cast<wchar_t>(c - L'A' + L'a') : c; }

bool equal_ignoring_ascii_case(const std::wstring& left, const std::wstring& right) {
  if (left.size() != right.size()) return false;
  for (std::size_t i = 0; i < left.size(); ++i) {
    if (ascii_lower(left[i]) != ascii_lower(right[i])) return false;
  }
  return true;
}

}  // namespace

signature_checker::signature_checker(std::optional<signature> current) {
  if (current && !current->subject.empty()) current_ = std::move(current);
}

bool signature_checker::check_low_security(const std::wstring& path) {
  std::error_code code;
  const bool trusted = is_trusted(path, code);
  if (!code && trusted) return true;
  if (!code) {
    logging::logger_stream(logging::level_info, L"signature_checker::check_low_security")
        << L"not trusted " << std::quoted(path);
  } else {
    logging::logger_stream(logging::level_info, L"signature_checker::check_low_security")
        << L"failed is_trusted for " << std::quoted(path) << L" err=" << code.value();
  }
  return false;
}

trust_level signature_checker::get_process_trust(const std::wstring& path) {
  std::error_code code;
  const winapi::unique_handle file = open_image(path, code);
  if (!file) {
    logging::logger_stream(logging::level_info, L"signature_checker::check_low_security")
        << L"failed is_trusted for " << std::quoted(path) << L" err=" << code.value();
    return trust_level::untrusted;
  }
  return get_image_trust(file.get(), path);
}

trust_level signature_checker::get_image_trust(HANDLE file, const std::wstring& path, trust_evidence* evidence) {
  const image_verdict verdict = verify_image(file, path);
  if (evidence != nullptr) {
    *evidence = trust_evidence{};
    evidence->verification = verdict.result;
    if (verdict.signer) evidence->signer = verdict.signer->subject;
  }
  // The lines of check_low_security, as for a verification by path.
  if (!verdict.trusted) {
    if (!verdict.code) {
      logging::logger_stream(logging::level_info, L"signature_checker::check_low_security")
          << L"not trusted " << std::quoted(path);
    } else {
      logging::logger_stream(logging::level_info, L"signature_checker::check_low_security")
          << L"failed is_trusted for " << std::quoted(path) << L" err=" << verdict.code.value();
    }
    return trust_level::untrusted;
  }
  const std::optional<signature>& peer = verdict.signer;
  if (verdict.signer_code) {
    logging::logger_stream(logging::level_warning, L"signature_checker::get_process_trust")
        << L"get_signature err=" << verdict.signer_code.value();
    return trust_level::low_trust;
  }
  if (!peer) {
    logging::logger_stream(logging::level_info, L"signature_checker::get_process_trust")
        << L"get_signature returns no signature";
    return trust_level::low_trust;
  }
  // Without a signer of our own, or without a readable signer of the peer's,
  // there is nobody to be the same signer as.
  if (!current_ || peer->subject.empty()) return trust_level::low_trust;
  return equal_ignoring_ascii_case(peer->subject, current_->subject) ? trust_level::high_trust
                                                                      : trust_level::low_trust;
}

// ---------------------------------------------------------------------------
// processes_trust_cache
// ---------------------------------------------------------------------------

processes_trust_cache::processes_trust_cache() {
  stop_event_.reset(::CreateEventW(/* attributes */ nullptr, /* manual_reset */ TRUE,
                                   /* initial_state */ FALSE, /* name */ nullptr));
  wake_event_.reset(::CreateEventW(/* attributes */ nullptr, /* manual_reset */ FALSE,
                                   /* initial_state */ FALSE, /* name */ nullptr));
  thread_ = std::thread(&processes_trust_cache::monitor, this);
}

processes_trust_cache::~processes_trust_cache() {
  ::SetEvent(stop_event_.get());
  if (thread_.joinable()) thread_.join();
  wake_event_.reset();
  stop_event_.reset();
  // Members then close what is left: evicted handles, then the untrusted,
  // low and high maps.
}

trust_level processes_trust_cache::find_image(const image_identity& image, trust_evidence* evidence) {
  std::lock_guard<srw_mutex> lock(mutex_);
  const auto found = images_.find(image);
  if (found == images_.end()) return trust_level::unknown;
  if (evidence != nullptr) *evidence = found->second.evidence;
  return found->second.trust;
}

void processes_trust_cache::release_image_locked(const entry& leaving) {
  if (!leaving.image) return;
  const auto found = images_.find(*leaving.image);
  if (found != images_.end() && --found->second.processes == 0) images_.erase(found);
}

trust_level processes_trust_cache::find(const process_info& info, trust_evidence* evidence) {
  std::lock_guard<srw_mutex> lock(mutex_);
  for (const trust_level trust : {trust_level::high_trust, trust_level::low_trust, trust_level::untrusted}) {
    const map_type& map = *map_for_locked(trust);
    const auto found = map.find(info);
    if (found == map.end()) continue;
    if (evidence != nullptr) *evidence = found->second.evidence;
    return trust;
  }
  return trust_level::unknown;
}

processes_trust_cache::map_type* processes_trust_cache::map_for_locked(trust_level trust) {
  switch (trust) {
    case trust_level::high_trust:
      return &high_;
    case trust_level::low_trust:
      return &low_;
    case trust_level::untrusted:
      return &untrusted_;
    default:
      return nullptr;
  }
}

void processes_trust_cache::add(const process_info& info, winapi::unique_handle process, trust_level trust,
                                const std::optional<image_identity>& image, const trust_evidence& evidence) {
  if (!process) {
    // A null handle in the wait list would make every wait fail and end
    // exit monitoring for all cached processes.
    logging::logger_stream(logging::level_error, L"processes_trust_cache::add")
        << L"null process handle for pid=" << info.pid;
    return;
  }
  std::lock_guard<srw_mutex> lock(mutex_);
  map_type* map = map_for_locked(trust);
  if (map == nullptr) return;  // `process` closes as it leaves
  trim_locked();
  // An equal key keeps its entry; ours closes.
  const bool inserted = map->emplace(info, entry{std::move(process), image, evidence}).second;
  if (inserted && image) {
    // A later verdict about the file (it was verified again meanwhile) is
    // the same as the earlier: the file cannot change while they run.
    auto& verdict = images_.emplace(*image, image_entry{trust, 0, evidence}).first->second;
    ++verdict.processes;
  }
  ::SetEvent(wake_event_.get());
}

void processes_trust_cache::trim_locked() {
  if (high_.size() + low_.size() + untrusted_.size() < max_handles) return;
  for (map_type* map : {&high_, &low_, &untrusted_}) {
    while (map->size() > trimmed_map_size) {
      auto oldest = map->begin();
      release_image_locked(oldest->second);
      if (monitoring_) {
        // The wait in progress may include it: the monitoring thread closes
        // it after its next rebuild, which the wake after this insertion
        // brings about.
        evicted_.push_back(std::move(oldest->second.process));
      }
      map->erase(oldest);
    }
  }
}

std::size_t processes_trust_cache::size() const {
  std::lock_guard<srw_mutex> lock(mutex_);
  return high_.size() + low_.size() + untrusted_.size();
}

std::size_t processes_trust_cache::image_count() const {
  std::lock_guard<srw_mutex> lock(mutex_);
  return images_.size();
}

std::size_t processes_trust_cache::count(trust_level trust) const {
  std::lock_guard<srw_mutex> lock(mutex_);
  switch (trust) {
    case trust_level::high_trust:
      return high_.size();
    case trust_level::low_trust:
      return low_.size();
    case trust_level::untrusted:
      return untrusted_.size();
    default:
      return 0;
  }
}

std::size_t processes_trust_cache::pending_close_count() const {
  std::lock_guard<srw_mutex> lock(mutex_);
  return evicted_.size();
}

bool processes_trust_cache::monitoring() const {
  std::lock_guard<srw_mutex> lock(mutex_);
  return monitoring_;
}

std::uint64_t processes_trust_cache::wait_rounds() const {
  std::lock_guard<srw_mutex> lock(mutex_);
  return wait_rounds_;
}

void processes_trust_cache::monitor() {
  std::vector<HANDLE> handles;
  handles.reserve(MAXIMUM_WAIT_OBJECTS);
  std::vector<winapi::unique_handle> to_close;
  for (;;) {
    std::size_t low_begin = 0;
    std::size_t untrusted_begin = 0;
    {
      std::lock_guard<srw_mutex> lock(mutex_);
      handles.clear();
      handles.push_back(stop_event_.get());
      handles.push_back(wake_event_.get());
      for (const auto& cached : high_) handles.push_back(cached.second.process.get());
      low_begin = handles.size();
      for (const auto& cached : low_) handles.push_back(cached.second.process.get());
      untrusted_begin = handles.size();
      for (const auto& cached : untrusted_) handles.push_back(cached.second.process.get());
      // Evicted handles are in no list from now on.
      to_close.swap(evicted_);
      ++wait_rounds_;
    }
    to_close.clear();

    const DWORD result = ::WaitForMultipleObjects(static_cast<DWORD>(handles.size()), handles.data(),
                                                  /* wait_all */ FALSE, INFINITE);
    if (result == WAIT_FAILED) {
      const DWORD error = ::GetLastError();
      logging::logger_stream(logging::level_error, L"processes_trust_cache::monitor")
          << L"WaitForMultipleObjects err=" << error;
      break;
    }
    if (result == WAIT_OBJECT_0) break;  // stop
    if (result == WAIT_OBJECT_0 + 1 || result == WAIT_TIMEOUT || result >= WAIT_ABANDONED_0) continue;

    const std::size_t index = result - WAIT_OBJECT_0;
    if (index >= handles.size()) continue;
    const HANDLE exited = handles[index];
    std::lock_guard<srw_mutex> lock(mutex_);
    map_type& map = index < low_begin ? high_ : (index < untrusted_begin ? low_ : untrusted_);
    for (auto it = map.begin(); it != map.end(); ++it) {
      if (it->second.process.get() == exited) {
        release_image_locked(it->second);
        map.erase(it);
        break;
      }
    }
  }

  // From here on nobody waits: evictions close at once.
  std::lock_guard<srw_mutex> lock(mutex_);
  monitoring_ = false;
  evicted_.clear();
}
