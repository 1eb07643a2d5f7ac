// Reading the texts of XML-RPC scalars. Texts come trimmed; one that cannot be read gives a neutral value,
// never a failure. No locale and no time zone of the process takes part.
#pragma once

#include <array>
#include <optional>
#include <string_view>

#include "Values/Value.h"

namespace veltoid::xmlrpc {

/// One way to write a date: with or without hyphens in the calendar part, with or without a zone at the end.
struct DateFormat {
    bool hyphens;
    bool zone;
};

/// In the order in which parseDate tries them: the basic and the extended calendar form of ISO 8601, zoned
/// ones first.
inline constexpr std::array<DateFormat, 4> kDateFormats = {
    {{false, true}, {true, true}, {false, false}, {true, false}}};

// All operations may be called from any thread.

/// The text without Unicode white space and line breaks at both ends. A view into `text`.
std::string_view parseString(std::string_view text);

/// The leading integer, at the nearest limit when it does not fit; 0 when there is none.
int32_t parseInteger(std::string_view text);

/// The leading decimal number, at the nearest finite one when it does not fit; 0.0 when there is none.
double parseDouble(std::string_view text);

/// True exactly for "1".
bool parseBoolean(std::string_view text);

/// The date in the first format that reads the whole text; Null when none does.
Value parseDate(std::string_view text);

/// Seconds since 1970-01-01 00:00:00 UTC. A zone is "Z" or an offset such as "+0100" or "-08:00"; without one
/// the text is at UTC. None unless the whole text is in this format and names an existing second.
std::optional<double> parseDateString(std::string_view text, DateFormat withFormat);

/// See dataFromBase64String.
Data parseData(std::string_view text);

}  // namespace veltoid::xmlrpc
