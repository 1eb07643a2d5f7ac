#include "XMLRPC/XMLRPCResponse.h"

#include <gtest/gtest.h>

#include "TestSupport/XMLRPCDocuments.h"
#include "XMLRPC/XMLRPCEventBasedParser.h"

namespace veltoid {
namespace {

Value dataOf(std::string_view text) { return Data(platform::bytesOf(text)); }

XMLRPCResponse responseOf(std::string_view text) {
    const platform::Bytes bytes = platform::bytesOf(text);
    return XMLRPCResponse({bytes.begin(), bytes.end()});
}

std::string date(const std::string& text) {
    return "<value><dateTime.iso8601>" + text + "</dateTime.iso8601></value>";
}

const std::string kOne = "<value><i4>1</i4></value>";
const std::string kX = "<value>x</value>";
const Value k1 = Value::int32(1);
const Dictionary kA1 = {{"a", k1}};
const Dictionary kB1 = {{"b", k1}};

void expectValues(std::initializer_list<std::tuple<const char*, std::string, Value>> cases) {
    for (const auto& [what, xml, value] : cases) {
        const XMLRPCResponse response = responseOf(document(xml));
        EXPECT_EQ(response.object(), value) << what;
        EXPECT_FALSE(response.isFault()) << what;
    }
}

TEST(XMLRPCResponse, ReadsScalarsOfEachType) {
    expectValues({
        {"int", "<value><int>5</int></value>", Value::int32(5)},
        {"i4", "<value><i4>-5</i4></value>", Value::int32(-5)},
        {"an integer in white space", "<value> <i4>\n5 </i4> </value>", Value::int32(5)},
        {"double", "<value><double>0.5</double></value>", Value::real(0.5)},
        {"true", "<value><boolean>1</boolean></value>", Value::boolean(true)},
        {"the word true", "<value><boolean>true</boolean></value>", Value::boolean(false)},
        {"string", "<value><string>x</string></value>", "x"},
        {"a string that needs trimming", "<value><string>\n x y\n</string></value>", "x y"},
        {"a string in pieces", "<value>a&lt;b<![CDATA[<c>]]>\u20AC&#x27;</value>", "a<b<c>\u20AC'"},
        {"no type", "<value>  padded  </value>", "padded"},
        {"nothing", "<value/>", ""},
        {"nil", "<value><nil/></value>", ""},
        {"date", date("20260117T01:58:42"), Value::date(1'768'615'122)},
        {"no date", date("17.01.2026"), Value::null()},
        {"data", "<value><base64>YWJj\r\nZA==</base64></value>", dataOf("abcd")},
        {"no data", "<value><base64/></value>", dataOf("")},
    });
    EXPECT_TRUE(responseOf(document("<value><double>1</double></value>")).object().isFloating());
}

TEST(XMLRPCResponse, ReadsArraysAndStructs) {
    const std::string noDate = date("x");
    const std::string named = "<member><name>a</name>";
    expectValues({
        {"an empty array", array(""), Array()},
        {"an array keeps its order", array("<value>b</value> <value>a</value>" + kOne), Array{"b", "a", k1}},
        {"data is not needed", "<value><array><value>a</value></array></value>", Array{"a"}},
        {"an element that is no date", array(noDate + kOne), Array{Value::null(), k1}},
        {"an empty struct", structure(""), Dictionary()},
        {"members in order", structure(" " + member("b", kOne) + "\n" + member("a", kX)),
         Dictionary{{"b", k1}, {"a", "x"}}},
        {"a name that needs trimming", structure(member(" a&amp;b\n", kOne)), Dictionary{{"a&b", k1}}},
        {"the later of two of a name", structure(member("a", kX) + member("a", kOne)), kA1},
        {"no date removes the name", structure(member("a", kOne) + member("b", kOne) + member("a", noDate)),
         kB1},
        {"a member without value", structure(named + "</member>"), Dictionary{{"a", ""}}},
        {"a member without name", structure("<member>" + kOne + "</member>" + member("a", kOne)), kA1},
        {"the name after the value", structure("<member>" + kOne + "<name>a</name></member>"), kA1},
        {"an empty name", structure(member("", kOne)), Dictionary{{"", k1}}},
        {"the last of two values", structure(named + kX + kOne + "</member>"), kA1},
        {"nesting",
         structure(member("a", array(structure(member("b", array(kOne))) + kOne)) + member("c", kOne)),
         Dictionary{{"a", Array{Dictionary{{"b", Array{k1}}}, k1}}, {"c", k1}}},
    });
}

TEST(XMLRPCResponse, SurvivesElementsInWrongPlaces) {
    const std::string named = "<member><name>a</name>";
    expectValues({
        {"unknown elements everywhere", "<x/><value><y><i4><z>1</z>2</i4></y></value>", Value::int32(12)},
        {"the last type counts, all text", "<value>1<string>2</string><i4>3</i4></value>", Value::int32(123)},
        {"a value in a value", "<value>a" + kOne + "b</value>", "ab"},
        {"a type after an array", "<value><array><value>x</value></array><i4>7</i4></value>",
         Value::int32(7)},
        {"text around an array", "<value>x<array>y</array>z</value>", Array()},
        {"a second array", "<value><array>" + kOne + "</array><array/></value>", Array()},
        {"a struct after an array", "<value><array>" + kOne + "</array><struct/></value>", Dictionary()},
        {"a value in a struct", structure(kOne), Dictionary()},
        {"a name in a struct", structure("<name>a</name>"), Dictionary()},
        {"a name in an array", array("<name> a </name>"), Array{"a"}},
        {"a typed name is a value", structure(named + "<name><i4>2</i4></name></member>"),
         Dictionary{{"a", Value::int32(2)}}},
        {"a typed member", structure(named + "<i4>3</i4></member>"), Dictionary{{"a", Value::int32(3)}}},
        {"a member in an array", array(member("a", kOne)), Array{k1}},
        {"only the first value", kOne + kX, k1},
        {"no value", "<i4>1</i4>", Value()},
        {"a fault after the value", kOne + "<fault/>", k1},
    });
}

TEST(XMLRPCResponse, ARepeatedNameIsOneText) {
    const std::string members = structure(member("repeated", "<value>1</value>"));
    const XMLRPCResponse response = responseOf(document(array(members + members)));
    const Array& structs = *response.object().asArray();
    const auto key = [&](size_t i) { return structs[i].asDictionary()->begin()->key.view().data(); };
    EXPECT_EQ(key(0), key(1));
}

TEST(XMLRPCResponse, TellsFaultsApart) {
    const std::string code = member("faultCode", "<value><int>-20101</int></value>");
    const std::string text = member("faultString", "<value><string>x</string></value>");
    const auto fault = [](const std::string& value) { return responseOf(faultDocument(value)); };
    const XMLRPCResponse whole = fault(structure(code + text));
    EXPECT_TRUE(whole.isFault());
    EXPECT_EQ(whole.faultCode(), Value::int32(-20101));
    EXPECT_EQ(whole.faultString(), Value("x"));

    const XMLRPCResponse noStruct = fault(kX);
    EXPECT_TRUE(noStruct.isFault());
    EXPECT_TRUE(noStruct.faultCode().isAbsent());

    EXPECT_TRUE(fault("").isFault());
    EXPECT_TRUE(fault(structure(text)).faultCode().isAbsent());
    EXPECT_TRUE(responseOf(document(structure(code + text))).faultCode().isAbsent())
        << "no fault, whatever it says";
}

TEST(XMLRPCResponse, ABrokenDocumentHasNoObject) {
    const std::string good = document(kX);
    const std::string bad[] = {
        "",
        "<html><body>Bad gateway<br></body></html>",
        good + "x",
        good.substr(0, good.size() / 2),
        document("<value>\xFF</value>"),
        "<!DOCTYPE x [<!ENTITY e 'v'>]>" +
            document("<value>&e;</value>").substr(strlen("<?xml version='1.0'?>")),
    };
    for (const std::string& text : bad) EXPECT_TRUE(responseOf(text).object().isAbsent()) << text;
    // Cut off anywhere, a document is never half a value.
    for (size_t size = 0; size < good.size(); ++size)
        EXPECT_TRUE(responseOf(good.substr(0, size)).object().isAbsent()) << size;
}

TEST(XMLRPCResponse, RefusesToNestTooDeeply) {
    const auto nested = [](size_t nodes) {
        std::string xml;
        for (size_t i = 1; i < nodes; ++i) xml += "<value><array>";
        xml += "<value>x</value>";
        for (size_t i = 1; i < nodes; ++i) xml += "</array></value>";
        return responseOf(document(xml)).object();
    };
    EXPECT_NE(nested(kMaxXMLRPCDepth).asArray(), nullptr);
    EXPECT_TRUE(nested(kMaxXMLRPCDepth + 1).isAbsent());
    EXPECT_TRUE(nested(100'000).isAbsent());
}

TEST(XMLRPCResponse, KeepsItsBodyAsText) {
    EXPECT_EQ(responseOf("<a>\u20AC").body(), String("<a>\u20AC"));
    EXPECT_EQ(responseOf("\xFF").body(), String());
}

TEST(XMLRPCEventBasedParser, SaysWhyItStopped) {
    const std::string text = document("<value>x</value") + ">";
    XMLRPCEventBasedParser parser(platform::bytesOf(text));
    EXPECT_TRUE(parser.parse().isAbsent());
    ASSERT_TRUE(parser.parserError());
    EXPECT_FALSE(parser.parserError()->description.empty());
}

}  // namespace
}  // namespace veltoid
