// Admission decisions of a gateway as a host sees them: a face that a
// gateway observer may offer to hear every decision, and a face of the
// gateway that explains, on demand, how it would judge a process or an
// image file.
#pragma once

#include <vorbel/qm_base.h>

#include <cstdint>

// Which decision a gateway_admission describes.
enum class gateway_admission_side : std::uint32_t {
  local = 0,        // a process connected to a pipe this process serves
  remote = 1,       // this process joined a pipe that the process serves
  explanation = 2,  // asked through igateway_trust_explainer; nothing was admitted
};

// The trust the peer's image earned (the values of the component's log).
enum class gateway_admission_trust : std::uint32_t {
  low_trust = 0,   // the signature verifies; another signer than this process's
  high_trust = 1,  // the signature verifies; this process's signer
  untrusted = 2,   // the signature does not verify, or the image is not the file the peer runs
  unknown = 3,     // not judged (see reason)
};

// Where the trust came from.
enum class gateway_admission_source : std::uint32_t {
  none = 0,            // the process or its image was not judged
  judged = 1,          // judged for this decision (its image verified, unless a check before decided)
  cached_process = 2,  // the process was judged before and still runs
  cached_image = 3,    // another running process of the same file was judged before
};

// Why the decision came out as it did.
enum class gateway_admission_reason : std::uint32_t {
  admitted = 0,
  no_own_signer = 1,          // this process's own image has no signer: every peer is refused
  pipe_not_configured = 2,    // the pipe's name is not among the gateway's pipes
  process_not_inspected = 3,  // the process could not be opened or read (gone, or access denied)
  image_not_judged = 4,       // its image could not be opened, tied to the process, or its path checked
  signature_invalid = 5,      // the image is unsigned, or its signature does not verify: untrusted
  image_replaced = 6,         // the file at the image's path is not the file the process runs: untrusted
  image_path_unprotected = 7, // the peer's user may change the image's path (opt-in policy): untrusted
  other_signer = 8,           // low_trust on a level 0 pipe, which admits this process's signer only
};

// gateway_admission::level when the pipe's level is not known.
inline constexpr std::uint32_t gateway_admission_no_level = 0xFFFFFFFF;
// gateway_admission::verification when the image was not verified.
inline constexpr std::uint32_t gateway_admission_not_verified = 0xFFFFFFFF;

// The facts of one decision. Strings are UTF-8, never null (empty when not
// known), and valid only during the call that receives them.
struct gateway_admission {
  gateway_admission_side side;
  std::uint32_t pid;  // the peer; 0 for an image judged by its path
  // The pipe's name as read from its handle (a backslash and the pipe's own
  // name); empty for an explanation.
  const char* pipe;
  std::uint32_t level;  // 0 or 1, or gateway_admission_no_level
  const char* image;    // the peer's image path as the system recorded it at its start
  // WinVerifyTrust's result for the image: 0 when it verifies, for example
  // 0x800B0100 TRUST_E_NOSIGNATURE or 0x80096010 TRUST_E_BAD_DIGEST; or
  // gateway_admission_not_verified.
  std::uint32_t verification;
  // Its name: "ERROR_SUCCESS", "TRUST_E_NOSIGNATURE", ..., "not_verified",
  // or "0x" and eight hexadecimal digits for a code without a name here.
  const char* verification_name;
  const char* signer;      // the subject name of the image's signer, as verified; empty when none
  const char* own_signer;  // this process's signer name; empty when it has none
  gateway_admission_trust trust;
  gateway_admission_source source;
  bool allowed;  // ALLOW (true) or DENY
  gateway_admission_reason reason;
  const char* reason_text;  // the reason for a person, with any error code
};

// {7D839F70-7999-4EFF-91C5-D22C24ECA535}: asked of each of a gateway's
// observers (the entries added with add_observer) with GetInterface.
inline constexpr GUID IID_igateway_admission_observer = {
    0x7D839F70, 0x7999, 0x4EFF, {0x91, 0xC5, 0xD2, 0x2C, 0x24, 0xEC, 0xA5, 0x35}};

// Every admission decision of the gateway, on both sides of its pipes: once
// per decision, on the gateway's notification thread (the thread of the
// igateway_observer calls), in the order the decisions were taken, an
// admitted connection's before its on_local_connect or on_remote_connect.
// Also the receiver of an explanation (igateway_trust_explainer), called
// there on the explaining thread.
struct igateway_admission_observer : IQmBaseInterface {
  virtual void on_admission(const gateway_admission* admission) = 0;
};

// {9ED781ED-2B23-478B-90B3-A7932D28A199}: answered by the gateway's
// GetInterface.
inline constexpr GUID IID_igateway_trust_explainer = {
    0x9ED781ED, 0x2B23, 0x478B, {0x90, 0xB3, 0xA7, 0x93, 0x2D, 0x28, 0xA1, 0x99}};

// How the gateway would judge a process, or an image file, against a pipe of
// `level`: the same judgement that admits peers, without the trust cache
// (nothing is read from it or added to it, so the image is verified afresh).
// Runs on the calling thread and takes as long as a first admission (the
// image's signature is verified: tenths of a second for a few MiB). Each
// call gives `receiver` one on_admission (side explanation) before it
// returns 0; 87 without a call for a null receiver or path, an empty path,
// or a level other than 0 or 1. Any thread may call, as long as the bus
// exists.
struct igateway_trust_explainer : IQmBaseInterface {
  virtual std::uint32_t explain_process(std::uint32_t pid, std::uint32_t level,
                                        igateway_admission_observer* receiver) = 0;
  // An image file by its path (UTF-8). Without a process only the signature
  // is judged: whether a process runs that file, and the protected-path
  // policy, need a running process.
  virtual std::uint32_t explain_image(const char* path, std::uint32_t level,
                                      igateway_admission_observer* receiver) = 0;
};
