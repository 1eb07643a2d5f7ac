#include "Platform/encoding/CalendarText.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <ctime>

namespace platform {
namespace {

constexpr double secondsAt(std::chrono::sys_days day) {
    return static_cast<double>(std::chrono::sys_seconds(day).time_since_epoch().count());
}

constexpr double kMinSeconds = secondsAt(std::chrono::year::min() / 1 / 1);
constexpr double kMaxSeconds = secondsAt(std::chrono::year::max() / 12 / 31);

}  // namespace

std::optional<double> secondsOf(const CalendarDate& date) {
    const auto within = [](int64_t value, int64_t lowest, int64_t highest) {
        return lowest <= value && value <= highest;
    };
    if (!within(date.year, 1, 9'999) || !within(date.month, 1, 12) || !within(date.day, 1, 31) ||
        !within(date.hour, 0, 23) || !within(date.minute, 0, 59) || !within(date.second, 0, 60))
        return std::nullopt;
    const std::chrono::year_month_day day{std::chrono::year(static_cast<int>(date.year)),
                                          std::chrono::month(static_cast<unsigned>(date.month)),
                                          std::chrono::day(static_cast<unsigned>(date.day))};
    if (!day.ok()) return std::nullopt;
    const std::chrono::sys_seconds midnight = std::chrono::sys_days(day);
    return static_cast<double>(midnight.time_since_epoch().count() + date.hour * 3'600 + date.minute * 60 +
                               date.second);
}

CalendarDate calendarDate(double seconds) {
    using namespace std::chrono;
    const double known = std::isnan(seconds) ? 0 : std::clamp(seconds, kMinSeconds, kMaxSeconds);
    const sys_seconds time{std::chrono::seconds(static_cast<int64_t>(std::floor(known)))};
    const sys_days midnight = floor<days>(time);
    const year_month_day day(midnight);
    const hh_mm_ss clock(time - midnight);
    return {static_cast<int>(day.year()),     static_cast<unsigned>(day.month()),
            static_cast<unsigned>(day.day()), clock.hours().count(),
            clock.minutes().count(),          clock.seconds().count()};
}

std::optional<std::string> calendarText(double seconds, const char* format) {
    if (!(seconds >= kMinSeconds && seconds <= kMaxSeconds)) return std::nullopt;
    const auto time = static_cast<time_t>(std::floor(seconds));
    std::tm fields{};
    gmtime_r(&time, &fields);
    char text[64];
    return std::string(text, std::strftime(text, sizeof text, format, &fields));
}

}  // namespace platform
