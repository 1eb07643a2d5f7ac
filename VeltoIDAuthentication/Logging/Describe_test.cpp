#include "Logging/Describe.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <ctime>

#include "TestSupport/SimulatedClock.h"
#include "Values/Error.h"
#include "Values/SecurityObject.h"

namespace veltoid {
namespace {

Data bytes(std::initializer_list<uint8_t> values) { return Data(std::vector<uint8_t>(values)); }

TEST(Describe, EachKindOfValueHasItsText) {
    const std::pair<Value, const char*> cases[] = {
        {Value(), "[ NULL ] "},
        {Value::null(), "NULL"},
        {Value("a\tb\n\r\x01\x1f"), "\"a\\tb\\n\\r\\a\\\x7f\""},
        {Value("Zoë"), "\"Zoë\""},
        {Value(Array{}), "( )"},
        {Value(Array{"a", Value::int32(1)}), "( \"a\", 1)"},
        {Value(Dictionary{}), "{  }"},
        {Value(Dictionary{{"b", Value::int32(1)}, {"A", Value::int32(2)}, {"c", Value::int32(3)}}),
         "{ \"A\"=2, \"b\"=1, \"c\"=3 }"},
        {Value(bytes({0, 255})), "$00ff"},
        {Value(bytes({'a', 'b', 'c'})), "$\"abc\""},
        {Value(Data(std::span<const uint8_t>())), "$\"\""},
        {Value::int64(5'000'000'000), "5000000000"},
        {Value::real(0.5), "0.500000"},
        {Value::real(727.8), "727.800"},
        {Value::singleReal(2), "2.00000"},
        {Value::real(std::nan("")), "NAN"},
        {Value::uint64(0), "0x0"},
        {Value::uint64(0xAB00), "0xAB000000000000"},
        {Value::boolean(true), "true"},
        {Value::url("rel", "https://h/"), "\"rel\" base:\"https://h/\""},
        {Value(Error{String(kIdentityErrorDomain), -101, {}}),
         "ERROR:\"HWIdentityErrorDomain\" #-101 kHWIdentityVeltoIDInvalidAccountOrPasswordErr"},
        {Value(Error{String(kIdentityErrorDomain), 99, {{"k", "v"}}}),
         "ERROR:\"HWIdentityErrorDomain\" #99 { \"k\"=\"v\" }"},
        {Value(Error{"HTTP", -101, {}}), "ERROR:\"HTTP\" #-101"},
        {Value::object({CertificateDescription{"Jane"}}), "CERT:\"Jane\"  "},
        {Value::object({TrustDescription{9, {{}, {"B"}}}}),
         "TRUSTOBJ:[ TrustResultUnknown,9 CERTs:[CERT: , CERT:\"B\"  ]"},
        {Value::object({IdentityDescription{CertificateDescription{"J"}, KeyDescription{"rsa"}}}),
         "[ CERT:\"J\"  KEY:\"rsa\"] "},
    };
    for (const auto& [value, expected] : cases) EXPECT_EQ(describeValue(value), expected);
    EXPECT_EQ(describeValue(Value(std::string_view("a\0b", 3))), "\"a(null)b\"");
}

TEST(Describe, LongStringsArePrintedWhole) {
    const std::string text = std::string(1'023, 'x') + "ü" + std::string(5'000, 'y');
    EXPECT_EQ(describeValue(text), "\"" + text + "\"");
}

TEST(Describe, DatesAreRelativeOnlyNearNow) {
    setenv("TZ", "UTC", 1);
    tzset();
    const platform::SimulatedClock clock(1'394'039'040);
    const std::pair<double, const char*> cases[] = {
        {0, "now-ish 2014/03/05 17:04:00"},
        {-1, "now-ish 2014/03/05 17:03:59"},
        {0.5, "soon-ish 2014/03/05 17:04:00"},
        {30, "30 seconds from now, 2014/03/05 17:04:30"},
        {30.25, "30.25 seconds from now, 2014/03/05 17:04:30"},
        {300, "300 seconds from now, 2014/03/05 17:09:00"},
        {301, "2014/03/05 17:09:01"},
        {-30.6, "31 seconds ago, 2014/03/05 17:03:29"},
        {-600, "2014/03/05 16:54:00"},
        {1e300, "?"},
    };
    for (const auto& [offset, expected] : cases)
        EXPECT_EQ(describeValue(Value::date(clock.now() + offset)), expected) << offset;
}

}  // namespace
}  // namespace veltoid
