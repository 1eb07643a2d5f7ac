#include "XMLRPC/XMLRPCHelpers.h"

#include <algorithm>
#include <array>

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

String stringByGeneratingUUID() { return randomUUIDText(); }

}  // namespace veltoid
