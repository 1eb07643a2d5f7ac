#include "XMLRPC/XMLRPCRequest.h"

#include <gtest/gtest.h>

#include "Platform/storage/Preferences.h"
#include "TestSupport/TemporaryStateDirectory.h"

namespace veltoid {
namespace {

using Fields = std::vector<std::pair<std::string, std::string>>;

TEST(XMLRPCRequest, IsAnXMLPostOfTheDocument) {
    XMLRPCRequest request("https://server.example/rpc");
    request.setUserAgent("agent");
    request.setUserAgent("VeltoIDXMLRPC");
    request.setValue("text/plain", "content-type");
    request.setMethod("m", Dictionary{{"k", "\u20AC"}});

    const platform::HTTPRequest http = request.request();
    EXPECT_EQ(http.url, "https://server.example/rpc");
    EXPECT_EQ(http.method, "POST");
    EXPECT_FALSE(http.handlesCookies);
    EXPECT_EQ(
        std::string_view(http.body),
        "<?xml version=\"1.0\"?><methodCall><methodName>m</methodName><params><param><value><struct><member>"
        "<name>k</name><value><string>\u20AC</string></value></member></struct></value></param></params>"
        "</methodCall>");
    EXPECT_EQ(http.body, request.body());
    // The length counts bytes: the one character of the text is three of them.
    EXPECT_EQ(http.headerFields, (Fields{{"User-Agent", "VeltoIDXMLRPC"},
                                         {"content-type", "text/xml"},
                                         {"Content-Length", "202"},
                                         {"Accept", "text/xml"}}));
}

TEST(XMLRPCRequest, KeepsMethodAndParameters) {
    XMLRPCRequest request(nullptr);
    EXPECT_EQ(request.URL(), String(""));
    EXPECT_EQ(request.userAgent(), String());
    request.setURL("https://a.example");
    EXPECT_EQ(request.URL(), String("https://a.example"));

    request.setMethod("several", Array{"1", "2"});
    EXPECT_EQ(request.parameters(), (Array{"1", "2"}));
    const auto encoder = std::make_shared<XMLRPCDefaultEncoder>();
    encoder->setMethod("before", Array{"0"});
    request.setEncoder(encoder);
    EXPECT_EQ(encoder->method(), String("several")) << "the new encoder goes on with the call of the old one";
    EXPECT_EQ(encoder->parameters(), (Array{"1", "2"}));

    request.setMethod("one", Value("1"));
    EXPECT_EQ(request.parameters(), Array{"1"});
    request.setMethod("none", Value());
    EXPECT_EQ(request.parameters(), std::nullopt);
    request.setMethod("one", Value::null());
    EXPECT_EQ(request.parameters(), Array{Value::null()});
    request.setMethod("none");
    EXPECT_EQ(request.parameters(), std::nullopt);
    EXPECT_EQ(request.method(), String("none"));
    EXPECT_EQ(encoder->method(), String("none"));
}

TEST(XMLRPCRequest, TakesTheUserAgentOfThePreferencesWhenNoneIsSet) {
    const platform::TemporaryStateDirectory directory;
    XMLRPCRequest request("https://server.example/rpc");
    EXPECT_EQ(request.request().headerField("User-Agent"), nullptr);
    const platform::Preferences settings("com.velto.harbwell.veltoidauthagent");
    ASSERT_TRUE(settings.set({{"UserAgent", [](platform::ValueSink& sink) { sink.integer(1); }}}));
    EXPECT_EQ(request.request().headerField("User-Agent"), nullptr) << "a number is no user agent";
    ASSERT_TRUE(settings.set({{"UserAgent", [](platform::ValueSink& sink) { sink.string("preferred"); }}}));
    const platform::HTTPRequest http = request.request();
    ASSERT_NE(http.headerField("User-Agent"), nullptr);
    EXPECT_EQ(*http.headerField("User-Agent"), "preferred");
    request.setUserAgent("own");
    EXPECT_EQ(*request.request().headerField("User-Agent"), "own");
}

}  // namespace
}  // namespace veltoid
