#include "message_impl.h"

#include "platform/srw_sync.h"

#include <cstring>
#include <mutex>
#include <new>
#include <unordered_set>

#include "diagnostics.h"

namespace parlo::impl {
namespace {

static_assert(codec::max_fields == parlo::max_blob_fields, "one limit for the API and the wire");
static_assert(codec::max_name_length == parlo::max_name_length,
              "one limit for the API and the wire");
static_assert(codec::max_content_size == parlo::max_message_size,
              "one limit for the API and the wire");

// Live messages by address.
struct registry {
  srw_mutex mutex;
  std::unordered_set<const parlo::message*> live;
};

registry& messages() {
  static registry instance;
  return instance;
}

// The pointer get_blob hands out for a present field without bytes, so that
// "present and empty" differs from "absent".
const unsigned char empty_blob[1] = {0};

}  // namespace

message_impl* message_impl::create(codec::message_content content, bool library_owned) {
  auto* created = new message_impl(std::move(content), library_owned);
  try {
    registry& r = messages();
    std::lock_guard<srw_mutex> lock(r.mutex);
    r.live.insert(created);
  } catch (...) {
    delete created;
    throw;
  }
  return created;
}

message_impl* message_impl::find_live(parlo::message* candidate) {
  registry& r = messages();
  std::lock_guard<srw_mutex> lock(r.mutex);
  return r.live.count(candidate) != 0 ? static_cast<message_impl*>(candidate) : nullptr;
}

void message_impl::destroy(message_impl* message) noexcept {
  if (message == nullptr) return;
  {
    registry& r = messages();
    std::lock_guard<srw_mutex> lock(r.mutex);
    r.live.erase(message);
  }
  delete message;
}

codec::blob_field* message_impl::find_field(const char* name) {
  for (codec::blob_field& field : content_.fields)
    if (field.name == name) return &field;
  return nullptr;
}

std::uint32_t message_impl::check_writable(const char* function) const {
  if (!sealed_) return success;
  log_line(level_error, function) << (library_owned_ ? "delivered message is read-only"
                                                     : "message is sealed");
  return error_access_denied;
}

message* message_impl::copy() {
  try {
    message_impl* copied = create(content_, /* library_owned */ false);
    copied->incomplete_ = incomplete_;
    return copied;
  } catch (const std::bad_alloc&) {
    log_line(level_error, "parlo::message::copy") << "out of memory";
    return nullptr;
  }
}

bool message_impl::is_sealed() { return sealed_; }

std::uint32_t message_impl::blob_count() {
  return static_cast<std::uint32_t>(content_.fields.size());
}

const char* message_impl::blob_name(std::uint32_t index) {
  return index < content_.fields.size() ? content_.fields[index].name.c_str() : nullptr;
}

std::uint32_t message_impl::message_id() { return content_.id; }

std::uint32_t message_impl::set_message_id(std::uint32_t id) {
  if (const std::uint32_t refused = check_writable("parlo::message::set_message_id"))
    return refused;
  content_.id = id;
  return success;
}

std::uint32_t message_impl::remove_blob(const char* name) {
  if (name == nullptr) {
    log_line(level_error, "parlo::message::remove_blob") << "name is nullptr";
    return error_invalid_parameter;
  }
  if (const std::uint32_t refused = check_writable("parlo::message::remove_blob")) return refused;
  for (auto it = content_.fields.begin(); it != content_.fields.end(); ++it) {
    if (it->name == name) {
      content_.fields.erase(it);
      return success;
    }
  }
  return error_not_found;
}

std::uint32_t message_impl::clear() {
  if (const std::uint32_t refused = check_writable("parlo::message::clear")) return refused;
  content_ = codec::message_content{};
  incomplete_ = false;
  return success;
}

std::uint64_t message_impl::encoded_size() { return codec::encoded_size(content_); }

std::uint32_t message_impl::encode(void* buffer, std::uint64_t capacity, std::uint64_t* written) {
  if (written != nullptr) *written = 0;
  if (buffer == nullptr || written == nullptr) {
    log_line(level_error, "parlo::message::encode") << "buffer or written is nullptr";
    return error_invalid_parameter;
  }
  const codec::status result = codec::encode_into(content_, buffer, capacity, *written);
  if (result == codec::status::ok) return success;
  log_line(level_error, "parlo::message::encode")
      << codec::status_text(result) << " capacity=" << capacity << " needed=" << encoded_size();
  return error_invalid_parameter;
}

std::uint32_t message_impl::reserved_10() { return error_not_implemented; }
std::uint32_t message_impl::reserved_11() { return error_not_implemented; }
std::uint32_t message_impl::reserved_12() { return error_not_implemented; }
std::uint32_t message_impl::reserved_13() { return error_not_implemented; }
std::uint32_t message_impl::reserved_16() { return error_not_implemented; }
std::uint32_t message_impl::reserved_17() { return error_not_implemented; }
std::uint32_t message_impl::reserved_18() { return error_not_implemented; }
std::uint32_t message_impl::reserved_20() { return error_not_implemented; }
std::uint32_t message_impl::reserved_21() { return error_not_implemented; }

const void* message_impl::get_blob(const char* name, std::uint64_t* size) {
  if (size != nullptr) *size = 0;
  if (name == nullptr || size == nullptr) {
    log_line(level_error, "parlo::message::get_blob") << "name or size is nullptr";
    return nullptr;
  }
  const codec::blob_field* field = find_field(name);
  if (field == nullptr) return nullptr;
  *size = field->data.size();
  return field->data.empty() ? static_cast<const void*>(empty_blob) : field->data.data();
}

std::uint32_t message_impl::set_blob(const char* name, const void* data, std::uint64_t size) {
  const std::uint32_t result = store_blob(name, data, size);
  // A sealed message stays as it was sealed: whole.
  if (result != success && !sealed_) incomplete_ = true;
  return result;
}

std::uint32_t message_impl::store_blob(const char* name, const void* data, std::uint64_t size) {
  const char* const function = "parlo::message::set_blob";
  if (name == nullptr || (data == nullptr && size != 0)) {
    log_line(level_error, function) << (name == nullptr ? "name is nullptr" : "data is nullptr");
    return error_invalid_parameter;
  }
  const std::size_t name_length = std::strlen(name);
  if (name_length == 0 || name_length > max_name_length) {
    log_line(level_error, function)
        << "name length " << name_length << " outside 1.." << max_name_length;
    return error_invalid_parameter;
  }
  if (const std::uint32_t refused = check_writable(function)) return refused;

  codec::blob_field* field = find_field(name);
  std::uint64_t others = 0;
  for (const codec::blob_field& f : content_.fields)
    if (&f != field) others += f.name.size() + f.data.size();
  // Compared without adding first: `size` comes from the caller and may be
  // near 2^64.
  if (size > max_message_size || name_length + size > max_message_size - others) {
    log_line(level_error, function) << "message would exceed " << max_message_size
                                    << " bytes: field " << name << " size=" << size;
    return error_invalid_parameter;
  }
  if (field == nullptr && content_.fields.size() >= max_blob_fields) {
    log_line(level_error, function) << "more than " << max_blob_fields << " fields";
    return error_invalid_parameter;
  }
  try {
    const auto* bytes = static_cast<const unsigned char*>(data);
    std::vector<unsigned char> copied(bytes, bytes + size);
    if (field != nullptr) {
      field->data.swap(copied);
    } else {
      content_.fields.push_back(codec::blob_field{name, std::move(copied)});
    }
  } catch (const std::bad_alloc&) {
    log_line(level_error, function) << "out of memory, size=" << size;
    return error_not_enough_memory;
  }
  return success;
}

std::uint32_t message_impl::seal() {
  sealed_ = true;
  return success;
}

std::uint32_t message_impl::release() {
  if (library_owned_) {
    log_line(level_error, "parlo::message::release")
        << "a delivered message belongs to the library; copy() it to keep it";
    return error_access_denied;
  }
  destroy(this);
  return success;
}

}  // namespace parlo::impl
