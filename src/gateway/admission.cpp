#include "gateway/admission.h"

#include <windows.h>

#include <cstdio>
#include <iomanip>
#include <system_error>

#include "logging/logger.h"
#include "platform/win_api.h"

namespace {

struct named_code {
  std::uint32_t code;
  const char* name;
};

#define VORBEL_NAMED_CODE(name) \
  named_code { static_cast<std::uint32_t>(name), #name }

// What WinVerifyTrust returns for files, and the few system codes it passes
// through.
const named_code verification_codes[] = {
    VORBEL_NAMED_CODE(ERROR_SUCCESS),
    VORBEL_NAMED_CODE(TRUST_E_NOSIGNATURE),
    VORBEL_NAMED_CODE(TRUST_E_SUBJECT_NOT_TRUSTED),
    VORBEL_NAMED_CODE(TRUST_E_BAD_DIGEST),
    VORBEL_NAMED_CODE(TRUST_E_EXPLICIT_DISTRUST),
    VORBEL_NAMED_CODE(TRUST_E_PROVIDER_UNKNOWN),
    VORBEL_NAMED_CODE(TRUST_E_ACTION_UNKNOWN),
    VORBEL_NAMED_CODE(TRUST_E_SUBJECT_FORM_UNKNOWN),
    VORBEL_NAMED_CODE(TRUST_E_FAIL),
    VORBEL_NAMED_CODE(TRUST_E_SYSTEM_ERROR),
    VORBEL_NAMED_CODE(TRUST_E_NO_SIGNER_CERT),
    VORBEL_NAMED_CODE(TRUST_E_COUNTER_SIGNER),
    VORBEL_NAMED_CODE(TRUST_E_CERT_SIGNATURE),
    VORBEL_NAMED_CODE(TRUST_E_TIME_STAMP),
    VORBEL_NAMED_CODE(TRUST_E_BASIC_CONSTRAINTS),
    VORBEL_NAMED_CODE(TRUST_E_FINANCIAL_CRITERIA),
    VORBEL_NAMED_CODE(CERT_E_EXPIRED),
    VORBEL_NAMED_CODE(CERT_E_VALIDITYPERIODNESTING),
    VORBEL_NAMED_CODE(CERT_E_UNTRUSTEDROOT),
    VORBEL_NAMED_CODE(CERT_E_CHAINING),
    VORBEL_NAMED_CODE(CERT_E_REVOKED),
    VORBEL_NAMED_CODE(CERT_E_UNTRUSTEDTESTROOT),
    VORBEL_NAMED_CODE(CERT_E_REVOCATION_FAILURE),
    VORBEL_NAMED_CODE(CERT_E_WRONG_USAGE),
    VORBEL_NAMED_CODE(CERT_E_UNTRUSTEDCA),
    VORBEL_NAMED_CODE(CRYPT_E_REVOKED),
    VORBEL_NAMED_CODE(CRYPT_E_NO_REVOCATION_CHECK),
    VORBEL_NAMED_CODE(CRYPT_E_REVOCATION_OFFLINE),
    VORBEL_NAMED_CODE(CRYPT_E_FILE_ERROR),
    VORBEL_NAMED_CODE(CRYPT_E_NO_MATCH),
    VORBEL_NAMED_CODE(CRYPT_E_SECURITY_SETTINGS),
    VORBEL_NAMED_CODE(E_ACCESSDENIED),
    VORBEL_NAMED_CODE(E_INVALIDARG),
    VORBEL_NAMED_CODE(E_OUTOFMEMORY),
    VORBEL_NAMED_CODE(ERROR_FILE_NOT_FOUND),
    VORBEL_NAMED_CODE(ERROR_ACCESS_DENIED),
    VORBEL_NAMED_CODE(ERROR_SHARING_VIOLATION),
};

#undef VORBEL_NAMED_CODE

std::wstring widen(const std::string& ascii) { return std::wstring(ascii.begin(), ascii.end()); }

std::string hex8(std::uint32_t code) {
  char text[11];
  std::snprintf(text, sizeof text, "0x%08x", static_cast<unsigned>(code));
  return text;
}

const wchar_t* side_name(gateway_admission_side side) {
  switch (side) {
    case gateway_admission_side::local:
      return L"local";
    case gateway_admission_side::remote:
      return L"remote";
    case gateway_admission_side::explanation:
      return L"explain";
  }
  return L"";
}

const wchar_t* source_name(gateway_admission_source source) {
  switch (source) {
    case gateway_admission_source::none:
      return L"none";
    case gateway_admission_source::judged:
      return L"judged";
    case gateway_admission_source::cached_process:
      return L"cached_process";
    case gateway_admission_source::cached_image:
      return L"cached_image";
  }
  return L"";
}

std::string utf8(const std::wstring& text) {
  std::error_code ignored;  // a name that does not convert is shown empty
  return winapi::utf16_to_utf8(text, ignored);
}

}  // namespace

void admission_facts::judged(trust_level verdict, const trust_evidence& evidence, gateway_admission_source from,
                             bool admitted) {
  trust = verdict;
  verification = evidence.verification;
  signer = evidence.signer;
  source = from;
  allowed = admitted;
  if (allowed) {
    reason = gateway_admission_reason::admitted;
  } else if (verdict == trust_level::untrusted) {
    switch (evidence.untrusted_by) {
      case trust_evidence::finding::other_file:
        reason = gateway_admission_reason::image_replaced;
        break;
      case trust_evidence::finding::unprotected_path:
        reason = gateway_admission_reason::image_path_unprotected;
        break;
      case trust_evidence::finding::signature:
        reason = gateway_admission_reason::signature_invalid;
        break;
    }
  } else {
    reason = gateway_admission_reason::other_signer;
  }
}

std::string verification_name(std::uint32_t code) {
  if (code == trust_evidence::not_verified) return "not_verified";
  for (const named_code& known : verification_codes) {
    if (known.code == code) return known.name;
  }
  return hex8(code);
}

std::wstring reason_text(const admission_facts& facts) {
  const std::wstring detail = facts.detail.empty() ? std::wstring() : L": " + facts.detail;
  switch (facts.reason) {
    case gateway_admission_reason::admitted:
      return L"admitted";
    case gateway_admission_reason::no_own_signer:
      return L"this process's own image has no signer, so it refuses every peer";
    case gateway_admission_reason::pipe_not_configured:
      return L"the pipe is not among this gateway's pipes";
    case gateway_admission_reason::process_not_inspected:
      return L"the process cannot be inspected" + detail;
    case gateway_admission_reason::image_not_judged:
      return L"its image cannot be judged" + detail;
    case gateway_admission_reason::signature_invalid:
      if (facts.verification == static_cast<std::uint32_t>(TRUST_E_NOSIGNATURE)) return L"its image is not signed";
      if (facts.verification == static_cast<std::uint32_t>(TRUST_E_BAD_DIGEST)) {
        return L"its image was changed after it was signed";
      }
      return L"its image's signature does not verify (" + widen(verification_name(facts.verification)) + L")";
    case gateway_admission_reason::image_replaced:
      return L"the file at its image's path is not the file it runs";
    case gateway_admission_reason::image_path_unprotected:
      return L"its user may change its image's path" + detail;
    case gateway_admission_reason::other_signer:
      return std::wstring(facts.signer.empty() ? L"its signer cannot be read"
                                               : L"it is signed by another signer than this process") +
             L", and a level 0 pipe admits this process's signer only";
  }
  return std::wstring();
}

void write_admission_line(const admission_facts& facts) {
  logging::logger_stream line(logging::level_info, L"gateway_observer::admission");
  line << (facts.allowed ? L"ALLOW" : L"DENY") << L" side=" << side_name(facts.side) << L" pid=" << facts.pid;
  if (facts.side != gateway_admission_side::explanation) line << L" pipe=" << facts.pipe;
  line << L" level=";
  if (facts.level) {
    line << *facts.level;
  } else {
    line << L"none";
  }
  // "TRUST_E_NOSIGNATURE(0x800b0100)"; a code without a name is its number.
  const std::string name = verification_name(facts.verification);
  line << L" image=" << std::quoted(facts.image) << L" verification=" << widen(name);
  if (name.rfind("0x", 0) != 0 && facts.verification != trust_evidence::not_verified) {
    line << L"(" << widen(hex8(facts.verification)) << L")";
  }
  line << L" signer=" << std::quoted(facts.signer) << L" own_signer=" << std::quoted(facts.own_signer)
       << L" trust=" << trust_level_name(facts.trust) << L" source=" << source_name(facts.source);
  if (!facts.allowed) line << L" reason: " << reason_text(facts);
}

admission_record::admission_record(const admission_facts& facts)
    : pipe_(facts.pipe),
      image_(utf8(facts.image)),
      verification_name_(verification_name(facts.verification)),
      signer_(utf8(facts.signer)),
      own_signer_(utf8(facts.own_signer)),
      reason_text_(utf8(reason_text(facts))) {
  view_.side = facts.side;
  view_.pid = facts.pid;
  view_.pipe = pipe_.c_str();
  view_.level = facts.level ? *facts.level : gateway_admission_no_level;
  view_.image = image_.c_str();
  view_.verification = facts.verification;
  view_.verification_name = verification_name_.c_str();
  view_.signer = signer_.c_str();
  view_.own_signer = own_signer_.c_str();
  static_assert(static_cast<std::uint32_t>(gateway_admission_trust::untrusted) ==
                    static_cast<std::uint32_t>(trust_level::untrusted),
                "the public trust values are the component's");
  view_.trust = static_cast<gateway_admission_trust>(facts.trust);
  view_.source = facts.source;
  view_.allowed = facts.allowed;
  view_.reason = facts.reason;
  view_.reason_text = reason_text_.c_str();
}
