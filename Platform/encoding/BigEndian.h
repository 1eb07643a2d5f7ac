// Numbers as bytes, the most significant one first.
#pragma once

#include <cstdint>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Appends the lowest `width` bytes of the value; more than eight are filled up with zeros.
template <typename Container>
void appendBigEndian(Container& output, uint64_t value, size_t width) {
    for (size_t i = width; i-- > 0;) output.push_back(static_cast<uint8_t>(i < 8 ? value >> (8 * i) : 0));
}

/// The number of up to eight bytes.
inline uint64_t bigEndian(Bytes bytes) {
    uint64_t value = 0;
    for (const uint8_t byte : bytes) value = value << 8U | byte;
    return value;
}

}  // namespace platform
