// Trust classification of peer processes by their image's signature, and
// the cache that remembers each process's trust while it runs.
#pragma once

#include <windows.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/handles.h"
#include "platform/srw_sync.h"
#include "security/image_file.h"
#include "security/signature.h"

enum class trust_level : std::uint32_t { low_trust = 0, high_trust = 1, untrusted = 2, unknown = 3 };

// "low_trust", "high_trust", "untrusted", "unknown"; empty for other values.
const wchar_t* trust_level_name(trust_level level);

// The identity of a running process, and the key of the trust cache. Keys
// order by creation time (high, then low 32 bits), pid, then image path, so
// that older processes come first and a reused pid is a different key.
struct process_info {
  FILETIME creation_time;
  std::uint32_t pid;
  std::filesystem::path image_path;
};

bool operator<(const process_info& left, const process_info& right);

// Creation time and image path of `process` (opened with
// PROCESS_QUERY_LIMITED_INFORMATION), both as the kernel records them: the
// path is not read from the process's own memory, which the process may
// rewrite. Throws std::system_error ("GetProcessTimes failed",
// "QueryFullProcessImageName failed") with the Win32 code.
process_info get_process_info(std::uint32_t pid, HANDLE process);

// What a classification rests on, kept beside its verdict so that a
// decision answered from the cache can still say why.
struct trust_evidence {
  static constexpr std::uint32_t not_verified = 0xFFFFFFFF;
  // What the image's verification returned (0: it verifies), or
  // not_verified when the verdict came before any verification.
  std::uint32_t verification = not_verified;
  // The signer name that verification found; empty when none.
  std::wstring signer;
  // Why an untrusted verdict is untrusted.
  enum class finding : std::uint32_t {
    signature,           // the signature (verification says how)
    other_file,          // the process does not run the file at its image's path
    unprotected_path,    // the process's user may change its image's path
  } untrusted_by = finding::signature;
};

// Classifies image files against the current process's own signer.
// Immutable after construction; any thread may call it at once.
class signature_checker {
 public:
  // `current` is the current process's signature. One whose signer name is
  // empty is not kept: an empty name could only ever "match" a peer whose
  // signer could not be read either.
  explicit signature_checker(std::optional<signature> current);

  bool has_signature() const { return current_.has_value(); }
  // The current process's signer name; empty without a signature.
  std::wstring signer_name() const { return current_ ? current_->subject : std::wstring(); }
  // True when the file's signature verifies.
  bool check_low_security(const std::wstring& path);
  // untrusted, low_trust or high_trust (same signer name, ASCII case
  // ignored); never unknown. Opens the file once (open_image) and classifies
  // it through that handle; a file that cannot be opened is untrusted.
  trust_level get_process_trust(const std::wstring& path);
  // The same for a file already open as `file` (`path` names it in lines):
  // one verification, whose own signer is compared. With `evidence`, what
  // the verification returned and the signer it found.
  trust_level get_image_trust(HANDLE file, const std::wstring& path, trust_evidence* evidence = nullptr);

 private:
  std::optional<signature> current_;
};

// Remembers the trust of each classified process until the process exits.
//
// Owns one SYNCHRONIZE handle per entry. find and add run on any thread (the
// IPC library's event threads); a monitoring thread of its own waits on every
// held handle together with a stop and a wake event, and drops the entry of
// a process that exits. The mutex guards the maps and the handles waiting to
// be closed; it is never held during the wait. At most 62 handles are held
// (62 + the two events = one wait's limit); past that, an insertion first
// cuts each map to its 16 most recently created processes.
//
// Handles that a trim evicts may be part of the wait in progress, so they
// are not closed on the inserting thread: the monitoring thread closes them
// once it has rebuilt its wait list without them.
//
// Beside the processes, the verdict about each image file (by its identity)
// that a cached process runs: other processes of the same file are then
// classified without verifying it again. A file verdict lives exactly as
// long as a cached process runs that file. While a process runs its image,
// Windows lets nobody write the file, so the verdict cannot go stale; once
// the last such process is gone, the file may change in place and the
// verdict goes with it.
class processes_trust_cache {
 public:
  static constexpr std::size_t max_handles = MAXIMUM_WAIT_OBJECTS - 2;
  static constexpr std::size_t trimmed_map_size = 16;

  processes_trust_cache();
  processes_trust_cache(const processes_trust_cache&) = delete;
  processes_trust_cache& operator=(const processes_trust_cache&) = delete;
  ~processes_trust_cache();

  // high_trust, low_trust or untrusted when cached; unknown otherwise. With
  // `evidence`, what the verdict rests on, when cached.
  trust_level find(const process_info& info, trust_evidence* evidence = nullptr);
  // Stores `process` (SYNCHRONIZE access; the cache takes it) under `info`
  // in the map of `trust`, with the `evidence` for it. An equal key already
  // cached keeps its entry and the new handle is closed; unknown or other
  // values store nothing. With `image`, `trust` is also the verdict about
  // that file while the process is cached.
  void add(const process_info& info, winapi::unique_handle process, trust_level trust,
           const std::optional<image_identity>& image = std::nullopt, const trust_evidence& evidence = {});
  // The verdict about an image file that a cached process runs; unknown
  // when none does. With `evidence`, as for find.
  trust_level find_image(const image_identity& image, trust_evidence* evidence = nullptr);

  // Read-only views, for diagnostics and tests.
  std::size_t size() const;
  std::size_t image_count() const;
  std::size_t count(trust_level trust) const;
  // Evicted handles not yet closed by the monitoring thread.
  std::size_t pending_close_count() const;
  // False once the monitoring thread has ended.
  bool monitoring() const;
  // How many wait lists the monitoring thread has built so far.
  std::uint64_t wait_rounds() const;

 private:
  struct entry {
    winapi::unique_handle process;
    std::optional<image_identity> image;
    trust_evidence evidence;
  };
  using map_type = std::map<process_info, entry>;
  struct image_entry {
    trust_level trust;
    std::size_t processes;  // cached processes that run the file
    trust_evidence evidence;
  };

  void monitor();
  void trim_locked();
  map_type* map_for_locked(trust_level trust);
  // Forgets a process entry that is leaving its map: its file verdict loses
  // one process.
  void release_image_locked(const entry& leaving);

  map_type high_;
  map_type low_;
  map_type untrusted_;
  std::map<image_identity, image_entry> images_;
  mutable srw_mutex mutex_;
  std::thread thread_;
  winapi::unique_handle stop_event_;
  winapi::unique_handle wake_event_;
  std::vector<winapi::unique_handle> evicted_;  // closed by the monitoring thread
  bool monitoring_ = true;
  std::uint64_t wait_rounds_ = 0;
};
