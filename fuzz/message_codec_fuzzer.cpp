// Fuzzes the decoder of the messaging library's wire form, which reads bytes
// that come from another process through the IPC library.
//
// On every input: a refusal leaves an empty message and names a known
// reason. An accepted input is canonical: the message passes the encoder's
// limits, and encoding it gives back exactly the input bytes, into a buffer
// of exactly that size and not into one byte less.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <vector>

#include "fuzz_check.h"
#include "message_codec.h"

using namespace parlo::codec;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  message_content content;
  content.id = 0xA5A5A5A5u;
  content.fields.push_back(blob_field{"sentinel", {1, 2, 3}});
  const status result = decode(data, size, content);
  FUZZ_CHECK(std::strcmp(status_text(result), "unknown status") != 0);
  if (result != status::ok) {
    FUZZ_CHECK(content.id == 0);
    FUZZ_CHECK(content.fields.empty());
    return 0;
  }

  FUZZ_CHECK(content.fields.size() <= max_fields);
  FUZZ_CHECK(check_limits(content) == status::ok);
  FUZZ_CHECK(encoded_size(content) == size);

  std::vector<unsigned char> again;
  FUZZ_CHECK(encode(content, again) == status::ok);
  FUZZ_CHECK(again.size() == size);
  FUZZ_CHECK(std::memcmp(again.data(), data, size) == 0);

  std::vector<unsigned char> exact(size);
  std::uint64_t written = 1;
  FUZZ_CHECK(encode_into(content, exact.data(), size - 1, written) == status::too_large);
  FUZZ_CHECK(written == 0);
  FUZZ_CHECK(encode_into(content, exact.data(), size, written) == status::ok);
  FUZZ_CHECK(written == size);
  FUZZ_CHECK(exact == again);
  return 0;
}
