#include "XMLRPC/XMLRPCHelpers.h"

#include <algorithm>
#include <array>
#include <optional>

#include "Values/Base64.h"
#include "Values/Digest.h"

namespace veltoid {
namespace {

constexpr unsigned char kLastASCII = 0x7F;

/// At least what a string keeps inside itself, where it would not be wiped.
constexpr size_t kKeptInside = 32;

/// What replaces each byte; empty for the many that stay.
constexpr std::array<std::string_view, 256> kReplacements = [] {
    std::array<std::string_view, 256> replacements{};
    replacements['&'] = "&amp;";
    replacements['"'] = "&quot;";
    replacements['\''] = "&#x27;";
    replacements['>'] = "&gt;";
    replacements['<'] = "&lt;";
    return replacements;
}();

/// Beside the replacements because 256 bytes stay in the cache where 4 KiB do not.
constexpr std::array<bool, 256> kIsReplaced = [] {
    std::array<bool, 256> replaced{};
    for (size_t byte = 0; byte < replaced.size(); ++byte) replaced[byte] = !kReplacements[byte].empty();
    return replaced;
}();

/// What may follow the first byte of a character: how many bytes, and the range of the first of them.
struct Continuation {
    size_t count;
    unsigned char lowest = 0x80;
    unsigned char highest = 0xBF;
};

std::optional<Continuation> continuationOf(unsigned char first) {
    if (first <= kLastASCII) return Continuation{0};
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

void appendEscapedString(platform::SecretText& out, std::string_view text) {
    size_t copied = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const auto byte = static_cast<unsigned char>(text[i]);
        if (!kIsReplaced[byte]) continue;
        out.append(text.substr(copied, i - copied)).append(kReplacements[byte]);
        copied = i + 1;
    }
    out.append(text.substr(copied));
}

platform::SecretText escapedString(std::string_view text) {
    platform::SecretText escaped;
    escaped.reserve(text.size() + kKeptInside);
    appendEscapedString(escaped, text);
    return escaped;
}

String base64EncodedString(platform::Bytes bytes) { return xmlrpcBase64Encode(bytes, true); }

Data dataFromBase64String(std::string_view text) {
    const bool isASCII = std::all_of(text.begin(), text.end(),
                                     [](char c) { return static_cast<unsigned char>(c) <= kLastASCII; });
    return isASCII ? xmlrpcBase64Decode(text) : Data(platform::Bytes());
}

bool isUTF8(std::string_view text) {
    const platform::Bytes bytes = platform::bytesOf(text);
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

String stringByGeneratingUUID() { return randomUUIDText(); }

}  // namespace veltoid
