#include "Platform/encoding/UTF8.h"

#include <cstdint>
#include <cstring>

namespace platform {
namespace {

/// How many bytes from the start are ASCII, in whole groups of eight and one by one after them.
size_t leadingASCII(std::string_view text) {
    constexpr uint64_t kHighBits = 0x8080808080808080;
    size_t length = 0;
    for (uint64_t eight = 0; length + sizeof eight <= text.size(); length += sizeof eight) {
        std::memcpy(&eight, text.data() + length, sizeof eight);
        if ((eight & kHighBits) != 0) break;
    }
    while (length < text.size() && static_cast<uint8_t>(text[length]) < 0x80) ++length;
    return length;
}

}  // namespace

bool isASCII(std::string_view text) { return leadingASCII(text) == text.size(); }

bool isUTF8(std::string_view text) {
    for (;;) {
        text.remove_prefix(leadingASCII(text));
        if (text.empty()) return true;
        if (!takeCodePoint(text)) return false;
    }
}

std::optional<char32_t> takeCodePoint(std::string_view& text) {
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

void appendUTF8(SecretText& text, char32_t point) {
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

}  // namespace platform
