#include "Platform/encoding/UTF8.h"

#include <optional>

#include "Platform/runtime/SecureMemory.h"

namespace platform {
namespace {

/// What may follow the first byte of a character: how many bytes, and the range of the first of them.
struct Continuation {
    size_t count;
    unsigned char lowest = 0x80;
    unsigned char highest = 0xBF;
};

std::optional<Continuation> continuationOf(unsigned char first) {
    if (first < 0x80) return Continuation{0};
    if (first < 0xC2 || first > 0xF4) return std::nullopt;
    if (first < 0xE0) return Continuation{1};
    // The narrower ranges leave out overlong forms, surrogates and what lies beyond U+10FFFF.
    if (first == 0xE0) return Continuation{2, 0xA0};
    if (first == 0xED) return Continuation{2, 0x80, 0x9F};
    if (first < 0xF0) return Continuation{2};
    if (first == 0xF0) return Continuation{3, 0x90};
    if (first == 0xF4) return Continuation{3, 0x80, 0x8F};
    return Continuation{3};
}

}  // namespace

bool isUTF8(std::string_view text) {
    const Bytes bytes = bytesOf(text);
    for (size_t i = 0; i < bytes.size();) {
        const auto continuation = continuationOf(bytes[i++]);
        if (!continuation || bytes.size() - i < continuation->count) return false;
        for (size_t k = 0; k < continuation->count; ++k, ++i) {
            const unsigned char lowest = k == 0 ? continuation->lowest : 0x80;
            const unsigned char highest = k == 0 ? continuation->highest : 0xBF;
            if (bytes[i] < lowest || bytes[i] > highest) return false;
        }
    }
    return true;
}

}  // namespace platform
