#include "Logging/LogText.h"

#include <algorithm>
#include <sstream>
#include <vector>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"

namespace veltoid {
namespace {

constexpr int64_t kMinute = 60;
constexpr int64_t kHour = 3'600;
constexpr int64_t kDay = 86'400;
constexpr int64_t kWeek = 604'800;

/// The characters of UTF-8 text, so that masking never cuts one in two.
std::vector<std::string_view> charactersOf(std::string_view text) {
    std::vector<std::string_view> characters;
    for (size_t start = 0; start < text.size();) {
        size_t end = start + 1;
        while (end < text.size() && (static_cast<unsigned char>(text[end]) & 0xC0U) == 0x80U) ++end;
        characters.push_back(text.substr(start, end - start));
        start = end;
    }
    return characters;
}

std::string join(const std::vector<std::string_view>& characters, size_t from, size_t to) {
    std::string text;
    for (size_t i = from; i < to; ++i) text += characters[i];
    return text;
}

std::string firstAndLastTwo(const std::vector<std::string_view>& characters, size_t count) {
    return join(characters, 0, 2) + "..." + join(characters, count - 2, count);
}

/// What stands before the "@", or the whole name when nothing does, with its middle masked.
std::string maskedFront(const std::vector<std::string_view>& characters, size_t at) {
    constexpr size_t kShortest = 5;
    const size_t count = characters.size();
    if (at == count || at == 0) return count < kShortest ? "???" : firstAndLastTwo(characters, count);
    const std::string front = at >= kShortest ? firstAndLastTwo(characters, at) : std::string(at, '?');
    return front + join(characters, at, count);
}

std::string maskedName(std::string_view name) {
    const std::vector<std::string_view> characters = charactersOf(name);
    const auto at =
        static_cast<size_t>(std::find(characters.begin(), characters.end(), "@") - characters.begin());
    std::string front = maskedFront(characters, at);
    const size_t domain = front.find('@');
    if (domain == std::string::npos) return front;
    std::string masked = front.substr(0, domain + 1);
    for (const std::string_view character : charactersOf(std::string_view(front).substr(domain + 1)))
        masked += character == "." ? '.' : '?';
    return masked;
}

}  // namespace

std::string describeAccountForLog(const String& accountName) {
    if (!accountName) return "NULL";
    return describeValue(String(maskedName(accountName.view())));
}

std::string describeAccountListForLog(const Array& accountNames) {
    std::string text = "(";
    for (const Value& name : accountNames) {
        if (text.size() > 1) text += ", ";
        text += describeAccountForLog(name.asString());
    }
    return text + ")";
}

std::string describeQueueForLog(const platform::WorkQueue* queue) {
    if (queue == nullptr) return "NULL";
    return queue->isCurrent() ? "(current)" : queue->label();
}

std::string describeDispatchTime(std::optional<double> time) {
    if (!time) return "forever";
    const double left = *time - platform::now();
    if (left <= 0) return "now";
    return logText(left, "s");
}

std::string describeDuration(double seconds) {
    const auto total = static_cast<int64_t>(std::clamp(seconds, -9.2e18, 9.2e18));
    std::ostringstream text;
    int64_t rest = total;
    // "N units " from two on, the given wording for one.
    const auto piece = [&](int64_t unit, const char* several, const char* one) {
        if (rest >= 2 * unit) {
            text << rest / unit << several;
        } else if (rest >= unit) {
            text << one;
        } else {
            return;
        }
        rest %= unit;
    };

    if (total >= kWeek) {
        piece(kWeek, " weeks ", " 1 week ");
    } else {
        piece(kDay, " days ", " 1 days ");
    }
    if (total >= 3 * kDay) return text.str();
    piece(kHour, " hours ", " 1 hour ");
    if (total >= 12 * kHour) return text.str();
    piece(kMinute, " minutes ", " 1 minute ");
    if (total >= kHour) return text.str();
    if (rest >= 2) {
        text << rest << " seconds ";
    } else {
        text << "1 second ";
    }
    return text.str();
}

}  // namespace veltoid
