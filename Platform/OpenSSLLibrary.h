// libcrypto for the sources that call it: loaded with the first call, its errors as text.
#pragma once

#include <string>

#include "Platform/LazyLibrary.h"

namespace platform::openssl {

extern const LazyLibrary library;

/// The library's own words for what just failed on the calling thread, whose error queue is empty afterwards.
std::string takeReason();

/// Empties the calling thread's error queue, where a failure needs no words.
void clearErrors();

}  // namespace platform::openssl
