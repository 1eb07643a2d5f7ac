#include "XMLRPC/XMLRPCScalarTexts.h"

#include <gtest/gtest.h>

#include <limits>
#include <tuple>

namespace veltoid::xmlrpc {
namespace {

constexpr int32_t kLowest = std::numeric_limits<int32_t>::min();
constexpr int32_t kHighest = std::numeric_limits<int32_t>::max();
constexpr double kLargest = std::numeric_limits<double>::max();

using Texts = std::vector<std::string_view>;

template <typename Result, typename Parse>
void expectResults(Parse parse, const std::vector<std::pair<Result, Texts>>& cases) {
    for (const auto& [result, texts] : cases)
        for (const std::string_view text : texts) EXPECT_EQ(parse(text), result) << text;
}

TEST(XMLRPCScalarTexts, TrimsEveryKindOfWhiteSpaceAtTheEndsOnly) {
    expectResults<std::string_view>(parseString, {{"", {"", " \t\r\n\v\f"}},
                                                  {"a b", {"  a b  "}},
                                                  {"a\u00A0b", {"\u00A0\u2003a\u00A0b\u3000\u2028\u0085"}},
                                                  {"\u200Ba", {"\u200Ba"}},  // zero width: no white space
                                                  {"\u00E0", {"\u00E0"}},    // ends in the byte A0
                                                  {"x\x85", {"x\x85"}}});    // a stray continuation byte
}

TEST(XMLRPCScalarTexts, ReadsTheLeadingNumber) {
    expectResults<int32_t>(parseInteger, {{5, {"5"}},
                                          {-20101, {"-20101"}},
                                          {7, {"+7", "007"}},
                                          {12, {"12 3"}},
                                          {3, {"3.9"}},
                                          {4, {"4x"}},
                                          {0, {"", "x4", "-", "+-5", "--5"}},
                                          {kHighest, {"2147483647", "2147483648"}},
                                          {kLowest, {"-2147483648", "-99999999999999999999"}}});
    const std::string nines(400, '9');
    const std::string tiny = "0." + std::string(400, '0') + "1";
    expectResults<double>(parseDouble, {{0.5, {"0.5", ".5"}},
                                        {-125, {"-1.25e2"}},
                                        {3, {"+3"}},
                                        {5, {"5."}},
                                        {1, {"1,5"}},
                                        {2, {"2 apples"}},
                                        {0, {"", "x", "+-1", "nan", "inf", "-infinity", "0x10", tiny}},
                                        {0, {"1e-999", "1000e-999", "1e-99999999999999999999"}},
                                        {kLargest, {"1e999", "0.001e999", "1e99999999999999999999", nines}},
                                        {-kLargest, {"-1e999"}}});
}

TEST(XMLRPCScalarTexts, OnlyOneIsTrue) {
    expectResults<bool>(parseBoolean, {{true, {"1"}}, {false, {"0", "true", "01", "", "11"}}});
}

TEST(XMLRPCScalarTexts, ReadsTheFourFormsOfADate) {
    expectResults<Value>(parseDate, {{Value::date(1'768'615'122),
                                      {"20260117T01:58:42", "2026-01-17T01:58:42", "20260117T01:58:42Z",
                                       "2026-01-17T01:58:42Z", "20260117T01:58:42+0000",
                                       "20260116T17:58:42-0800", "2026-01-17T03:28:42+01:30"}},
                                     {Value::date(0), {"19700101T00:00:00Z"}},
                                     {Value::date(-1), {"19691231T23:59:59"}},
                                     {Value::date(1'709'164'800), {"20240229T00:00:00"}},
                                     {Value::date(-62'135'596'800), {"00010101T00:00:00"}},
                                     {Value::date(253'402'300'799), {"99991231T23:59:59"}}});
}

TEST(XMLRPCScalarTexts, WhatIsNoDateIsNull) {
    const std::pair<const char*, Texts> cases[] = {
        {"another form", {"", "17.01.2026", "20260117", "20260117T01:58", "20260117 01:58:42"}},
        {"more than the date", {"20260117T01:58:42.5", "20260117T01:58:42 "}},
        {"a zone in words", {"20260117T01:58:42z", "20260117T01:58:42GMT"}},
        {"half a zone, or none on earth",
         {"20260117T01:58:42+01", "20260117T01:58:42+2400", "20260117T01:58:42+0160"}},
        {"no time of a day", {"20260117T24:00:00", "20260117T01:60:00", "20260117T01:58:60"}},
        {"no month", {"20260017T01:58:42", "20261317T01:58:42"}},
        {"no day of the month", {"20260100T01:58:42", "20260431T00:00:00"}},
        {"no leap year, nor such a century", {"20250229T00:00:00", "19000229T00:00:00"}},
        {"no year", {"00000101T00:00:00", "+2026117T01:58:42", "2026 117T01:58:42"}},
        {"half-hearted hyphens", {"2026-0117T01:58:42", "202601-17T01:58:42"}},
    };
    for (const auto& [what, texts] : cases)
        for (const std::string_view text : texts) EXPECT_EQ(parseDate(text), Value::null()) << what << text;
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
