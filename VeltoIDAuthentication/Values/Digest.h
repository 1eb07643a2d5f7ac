// Digests and identifiers of texts.
#pragma once

#include "Platform/Crypto.h"
#include "Values/Value.h"

namespace veltoid {

/// SHA-256 of the UTF-8 text (32 bytes); null for null.
Data sha256OfString(const String& text);

/// The 16 bytes in canonical order.
Data uuidBytes(const platform::UUIDBytes& uuid);

/// A new random UUID in canonical text form.
String randomUUIDText();

}  // namespace veltoid
