// The facts of one admission decision: what the gateway observer found out
// about a peer while deciding, its line in the log, and the copy that the
// gateway's admission observers and an explanation's receiver get.
//
// admission_facts is a plain value, filled on the thread that decides (an
// IPC library thread, or the thread asking for an explanation); what leaves
// that thread is an admission_record, which owns UTF-8 copies of every
// string, so that whoever reads it later touches no pipe handle and no
// process, which may be gone by then.
#pragma once

#include <vorbel/igateway_admission.h>

#include <cstdint>
#include <optional>
#include <string>

#include "security/process_trust.h"

struct admission_facts {
  gateway_admission_side side = gateway_admission_side::local;
  std::uint32_t pid = 0;
  std::string pipe;  // UTF-8, as read from the pipe's handle
  std::optional<std::uint32_t> level;
  std::wstring image;
  std::uint32_t verification = trust_evidence::not_verified;
  std::wstring signer;
  std::wstring own_signer;
  trust_level trust = trust_level::unknown;
  gateway_admission_source source = gateway_admission_source::none;
  bool allowed = false;
  gateway_admission_reason reason = gateway_admission_reason::process_not_inspected;
  // What failed, for a process or an image that could not be judged.
  std::wstring detail;

  // Takes a verdict, what it rests on and whether the pipe's level admits
  // it, and names the reason.
  void judged(trust_level verdict, const trust_evidence& evidence, gateway_admission_source from, bool admitted);
};

// "ERROR_SUCCESS", "TRUST_E_NOSIGNATURE", ... for what a verification
// returned; "not_verified"; or "0x" and eight hexadecimal digits.
std::string verification_name(std::uint32_t code);

// The reason for a person, with the detail of what failed.
std::wstring reason_text(const admission_facts& facts);

// Writes the decision's line: "ALLOW" or "DENY", then every fact, at
// level_info under "gateway_observer::admission".
void write_admission_line(const admission_facts& facts);

// The facts as the public struct sees them, with copies of the strings.
// Immutable once built, so any thread may read it; not copyable: the view
// points into the record's own strings. Shared by the tasks that deliver it.
class admission_record {
 public:
  explicit admission_record(const admission_facts& facts);
  admission_record(const admission_record&) = delete;
  admission_record& operator=(const admission_record&) = delete;

  const gateway_admission& view() const { return view_; }

 private:
  std::string pipe_;
  std::string image_;
  std::string verification_name_;
  std::string signer_;
  std::string own_signer_;
  std::string reason_text_;
  gateway_admission view_{};
};
