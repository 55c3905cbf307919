// A gateway observer for tests that offers both faces: it records every
// admission decision and every connect notification, in the one order the
// gateway's worker delivers them, with the thread each ran on. Also the
// receiver of explanations (called on the explaining thread).
#pragma once

#include <vorbel/igateway.h>
#include <vorbel/igateway_admission.h>

#include <windows.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/srw_sync.h"
#include "support/log_capture.h"

namespace test_support {

// A copy of one gateway_admission (kind "admission"), or a connect
// notification (kind "connect": side, pipe and pid only).
struct heard {
  std::string kind;
  gateway_admission_side side = gateway_admission_side::local;
  std::uint32_t pid = 0;
  std::string pipe;
  std::uint32_t level = 0;
  std::string image;
  std::uint32_t verification = 0;
  std::string verification_name;
  std::string signer;
  std::string own_signer;
  gateway_admission_trust trust = gateway_admission_trust::unknown;
  gateway_admission_source source = gateway_admission_source::none;
  bool allowed = false;
  gateway_admission_reason reason = gateway_admission_reason::admitted;
  std::string reason_text;
  DWORD thread = 0;
};

class admission_recorder final : public igateway_observer, public igateway_admission_observer {
 public:
  // When false, GetInterface gives no admission face: a plain gateway observer.
  bool offers_admission = true;

  void* GetInterface(GUID iid) override {
    if (qm::same_iid(iid, IID_igateway_observer)) return static_cast<igateway_observer*>(this);
    if (offers_admission && qm::same_iid(iid, IID_igateway_admission_observer)) {
      return static_cast<igateway_admission_observer*>(this);
    }
    return nullptr;
  }
  void on_admission(const gateway_admission* a) override {
    heard h;
    h.kind = "admission";
    h.side = a->side, h.pid = a->pid, h.pipe = a->pipe, h.level = a->level, h.image = a->image;
    h.verification = a->verification, h.verification_name = a->verification_name;
    h.signer = a->signer, h.own_signer = a->own_signer, h.trust = a->trust, h.source = a->source;
    h.allowed = a->allowed, h.reason = a->reason, h.reason_text = a->reason_text;
    record(std::move(h));
  }
  void on_local_connect(const char* name, std::uint32_t pid) override { connect(gateway_admission_side::local, name, pid); }
  void on_remote_connect(const char* name, std::uint32_t pid) override {
    connect(gateway_admission_side::remote, name, pid);
  }
  void on_listen(const char*) override {}
  void on_local_disconnect(const char*, std::uint32_t) override {}
  void on_local_start_communication(const char*, std::uint32_t) override {}
  void on_local_error(const char*, std::uint32_t, std::uint32_t) override {}
  void on_remote_disconnect(const char*, std::uint32_t) override {}
  void on_remote_start_communication(const char*, std::uint32_t) override {}
  void on_remote_error(const char*, std::uint32_t, std::uint32_t) override {}

  std::vector<heard> seen() {
    std::lock_guard<srw_mutex> lock(mutex_);
    return seen_;
  }
  // What was heard of `kind` about `pid` on `pipe` (any pipe when empty).
  std::vector<heard> about(const std::string& kind, std::uint32_t pid, const std::string& pipe = "") {
    std::vector<heard> found;
    for (heard& h : seen()) {
      if (h.kind == kind && h.pid == pid && (pipe.empty() || h.pipe == pipe)) found.push_back(std::move(h));
    }
    return found;
  }
  // Waits until at least `count` such records were heard.
  bool wait_about(const std::string& kind, std::uint32_t pid, const std::string& pipe, std::size_t count,
                  std::chrono::milliseconds timeout) {
    return wait_until([&] { return about(kind, pid, pipe).size() >= count; }, timeout);
  }

 private:
  void connect(gateway_admission_side side, const char* name, std::uint32_t pid) {
    heard h;
    h.kind = "connect";
    h.side = side, h.pipe = name, h.pid = pid;
    record(std::move(h));
  }
  void record(heard h) {
    h.thread = ::GetCurrentThreadId();
    std::lock_guard<srw_mutex> lock(mutex_);
    seen_.push_back(std::move(h));
  }
  srw_mutex mutex_;
  std::vector<heard> seen_;
};

// The trust names as the component writes them.
inline const char* trust_name(gateway_admission_trust trust) {
  static const char* const names[] = {"low_trust", "high_trust", "untrusted", "unknown"};
  const auto i = static_cast<std::uint32_t>(trust);
  return i < 4 ? names[i] : "";
}

}  // namespace test_support
