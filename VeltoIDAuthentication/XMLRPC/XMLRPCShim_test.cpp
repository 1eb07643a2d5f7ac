#include "XMLRPC/XMLRPCShim.h"

#include <gtest/gtest.h>

#include <limits>

#include "TestSupport/FakeHTTPSession.h"
#include "TestSupport/FakeSystemLog.h"
#include "XMLRPC/XMLRPCConnection.h"

namespace veltoid {
namespace {

constexpr const char* kURL = "https://server.example/rpc";

std::string document(const std::string& value) {
    return "<methodResponse><params><param>" + value + "</param></params></methodResponse>";
}

std::string member(const std::string& name, const std::string& value) {
    return "<member><name>" + name + "</name><value>" + value + "</value></member>";
}

std::string structure(const std::string& members) {
    return "<value><struct>" + members + "</struct></value>";
}

std::string fault(const std::string& members) {
    return "<methodResponse><fault>" + structure(members) + "</fault></methodResponse>";
}

struct Outcome {
    bool success = false;
    std::optional<Dictionary> result = Dictionary{{"left", "over"}};
    std::optional<Error> error;
};

class XMLRPCShim : public testing::Test {
  protected:
    Outcome invoke(const std::string& body, int status = 200) {
        platform::FakeHTTPAnswer answer;
        answer.status = status;
        answer.body = body;
        return invoke(answer);
    }

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
    const Outcome dictionary = invoke(document(structure(member("a", "<i4>1</i4>"))));
    EXPECT_TRUE(dictionary.success);
    EXPECT_EQ(dictionary.result, (Dictionary{{"a", Value::int32(1)}}));
    for (const std::string& body : {document("<value><array/></value>"), document(""), std::string(),
                                    std::string("<html>Bad gateway<br></html>")}) {
        const Outcome other = invoke(body);
        EXPECT_TRUE(other.success) << body;
        EXPECT_FALSE(other.result) << body;
        EXPECT_FALSE(other.error) << body;
    }
}

TEST_F(XMLRPCShim, AFaultIsAnErrorWithItsCodeAndText) {
    const std::string text = member("faultString", "not you");
    const Dictionary description{{kErrorDescriptionKey, "not you"}};
    const std::tuple<std::string, int64_t, Dictionary> cases[] = {
        {member("faultCode", "<int>-20101</int>") + text, -20101, description},
        {member("faultCode", "<int>-20101</int>"), -20101, {}},
        {text, -1, description},
        {"", -1, {}},
        {member("faultCode", "-4164") + text, -4164, description},
        {member("faultCode", "<double>7.9</double>"), 7, {}},
        {member("faultCode", "<double>-1e300</double>"), std::numeric_limits<int32_t>::min(), {}},
        {member("faultCode", "<boolean>1</boolean>"), 1, {}},
        {member("faultCode", "none"), 0, {}},
        {member("faultCode", "<array/>"), 0, {}},
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
    const Outcome serverError = invoke(fault(member("faultCode", "<int>-20101</int>")), 500);
    EXPECT_FALSE(serverError.success);
    EXPECT_FALSE(serverError.result);
    EXPECT_EQ(serverError.error, (Error{kIdentityErrorDomain, -1, userInfo}));

    platform::FakeHTTPAnswer unreachable;
    unreachable.status = 0;
    unreachable.error = platform::HTTPError{7, "refused"};
    Dictionary withReason = userInfo;
    withReason.set(kErrorUnderlyingErrorKey,
                   Error{kTransportErrorDomain, 7, {{kErrorDescriptionKey, "refused"}}});
    EXPECT_EQ(invoke(unreachable).error, (Error{kIdentityErrorDomain, -1, withReason}));
    transport_.enqueue(unreachable);
    EXPECT_FALSE(xmlInvoke(kURL, "m", Value(), nullptr, nullptr));
}

TEST_F(XMLRPCShim, AMessageOfTheServerGoesToTheSystemLog) {
    const std::string hello = member("LogString", "hello");
    const auto level = [&](const std::string& value) { return hello + member("LogStringLevel", value); };
    const std::pair<std::string, std::optional<platform::LogPriority>> cases[] = {
        {hello, platform::LogPriority::Error},
        {level("<i4>5</i4>"), platform::LogPriority::Notice},
        {level("five"), platform::LogPriority::Error},
        {level("<i4>8</i4>"), platform::LogPriority::Debug},
        {level("<i4>-1</i4>"), platform::LogPriority::Emergency},
        {member("LogString", "<i4>1</i4>"), std::nullopt},
        {member("LogStringLevel", "<i4>1</i4>"), std::nullopt},
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
    invoke(document(structure(member("LogString", "two\nlines"))));
    EXPECT_TRUE(log_.contains("two\\nlines")) << "a server must not write lines of its own making";
}

}  // namespace
}  // namespace veltoid
