// Base64 (RFC 4648 alphabet). Bytes and texts stay the caller's, who knows whether they are secret. Any
// thread.
#pragma once

#include <string_view>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// How a body is broken into lines: `lineBreak` stands between lines of `length` characters; 0: a single
/// line.
struct Base64Lines {
    size_t length = 0;
    std::string_view lineBreak = {};
};

/// The characters of a body without line breaks.
constexpr size_t base64Size(size_t bytes) { return (bytes + 2) / 3 * 4; }

/// The characters of a body with its line breaks.
size_t base64Size(size_t bytes, const Base64Lines& lines);

/// Writes base64Size(bytes.size(), lines) characters.
void writeBase64(Bytes bytes, const Base64Lines& lines, char* out);

// The readers write at most (text.size() + 3) / 4 * 3 bytes and return how many.

/// Skips every byte outside the alphabet, "=" included; a last group of three symbols gives two bytes, of two
/// one byte.
size_t readBase64(std::string_view text, uint8_t* out);

/// Reads up to the first "<", skipping everything outside the alphabet. A group that ends with "=" is shorter
/// by as many bytes; symbols left over at the end are dropped.
size_t readPaddedBase64(std::string_view text, uint8_t* out);

/// Replaces `data` by what the text says; white space may be anywhere in it. False, with the data as it was,
/// when there is anything else, or the padding is not the one that the last group needs.
bool decodeStrictBase64(std::string_view text, SecretBytes& data);

}  // namespace platform
