#include "VeltoIDXMLServerCommunications/Methods.h"

#include <array>

#include "TestSupport/FakeIdentityServer.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"

namespace veltoid {
namespace {

class GetMyInfo : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        createAccount("d1");
    }

    Session session(const String& encDsId = "d1") const {
        return Session(new VeltoIDAuthenticationSessionInfo{kName, kPassword, "https://server.example", "s1",
                                                            now(), 100, encDsId,
                                                            copySessionQueueForAccount(kName)});
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
        failing.reset();
        EXPECT_EQ(takeCachedSession(kName, kPassword, "https://server.example"), nullptr) << each.what;
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 0);
    server_.answer("getMyInfo", Dictionary{{"x", "y"}, {"dsSessionValidityDuration", number(50)}});
    Session working = session();
    EXPECT_TRUE(_VeltoIDSessionDoGetMyInfo(*working, "d1", {}, {}, nullptr, nullptr));
    EXPECT_EQ(working->fValidityDuration, 50) << "commands of any reply are applied";
    working.reset();
    EXPECT_NE(takeCachedSession(kName, kPassword, "https://server.example"), nullptr);
}

// --- The other methods

class Methods : public GetMyInfo {
  protected:
    /// The parameters of the last call beyond those that every call has.
    Dictionary takeOwnParameters() {
        Dictionary sent = server_.take().back().parameters;
        for (const std::string& key : keysOf(createCallParameters(kName, "s1", {}))) sent.remove(key);
        return sent;
    }
    CertificateAnswer fetched(const Dictionary& reply) {
        server_.answer("fetchCert", reply);
        CertificateAnswer answer;
        EXPECT_TRUE(__VeltoIDSessionDoFetchCSRResult(*session(), "d1", "t1", {}, &answer, nullptr));
        return answer;
    }
};

TEST_F(Methods, SendWhatTheyAreGiven) {
    for (const char* method : {"findPerson", "createCert", "fetchCert", "downloadCertComplete", "revokeCert",
                               "saveBreadcrumbEk", "fetchBreadcrumbEk"})
        server_.answer(method, Dictionary{{"x", "y"}});
    setValue("AccountUUID", "U");
    const Data data(platform::bytesOf("ABC"));
    const Dictionary criteria = {{"email", Array{"a@b", "c@d"}}};
    const Value lifetime = Value::real(1'209'600);
    struct Case {
        const char* what;
        std::function<bool(VeltoIDAuthenticationSessionInfo&)> call;
        Dictionary sent;
        const char* counter;
    };
    const Case cases[] = {
        {"find",
         [&](auto& s) { return __VeltoIDSessionDoFindPerson(s, criteria, {}, nullptr, nullptr); },
         {{"searchCriteria", criteria}},
         "VeltoIDXMLFindPersonCount"},
        {"request",
         [](auto& s) { return __VeltoIDSessionDoSendCSR(s, "d1", "pem", {}, nullptr, nullptr, nullptr); },
         {{"CSR", "pem"}, {"encDsId", "d1"}, {"RequestedCertificateLifetimeInSeconds", lifetime}},
         "VeltoIDXMLSendCSRCount"},
        {"request with delays",
         [](auto& s) {
             return __VeltoIDSessionDoSendCSR(
                 s, "d1", "pem", {{"__CERT_FETCH_DELAY_MIN", "5"}, {"__CERT_FETCH_DELAY_MAX", number(10)}},
                 nullptr, nullptr, nullptr);
         },
         {{"__CERT_FETCH_DELAY_MIN", "5"},
          {"CSR", "pem"},
          {"encDsId", "d1"},
          {"RequestedCertificateLifetimeInSeconds", lifetime}},
         "VeltoIDXMLSendCSRCount"},
        {"fetch",
         [](auto& s) { return __VeltoIDSessionDoFetchCSRResult(s, "d1", "t1", {}, nullptr, nullptr); },
         {{"CertificateToken", "t1"}, {"encDsId", "d1"}},
         "VeltoIDXMLFetchCertCount"},
        {"complete",
         [](auto& s) { return __VeltoIDSessionDoCompleteCertificate(s, "d1", "t1", {}, nullptr); },
         {{"CertificateToken", "t1"}, {"encDsId", "d1"}},
         "VeltoIDXMLCompleteCertCount"},
        {"fetch by number",
         [](auto& s) {
             return __VeltoIDSessionDoFetchCertificateBySerialNumber(s, "7", {}, nullptr, nullptr);
         },
         {{"certSerialNumber", "7"}},
         "VeltoIDXMLFetchCertCount"},
        {"revoke",
         [](auto& s) { return __VeltoIDSessionDoRevokeCertificate(s, "7", {}, nullptr); },
         {{"SerialNumber", "7"}},
         nullptr},
        {"set breadcrumb",
         [&](auto& s) { return __VeltoIDSessionDoSetBreadcrumb(s, "k", data, {}, nullptr); },
         {{"machineUUID", "U"}, {"breadcrumbKey", "k"}, {"ek", "QUJD"}},
         nullptr},
        {"get breadcrumb",
         [](auto& s) { return !__VeltoIDSessionDoCopyBreadcrumb(s, "k", {}, nullptr); },
         {{"machineUUID", "U"}, {"breadcrumbKey", "k"}},
         nullptr},
    };
    for (const Case& each : cases) {
        const auto counted = [&] { return each.counter != nullptr ? count(each.counter) : 0; };
        const int64_t before = counted();
        Session working = session();
        EXPECT_TRUE(each.call(*working)) << each.what;
        EXPECT_EQ(takeOwnParameters(), each.sent) << each.what;
        EXPECT_EQ(working->fSessionID, "s1") << each.what << ": not spoiled";
        EXPECT_EQ(counted(), before + (each.counter != nullptr ? 1 : 0)) << each.what;
    }
    for (const auto& [stored, sent] : {std::pair(number(60), 60.0), std::pair(Value("60"), 1'209'600.0)}) {
        __VeltoIDDBSetMetaInfoValue(nullptr, "VeltoIDMetaDefaultCertificateRequestedLifetime", stored);
        EXPECT_TRUE(cases[1].call(*session()));
        EXPECT_EQ(takeOwnParameters()["RequestedCertificateLifetimeInSeconds"], Value::real(sent));
    }
    for (const char* method : {"findPerson", "createCert", "fetchCert", "downloadCertComplete", "revokeCert",
                               "saveBreadcrumbEk", "fetchBreadcrumbEk"})
        server_.fault(method, -9);
    for (const Case& each : cases) {
        Session failing = session();
        const bool isCopy = std::string_view(each.what) == "get breadcrumb";
        EXPECT_EQ(each.call(*failing), isCopy) << each.what;
        EXPECT_EQ(failing->fSessionID, String()) << each.what << ": spoiled";
    }
}

TEST_F(Methods, TakeWhatIsOfUseInACertificateAnswer) {
    const Dictionary dsCert = {{"Certificate", "pem"},
                               {"CertType", "t"},
                               {"SerialNumber", "7"},
                               {"CertStatus", "CERT_ISSUED"},
                               {"IntermediateCert", "above"},
                               {"Expires", "2014-03-05T17:04:00Z"},
                               {"Other", "x"}};
    const Dictionary result = {{"Certificate", "pem"},
                               {"CertType", "t"},
                               {"SerialNumber", "7"},
                               {"CertStatus", "CERT_ISSUED"},
                               {"IntermediateCertificate", "above"},
                               {"Expires", Value::date(1'394'039'040)}};
    EXPECT_EQ(fetched({{"dsCert", dsCert}}).result, result);
    EXPECT_EQ(fetched({{"dsCert", Array{dsCert, Dictionary()}}}).result, result);
    EXPECT_EQ(fetched({{"dsCert", dsCert}, {"Delay", Value::real(2.5)}}).delay, Value::real(2.5));
    EXPECT_EQ(fetched({{"dsCert", Dictionary{{"Expires", date(5)}, {"SerialNumber", number(7)}}}}).result,
              (Dictionary{{"Expires", date(5)}}));
    for (const Value& none : {Value(Array()), Value(Array{"x", dsCert}), Value("x"),
                              Value(Dictionary{{"CertStatus", number(1)}, {"Expires", "soon"}})})
        EXPECT_EQ(fetched({{"dsCert", none}, {"Delay", "soon"}}).result, std::nullopt);

    String token;
    CertificateAnswer answer;
    server_.answer("createCert",
                   Dictionary{{"CertificateToken", "t"}, {"dsCert", dsCert}, {"Delay", number(5)}});
    EXPECT_TRUE(__VeltoIDSessionDoSendCSR(*session(), "d1", "pem", {}, &token, &answer, nullptr));
    EXPECT_EQ(token, "t");
    EXPECT_EQ(answer.result, result);
    EXPECT_EQ(answer.delay, number(5));

    server_.fault("fetchCert", -4164);
    Session pending = session();
    EXPECT_TRUE(__VeltoIDSessionDoFetchCSRResult(*pending, "d1", "t1", {}, &answer, nullptr));
    EXPECT_EQ(answer.result, (Dictionary{{"CertificateToken", "t1"}, {"CertStatus", "SIGNIN_PENDING"}}));
    EXPECT_EQ(answer.delay, number(300));
    EXPECT_EQ(pending->fSessionID, "s1");
    std::optional<Error> error;
    EXPECT_FALSE(__VeltoIDSessionDoFetchCertificateBySerialNumber(*session(), "7", {}, nullptr, &error));
    EXPECT_EQ(error->code, -100) << "that fault is a failure everywhere else";
}

TEST_F(Methods, HandOutWhatWasFound) {
    const Array people{Dictionary{{"matched", "email"}, {"value", "a@b"}}, "nobody"};
    std::optional<Array> matches;
    server_.answer("findPerson", Dictionary{{"matches", people}});
    EXPECT_TRUE(__VeltoIDSessionDoFindPerson(*session(), {}, {}, &matches, nullptr));
    EXPECT_EQ(matches, people);
    EXPECT_EQ(__VeltoIDDBCopyCachedFindPersonResults({{"email", Array{"a@b"}}})->size(), 1U);
    server_.answer("findPerson", Dictionary{{"matches", "none"}});
    EXPECT_TRUE(__VeltoIDSessionDoFindPerson(*session(), {}, {}, &matches, nullptr));
    EXPECT_EQ(matches, std::nullopt);

    String certificate;
    server_.answer("fetchCert", Dictionary{{"Certificate", "pem"}});
    EXPECT_TRUE(__VeltoIDSessionDoFetchCertificateBySerialNumber(*session(), "7", {}, &certificate, nullptr));
    EXPECT_EQ(certificate, "pem");

    for (const auto& [reply, expected] :
         {std::pair<Value, Data>(Dictionary{{"ek", "QUJD"}}, Data(platform::bytesOf("ABC"))),
          {Dictionary{{"ek", "!"}}, {}},
          {Dictionary{{"ek", number(1)}}, {}},
          {"hello", {}}}) {
        server_.answer("fetchBreadcrumbEk", reply);
        std::optional<Error> error;
        Session working = session();
        EXPECT_EQ(__VeltoIDSessionDoCopyBreadcrumb(*working, "k", {}, &error), expected);
        EXPECT_EQ(error, std::nullopt);
        EXPECT_EQ(working->fSessionID, "s1") << "nothing stored is no failure";
    }
}

}  // namespace
}  // namespace veltoid
