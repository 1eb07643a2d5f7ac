#include "XMLRPC/XMLRPCScalarTexts.h"

#include <gtest/gtest.h>

#include <limits>
#include <tuple>

namespace veltoid::xmlrpc {
namespace {

constexpr int32_t kLowest = std::numeric_limits<int32_t>::min();
constexpr int32_t kHighest = std::numeric_limits<int32_t>::max();
constexpr double kLargest = std::numeric_limits<double>::max();

template <typename Result>
using Cases = std::initializer_list<std::pair<std::string_view, Result>>;

TEST(XMLRPCScalarTexts, TrimsEveryKindOfWhiteSpaceAtTheEndsOnly) {
    const Cases<std::string_view> cases = {{"", ""},
                                           {" \t\r\n\v\f", ""},
                                           {"  a b  ", "a b"},
                                           {"\u00A0\u2003a\u00A0b\u3000\u2028\u0085", "a\u00A0b"},
                                           {"\u200Ba", "\u200Ba"},  // zero width: no white space
                                           {"\u00E0", "\u00E0"},    // ends in the byte A0
                                           {"x\x85", "x\x85"}};     // a stray continuation byte
    for (const auto& [text, trimmed] : cases) EXPECT_EQ(parseString(text), trimmed) << text;
}

TEST(XMLRPCScalarTexts, ReadsTheLeadingInteger) {
    const Cases<int32_t> cases = {{"5", 5},
                                  {"-20101", -20101},
                                  {"+7", 7},
                                  {"007", 7},
                                  {"12 3", 12},
                                  {"3.9", 3},
                                  {"4x", 4},
                                  {"", 0},
                                  {"x4", 0},
                                  {"-", 0},
                                  {"+-5", 0},
                                  {"--5", 0},
                                  {"2147483647", kHighest},
                                  {"2147483648", kHighest},
                                  {"-2147483648", kLowest},
                                  {"-99999999999999999999", kLowest}};
    for (const auto& [text, number] : cases) EXPECT_EQ(parseInteger(text), number) << text;
}

TEST(XMLRPCScalarTexts, ReadsTheLeadingNumber) {
    const Cases<double> cases = {{"0.5", 0.5},
                                 {"-1.25e2", -125},
                                 {"+3", 3},
                                 {".5", 0.5},
                                 {"5.", 5},
                                 {"1,5", 1},
                                 {"2 apples", 2},
                                 {"", 0},
                                 {"x", 0},
                                 {"+-1", 0},
                                 {"nan", 0},
                                 {"inf", 0},
                                 {"-infinity", 0},
                                 {"0x10", 0},
                                 {"1e999", kLargest},
                                 {"-1e999", -kLargest},
                                 {"0.001e999", kLargest},
                                 {"1e-999", 0},
                                 {"1000e-999", 0},
                                 {"1e99999999999999999999", kLargest},
                                 {"1e-99999999999999999999", 0}};
    for (const auto& [text, number] : cases) EXPECT_EQ(parseDouble(text), number) << text;
    EXPECT_EQ(parseDouble(std::string(400, '9')), kLargest);
    EXPECT_EQ(parseDouble("0." + std::string(400, '0') + "1"), 0);
}

TEST(XMLRPCScalarTexts, OnlyOneIsTrue) {
    const Cases<bool> cases = {{"1", true},   {"0", false}, {"true", false},
                               {"01", false}, {"", false},  {"11", false}};
    for (const auto& [text, flag] : cases) EXPECT_EQ(parseBoolean(text), flag) << text;
}

TEST(XMLRPCScalarTexts, ReadsTheFourFormsOfADate) {
    constexpr double kInstant = 1'768'615'122;
    const Cases<double> cases = {{"20260117T01:58:42", kInstant},
                                 {"2026-01-17T01:58:42", kInstant},
                                 {"20260117T01:58:42Z", kInstant},
                                 {"2026-01-17T01:58:42Z", kInstant},
                                 {"20260117T01:58:42+0000", kInstant},
                                 {"20260116T17:58:42-0800", kInstant},
                                 {"2026-01-17T03:28:42+01:30", kInstant},
                                 {"19700101T00:00:00Z", 0},
                                 {"19691231T23:59:59", -1},
                                 {"20240229T00:00:00", 1'709'164'800},
                                 {"00010101T00:00:00", -62'135'596'800},
                                 {"99991231T23:59:59", 253'402'300'799}};
    for (const auto& [text, seconds] : cases) EXPECT_EQ(parseDate(text), Value::date(seconds)) << text;
}

TEST(XMLRPCScalarTexts, WhatIsNoDateIsNull) {
    const std::string_view texts[] = {
        "",
        "17.01.2026",
        "20260117",
        "20260117T01:58",
        "20260117T01:58:42.5",  // fractions
        "20260117T01:58:42 ",   // more than the date
        "20260117T01:58:42z",
        "20260117T01:58:42GMT",
        "20260117T01:58:42+01",  // half a zone
        "20260117T01:58:42+2400",
        "20260117T01:58:42+0160",
        "20260117T24:00:00",
        "20260117T01:60:00",
        "20260117T01:58:60",
        "20260017T01:58:42",
        "20261317T01:58:42",
        "20260100T01:58:42",
        "20250229T00:00:00",  // no leap year
        "19000229T00:00:00",  // nor a century
        "20260431T00:00:00",
        "00000101T00:00:00",
        "2026-0117T01:58:42",  // half-hearted hyphens
        "202601-17T01:58:42",
        "20260117 01:58:42",
        "+2026117T01:58:42",
        "2026 117T01:58:42",
    };
    for (const std::string_view text : texts) EXPECT_EQ(parseDate(text), Value::null()) << text;
}

TEST(XMLRPCScalarTexts, OneFormatReadsNoOtherForm) {
    const std::string_view forms[] = {"20260117T01:58:42Z", "2026-01-17T01:58:42Z", "20260117T01:58:42",
                                      "2026-01-17T01:58:42"};
    for (size_t format = 0; format < kDateFormats.size(); ++format)
        for (size_t form = 0; form < std::size(forms); ++form)
            EXPECT_EQ(parseDateString(forms[form], kDateFormats[format]).has_value(), form == format)
                << forms[form];
}

}  // namespace
}  // namespace veltoid::xmlrpc
