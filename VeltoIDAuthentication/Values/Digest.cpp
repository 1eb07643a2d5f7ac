#include "Values/Digest.h"

namespace veltoid {

Data sha256OfString(const String& text) {
    if (!text) return {};
    return Data(platform::sha256(platform::bytesOf(text.view())));
}

std::string sha256Text(const Data& data) {
    constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    text.reserve(2 * std::tuple_size_v<platform::SHA256Digest>);
    for (const uint8_t byte : platform::sha256(data.bytes())) {
        text += kDigits[byte >> 4U];
        text += kDigits[byte & 0x0FU];
    }
    return text;
}

Data uuidBytes(const platform::UUIDBytes& uuid) { return Data(uuid); }

String randomUUIDText() { return platform::canonicalUUIDText(platform::randomUUID()); }

}  // namespace veltoid
