// Texts in UTF-8 (RFC 3629): no overlong forms, no surrogates, nothing beyond U+10FFFF. Any thread.
#pragma once

#include <optional>
#include <string_view>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

bool isASCII(std::string_view text);

bool isUTF8(std::string_view text);

/// Takes one code point from the front of a text that is not empty; none, with the text as it was, when it
/// does not start with a well-formed one.
std::optional<char32_t> takeCodePoint(std::string_view& text);

void appendUTF8(SecretText& text, char32_t point);

}  // namespace platform
