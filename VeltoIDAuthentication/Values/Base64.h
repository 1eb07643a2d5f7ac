// Base64 (RFC 4648 alphabet): the agent's own codec, with framing text and line feeds, and the XML-RPC
// library's.
#pragma once

#include "Platform/runtime/SecureMemory.h"
#include "Values/Value.h"

namespace veltoid {

inline constexpr size_t kBase64LineLength = 64;
inline constexpr size_t kMaxBase64InputBytes = 1'073'741'822;

/// prefix + body + suffix; a line feed follows every `lineLength`-th character of the body, padding counted
/// (0: none). Null for data that is null or longer than kMaxBase64InputBytes.
String base64Encode(const Data& data, std::string_view prefix = {}, std::string_view suffix = {},
                    size_t lineLength = kBase64LineLength);

/// Reads up to the first "<", skipping everything outside the alphabet; symbols left over at the end are
/// dropped. Null for text that is null or empty.
Data base64Decode(const String& text);

/// Appends the base64 text of the bytes; with `separateLines` a CR LF stands between lines of 64 characters.
void appendXMLRPCBase64(platform::SecretText& text, platform::Bytes bytes, bool separateLines);

/// Like appendXMLRPCBase64, as a text of its own.
String xmlrpcBase64Encode(platform::Bytes bytes, bool separateLines);

/// Skips every byte outside the alphabet, "=" included; a last group of three symbols gives two bytes, of two
/// one byte.
Data xmlrpcBase64Decode(std::string_view text);

}  // namespace veltoid
