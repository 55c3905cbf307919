// Text helpers of the host program: UTF-16 <-> UTF-8, strict number parsing,
// escaping names for one-line output, and the system's text for a Win32 code.
// Pure functions, any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace vorbel_host {

// Unpaired surrogates become U+FFFD rather than failing: these are paths and
// arguments, shown to a person or passed on as names.
std::string to_utf8(std::wstring_view text);
// Invalid UTF-8 sequences become U+FFFD.
std::wstring to_utf16(std::string_view text);

// Decimal digits only (no sign, no blanks), within [0, max].
std::optional<std::uint32_t> parse_u32(std::string_view text,
                                       std::uint32_t max = UINT32_MAX);

// A name as one word of a text line: bytes below 0x21 and 0x7F are written
// as \xNN, so a name sent by a peer cannot break a line or a key=value pair.
// Other bytes, UTF-8 included, pass unchanged.
std::string printable(std::string_view name);

// A text as one quoted word: a double quote, the text with each backslash
// and double quote preceded by a backslash and bytes below 0x20 and 0x7F
// written as \xNN, a double quote. For paths and signer names, which hold
// blanks.
std::string quoted_word(std::string_view text);

// "err=<code> (<system text>)", or just "err=<code>" when the system has no
// text for it.
std::string describe_error(std::uint32_t code);

}  // namespace vorbel_host
