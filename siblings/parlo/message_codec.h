// The wire form of a parlo message: its 32-bit id and its named blob fields
// as one byte string. parlo.dll hands this form to the IPC library's taps and
// decodes it again in parlo_inject, so that a message can cross a pipe.
//
// Pure C++17 without any system header: it builds natively (fuzzing,
// sanitizers) as well as for Windows. Decoding trusts nothing in the input.
//
// Layout, every integer little-endian:
//
//   offset  size  field
//   0       4     magic "PRL1" (50 52 4C 31)
//   4       4     message id
//   8       4     field count, at most max_fields
//   12      ...   the fields, each:
//                   2  name length n, 1..max_name_length
//                   4  data size d
//                   n  name bytes (no zero byte)
//                   d  data bytes
//
// Nothing follows the last field. Names are unique within a message. The
// names and data of all fields together hold at most max_content_size bytes.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace parlo::codec {

inline constexpr unsigned char magic[4] = {'P', 'R', 'L', '1'};
inline constexpr std::size_t header_size = 12;
inline constexpr std::size_t field_header_size = 6;

inline constexpr std::uint32_t max_fields = 1024;
inline constexpr std::size_t max_name_length = 255;
inline constexpr std::uint64_t max_content_size = 16u << 20;
inline constexpr std::uint64_t max_encoded_size =
    header_size + std::uint64_t{max_fields} * field_header_size + max_content_size;

struct blob_field {
  std::string name;
  std::vector<unsigned char> data;
};

// A message's content, fields in the order they were first set.
struct message_content {
  std::uint32_t id = 0;
  std::vector<blob_field> fields;
};

enum class status {
  ok,
  truncated,        // the input ends inside the header or a field
  bad_magic,        // not a message of this format
  too_many_fields,  // more than max_fields
  bad_name,         // empty, longer than max_name_length, or holds a zero byte
  duplicate_name,   // two fields of one name
  too_large,        // over max_content_size or max_encoded_size
  trailing_bytes,   // bytes after the last field
};

// A short English text for `value`, e.g. "truncated".
const char* status_text(status value) noexcept;

// Whether `content` stays within the limits above; encode refuses it
// otherwise.
status check_limits(const message_content& content) noexcept;

// Size of the encoding of `content` (which must pass check_limits).
std::uint64_t encoded_size(const message_content& content) noexcept;

// Writes the encoding into `buffer`, which holds `capacity` bytes; `written`
// receives the size. status::too_large when the buffer is too small.
status encode_into(const message_content& content, void* buffer, std::uint64_t capacity,
                   std::uint64_t& written) noexcept;

// Replaces `out` with the encoding. May throw std::bad_alloc.
status encode(const message_content& content, std::vector<unsigned char>& out);

// Decodes `size` bytes into `out`. Only on ok does `out` hold the message;
// otherwise it is left empty. At most `size` bytes are read, and nothing is
// allocated before the sizes that govern it have been checked against the
// input. May throw std::bad_alloc.
status decode(const void* bytes, std::size_t size, message_content& out);

}  // namespace parlo::codec
