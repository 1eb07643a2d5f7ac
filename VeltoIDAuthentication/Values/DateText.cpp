#include "Values/DateText.h"

#include <chrono>
#include <cstdio>
#include <string>

namespace veltoid {
namespace {

constexpr size_t kMaxDateTextBytes = 128;
constexpr long kMaxOffset = 9'999;

struct Fields {
    long year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0, offset = 0;
};

bool readFields(const char* text, Fields& f) {
    int end = -1;
    // NOLINTBEGIN(cert-err34-c): fields are range-checked afterwards
    if (std::sscanf(text, "%ld-%ld-%ldT%ld:%ld:%ldZ%n", &f.year, &f.month, &f.day, &f.hour, &f.minute,
                    &f.second, &end) == 6 &&
        end >= 0)
        return true;
    for (const char* format : {"%ld-%ld-%ldT%ld:%ld:%ld%ld", "%ld-%ld-%ld %ld:%ld:%ld %ld"})
        if (std::sscanf(text, format, &f.year, &f.month, &f.day, &f.hour, &f.minute, &f.second, &f.offset) ==
            7)
            return true;
    // NOLINTEND(cert-err34-c)
    return false;
}

/// Seconds since 1970 of the fields as a time at UTC; none when they are no date or time.
std::optional<double> wallClockOf(const Fields& f) {
    // A leap second is read as the second after it.
    if (f.year < 1 || f.year > 9'999 || f.month < 1 || f.month > 12 || f.day < 1 || f.day > 31 ||
        f.hour < 0 || f.hour > 23 || f.minute < 0 || f.minute > 59 || f.second < 0 || f.second > 60)
        return std::nullopt;
    const std::chrono::year_month_day date{std::chrono::year(static_cast<int>(f.year)),
                                           std::chrono::month(static_cast<unsigned>(f.month)),
                                           std::chrono::day(static_cast<unsigned>(f.day))};
    if (!date.ok()) return std::nullopt;
    const std::chrono::sys_seconds midnight = std::chrono::sys_days(date);
    return static_cast<double>(midnight.time_since_epoch().count() + f.hour * 3'600 + f.minute * 60 +
                               f.second);
}

}  // namespace

std::optional<double> dateFromValue(const Value& value) {
    if (const auto date = value.asDate()) return date;
    const std::optional<std::string_view> text = value.asText();
    if (!text || text->size() > kMaxDateTextBytes) return std::nullopt;

    Fields f;
    if (!readFields(std::string(*text).c_str(), f) || f.offset < -kMaxOffset || f.offset > kMaxOffset)
        return std::nullopt;
    const std::optional<double> wallClock = wallClockOf(f);
    if (!wallClock) return std::nullopt;
    const long hours = f.offset / 100;
    const long minutes = f.offset - 100 * hours;
    return *wallClock - static_cast<double>(hours * 3'600 + minutes * 60);
}

}  // namespace veltoid
