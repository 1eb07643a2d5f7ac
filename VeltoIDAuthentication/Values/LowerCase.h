// Lower case for account names.
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// Every character lower-cased by Unicode's simple mapping, whatever the locale; bytes that are no UTF-8
/// stay. Null for null. Any thread.
String lowerCased(const String& text);

}  // namespace veltoid
