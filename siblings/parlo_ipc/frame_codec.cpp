#include "frame_codec.h"

#include <algorithm>
#include <cstring>

namespace parlo::ipc::frame {
namespace {

void put_u16(std::vector<unsigned char>& out, std::size_t value) {
  out.push_back(static_cast<unsigned char>(value & 0xFF));
  out.push_back(static_cast<unsigned char>((value >> 8) & 0xFF));
}

void put_u32_at(std::vector<unsigned char>& out, std::size_t offset, std::uint64_t value) {
  for (std::size_t i = 0; i < 4; ++i) {
    out[offset + i] = static_cast<unsigned char>((value >> (8 * i)) & 0xFF);
  }
}

void put_name(std::vector<unsigned char>& out, std::string_view name) {
  put_u16(out, name.size());
  out.insert(out.end(), name.begin(), name.end());
}

// Reads fields from a payload, front to back; every read checks the bounds.
class cursor {
 public:
  cursor(const unsigned char* data, std::size_t size) : data_(data), size_(size) {}

  bool u16(std::uint16_t& value) {
    if (size_ - offset_ < 2) return false;
    value = static_cast<std::uint16_t>(data_[offset_] | (data_[offset_ + 1] << 8));
    offset_ += 2;
    return true;
  }
  // A length-prefixed name; bad_name or truncated on failure.
  status name(std::string_view& value) {
    std::uint16_t length = 0;
    if (!u16(length)) return status::truncated;
    if (length == 0 || length > max_name_length) return status::bad_name;
    if (size_ - offset_ < length) return status::truncated;
    value = std::string_view(reinterpret_cast<const char*>(data_ + offset_), length);
    offset_ += length;
    return valid_name(value) ? status::ok : status::bad_name;
  }
  std::size_t left() const { return size_ - offset_; }
  const unsigned char* here() const { return data_ + offset_; }

 private:
  const unsigned char* data_;
  std::size_t size_;
  std::size_t offset_ = 0;
};

}  // namespace

const char* status_text(status value) noexcept {
  switch (value) {
    case status::ok: return "ok";
    case status::truncated: return "truncated";
    case status::oversized: return "oversized";
    case status::empty_frame: return "empty frame";
    case status::unknown_type: return "unknown type";
    case status::bad_version: return "bad version";
    case status::bad_name: return "bad name";
    case status::too_many_channels: return "too many channels";
    case status::trailing_bytes: return "trailing bytes";
    case status::empty_message: return "empty message";
  }
  return "unknown status";
}

bool valid_name(std::string_view name) noexcept {
  return !name.empty() && name.size() <= max_name_length &&
         name.find('\0') == std::string_view::npos;
}

status encode_hello(const hello& value, std::vector<unsigned char>& out) {
  out.clear();
  if (!valid_name(value.bus_name)) return status::bad_name;
  if (value.channels.size() > max_hello_channels) return status::too_many_channels;
  for (const std::string& channel : value.channels) {
    if (!valid_name(channel)) return status::bad_name;
  }
  out.resize(header_size);
  out[length_size] = static_cast<unsigned char>(frame_type::hello);
  put_u16(out, value.version);
  put_name(out, value.bus_name);
  put_u16(out, value.channels.size());
  for (const std::string& channel : value.channels) put_name(out, channel);
  put_u32_at(out, 0, out.size() - length_size);
  return status::ok;
}

status encode_message(std::string_view channel, const void* wire, std::uint64_t wire_size,
                      std::vector<unsigned char>& out) {
  out.clear();
  if (!valid_name(channel)) return status::bad_name;
  if (wire == nullptr || wire_size == 0) return status::empty_message;
  const std::uint64_t length = 1 + 2 + channel.size() + wire_size;
  if (wire_size > max_frame_length || length > max_frame_length) return status::oversized;
  out.reserve(static_cast<std::size_t>(length_size + length));
  out.resize(header_size);
  put_u32_at(out, 0, length);
  out[length_size] = static_cast<unsigned char>(frame_type::message);
  put_name(out, channel);
  const auto* bytes = static_cast<const unsigned char*>(wire);
  out.insert(out.end(), bytes, bytes + wire_size);
  return status::ok;
}

status decode_hello(const unsigned char* payload, std::size_t size, hello& out) {
  out = hello{};
  if (payload == nullptr && size != 0) return status::truncated;
  cursor in(payload, size);
  std::uint16_t version = 0;
  if (!in.u16(version)) return status::truncated;
  if (version != protocol_version) return status::bad_version;
  std::string_view bus_name;
  if (const status s = in.name(bus_name); s != status::ok) return s;
  std::uint16_t count = 0;
  if (!in.u16(count)) return status::truncated;
  if (count > max_hello_channels) return status::too_many_channels;
  // Each channel takes at least its two length bytes: a count that the
  // payload cannot hold is refused before anything is reserved for it.
  if (in.left() / 2 < count) return status::truncated;
  hello result;
  result.version = version;
  result.bus_name.assign(bus_name);
  result.channels.reserve(count);
  for (std::uint16_t i = 0; i < count; ++i) {
    std::string_view channel;
    if (const status s = in.name(channel); s != status::ok) return s;
    result.channels.emplace_back(channel);
  }
  if (in.left() != 0) return status::trailing_bytes;
  out = std::move(result);
  return status::ok;
}

status decode_message(const unsigned char* payload, std::size_t size, message_view& out) noexcept {
  out = message_view{};
  if (payload == nullptr && size != 0) return status::truncated;
  cursor in(payload, size);
  std::string_view channel;
  if (const status s = in.name(channel); s != status::ok) return s;
  if (in.left() == 0) return status::empty_message;
  out.channel = channel;
  out.wire = in.here();
  out.wire_size = in.left();
  return status::ok;
}

std::size_t frame_reader::feed(const void* data, std::size_t size) {
  if (failed() || complete_ || data == nullptr) return 0;
  const auto* bytes = static_cast<const unsigned char*>(data);
  std::size_t used = 0;
  if (header_fill_ < header_size) {
    // The length alone already tells an oversized or empty frame: refuse it
    // before waiting for a type byte that might never come.
    while (header_fill_ < length_size && used < size) header_[header_fill_++] = bytes[used++];
    if (header_fill_ < length_size) return used;
    if (length_ == 0) {
      std::uint64_t length = 0;
      for (std::size_t i = 0; i < length_size; ++i) length |= std::uint64_t{header_[i]} << (8 * i);
      if (length == 0) {
        state_ = status::empty_frame;
        return used;
      }
      if (length > max_frame_length) {
        state_ = status::oversized;
        return used;
      }
      length_ = length;
    }
    if (used == size) return used;
    const unsigned char type = bytes[used++];
    header_[header_fill_++] = type;
    if (type != static_cast<unsigned char>(frame_type::hello) &&
        type != static_cast<unsigned char>(frame_type::message)) {
      state_ = status::unknown_type;
      return used;
    }
    type_ = static_cast<frame_type>(type);
  }
  const std::uint64_t wanted = length_ - 1 - payload_.size();
  const std::size_t take = static_cast<std::size_t>(std::min<std::uint64_t>(wanted, size - used));
  payload_.insert(payload_.end(), bytes + used, bytes + used + take);
  used += take;
  if (payload_.size() == length_ - 1) complete_ = true;
  return used;
}

void frame_reader::next() noexcept {
  if (failed()) return;
  header_fill_ = 0;
  length_ = 0;
  payload_.clear();
  // A large frame's buffer is not kept for the small ones that follow.
  if (payload_.capacity() > (1u << 20)) std::vector<unsigned char>().swap(payload_);
  complete_ = false;
}

}  // namespace parlo::ipc::frame
