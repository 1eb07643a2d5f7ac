// Texts for log lines: masked account names, queues, durations and moments. Any thread.
#pragma once

#include <optional>
#include <string>

#include "Platform/runtime/WorkQueue.h"
#include "Values/Value.h"

namespace veltoid {

/// The account name with most of it masked, as a described string: the first and last two characters of what
/// stands before the "@" stay (of the whole name when there is none), the domain keeps its dots only. "NULL"
/// for null.
std::string describeAccountForLog(const String& accountName);

/// "(NAME, NAME)", masked; elements that are not strings appear as "NULL".
std::string describeAccountListForLog(const Array& accountNames);

/// "NULL" for none, "(current)" for the queue that the caller is on, otherwise its label.
std::string describeQueueForLog(const platform::WorkQueue* queue);

/// "forever" for none, the seconds until then followed by "s" for a moment (seconds since 1970) in the
/// future, else "now".
std::string describeDispatchTime(std::optional<double> time);

/// Weeks and days from three days up, hours as well from twelve hours up, minutes from one hour up, else
/// seconds.
std::string describeDuration(double seconds);

}  // namespace veltoid
