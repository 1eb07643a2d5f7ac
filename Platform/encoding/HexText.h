// Bytes as text.
#pragma once

#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

inline constexpr const char* kLowerCaseDigits = "0123456789abcdef";
inline constexpr const char* kUpperCaseDigits = "0123456789ABCDEF";

/// Two hexadecimal digits for each byte. Any thread.
template <typename Text = std::string>
Text hexText(Bytes bytes, const char* digits = kLowerCaseDigits) {
    Text text;
    text.reserve(2 * bytes.size());
    for (const uint8_t byte : bytes) {
        text += digits[byte >> 4U];
        text += digits[byte & 0x0FU];
    }
    return text;
}

}  // namespace platform
