#include "VeltoIDXMLServerCommunications/Methods.h"

#include <array>

#include "VeltoIDXMLServerCommunications/FakeIdentityServer.h"
#include "VeltoIDXMLServerCommunications/SessionCache.h"

namespace veltoid {
namespace {

class GetMyInfo : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        createAccount("d1");
    }

    Session session(const String& encDsId = "d1") const {
        return std::make_unique<VeltoIDAuthenticationSessionInfo>(
            VeltoIDAuthenticationSessionInfo{kName, kPassword, "https://server.example", "s1", now(), 100,
                                             encDsId, copySessionQueueForAccount(kName)});
    }

    /// What the operation makes of a reply.
    Dictionary resultOf(const Dictionary& reply) {
        server_.answer("getMyInfo", reply);
        Dictionary result;
        EXPECT_TRUE(_VeltoIDSessionDoGetMyInfo(*session(), nullptr, {}, {}, &result, nullptr));
        return result;
    }
};

TEST_F(GetMyInfo, SendsWhatTheAgentHasAlready) {
    struct Case {
        const char* what;
        String argument;
        String ofSession;
        Dictionary parameters;
        /// What is sent of the encDsId, the serial number and the record's identifier.
        std::array<Value, 3> sent;
    };
    constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";
    const Dictionary given = {{"SerialNumber", "given"}, {kIdentifier, ""}, {"Other", "x"}};
    const Dictionary wrong = {{"SerialNumber", number(1)}, {kIdentifier, number(1)}};
    __VeltoIDDBSetCertificateInfo("certified", Dictionary{{"SerialNumber", "stored"}});
    const Case cases[] = {
        {"nothing", nullptr, nullptr, {}, {}},
        {"the session's", nullptr, "s", {}, {"s"}},
        {"the argument first", "a", "s", {}, {"a"}},
        {"parameters", "a", "s", given, {"a", "given", ""}},
        {"the entry's serial number first", "certified", "s", given, {"certified", "stored", ""}},
        {"of the argument only", nullptr, "certified", given, {"certified", "given", ""}},
        {"wrong kinds", "a", "s", wrong, {"a"}},
    };
    server_.answer("getMyInfo", Dictionary{{"x", "y"}});
    const std::set<std::string> common = keysOf(createCallParameters(kName, "s1", {}));
    for (const Case& each : cases) {
        ASSERT_TRUE(_VeltoIDSessionDoGetMyInfo(*session(each.ofSession), each.argument, each.parameters, {},
                                               nullptr, nullptr));
        Dictionary sent = server_.take().at(0).parameters;
        EXPECT_EQ(sent["dsSession"], Value("s1")) << each.what;
        for (const std::string& key : common) EXPECT_TRUE(sent.remove(key)) << each.what << key;
        EXPECT_EQ(sent, (Dictionary{{"encDsId", each.sent[0]},
                                    {"CertificateSerialNumber", each.sent[1]},
                                    {"ClientVIDVRecordIdentifier", each.sent[2]}}))
            << each.what;
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 7);
}

TEST_F(GetMyInfo, TakesEntriesOfTheRightKind) {
    const Value list = Array{"a", "b"};
    struct Case {
        const char* replyKey;
        const char* resultKey;
        Value right;
        Value wrong;
    };
    const Case cases[] = {
        {"encDsId", "encDsId", "d", number(1)},
        {"lastNm", "LastName", "Roe", number(1)},
        {"firstNm", "FirstName", "Jane", list},
        {"ValidatedEmail", "ValidatedEmail", list, "a"},
        {"ValidatedPhones", "ValidatedPhones", Array(), flag(true)},
        {"PrimaryEmail", "PrimaryEmail", "p", number(1)},
        {"VeltoID", "VeltoID", "v", list},
        {"CertificateIsValid", "CertificateIsValid", flag(false), "false"},
        {"AllEmails", "AllEmails", list, "a"},
        {"ValidForInterval", "ValidForInterval", Value::real(2.5), "60"},
    };
    Dictionary right = {{"Unknown", "x"}};
    Dictionary wrong = {{"Unknown", "x"}};
    Dictionary result;
    for (const Case& each : cases) {
        right.set(each.replyKey, each.right);
        wrong.set(each.replyKey, each.wrong);
        result.set(each.resultKey, each.right);
    }
    EXPECT_EQ(resultOf(right), result);
    EXPECT_EQ(resultOf(wrong), Dictionary());
}

TEST_F(GetMyInfo, AValidationRecordComesWithItsData) {
    const Data data(std::vector<uint8_t>{1, 2, 3});
    const Value identifier = "v1";
    const Value checked = "2030-01-02T03:04:05Z";
    constexpr const char* kData = "VeltoIDAccountValidationRecordData";
    constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";
    constexpr const char* kNextCheck = "VeltoIDAccountValidationRecordNextCheckDateKey";
    EXPECT_EQ(
        resultOf({{"VIDVRecord", "AQID"},
                  {"VIDVRecordIdentifier", identifier},
                  {"VIDVRecordNextCheckDate", checked}}),
        (Dictionary{{kData, data}, {kIdentifier, identifier}, {kNextCheck, Value::date(1'893'553'445)}}));
    EXPECT_EQ(
        resultOf(
            {{"VIDVRecord", "AQID"}, {"VIDVRecordIdentifier", number(1)}, {"VIDVRecordNextCheckDate", "x"}}),
        (Dictionary{{kData, data}}));
    EXPECT_EQ(resultOf({{"VIDVRecord", "AQID"}, {"VIDVRecordNextCheckDate", date()}}),
              (Dictionary{{kData, data}}));
    for (const Value& record : {Value(""), number(5), Value()})
        EXPECT_EQ(resultOf({{"VIDVRecord", record},
                            {"VIDVRecordIdentifier", identifier},
                            {"VIDVRecordNextCheckDate", checked}}),
                  Dictionary())
            << testing::PrintToString(record);
}

TEST_F(GetMyInfo, ASessionWithoutEncDsIdLearnsIt) {
    server_.answer("getMyInfo", Dictionary{{"encDsId", "learned"}});
    const Session without = session(nullptr);
    ASSERT_TRUE(_VeltoIDSessionDoGetMyInfo(*without, nullptr, {}, {}, nullptr, nullptr));
    EXPECT_EQ(without->fEncDsId, "learned");
    const Session with = session("own");
    ASSERT_TRUE(_VeltoIDSessionDoGetMyInfo(*with, nullptr, {}, {}, nullptr, nullptr));
    EXPECT_EQ(with->fEncDsId, "own");
}

TEST_F(GetMyInfo, AFailedCallSpoilsTheSession) {
    struct Case {
        const char* what;
        std::function<void()> prepare;
        int64_t code;
        bool keepsPassword;
    };
    const Case cases[] = {
        {"a fault", [this] { server_.fault("getMyInfo", -4); }, -100, true},
        {"wrong password", [this] { server_.fault("getMyInfo", -20283); }, -101, false},
        {"no server", [this] { server_.refuse("getMyInfo", 500); }, -100, true},
        {"no dictionary", [this] { server_.answer("getMyInfo", "hello"); }, -100, true},
    };
    for (const Case& each : cases) {
        createAccount();
        each.prepare();
        Session failing = session();
        Dictionary result{{"left", "over"}};
        std::optional<Error> error;
        EXPECT_FALSE(_VeltoIDSessionDoGetMyInfo(*failing, "d1", {}, {}, &result, &error)) << each.what;
        EXPECT_EQ(result, (Dictionary{{"left", "over"}})) << each.what;
        EXPECT_EQ(error->code, each.code) << each.what;
        EXPECT_EQ(hasPassword(), each.keepsPassword) << each.what;
        EXPECT_EQ(failing->fSessionID, String()) << each.what;
        __VeltoIDSessionRelease(std::move(failing));
        EXPECT_EQ(takeCachedSession(kName, kPassword, "https://server.example"), nullptr) << each.what;
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 0);
    server_.answer("getMyInfo", Dictionary{{"x", "y"}, {"dsSessionValidityDuration", number(50)}});
    Session working = session();
    EXPECT_TRUE(_VeltoIDSessionDoGetMyInfo(*working, "d1", {}, {}, nullptr, nullptr));
    EXPECT_EQ(working->fValidityDuration, 50) << "commands of any reply are applied";
    __VeltoIDSessionRelease(std::move(working));
    EXPECT_NE(takeCachedSession(kName, kPassword, "https://server.example"), nullptr);
}

}  // namespace
}  // namespace veltoid
