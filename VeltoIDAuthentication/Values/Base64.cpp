#include "Values/Base64.h"

#include <algorithm>

#include "Platform/encoding/Base64Codec.h"

namespace veltoid {
namespace {

platform::Base64Lines xmlrpcLines(bool separateLines) {
    return separateLines ? platform::Base64Lines{kBase64LineLength, "\r\n"} : platform::Base64Lines();
}

}  // namespace

String base64Encode(const Data& data, std::string_view prefix, std::string_view suffix, size_t lineLength) {
    if (!data || data.size() > kMaxBase64InputBytes) return nullptr;
    const platform::Base64Lines lines{lineLength, "\n"};
    const size_t bodySize = platform::base64Size(data.size());
    const size_t linesSize = platform::base64Size(data.size(), lines);
    const bool endsFullLine = lineLength != 0 && bodySize != 0 && bodySize % lineLength == 0;
    const size_t size = prefix.size() + linesSize + (endsFullLine ? 1 : 0) + suffix.size();
    return String::writtenBy(size, [&](char* out) {
        out = std::copy(prefix.begin(), prefix.end(), out);
        platform::writeBase64(data.bytes(), lines, out);
        out += linesSize;
        if (endsFullLine) *out++ = '\n';
        std::copy(suffix.begin(), suffix.end(), out);
    });
}

Data base64Decode(const String& text) {
    if (text.empty()) return {};
    return Data::filledBy(text.view().size() / 4 * 3,
                          [&](uint8_t* out) { return platform::readPaddedBase64(text.view(), out); });
}

void appendXMLRPCBase64(platform::SecretText& text, platform::Bytes bytes, bool separateLines) {
    const platform::Base64Lines lines = xmlrpcLines(separateLines);
    const size_t before = text.size();
    text.resize(before + platform::base64Size(bytes.size(), lines));
    platform::writeBase64(bytes, lines, text.data() + before);
}

String xmlrpcBase64Encode(platform::Bytes bytes, bool separateLines) {
    const platform::Base64Lines lines = xmlrpcLines(separateLines);
    return String::writtenBy(platform::base64Size(bytes.size(), lines),
                             [&](char* out) { platform::writeBase64(bytes, lines, out); });
}

Data xmlrpcBase64Decode(std::string_view text) {
    return Data::filledBy((text.size() + 3) / 4 * 3,
                          [&](uint8_t* out) { return platform::readBase64(text, out); });
}

}  // namespace veltoid
