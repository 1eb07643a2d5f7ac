// Dates of the proleptic Gregorian calendar at UTC. Seconds count from 1970-01-01. No time zone and no locale
// of the process takes part. Any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace platform {

struct CalendarDate {
    int64_t year = 0;
    int64_t month = 0;
    int64_t day = 0;
    int64_t hour = 0;
    int64_t minute = 0;
    int64_t second = 0;
};

/// None when there is no such day or time, or the year is not one of 1 to 9999. A second of 60, which a leap
/// second has, is the second after it.
std::optional<double> secondsOf(const CalendarDate& date);

/// The day and time of the seconds, fractions dropped towards the past; the nearest that std::chrono's
/// calendar knows for seconds beyond it, 1970-01-01 for what is no number.
CalendarDate calendarDate(double seconds);

/// The same in a form of strftime(3), which may name numeric fields of date and time only. None for seconds
/// beyond the calendar.
std::optional<std::string> calendarText(double seconds, const char* format);

/// ISO 8601 with the zone "Z".
inline constexpr const char* kISO8601 = "%Y-%m-%dT%H:%M:%SZ";

}  // namespace platform
