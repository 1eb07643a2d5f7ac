// Texts from outside.
#pragma once

#include <string_view>

namespace platform {

/// Whether the text is well-formed UTF-8 (RFC 3629): no overlong forms, no surrogates. Any thread.
bool isUTF8(std::string_view text);

}  // namespace platform
