// Feeds arbitrary bytes to the readers of property lists of both forms. Whatever they accept must be a sound
// value: written and read again it gives the same.
#include <cstdlib>

#include "Platform/propertylist/PropertyList.h"

namespace {

using platform::Bytes;
using platform::SecretBytes;

/// The list read and written again in the binary form; whether it was accepted.
bool rewrite(Bytes list, SecretBytes& written) {
    bool isAccepted = false;
    written = platform::writeBinaryPropertyList(
        [&](platform::ValueSink& sink) { isAccepted = platform::readPropertyList(list, sink); });
    return isAccepted;
}

void require(bool condition) {
    if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    SecretBytes list;
    if (!rewrite(Bytes(data, size), list)) return 0;
    SecretBytes again;
    require(rewrite(list, again));
    // By size, since a list may hold numbers that are not equal to themselves.
    require(!list.empty() && again.size() == list.size());
    return 0;
}
