// Digests and identifiers of texts.
#pragma once

#include <string>

#include "Platform/crypto/Crypto.h"
#include "Values/Value.h"

namespace veltoid {

/// SHA-256 of the UTF-8 text (32 bytes); null for null.
Data sha256OfString(const String& text);

/// SHA-256 of the bytes as 64 lower-case hexadecimal digits.
std::string sha256Text(const Data& data);

/// The 16 bytes in canonical order.
Data uuidBytes(const platform::UUIDBytes& uuid);

/// A new random UUID in canonical text form.
String randomUUIDText();

}  // namespace veltoid
