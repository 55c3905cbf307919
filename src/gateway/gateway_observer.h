// The event sink the gateway hands to the IPC library.
//
// Owned by the gateway, which creates it before the IPC library's gateway
// and destroys it after that (so no library thread can call a destroyed
// sink). The library calls the nine event operations from its own threads,
// possibly several at once, and several admissions run at once. Admission
// reads the signature checker, the pipe security map and the image-path
// policy without a lock (all are fixed before the library starts) and uses
// the trust cache's own mutex. Both sides admit: a client connecting to one
// of our pipes (on_local_connect), and a server we connect to
// (on_remote_connect), each at the level configured for the pipe. Every
// decision's facts are captured as values where it is taken and go to the
// gateway's admission observers as a task; explanations (any host thread)
// run the same judgement without the trust cache. Everything that touches
// the connections cache or the gateway's observers runs as a task on the
// notify context's single worker: the event operations only post, so the
// library's threads never wait for observers.
#pragma once

#include <windows.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "gateway/admission.h"
#include "gateway/connections_cache.h"
#include "gateway/notify_tasks.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "platform/task_pool.h"
#include "security/pipe_security.h"
#include "security/process_trust.h"

// Pipe name (a backslash and the pipe's own name, UTF-8) → pipe security
// level: 0 admits high_trust peers only, 1 also low_trust peers.
using pipe_security_map = std::map<std::string, std::uint32_t>;

// The highest pipe security level; the gateway refuses others.
inline constexpr std::uint32_t max_pipe_security_level = 1;

// The one decision rule, for a first classification and a cached one alike:
// level 0 admits high_trust, level 1 high_trust and low_trust; untrusted,
// unknown and any other level admit nobody.
bool admits(trust_level trust, std::uint32_t level);

// The level of the pipe behind `pipe`, read by its name; absent when the name
// cannot be read or the pipe is not in `map`. With `name`, the name as read
// (UTF-8; empty when it cannot be read).
std::optional<std::uint32_t> get_pipe_security(const pipe_security_map& map, HANDLE pipe,
                                               std::string* name = nullptr);

// The observer's map from the gateway's pipe table: a name that starts with
// the "\\.\pipe" prefix (in any letter case) is keyed without it, which is
// how the name reads back from the pipe's handle. The first name in table
// order wins a key.
pipe_security_map make_pipe_security_map(const std::map<std::string, std::uint32_t>& pipes);

class gateway_observer final : public parlo::ipc::gateway::events {
 public:
  // `observers` is the gateway's observer list; the gateway owns it and
  // outlives this object.
  explicit gateway_observer(gateway_observer_list* observers);
  gateway_observer(const gateway_observer&) = delete;
  gateway_observer& operator=(const gateway_observer&) = delete;
  ~gateway_observer();

  void on_listen(parlo::ipc::pipe_handle pipe, const char* name) override;
  bool on_local_connect(parlo::ipc::pipe_handle pipe, std::uint32_t pid) override;
  void on_local_disconnect(parlo::ipc::pipe_handle pipe) override;
  void on_local_start_communication(parlo::ipc::pipe_handle pipe) override;
  void on_local_error(parlo::ipc::pipe_handle pipe, std::uint32_t err) override;
  bool on_remote_connect(parlo::ipc::pipe_handle pipe, std::uint32_t pid) override;
  void on_remote_disconnect(parlo::ipc::pipe_handle pipe) override;
  void on_remote_start_communication(parlo::ipc::pipe_handle pipe) override;
  void on_remote_error(parlo::ipc::pipe_handle pipe, std::uint32_t err) override;

  // The trust part of admission: may process `pid` connect to a pipe of
  // security `level`?
  bool is_allowed_process(std::uint32_t pid, std::uint32_t level);
  // Remembers a freshly classified process until it exits; `process` is the
  // handle it was classified through (SYNCHRONIZE access), `image` the
  // identity of the file whose verdict `trust` is, `evidence` what it rests
  // on.
  void cache_process(const process_info& info, winapi::unique_handle process, trust_level trust,
                     const std::optional<image_identity>& image, const trust_evidence& evidence = {});

  // How a connection of process `pid`, or of a process running the image at
  // `path`, to a pipe of security `level` (0 or 1) would be decided: the
  // admission's own judgement, on the calling thread, without the trust
  // cache (nothing read from it, nothing added). Writes the decision's line
  // (side explain); posts nothing.
  admission_facts explain_process(std::uint32_t pid, std::uint32_t level);
  admission_facts explain_image(const std::wstring& path, std::uint32_t level);

  // Called by the gateway's start, before the IPC library starts.
  void set_pipe_security_map(pipe_security_map map) { pipe_security_ = std::move(map); }
  // Admit only peers whose image path their user cannot change (see
  // is_protected_image_path). Off unless the configuration asks for it;
  // set before the IPC library starts.
  void set_protected_image_paths(bool on) { protected_image_paths_ = on; }

  // Processes whose trust is cached (until they exit or are trimmed).
  std::size_t trusted_process_count() const { return trust_cache_.size(); }

  // For tests and diagnostics: runs `probe` on the worker after every task
  // posted so far, and waits for it.
  void run_on_worker(const std::function<void(connections_cache&)>& probe);

 private:
  struct notify_context {
    explicit notify_context(gateway_observer_list* list) : observers(list) {}
    gateway_observer_list* observers;
    connections_cache connections;
    // Last member: shut down first, before the cache its tasks point to.
    task_pool<0> pool;
  };

  // Whether the admission reads the trust cache and adds to it (admission)
  // or neither (explanation).
  enum class trust_cache_use { read_and_add, none };

  // The whole admission of a connection on `pipe` by `pid` (facts.side says
  // which side): its own lines, the decision's line, and the facts.
  bool is_allowed(HANDLE pipe, std::uint32_t pid, admission_facts& facts);
  // The trust part of every decision, admission and explanation alike: may
  // process `pid` take part on a pipe of `level`? Fills the facts.
  bool judge_process(std::uint32_t pid, std::uint32_t level, trust_cache_use cache, admission_facts& facts);
  // untrusted, low_trust or high_trust for a process not found in the cache,
  // opened as `process` (PROCESS_QUERY_LIMITED_INFORMATION); `image`
  // receives the identity of a file whose verdict this is, `evidence` what
  // it rests on. Absent when the process cannot be judged now (nothing is
  // cached then; facts.reason and facts.detail say why).
  std::optional<trust_level> classify(const process_info& info, HANDLE process, trust_cache_use cache,
                                      std::optional<image_identity>& image, trust_evidence& evidence,
                                      gateway_admission_source& source, admission_facts& facts);
  // The verdict about the image open as `file`: another cached process's
  // verdict about the same file, or one verification.
  trust_level judge_image(HANDLE file, const std::wstring& path, trust_cache_use cache,
                          std::optional<image_identity>& image, trust_evidence& evidence,
                          gateway_admission_source& source);
  void apply_security(HANDLE pipe);
  std::function<void()> event_task(gateway_event event, HANDLE pipe, std::uint32_t pid = 0,
                                   std::uint32_t err = 0);
  void post_event(gateway_event event, HANDLE pipe, std::uint32_t pid = 0, std::uint32_t err = 0);
  // The decision's admission notification, and for an admitted connection
  // its insert and its `connected` notification, in that order. Throws
  // (memory) before posting anything.
  void post_decision(const admission_facts& facts, HANDLE pipe, gateway_event connected);
  // Posts both as one task, or neither when memory runs out: a connection's
  // insert without its notification, or its notification without its
  // removal, would leave the cache out of step with the library, and a later
  // pipe given the same handle value would be named after this one.
  void post_pair(std::function<void()> first, std::function<void()> second);

  std::unique_ptr<notify_context> context_;
  signature_checker signature_checker_;
  pipes_security_descriptor pipes_security_descriptor_;
  processes_trust_cache trust_cache_;
  pipe_security_map pipe_security_;
  bool protected_image_paths_ = false;
  // Whether the system tells if a file is the image a process runs.
  const bool running_image_checked_;
  // "DENY ALL" is said once for the servers we join: a refused server is
  // joined again and again.
  std::atomic<bool> remote_deny_all_said_{false};
};
