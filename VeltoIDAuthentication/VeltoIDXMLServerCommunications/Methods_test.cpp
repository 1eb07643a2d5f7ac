#include "VeltoIDXMLServerCommunications/Methods.h"

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
        const char* argument;
        const char* ofSession;
        Dictionary parameters;
        Dictionary sent;
    };
    constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";
    __VeltoIDDBSetCertificateInfo("with certificate", Dictionary{{"SerialNumber", "stored"}});
    const Case cases[] = {
        {"nothing", nullptr, nullptr, {}, {}},
        {"the session's", nullptr, "s", {}, {{"encDsId", "s"}}},
        {"the argument first", "a", "s", {}, {{"encDsId", "a"}}},
        {"parameters",
         "a",
         "s",
         {{"SerialNumber", "given"}, {kIdentifier, ""}, {"Other", "x"}},
         {{"encDsId", "a"}, {"CertificateSerialNumber", "given"}, {"ClientVIDVRecordIdentifier", ""}}},
        {"the entry's serial number first",
         "with certificate",
         "s",
         {{"SerialNumber", "given"}},
         {{"encDsId", "with certificate"}, {"CertificateSerialNumber", "stored"}}},
        {"of the argument only",
         nullptr,
         "with certificate",
         {{"SerialNumber", "given"}},
         {{"encDsId", "with certificate"}, {"CertificateSerialNumber", "given"}}},
        {"wrong kinds",
         "a",
         "s",
         {{"SerialNumber", number(1)}, {kIdentifier, number(1)}},
         {{"encDsId", "a"}}},
    };
    server_.answer("getMyInfo", Dictionary{{"x", "y"}});
    const std::set<std::string> common = keysOf(createCallParameters(kName, "s1", {}));
    for (const Case& each : cases) {
        const auto text = [](const char* given) { return given != nullptr ? String(given) : String(); };
        ASSERT_TRUE(_VeltoIDSessionDoGetMyInfo(*session(text(each.ofSession)), text(each.argument),
                                               each.parameters, {}, nullptr, nullptr));
        Dictionary sent = server_.take().at(0).parameters;
        EXPECT_EQ(sent["dsSession"], Value("s1")) << each.what;
        for (const std::string& key : common) EXPECT_TRUE(sent.remove(key)) << each.what << key;
        EXPECT_EQ(sent, each.sent) << each.what;
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 7);
}

TEST_F(GetMyInfo, TakesEntriesOfTheRightKind) {
    const Array list{"a", "b"};
    EXPECT_EQ(resultOf({{"encDsId", "d"},
                        {"lastNm", "Roe"},
                        {"firstNm", "Jane"},
                        {"ValidatedEmail", list},
                        {"ValidatedPhones", Array()},
                        {"PrimaryEmail", "p"},
                        {"VeltoID", "v"},
                        {"CertificateIsValid", flag(false)},
                        {"AllEmails", list},
                        {"ValidForInterval", Value::real(2.5)},
                        {"Unknown", "x"}}),
              (Dictionary{{"encDsId", "d"},
                          {"LastName", "Roe"},
                          {"FirstName", "Jane"},
                          {"ValidatedEmail", list},
                          {"ValidatedPhones", Array()},
                          {"PrimaryEmail", "p"},
                          {"VeltoID", "v"},
                          {"CertificateIsValid", flag(false)},
                          {"AllEmails", list},
                          {"ValidForInterval", Value::real(2.5)}}));
    EXPECT_EQ(resultOf({{"encDsId", number(1)},
                        {"lastNm", number(1)},
                        {"firstNm", list},
                        {"ValidatedEmail", "a"},
                        {"ValidatedPhones", flag(true)},
                        {"PrimaryEmail", number(1)},
                        {"VeltoID", number(1)},
                        {"CertificateIsValid", "false"},
                        {"AllEmails", "a"},
                        {"ValidForInterval", "60"}}),
              Dictionary());
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
