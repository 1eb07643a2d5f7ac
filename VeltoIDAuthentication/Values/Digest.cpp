#include "Values/Digest.h"

#include "Platform/encoding/HexText.h"

namespace veltoid {

Data sha256OfString(const String& text) {
    if (!text) return {};
    return Data(platform::sha256(platform::bytesOf(text.view())));
}

std::string sha256Text(const Data& data) { return platform::hexText(platform::sha256(data.bytes())); }

Data uuidBytes(const platform::UUIDBytes& uuid) { return Data(uuid); }

String randomUUIDText() { return platform::canonicalUUIDText(platform::randomUUID()); }

}  // namespace veltoid
