// Lower case for account names.
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// Every character lower-cased by the current locale's rules; bytes that the locale cannot read stay, A to Z
/// aside. Null for null. Any thread.
String lowerCased(const String& text);

}  // namespace veltoid
