// Values as one line of text for the log.
#pragma once

#include <string>

#include "Values/Value.h"

namespace veltoid {

/// Recursive; equal dictionaries print alike, dates print relative to now and as local calendar time, data as
/// text when printable and as hexadecimal otherwise, and the agent's error codes by name. Any thread.
std::string describeValue(const Value& value);

/// Appends the bytes, control characters escaped: 0 as "(null)", tab, line feed and carriage return as \t \n
/// \r, others below 32 as a backslash and the character 96 higher.
void appendEscapedBytes(std::string& text, const char* bytes, size_t length);

}  // namespace veltoid
