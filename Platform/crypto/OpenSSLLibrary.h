// libcrypto for the sources that call it: loaded with the first call, its errors as text.
//
// The library leaves copies of keys in blocks that it has freed, its decoders and key generation above all.
// Before its first use in the process it is therefore made to wipe every block that it frees.
#pragma once

#include <string>

#include "Platform/runtime/LazyLibrary.h"
#include "Platform/runtime/SecureMemory.h"

namespace platform::openssl {

extern const LazyLibrary library;

/// Loads and prepares the library, as the first use of `library` does. For code that comes to it by another
/// way (linked with it, or through libcurl), before its first use. False, with one log line, when it was in
/// use already and will not wipe. Any thread.
bool prepare();

/// The library's own words for what just failed on the calling thread, whose error queue is empty afterwards.
std::string takeReason();

/// What the library's decoder reads; null when the bytes are more than `limit` or not exactly one such
/// object.
template <typename Owner, typename Decode>
Owner decoded(const Decode& decode, Bytes der, size_t limit) {
    if (der.empty() || der.size() > limit) return nullptr;
    const unsigned char* end = der.data();
    Owner object(decode(nullptr, &end, static_cast<long>(der.size())));
    if (end != der.data() + der.size()) object.reset();
    return object;
}

/// What the library's encoder writes for the object; empty when it refuses.
template <typename Container, typename Encode, typename Object>
Container encoded(const Encode& encode, const Object* object) {
    const int size = encode(object, nullptr);
    if (size <= 0) return {};
    Container der(static_cast<size_t>(size));
    unsigned char* end = der.data();
    if (encode(object, &end) != size) return {};
    return der;
}

/// Empties the calling thread's error queue, where a failure needs no words.
void clearErrors();

}  // namespace platform::openssl
