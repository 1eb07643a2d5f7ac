// Bytes as text.
#pragma once

#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Two lower-case hexadecimal digits for each byte. Any thread.
template <typename Text = std::string>
Text hexText(Bytes bytes) {
    constexpr char kDigits[] = "0123456789abcdef";
    Text text;
    text.reserve(2 * bytes.size());
    for (const uint8_t byte : bytes) {
        text += kDigits[byte >> 4U];
        text += kDigits[byte & 0x0FU];
    }
    return text;
}

}  // namespace platform
