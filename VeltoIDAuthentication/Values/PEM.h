// The body of a PEM block (RFC 7468).
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// The decoded text between the BEGIN and END lines; a text without them is decoded whole. Null when nothing
/// is left.
Data pemBodyToData(const String& text);

}  // namespace veltoid
