#include "XMLRPC/XMLRPCScalarTexts.h"

#include <algorithm>
#include <charconv>
#include <limits>

#include "Platform/encoding/CalendarText.h"
#include "XMLRPC/XMLRPCHelpers.h"

namespace veltoid::xmlrpc {
namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

bool isASCIISpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }

/// The white space and line separators of Unicode beyond ASCII, in UTF-8.
constexpr std::string_view kWideSpaces[] = {
    "\u0085", "\u00A0", "\u1680", "\u2000", "\u2001", "\u2002", "\u2003", "\u2004", "\u2005", "\u2006",
    "\u2007", "\u2008", "\u2009", "\u200A", "\u2028", "\u2029", "\u202F", "\u205F", "\u3000"};

bool isASCII(char c) { return static_cast<unsigned char>(c) < 0x80; }

/// The size of the white-space character that the text starts with; 0 when it starts with another one.
size_t leadingSpace(std::string_view text) {
    if (text.empty()) return 0;
    if (isASCII(text.front())) return isASCIISpace(text.front()) ? 1 : 0;
    for (const std::string_view space : kWideSpaces)
        if (text.starts_with(space)) return space.size();
    return 0;
}

size_t trailingSpace(std::string_view text) {
    if (text.empty()) return 0;
    if (isASCII(text.back())) return isASCIISpace(text.back()) ? 1 : 0;
    for (const std::string_view space : kWideSpaces)
        if (text.ends_with(space)) return space.size();
    return 0;
}

/// The text without one leading plus sign, which std::from_chars does not take.
std::string_view withoutPlus(std::string_view text) {
    return text.starts_with('+') && !text.substr(1).starts_with('-') ? text.substr(1) : text;
}

/// Whether a number that a double cannot hold is too large rather than too small: the place of its first
/// significant digit decides.
bool isTooLarge(std::string_view number) {
    const size_t exponentMark = number.find_first_of("eE");
    const std::string_view digits = number.substr(0, exponentMark);
    const size_t point = std::min(digits.find('.'), digits.size());
    const size_t first = digits.find_first_of("123456789");
    if (first == std::string_view::npos) return false;
    const auto place = static_cast<int64_t>(point) - static_cast<int64_t>(first);
    if (exponentMark == std::string_view::npos) return place > 0;

    const std::string_view exponentText = withoutPlus(number.substr(exponentMark + 1));
    int64_t exponent = 0;
    const auto read =
        std::from_chars(exponentText.data(), exponentText.data() + exponentText.size(), exponent);
    if (read.ec == std::errc::result_out_of_range) return !exponentText.starts_with('-');
    return exponent > -place;
}

/// Takes fixed-width fields off the front of a text; once something does not fit, all that follows fails.
class FieldReader {
  public:
    explicit FieldReader(std::string_view text) : left_(text) {}

    /// Exactly `width` digits.
    int number(size_t width) {
        int result = 0;
        for (size_t i = 0; i < width; ++i) {
            if (left_.empty() || !isDigit(left_.front())) {
                ok_ = false;
                return 0;
            }
            result = result * 10 + (left_.front() - '0');
            left_.remove_prefix(1);
        }
        return result;
    }

    bool take(char c) {
        if (!left_.starts_with(c)) return false;
        left_.remove_prefix(1);
        return true;
    }

    void literal(char c) { ok_ = take(c) && ok_; }
    void require(bool condition) { ok_ = condition && ok_; }
    bool readAll() const { return ok_ && left_.empty(); }

  private:
    std::string_view left_;
    bool ok_ = true;
};

/// Seconds east of UTC.
double readZone(FieldReader& fields) {
    if (fields.take('Z')) return 0;
    const bool isWest = fields.take('-');
    if (!isWest) fields.literal('+');
    const int hours = fields.number(2);
    (void)fields.take(':');
    const int minutes = fields.number(2);
    fields.require(hours < 24 && minutes < 60);
    const int offset = 3'600 * hours + 60 * minutes;
    return isWest ? -offset : offset;
}

}  // namespace

std::string_view parseString(std::string_view text) {
    while (const size_t size = leadingSpace(text)) text.remove_prefix(size);
    while (const size_t size = trailingSpace(text)) text.remove_suffix(size);
    return text;
}

int32_t parseInteger(std::string_view text) {
    const std::string_view number = withoutPlus(text);
    int32_t result = 0;
    const auto read = std::from_chars(number.data(), number.data() + number.size(), result);
    if (read.ec != std::errc::result_out_of_range) return result;
    return number.starts_with('-') ? std::numeric_limits<int32_t>::min()
                                   : std::numeric_limits<int32_t>::max();
}

double parseDouble(std::string_view text) {
    const std::string_view number = withoutPlus(text);
    const bool isNegative = number.starts_with('-');
    // std::from_chars would also take "inf" and "nan", which no reader of a duration or a date expects.
    const std::string_view digits = number.substr(isNegative ? 1 : 0);
    if (digits.empty() || !(isDigit(digits.front()) || digits.front() == '.')) return 0.0;

    double result = 0.0;
    const auto read = std::from_chars(number.data(), number.data() + number.size(), result);
    if (read.ec != std::errc::result_out_of_range) return result;
    if (!isTooLarge(digits.substr(0, static_cast<size_t>(read.ptr - digits.data())))) return 0.0;
    return isNegative ? std::numeric_limits<double>::lowest() : std::numeric_limits<double>::max();
}

bool parseBoolean(std::string_view text) { return text == "1"; }

Value parseDate(std::string_view text) {
    for (const DateFormat format : kDateFormats)
        if (const std::optional<double> seconds = parseDateString(text, format)) return Value::date(*seconds);
    return Value::null();
}

std::optional<double> parseDateString(std::string_view text, DateFormat withFormat) {
    FieldReader fields(text);
    platform::CalendarDate date;
    date.year = fields.number(4);
    if (withFormat.hyphens) fields.literal('-');
    date.month = fields.number(2);
    if (withFormat.hyphens) fields.literal('-');
    date.day = fields.number(2);
    fields.literal('T');
    date.hour = fields.number(2);
    fields.literal(':');
    date.minute = fields.number(2);
    fields.literal(':');
    date.second = fields.number(2);
    fields.require(date.second < 60);
    const double offset = withFormat.zone ? readZone(fields) : 0;
    const auto seconds = platform::secondsOf(date);
    return fields.readAll() && seconds ? std::optional(*seconds - offset) : std::nullopt;
}

Data parseData(std::string_view text) { return dataFromBase64String(text); }

}  // namespace veltoid::xmlrpc
