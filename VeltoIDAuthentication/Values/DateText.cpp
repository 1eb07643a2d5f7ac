#include "Values/DateText.h"

#include <cstdio>
#include <cstring>

namespace veltoid {
namespace {

constexpr size_t kMaxDateTextBytes = 128;
constexpr long kMaxOffset = 9'999;

bool isLeapYear(long year) { return (year % 4 == 0 && year % 100 != 0) || year % 400 == 0; }

long daysInMonth(long year, long month) {
    constexpr long kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    return month == 2 && isLeapYear(year) ? 29 : kDays[month - 1];
}

/// Days since 1970-01-01 of the proleptic Gregorian calendar, by whole 400-year eras that begin in March.
long daysFromCivil(long year, long month, long day) {
    const long shifted = month <= 2 ? year - 1 : year;
    const long era = (shifted >= 0 ? shifted : shifted - 399) / 400;
    const long yearOfEra = shifted - era * 400;
    const long dayOfYear = (153 * (month + (month > 2 ? -3 : 9)) + 2) / 5 + day - 1;
    const long dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * 146'097 + dayOfEra - 719'468;
}

struct Fields {
    long year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0, offset = 0;
};

bool readFields(const char* text, Fields& f) {
    int end = -1;
    // NOLINTBEGIN(cert-err34-c): fields are range-checked afterwards
    if (std::sscanf(text, "%ld-%ld-%ldT%ld:%ld:%ldZ%n", &f.year, &f.month, &f.day, &f.hour, &f.minute, &f.second,
                    &end) == 6 && end >= 0)
        return true;
    for (const char* format : {"%ld-%ld-%ldT%ld:%ld:%ld%ld", "%ld-%ld-%ld %ld:%ld:%ld %ld"})
        if (std::sscanf(text, format, &f.year, &f.month, &f.day, &f.hour, &f.minute, &f.second, &f.offset) == 7)
            return true;
    // NOLINTEND(cert-err34-c)
    return false;
}

}  // namespace

std::optional<double> dateFromCalendar(long year, long month, long day, long hour, long minute, long second) {
    // A leap second is read as the second after it.
    if (year < 1 || year > 9'999 || month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month) ||
        hour < 0 || hour > 23 || minute < 0 || minute > 59 || second < 0 || second > 60)
        return std::nullopt;
    return static_cast<double>(daysFromCivil(year, month, day) * 86'400 + hour * 3'600 + minute * 60 + second);
}

std::optional<double> dateFromValue(const Value& value) {
    if (const auto date = value.asDate()) return date;
    const std::optional<std::string_view> text = value.asText();
    if (!text || text->size() > kMaxDateTextBytes) return std::nullopt;

    Fields f;
    if (!readFields(std::string(*text).c_str(), f) || f.offset < -kMaxOffset || f.offset > kMaxOffset)
        return std::nullopt;
    const std::optional<double> wallClock = dateFromCalendar(f.year, f.month, f.day, f.hour, f.minute, f.second);
    if (!wallClock) return std::nullopt;
    const long hours = f.offset / 100;
    const long minutes = f.offset - 100 * hours;
    return *wallClock - static_cast<double>(hours * 3'600 + minutes * 60);
}

}  // namespace veltoid
