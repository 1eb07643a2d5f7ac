#include "Values/Digest.h"

namespace veltoid {

Data sha256OfString(const String& text) {
    if (!text) return {};
    return Data(platform::sha256(platform::bytesOf(text.view())));
}

Data uuidBytes(const platform::UUIDBytes& uuid) { return Data(uuid); }

String randomUUIDText() { return platform::canonicalUUIDText(platform::randomUUID()); }

}  // namespace veltoid
