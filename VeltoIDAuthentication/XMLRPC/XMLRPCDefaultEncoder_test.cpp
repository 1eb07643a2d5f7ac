#include "XMLRPC/XMLRPCDefaultEncoder.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "Platform/encoding/UTF8.h"
#include "Values/Error.h"
#include "XMLRPC/XMLRPCHelpers.h"

namespace veltoid {
namespace {

Value dataOf(std::string_view text) { return Data(platform::bytesOf(text)); }

/// The `value` element of a scalar.
std::string scalar(const std::string& tag, const std::string& text) {
    return "<value><" + tag + ">" + text + "</" + tag + "></value>";
}

TEST(XMLRPCDefaultEncoder, WritesEachKindInItsForm) {
    const int64_t smallest = std::numeric_limits<int64_t>::min();
    const uint64_t largest = std::numeric_limits<uint64_t>::max();
    const std::pair<Value, std::string> forms[] = {
        {Value(), ""},
        {Value::boolean(true), scalar("boolean", "1")},
        {Value::boolean(false), scalar("boolean", "0")},
        {Value::int32(101), scalar("i4", "101")},
        {Value::integer(-7, NumberKind::Int8), scalar("i4", "-7")},
        {Value::int64(5'000'000'000), scalar("i4", "5000000000")},
        {Value::int64(smallest), scalar("i4", "-9223372036854775808")},
        {Value::uint64(largest), scalar("i4", "18446744073709551615")},
        {Value::singleReal(0.1F), scalar("i4", "0.1")},
        {Value::real(0.5), scalar("double", "0.5")},
        {Value::real(3), scalar("double", "3")},
        {Value::real(0.1), scalar("double", "0.1")},
        {Value::real(1e300), scalar("double", "1e+300")},
        {"text", scalar("string", "text")},
        {"", scalar("string", "")},
        {"a&lt;b", scalar("string", "a&amp;lt;b")},
        {"\"'><&", scalar("string", "&quot;&#x27;&gt;&lt;&amp;")},
        {" \u20AC\n\x01 ", scalar("string", " \u20AC\n\x01 ")},
        {dataOf(""), scalar("base64", "")},
        {dataOf("abc"), scalar("base64", "YWJj")},
        {Value::null(), "<value><nil/></value>"},
        {Error{"domain", 1, {}}, "<value><nil/></value>"},
        {Value::url("https://elsewhere.example"), "<value><nil/></value>"},
        {Array(), "<value><array><data></data></array></value>"},
        {Array{"a", Value::null(), Value::int32(1)}, "<value><array><data>" + scalar("string", "a") +
                                                         "<value><nil/></value>" + scalar("i4", "1") +
                                                         "</data></array></value>"},
        {Dictionary(), "<value><struct></struct></value>"},
        {Dictionary{{"z", "1"}, {"a<", Value::null()}},
         "<value><struct><member><name>z</name>" + scalar("string", "1") +
             "</member><member><name>a&lt;</name><value><nil/></value></member></struct></value>"},
    };
    for (const auto& [value, text] : forms)
        EXPECT_EQ(std::string_view(XMLRPCDefaultEncoder::encodeObject(value)), text);
}

TEST(XMLRPCDefaultEncoder, WritesDatesAtUTCWithoutFractions) {
    setenv("TZ", "America/Los_Angeles", 1);
    tzset();
    const std::pair<double, const char*> dates[] = {
        {1'768'615'122.9, "20260117T01:58:42Z"},
        {0, "19700101T00:00:00Z"},
        {-0.5, "19691231T23:59:59Z"},
        {1'709'164'800, "20240229T00:00:00Z"},
        {-62'135'596'800, "00010101T00:00:00Z"},
        {253'402'300'799.9, "99991231T23:59:59Z"},
        {253'402'300'800, "100000101T00:00:00Z"},
        {std::nan(""), "19700101T00:00:00Z"},
    };
    for (const auto& [seconds, text] : dates)
        EXPECT_EQ(std::string_view(XMLRPCDefaultEncoder::encodeDate(seconds)),
                  scalar("dateTime.iso8601", text));
    // Beyond every calendar: some date, but no crash.
    EXPECT_FALSE(XMLRPCDefaultEncoder::encodeDate(std::numeric_limits<double>::infinity()).empty());
    EXPECT_FALSE(XMLRPCDefaultEncoder::encodeDate(-1e300).empty());
}

TEST(XMLRPCDefaultEncoder, DoublesReadBackAsTheSameNumber) {
    const double numbers[] = {1.0 / 3, 0.1 + 0.2, 5e-324, 1.7976931348623157e308, -0.0, 123456789.125, 2e22};
    for (const double number : numbers) {
        const std::string text(XMLRPCDefaultEncoder::encodeNumber(Value::real(number)));
        EXPECT_EQ(std::strtod(text.c_str() + strlen("<value><double>"), nullptr), number) << text;
    }
}

TEST(XMLRPCDefaultEncoder, WritesTheDocumentInOneLine) {
    const std::string start =
        "<?xml version=\"1.0\"?><methodCall><methodName>a&lt;&#x27;</methodName><params>";
    const std::string end = "</params></methodCall>";
    const std::pair<std::optional<Array>, std::string> documents[] = {
        {std::nullopt, ""},
        {Array(), ""},
        {Array{Dictionary{{"k", "t"}}}, "<param><value><struct><member><name>k</name>" +
                                            scalar("string", "t") + "</member></struct></value></param>"},
        {Array{"1", "2"},
         "<param>" + scalar("string", "1") + "</param><param>" + scalar("string", "2") + "</param>"},
    };
    XMLRPCDefaultEncoder encoder;
    EXPECT_EQ(encoder.method(), String(""));
    EXPECT_EQ(encoder.parameters(), Array());
    for (const auto& [parameters, text] : documents) {
        encoder.setMethod("a<'", parameters);
        EXPECT_EQ(std::string_view(encoder.encode()), start + text + end);
        EXPECT_EQ(encoder.parameters(), parameters);
    }
}

TEST(XMLRPCDefaultEncoder, TextWithoutTagAndTagWithTextAsItIs) {
    EXPECT_EQ(std::string_view(XMLRPCDefaultEncoder::encodeString("<", true)), "&lt;");
    EXPECT_EQ(std::string_view(XMLRPCDefaultEncoder::valueTag("t", "<")), scalar("t", "<"));
    EXPECT_TRUE(XMLRPCDefaultEncoder::encodeNumber("no number").empty());
}

TEST(XMLRPCHelpers, Base64ComesInLinesAndIsReadFromASCIIOnly) {
    const platform::SecretBytes zeros(49);
    const std::string text = std::string(64, 'A') + "\r\nAA==";
    EXPECT_EQ(base64EncodedString(zeros), String(text));
    EXPECT_EQ(dataFromBase64String(text), Data(zeros));
    EXPECT_EQ(dataFromBase64String("QU JD\t\r\n!"), Data(platform::bytesOf("ABC")));
    EXPECT_EQ(dataFromBase64String("QUJD\u00E9"), Data(platform::Bytes()));
}

TEST(XMLRPCHelpers, KnowsUTF8) {
    const char* const good[] = {
        "", "a", "\u00E9", "\u20AC", "\U0001F600", "\xED\x9F\xBF", "\xF4\x8F\xBF\xBF"};
    const char* const bad[] = {
        "\x80",         "\xC1\xBF",  "\xE0\x9F\xBF", "\xED\xA0\x80",     "\xF0\x8F\xBF\xBF",
        "\xF5\x80\x80", "a\xE2\x82", "\xC3(",        "\xF4\x90\x80\x80", "\xE2\x28\xA1"};
    for (const char* text : good) EXPECT_TRUE(platform::isUTF8(text)) << text;
    for (const char* text : bad)
        EXPECT_FALSE(platform::isUTF8(text)) << testing::PrintToString(std::string(text));
}

TEST(XMLRPCHelpers, IdentifiersAreUUIDsAndDiffer) {
    const String identifier = stringByGeneratingUUID();
    ASSERT_EQ(identifier.view().size(), 36U);
    for (const size_t hyphen : {8U, 13U, 18U, 23U}) EXPECT_EQ(identifier.view()[hyphen], '-');
    EXPECT_NE(identifier, stringByGeneratingUUID());
}

}  // namespace
}  // namespace veltoid
