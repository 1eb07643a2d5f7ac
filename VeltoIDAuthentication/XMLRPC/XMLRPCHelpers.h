// Texts and bytes of the XML-RPC wire form.
#pragma once

#include "Platform/runtime/SecureMemory.h"
#include "Values/Value.h"

namespace veltoid {

// All operations may be called from any thread.

/// The text with & " ' > < replaced by &amp; &quot; &#x27; &gt; &lt;; everything else stays as it is.
platform::SecretText escapedString(std::string_view text);

/// Like escapedString, at the end of `out`.
void appendEscapedString(platform::SecretText& out, std::string_view text);

/// Base64 in lines of 64 characters with CR LF between them and none after the last; empty for no bytes.
String base64EncodedString(platform::Bytes bytes);

/// The bytes of a base64 text, white space and everything else outside the alphabet skipped; empty when the
/// text holds a non-ASCII character.
Data dataFromBase64String(std::string_view text);

/// A new random UUID: 36 characters with hyphens.
String stringByGeneratingUUID();

}  // namespace veltoid
