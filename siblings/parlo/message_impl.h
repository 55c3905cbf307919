// The library's message object.
//
// Owned by whoever created it: a caller (create_message, copy), who frees it
// with release(), or the bus, which holds the sealed copies it queues and
// delivers (library_owned) and frees them itself. Not locked: a caller's
// message is used by one thread at a time; a delivered copy is sealed and
// only read while it is delivered.
//
// Every live message is listed in a process-wide registry, so that post()
// can tell a message of this library from a stray or released pointer
// without touching it.
#pragma once

#include <cstdint>
#include <memory>

#include "bus/parlo/parlo.h"
#include "message_codec.h"

namespace parlo::impl {

class message_impl final : public parlo::message {
 public:
  // A new registered message; throws std::bad_alloc.
  static message_impl* create(codec::message_content content, bool library_owned);
  // Whether `candidate` is a live message of this library. Reads only the
  // pointer value.
  static message_impl* find_live(parlo::message* candidate);
  // Frees a library-owned message.
  static void destroy(message_impl* message) noexcept;

  const codec::message_content& content() const { return content_; }
  void seal_now() { sealed_ = true; }
  // A set_blob on it was refused since it was made or cleared: it is not
  // the message its caller built, and post() refuses it.
  bool incomplete() const { return incomplete_; }

  message* copy() override;
  bool is_sealed() override;
  std::uint32_t blob_count() override;
  const char* blob_name(std::uint32_t index) override;
  std::uint32_t message_id() override;
  std::uint32_t set_message_id(std::uint32_t id) override;
  std::uint32_t remove_blob(const char* name) override;
  std::uint32_t clear() override;
  std::uint64_t encoded_size() override;
  std::uint32_t encode(void* buffer, std::uint64_t capacity, std::uint64_t* written) override;
  std::uint32_t reserved_10() override;
  std::uint32_t reserved_11() override;
  std::uint32_t reserved_12() override;
  std::uint32_t reserved_13() override;
  const void* get_blob(const char* name, std::uint64_t* size) override;
  std::uint32_t set_blob(const char* name, const void* data, std::uint64_t size) override;
  std::uint32_t reserved_16() override;
  std::uint32_t reserved_17() override;
  std::uint32_t reserved_18() override;
  std::uint32_t seal() override;
  std::uint32_t reserved_20() override;
  std::uint32_t reserved_21() override;
  std::uint32_t release() override;

 private:
  message_impl(codec::message_content content, bool library_owned)
      : content_(std::move(content)), sealed_(library_owned), library_owned_(library_owned) {}
  ~message_impl() = default;

  codec::blob_field* find_field(const char* name);
  // 0, or error_access_denied with a line under `function`.
  std::uint32_t check_writable(const char* function) const;

  // set_blob without the refusal bookkeeping.
  std::uint32_t store_blob(const char* name, const void* data, std::uint64_t size);

  codec::message_content content_;
  bool sealed_;
  const bool library_owned_;
  bool incomplete_ = false;
};

}  // namespace parlo::impl
