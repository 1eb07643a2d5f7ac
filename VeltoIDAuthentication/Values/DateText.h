// Dates in server answers.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// A Date as it is (seconds since 1970 UTC); a String of one of the forms "2014-03-05T17:04:00Z",
/// "2014-03-05T09:04:00-0800" and "2014-03-05 09:04:00 -0800"; none for anything else. Any thread.
std::optional<double> dateFromValue(const Value& value);

}  // namespace veltoid
