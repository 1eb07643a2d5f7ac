#include "XMLRPC/XMLRPCShim.h"

#include <gtest/gtest.h>

#include <limits>

#include "TestSupport/FakeHTTPSession.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/XMLRPCDocuments.h"
#include "XMLRPC/XMLRPCConnection.h"

namespace veltoid {
namespace {

constexpr const char* kURL = "https://server.example/rpc";

/// A member whose value is of this content.
std::string entry(const std::string& name, const std::string& content) {
    return member(name, "<value>" + content + "</value>");
}

std::string fault(const std::string& members) { return faultDocument(structure(members)); }

std::string faultCode(const std::string& content) { return entry("faultCode", content); }

struct Outcome {
    bool success = false;
    std::optional<Dictionary> result = Dictionary{{"left", "over"}};
    std::optional<Error> error;
};

class XMLRPCShim : public testing::Test {
  protected:
    Outcome invoke(const std::string& body) { return invoke({200, body}); }

    Outcome invoke(const platform::FakeHTTPAnswer& answer) {
        transport_.enqueue(answer);
        Outcome outcome;
        outcome.success =
            xmlInvoke(kURL, "some.method", Dictionary{{"k", "v"}}, &outcome.result, &outcome.error);
        return outcome;
    }

    platform::FakeHTTPTransport transport_;
    platform::FakeSystemLog log_;
};

TEST_F(XMLRPCShim, SendsOneParameterInItsOwnName) {
    invoke(document("<value/>"));
    ASSERT_TRUE(xmlInvoke(kURL, "bare", Value(), nullptr, nullptr));
    const auto requests = transport_.requests();
    ASSERT_EQ(requests.size(), 2U);
    EXPECT_EQ(requests[0].url, kURL);
    EXPECT_EQ(*requests[0].headerField("User-Agent"), "VeltoIDXMLRPC");
    EXPECT_EQ(
        std::string_view(requests[0].body),
        "<?xml "
        "version=\"1.0\"?><methodCall><methodName>some.method</methodName><params><param><value><struct>"
        "<member><name>k</name><value><string>v</string></value></member></struct></value></param></params>"
        "</methodCall>");
    EXPECT_NE(requests[1].body.find("<params></params>"), std::string::npos);
}

TEST_F(XMLRPCShim, OnlyADictionaryIsAResult) {
    const Outcome dictionary = invoke(document(structure(entry("a", "<i4>1</i4>"))));
    EXPECT_TRUE(dictionary.success);
    EXPECT_EQ(dictionary.result, (Dictionary{{"a", Value::int32(1)}}));
    for (const std::string& body : {document("<value><array/></value>"), document(""), std::string(),
                                    std::string("<html>Bad gateway<br></html>")}) {
        const Outcome other = invoke(body);
        EXPECT_TRUE(other.success) << body;
        EXPECT_FALSE(other.result || other.error) << body;
    }
}

TEST_F(XMLRPCShim, AFaultIsAnErrorWithItsCodeAndText) {
    const std::string text = entry("faultString", "not you");
    const Dictionary description{{kErrorDescriptionKey, "not you"}};
    const std::tuple<std::string, int64_t, Dictionary> cases[] = {
        {faultCode("<int>-20101</int>") + text, -20101, description},
        {faultCode("<int>-20101</int>"), -20101, {}},
        {text, -1, description},
        {"", -1, {}},
        {faultCode("-4164") + text, -4164, description},
        {faultCode("<double>7.9</double>"), 7, {}},
        {faultCode("<double>-1e300</double>"), std::numeric_limits<int32_t>::min(), {}},
        {faultCode("<boolean>1</boolean>"), 1, {}},
        {faultCode("none"), 0, {}},
        {faultCode("<array/>"), 0, {}},
    };
    for (const auto& [members, code, userInfo] : cases) {
        SCOPED_TRACE(members);
        const Outcome outcome = invoke(fault(members));
        EXPECT_FALSE(outcome.success);
        EXPECT_FALSE(outcome.result);
        EXPECT_EQ(outcome.error, (Error{kXMLErrorDomain, code, userInfo}));
    }
}

TEST_F(XMLRPCShim, NoResponseIsAnErrorOfItsOwn) {
    const Dictionary userInfo{{kErrorFailureReasonKey, "NULL response from server"},
                              {"function", "xmlInvoke"},
                              {"file", "XMLRPCShim"},
                              {"line", Value::int64(90)}};
    const Outcome serverError = invoke({500, fault(faultCode("<int>-20101</int>"))});
    EXPECT_FALSE(serverError.success);
    EXPECT_FALSE(serverError.result);
    EXPECT_EQ(serverError.error, (Error{kIdentityErrorDomain, -1, userInfo}));

    const platform::FakeHTTPAnswer unreachable = {0, {}, platform::HTTPError{7, "refused"}};
    Dictionary withReason = userInfo;
    withReason.set(kErrorUnderlyingErrorKey,
                   Error{kTransportErrorDomain, 7, {{kErrorDescriptionKey, "refused"}}});
    EXPECT_EQ(invoke(unreachable).error, (Error{kIdentityErrorDomain, -1, withReason}));
    transport_.enqueue(unreachable);
    EXPECT_FALSE(xmlInvoke(kURL, "m", Value(), nullptr, nullptr));
}

TEST_F(XMLRPCShim, AMessageOfTheServerGoesToTheSystemLog) {
    const std::string hello = entry("LogString", "hello");
    const auto level = [&](const std::string& value) { return hello + entry("LogStringLevel", value); };
    const std::pair<std::string, std::optional<platform::LogPriority>> cases[] = {
        {hello, platform::LogPriority::Error},
        {level("<i4>5</i4>"), platform::LogPriority::Notice},
        {level("five"), platform::LogPriority::Error},
        {level("<i4>8</i4>"), platform::LogPriority::Debug},
        {level("<i4>-1</i4>"), platform::LogPriority::Emergency},
        {entry("LogString", "<i4>1</i4>"), std::nullopt},
        {entry("LogStringLevel", "<i4>1</i4>"), std::nullopt},
    };
    for (const auto& [members, priority] : cases) {
        const size_t before = log_.lines().size();
        const Outcome outcome = invoke(document(structure(members)));
        ASSERT_TRUE(outcome.success && outcome.result);
        const auto lines = log_.lines();
        ASSERT_EQ(lines.size() - before, priority ? 1U : 0U) << members;
        if (!priority) continue;
        EXPECT_EQ(lines.back().text, "VeltoIDAuthentication: Message from server \"\"hello\"\"");
        EXPECT_EQ(lines.back().priority, *priority) << members;
        EXPECT_TRUE(outcome.result->contains("LogString"));
    }
    invoke(document(structure(entry("LogString", "two\nlines"))));
    EXPECT_TRUE(log_.contains("two\\nlines")) << "a server must not write lines of its own making";
}

}  // namespace
}  // namespace veltoid
