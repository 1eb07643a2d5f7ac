// The texts of scalars and characters in the XML form of property lists. Internal to the PropertyList
// sources.
#pragma once

#include <optional>
#include <string_view>
#include <variant>

#include "Platform/runtime/SecureMemory.h"

namespace platform::propertylist {

inline bool isSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

/// How many bytes from the start are characters that stand for themselves wherever text may be: no markup, no
/// carriage return, nothing that XML or UTF-8 does not have. "]" and ">" are left to the caller, too, since
/// "]]>" is markup.
size_t plainTextLength(std::string_view text);

// Reading: white space around a number or date is passed over; none when the text is anything else.

/// Signed when it fits.
std::optional<std::variant<int64_t, uint64_t>> readInteger(std::string_view text);
std::optional<double> readReal(std::string_view text);
/// Of the form "2014-03-05T17:04:00Z": seconds since 1970-01-01 UTC.
std::optional<double> readDate(std::string_view text);
/// Replaces `data` by what the base64 text says; white space may be anywhere in it. False when it is none.
bool readBase64(std::string_view text, SecretBytes& data);

// Writing, to the end of `output`.

void appendText(SecretBytes& output, std::string_view text);
void appendReal(SecretBytes& output, double value);
/// False for dates outside the years 1 to 9999.
bool appendDate(SecretBytes& output, double seconds);
void appendBase64(SecretBytes& output, Bytes data);
/// The text with its markup escaped; false when it has characters that XML or UTF-8 does not have.
bool appendEscaped(SecretBytes& output, std::string_view utf8);

}  // namespace platform::propertylist
