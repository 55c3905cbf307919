#include "message_codec.h"

#include <algorithm>
#include <cstring>
#include <string_view>

namespace parlo::codec {
namespace {

void put_u16(unsigned char* out, std::uint16_t value) {
  out[0] = static_cast<unsigned char>(value);
  out[1] = static_cast<unsigned char>(value >> 8);
}

void put_u32(unsigned char* out, std::uint32_t value) {
  for (int i = 0; i < 4; ++i) out[i] = static_cast<unsigned char>(value >> (8 * i));
}

std::uint16_t get_u16(const unsigned char* in) {
  return static_cast<std::uint16_t>(in[0] | (in[1] << 8));
}

std::uint32_t get_u32(const unsigned char* in) {
  std::uint32_t value = 0;
  for (int i = 3; i >= 0; --i) value = (value << 8) | in[i];
  return value;
}

bool valid_name(std::string_view name) {
  return !name.empty() && name.size() <= max_name_length &&
         name.find('\0') == std::string_view::npos;
}

// Whether any two names are equal; sorts views, the fields keep their order.
bool has_duplicate_names(const message_content& content) {
  std::vector<std::string_view> names;
  names.reserve(content.fields.size());
  for (const blob_field& field : content.fields) names.emplace_back(field.name);
  std::sort(names.begin(), names.end());
  return std::adjacent_find(names.begin(), names.end()) != names.end();
}

}  // namespace

const char* status_text(status value) noexcept {
  switch (value) {
    case status::ok:
      return "ok";
    case status::truncated:
      return "truncated";
    case status::bad_magic:
      return "bad magic";
    case status::too_many_fields:
      return "too many fields";
    case status::bad_name:
      return "bad field name";
    case status::duplicate_name:
      return "duplicate field name";
    case status::too_large:
      return "too large";
    case status::trailing_bytes:
      return "trailing bytes";
  }
  return "unknown status";
}

status check_limits(const message_content& content) noexcept {
  if (content.fields.size() > max_fields) return status::too_many_fields;
  std::uint64_t total = 0;
  for (const blob_field& field : content.fields) {
    if (!valid_name(field.name)) return status::bad_name;
    total += field.name.size() + std::uint64_t{field.data.size()};
    if (total > max_content_size) return status::too_large;
  }
  try {
    if (has_duplicate_names(content)) return status::duplicate_name;
  } catch (...) {
    // Only the scratch list of names can fail to allocate; without it the
    // check cannot be made, and an unchecked message is not passed on.
    return status::too_large;
  }
  return status::ok;
}

std::uint64_t encoded_size(const message_content& content) noexcept {
  std::uint64_t size = header_size;
  for (const blob_field& field : content.fields)
    size += field_header_size + field.name.size() + field.data.size();
  return size;
}

status encode_into(const message_content& content, void* buffer, std::uint64_t capacity,
                   std::uint64_t& written) noexcept {
  written = 0;
  const status limits = check_limits(content);
  if (limits != status::ok) return limits;
  const std::uint64_t size = encoded_size(content);
  if (buffer == nullptr || capacity < size) return status::too_large;

  auto* out = static_cast<unsigned char*>(buffer);
  std::memcpy(out, magic, sizeof magic);
  put_u32(out + 4, content.id);
  put_u32(out + 8, static_cast<std::uint32_t>(content.fields.size()));
  out += header_size;
  for (const blob_field& field : content.fields) {
    put_u16(out, static_cast<std::uint16_t>(field.name.size()));
    put_u32(out + 2, static_cast<std::uint32_t>(field.data.size()));
    out += field_header_size;
    std::memcpy(out, field.name.data(), field.name.size());
    out += field.name.size();
    if (!field.data.empty()) std::memcpy(out, field.data.data(), field.data.size());
    out += field.data.size();
  }
  written = size;
  return status::ok;
}

status encode(const message_content& content, std::vector<unsigned char>& out) {
  out.clear();
  const status limits = check_limits(content);
  if (limits != status::ok) return limits;
  out.resize(static_cast<std::size_t>(encoded_size(content)));
  std::uint64_t written = 0;
  const status result = encode_into(content, out.data(), out.size(), written);
  if (result != status::ok) out.clear();
  return result;
}

status decode(const void* bytes, std::size_t size, message_content& out) {
  out = message_content{};
  if (bytes == nullptr || size < header_size) return status::truncated;
  if (size > max_encoded_size) return status::too_large;
  const auto* in = static_cast<const unsigned char*>(bytes);
  if (std::memcmp(in, magic, sizeof magic) != 0) return status::bad_magic;

  const std::uint32_t id = get_u32(in + 4);
  const std::uint32_t count = get_u32(in + 8);
  if (count > max_fields) return status::too_many_fields;
  std::size_t left = size - header_size;
  // Every field needs at least its header and a one-byte name; a count that
  // cannot fit is refused before anything is reserved for it.
  if (std::uint64_t{count} * (field_header_size + 1) > left) return status::truncated;
  in += header_size;

  message_content content;
  content.id = id;
  content.fields.reserve(count);
  std::uint64_t total = 0;
  for (std::uint32_t i = 0; i < count; ++i) {
    if (left < field_header_size) return status::truncated;
    const std::size_t name_length = get_u16(in);
    const std::uint32_t data_size = get_u32(in + 2);
    in += field_header_size;
    left -= field_header_size;
    if (name_length == 0 || name_length > max_name_length) return status::bad_name;
    total += name_length + std::uint64_t{data_size};
    if (total > max_content_size) return status::too_large;
    if (name_length > left || data_size > left - name_length) return status::truncated;

    std::string_view name(reinterpret_cast<const char*>(in), name_length);
    if (!valid_name(name)) return status::bad_name;
    blob_field field;
    field.name.assign(name);
    field.data.assign(in + name_length, in + name_length + data_size);
    content.fields.push_back(std::move(field));
    in += name_length + data_size;
    left -= name_length + data_size;
  }
  if (left != 0) return status::trailing_bytes;
  if (has_duplicate_names(content)) return status::duplicate_name;
  out = std::move(content);
  return status::ok;
}

}  // namespace parlo::codec
