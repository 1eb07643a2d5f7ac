// libcrypto for the sources that call it: loaded with the first call, its errors as text.
//
// The library leaves copies of keys in blocks that it has freed, its decoders and key generation above all.
// Before its first use in the process it is therefore made to wipe every block that it frees.
#pragma once

#include <string>

#include "Platform/runtime/LazyLibrary.h"

namespace platform::openssl {

extern const LazyLibrary library;

/// Loads and prepares the library, which `library` does by itself: for those who come to it by another way,
/// being linked with it or through libcurl, before they use it. False (and one log line) when it was in use
/// already and will not wipe. Any thread.
bool prepare();

/// The library's own words for what just failed on the calling thread, whose error queue is empty afterwards.
std::string takeReason();

/// Empties the calling thread's error queue, where a failure needs no words.
void clearErrors();

}  // namespace platform::openssl
