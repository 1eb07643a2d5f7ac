#include "Values/DateText.h"

#include <string>

#include "Platform/encoding/CalendarText.h"

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

}  // namespace

std::optional<double> dateFromValue(const Value& value) {
    if (const auto date = value.asDate()) return date;
    const std::optional<std::string_view> text = value.asText();
    if (!text || text->size() > kMaxDateTextBytes) return std::nullopt;

    Fields f;
    if (!readFields(std::string(*text).c_str(), f) || f.offset < -kMaxOffset || f.offset > kMaxOffset)
        return std::nullopt;
    const auto wallClock = platform::secondsOf({f.year, f.month, f.day, f.hour, f.minute, f.second});
    if (!wallClock) return std::nullopt;
    const long hours = f.offset / 100;
    const long minutes = f.offset - 100 * hours;
    return *wallClock - static_cast<double>(hours * 3'600 + minutes * 60);
}

}  // namespace veltoid
