#include "Platform/propertylist/PropertyListTexts.h"

#include <array>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>

#include "Platform/propertylist/PropertyListFormat.h"

namespace platform::propertylist {
namespace {

/// Of the characters of one byte.
constexpr std::array<bool, 256> kPlainBytes = [] {
    std::array<bool, 256> plain{};
    for (size_t byte = ' '; byte < 0x80; ++byte) plain[byte] = true;
    for (const char c : {'<', '&', ']', '>'}) plain[static_cast<uint8_t>(c)] = false;
    plain['\t'] = plain['\n'] = true;
    return plain;
}();

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isSpace(text.front())) text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back())) text.remove_suffix(1);
    return text;
}

/// The whole text as a number.
template <typename Number, typename... Format>
std::optional<Number> wholeNumber(std::string_view text, Format... format) {
    Number number{};
    const char* end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, number, format...);
    return error == std::errc() && stop == end ? std::optional(number) : std::nullopt;
}

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr uint8_t kNoSymbol = 64;

constexpr std::array<uint8_t, 256> kSymbolValues = [] {
    std::array<uint8_t, 256> values{};
    values.fill(kNoSymbol);
    for (uint8_t i = 0; i < 64; ++i) values[static_cast<uint8_t>(kAlphabet[i])] = i;
    return values;
}();

}  // namespace

size_t plainTextLength(std::string_view text) {
    size_t length = 0;
    for (;;) {
        while (length < text.size() && kPlainBytes[static_cast<uint8_t>(text[length])]) ++length;
        if (length == text.size() || static_cast<uint8_t>(text[length]) < 0x80) return length;
        std::string_view rest = text.substr(length);
        const auto point = takeCodePoint(rest);
        if (!point || *point == 0xFFFE || *point == 0xFFFF) return length;
        length = text.size() - rest.size();
    }
}

// --- Reading

std::optional<std::variant<int64_t, uint64_t>> readInteger(std::string_view text) {
    text = trimmed(text);
    const bool isNegative = text.starts_with('-');
    if (isNegative || text.starts_with('+')) text.remove_prefix(1);
    const bool isHexadecimal = text.starts_with("0x") || text.starts_with("0X");
    if (isHexadecimal) text.remove_prefix(2);
    const auto magnitude = wholeNumber<uint64_t>(text, isHexadecimal ? 16 : 10);
    if (!magnitude) return std::nullopt;
    if (isNegative) {
        if (*magnitude > uint64_t{1} << 63U) return std::nullopt;
        return static_cast<int64_t>(-*magnitude);
    }
    if (*magnitude > static_cast<uint64_t>(INT64_MAX)) return *magnitude;
    return static_cast<int64_t>(*magnitude);
}

std::optional<double> readReal(std::string_view text) {
    text = trimmed(text);
    if (text.starts_with('+')) {
        text.remove_prefix(1);
        if (text.starts_with('-')) return std::nullopt;
    }
    // The library would take "nan(...)".
    if (text.ends_with(')')) return std::nullopt;
    return wholeNumber<double>(text, std::chars_format::general);
}

std::optional<double> readDate(std::string_view text) {
    text = trimmed(text);
    constexpr std::string_view kPattern = "dddd-dd-ddTdd:dd:ddZ";
    if (text.size() != kPattern.size()) return std::nullopt;
    for (size_t i = 0; i < text.size(); ++i) {
        const bool isDigit = text[i] >= '0' && text[i] <= '9';
        if (kPattern[i] == 'd' ? !isDigit : text[i] != kPattern[i]) return std::nullopt;
    }
    const auto field = [text](size_t at, size_t size) {
        return static_cast<int>(*wholeNumber<unsigned>(text.substr(at, size)));
    };
    const std::chrono::year_month_day date{std::chrono::year(field(0, 4)),
                                           std::chrono::month(static_cast<unsigned>(field(5, 2))),
                                           std::chrono::day(static_cast<unsigned>(field(8, 2)))};
    const int hour = field(11, 2);
    const int minute = field(14, 2);
    const int second = field(17, 2);
    if (!date.ok() || field(0, 4) == 0 || hour > 23 || minute > 59 || second > 59) return std::nullopt;
    const std::chrono::sys_seconds time = std::chrono::sys_days(date) + std::chrono::hours(hour) +
                                          std::chrono::minutes(minute) + std::chrono::seconds(second);
    return static_cast<double>(time.time_since_epoch().count());
}

bool readBase64(std::string_view text, SecretBytes& data) {
    data.clear();
    data.reserve(text.size() / 4 * 3);
    uint32_t group = 0;
    size_t symbols = 0;
    size_t padding = 0;
    for (const char c : text) {
        if (isSpace(c)) continue;
        if (c == '=') {
            ++padding;
            continue;
        }
        const uint8_t value = kSymbolValues[static_cast<uint8_t>(c)];
        if (value == kNoSymbol || padding > 0) return false;
        group = group << 6U | value;
        if (++symbols % 4 == 0) appendBigEndian(data, group & 0xFFFFFFU, 3);
    }
    // The last group may lack one symbol or two, and says so.
    const size_t left = symbols % 4;
    if (left == 1 || padding != (4 - left) % 4) return false;
    if (left == 2) appendBigEndian(data, group >> 4U & 0xFFU, 1);
    if (left == 3) appendBigEndian(data, group >> 2U & 0xFFFFU, 2);
    return true;
}

// --- Writing

void appendText(SecretBytes& output, std::string_view text) {
    output.insert(output.end(), text.begin(), text.end());
}

void appendReal(SecretBytes& output, double value) {
    if (std::isnan(value)) return appendText(output, "nan");
    char digits[32];
    const auto end = std::to_chars(std::begin(digits), std::end(digits), value).ptr;
    appendText(output, {digits, end});
}

bool appendDate(SecretBytes& output, double seconds) {
    constexpr double kEarliest = -62'135'596'800;
    constexpr double kEnd = 253'402'300'800;
    if (!(seconds >= kEarliest && seconds < kEnd)) return false;
    const std::chrono::sys_seconds time(std::chrono::seconds(static_cast<int64_t>(std::floor(seconds))));
    const auto midnight = std::chrono::floor<std::chrono::days>(time);
    const std::chrono::year_month_day date(midnight);
    const std::chrono::hh_mm_ss clock(time - midnight);
    char text[32];
    const int size =
        std::snprintf(text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02dZ", static_cast<int>(date.year()),
                      static_cast<unsigned>(date.month()), static_cast<unsigned>(date.day()),
                      static_cast<int>(clock.hours().count()), static_cast<int>(clock.minutes().count()),
                      static_cast<int>(clock.seconds().count()));
    appendText(output, {text, static_cast<size_t>(size)});
    return true;
}

void appendBase64(SecretBytes& output, Bytes data) {
    for (; !data.empty(); data = data.subspan(std::min<size_t>(data.size(), 3))) {
        const size_t count = std::min<size_t>(data.size(), 3);
        const uint64_t group = bigEndian(data.first(count)) << (8 * (3 - count));
        for (size_t i = 0; i < 4; ++i) {
            const char symbol = kAlphabet[group >> (18 - 6 * i) & 63U];
            output.push_back(static_cast<uint8_t>(i <= count ? symbol : '='));
        }
    }
}

bool appendEscaped(SecretBytes& output, std::string_view utf8) {
    for (;;) {
        const size_t plain = plainTextLength(utf8);
        appendText(output, utf8.substr(0, plain));
        utf8.remove_prefix(plain);
        if (utf8.empty()) return true;
        switch (utf8.front()) {
            case '<':
                appendText(output, "&lt;");
                break;
            case '>':
                appendText(output, "&gt;");
                break;
            case '&':
                appendText(output, "&amp;");
                break;
            case ']':
                appendText(output, "]");
                break;
            case '\r':
                // As itself it would be read as a line feed.
                appendText(output, "&#13;");
                break;
            default:
                return false;
        }
        utf8.remove_prefix(1);
    }
}

}  // namespace platform::propertylist
