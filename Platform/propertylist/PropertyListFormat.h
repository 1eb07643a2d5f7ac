// The numbers of the binary property-list layout and the conversions that its writer and reader share.
// Internal to the PropertyList sources.
#pragma once

#include <algorithm>
#include <bit>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string_view>

#include "Platform/runtime/SecureMemory.h"

namespace platform::propertylist {

inline constexpr std::string_view kHeader = "bplist00";
/// Of whatever version.
inline constexpr std::string_view kAnyHeader = "bplist";
inline constexpr size_t kTrailerBytes = 32;
inline constexpr size_t kUUIDBytes = 16;
/// The binary form counts from 2001-01-01 00:00:00 UTC.
inline constexpr double kReferenceDate = 978307200.0;
/// A count of this or more does not fit into the marker and follows it as an integer.
inline constexpr uint64_t kCountFollows = 0x0F;

enum Marker : uint8_t {
    kNull = 0x00,
    kFalse = 0x08,
    kTrue = 0x09,
    kUUID = 0x0E,
    kInteger = 0x10,
    kFloat = 0x22,
    kDouble = 0x23,
    kDate = 0x33,
    kData = 0x40,
    kASCII = 0x50,
    kUTF16 = 0x60,
    kArray = 0xA0,
    kDictionary = 0xD0,
};

inline void appendBigEndian(SecretBytes& output, uint64_t value, size_t width) {
    for (size_t i = width; i-- > 0;) output.push_back(static_cast<uint8_t>(value >> (8 * i)));
}

inline uint64_t bigEndian(Bytes bytes) {
    uint64_t value = 0;
    for (const uint8_t byte : bytes) value = value << 8U | byte;
    return value;
}

/// The number of 1 to 8 bytes at `bytes`, behind which eight bytes can be read.
inline uint64_t bigEndianAt(const uint8_t* bytes, size_t width) {
    uint64_t value = 0;
    std::memcpy(&value, bytes, sizeof value);
    if constexpr (std::endian::native == std::endian::little) value = __builtin_bswap64(value);
    return value >> (64 - 8 * width);
}

/// The smallest of 1, 2, 4 and 8 bytes that holds the value.
inline size_t widthOf(uint64_t value) {
    if (value <= UINT8_MAX) return 1;
    if (value <= UINT16_MAX) return 2;
    return value <= UINT32_MAX ? 4 : 8;
}

inline bool isASCII(std::string_view text) {
    constexpr uint64_t kHighBits = 0x8080808080808080;
    constexpr size_t kAtOnce = sizeof(uint64_t);
    if (text.size() < kAtOnce)
        return std::ranges::all_of(text, [](char c) { return static_cast<uint8_t>(c) < 0x80; });
    uint64_t seen = 0;
    const auto look = [&](size_t at) {
        uint64_t eight = 0;
        std::memcpy(&eight, text.data() + at, kAtOnce);
        seen |= eight;
    };
    for (size_t at = 0; at + kAtOnce <= text.size(); at += kAtOnce) look(at);
    // The rest, together with some that were seen.
    look(text.size() - kAtOnce);
    return (seen & kHighBits) == 0;
}

/// Takes one code point from the front of `text`; none when it does not start with well-formed UTF-8 (RFC
/// 3629).
inline std::optional<char32_t> takeCodePoint(std::string_view& text) {
    const auto lead = static_cast<uint8_t>(text.front());
    const size_t length = lead < 0x80   ? 1
                          : lead < 0xC2 ? 0
                          : lead < 0xE0 ? 2
                          : lead < 0xF0 ? 3
                          : lead < 0xF5 ? 4
                                        : 0;
    if (length == 0 || text.size() < length) return std::nullopt;
    char32_t point = length == 1 ? lead : lead & (0x7FU >> length);
    for (size_t i = 1; i < length; ++i) {
        const auto next = static_cast<uint8_t>(text[i]);
        if ((next & 0xC0U) != 0x80) return std::nullopt;
        point = point << 6U | (next & 0x3FU);
    }
    const bool overlong = (length == 3 && point < 0x800) || (length == 4 && point < 0x10000);
    const bool surrogate = point >= 0xD800 && point <= 0xDFFF;
    if (overlong || surrogate || point > 0x10FFFF) return std::nullopt;
    text.remove_prefix(length);
    return point;
}

inline void appendUTF8(SecretText& text, char32_t point) {
    const auto tail = [&](unsigned shift) { text += static_cast<char>(0x80U | (point >> shift & 0x3FU)); };
    if (point < 0x80) {
        text += static_cast<char>(point);
    } else if (point < 0x800) {
        text += static_cast<char>(0xC0U | point >> 6U);
        tail(0);
    } else if (point < 0x10000) {
        text += static_cast<char>(0xE0U | point >> 12U);
        tail(6), tail(0);
    } else {
        text += static_cast<char>(0xF0U | point >> 18U);
        tail(12), tail(6), tail(0);
    }
}

}  // namespace platform::propertylist
