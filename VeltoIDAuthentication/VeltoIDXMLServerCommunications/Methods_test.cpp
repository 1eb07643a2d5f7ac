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

    /// What the operation makes of a reply.
    Dictionary resultOf(const Dictionary& reply) {
        server_.answer("getMyInfo", reply);
        Dictionary result;
        EXPECT_TRUE(_VeltoIDSessionDoGetMyInfo(*session(), nullptr, {}, {}, &result, nullptr));
        return result;
    }
};

TEST_F(GetMyInfo, SendsWhatTheAgentHasAlready) {
    const Dictionary given = {{"SerialNumber", "given"}, {kIdentifier, ""}, {"Other", "x"}};
    const Dictionary wrong = {{"SerialNumber", number(1)}, {kIdentifier, number(1)}};
    __VeltoIDDBSetCertificateInfo("certified", Dictionary{{"SerialNumber", "stored"}});
    const struct {
        const char* what;
        String argument, ofSession;
        Dictionary parameters;
        /// What is sent of the encDsId, the serial number and the record's identifier.
        std::array<Value, 3> ownParameters;
    } cases[] = {
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
    for (const auto& [what, argument, ofSession, parameters, ownParameters] : cases) {
        SCOPED_TRACE(what);
        ASSERT_TRUE(
            _VeltoIDSessionDoGetMyInfo(*session(ofSession), argument, parameters, {}, nullptr, nullptr));
        Dictionary sent = server_.take().at(0).parameters;
        EXPECT_EQ(sent["dsSession"], Value("s1"));
        for (const std::string& key : common) EXPECT_TRUE(sent.remove(key)) << key;
        EXPECT_EQ(sent, (Dictionary{{"encDsId", ownParameters[0]},
                                    {"CertificateSerialNumber", ownParameters[1]},
                                    {"ClientVIDVRecordIdentifier", ownParameters[2]}}));
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 7);
}

TEST_F(GetMyInfo, TakesEntriesOfTheRightKind) {
    const Value list = Array{"a", "b"};
    const std::tuple<const char*, const char*, Value, Value> cases[] = {
        {"encDsId", "encDsId", "d", number(1)},
        {"lastNm", "LastName", "Roe", number(1)},
        {"firstNm", "FirstName", "Jane", list},
        {"ValidatedEmail", "ValidatedEmail", list, "a"},
        {"ValidatedPhones", "ValidatedPhones", Array(), kOn},
        {"PrimaryEmail", "PrimaryEmail", "p", number(1)},
        {"VeltoID", "VeltoID", "v", list},
        {"CertificateIsValid", "CertificateIsValid", kOff, "false"},
        {"AllEmails", "AllEmails", list, "a"},
        {"ValidForInterval", "ValidForInterval", Value::real(2.5), "60"},
    };
    Dictionary right = {{"Unknown", "x"}};
    Dictionary wrong = {{"Unknown", "x"}};
    Dictionary result;
    for (const auto& [replyKey, resultKey, good, bad] : cases) {
        right.set(replyKey, good);
        wrong.set(replyKey, bad);
        result.set(resultKey, good);
    }
    EXPECT_EQ(resultOf(right), result);
    EXPECT_EQ(resultOf(wrong), Dictionary());
}

TEST_F(GetMyInfo, AValidationRecordComesWithItsData) {
    const Data data(std::vector<uint8_t>{1, 2, 3});
    const Value identifier = "v1";
    const Value checked = "2030-01-02T03:04:05Z";
    const auto resultOfRecord = [this](const Value& record, const Value& name, const Value& next) {
        return resultOf(
            {{"VIDVRecord", record}, {"VIDVRecordIdentifier", name}, {"VIDVRecordNextCheckDate", next}});
    };
    const Dictionary dataAlone = {{kData, data}};
    EXPECT_EQ(
        resultOfRecord("AQID", identifier, checked),
        (Dictionary{{kData, data}, {kIdentifier, identifier}, {kNextCheck, Value::date(1'893'553'445)}}));
    EXPECT_EQ(resultOfRecord("AQID", number(1), "x"), dataAlone);
    EXPECT_EQ(resultOfRecord("AQID", {}, date()), dataAlone);
    for (const Value& record : {Value(""), number(5), Value()})
        EXPECT_EQ(resultOfRecord(record, identifier, checked), Dictionary())
            << testing::PrintToString(record);
}

TEST_F(GetMyInfo, ASessionWithoutEncDsIdLearnsIt) {
    server_.answer("getMyInfo", Dictionary{{"encDsId", "learned"}});
    for (const auto& [before, after] : {std::pair(String(), "learned"), std::pair(String("own"), "own")}) {
        const Session called = session(before);
        ASSERT_TRUE(_VeltoIDSessionDoGetMyInfo(*called, nullptr, {}, {}, nullptr, nullptr));
        EXPECT_EQ(called->fEncDsId, after);
    }
}

TEST_F(GetMyInfo, AFailedCallSpoilsTheSession) {
    const std::tuple<const char*, std::function<void()>, int64_t, bool> cases[] = {
        {"a fault", [this] { server_.fault("getMyInfo", -4); }, -100, true},
        {"wrong password", [this] { server_.fault("getMyInfo", -20283); }, -101, false},
        {"no server", [this] { server_.refuse("getMyInfo", 500); }, -100, true},
        {"no dictionary", [this] { server_.answer("getMyInfo", "hello"); }, -100, true},
    };
    for (const auto& [what, prepare, code, keepsPassword] : cases) {
        SCOPED_TRACE(what);
        createAccount();
        prepare();
        Session failing = session();
        Dictionary result{{"left", "over"}};
        std::optional<Error> error;
        EXPECT_FALSE(_VeltoIDSessionDoGetMyInfo(*failing, "d1", {}, {}, &result, &error));
        EXPECT_EQ(result, (Dictionary{{"left", "over"}}));
        EXPECT_EQ(error->code, code);
        EXPECT_EQ(hasPassword(), keepsPassword);
        EXPECT_EQ(failing->fSessionID, String());
        failing.reset();
        EXPECT_EQ(takeCachedSession(kName, kPassword, kURL), nullptr);
    }
    EXPECT_EQ(count("VeltoIDXMLGetMyInfoCount"), 0);
    server_.answer("getMyInfo", Dictionary{{"x", "y"}, {"dsSessionValidityDuration", number(50)}});
    Session working = session();
    EXPECT_TRUE(_VeltoIDSessionDoGetMyInfo(*working, "d1", {}, {}, nullptr, nullptr));
    EXPECT_EQ(working->fValidityDuration, 50) << "commands of any reply are applied";
    working.reset();
    EXPECT_NE(takeCachedSession(kName, kPassword, kURL), nullptr);
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
    const auto methods = {"findPerson", "createCert",       "fetchCert",        "downloadCertComplete",
                          "revokeCert", "saveBreadcrumbEk", "fetchBreadcrumbEk"};
    for (const char* method : methods) server_.answer(method, Dictionary{{"x", "y"}});
    setValue("AccountUUID", "U");
    const Data data(platform::bytesOf("ABC"));
    const Dictionary criteria = {{"email", Array{"a@b", "c@d"}}};
    const Dictionary certificate = {{"CertificateToken", "t1"}, {"encDsId", "d1"}};
    const Dictionary breadcrumb = {{"machineUUID", "U"}, {"breadcrumbKey", "k"}};
    const Dictionary delays = {{"__CERT_FETCH_DELAY_MIN", "5"}, {"__CERT_FETCH_DELAY_MAX", number(10)}};
    const Dictionary csr = {
        {"CSR", "pem"}, {"encDsId", "d1"}, {"RequestedCertificateLifetimeInSeconds", Value::real(1'209'600)}};
    Dictionary delayed = csr;
    delayed.set("__CERT_FETCH_DELAY_MIN", "5");
    Dictionary withData = breadcrumb;
    withData.set("ek", "QUJD");
    using Call = std::function<bool(VeltoIDAuthenticationSessionInfo&)>;
    const std::tuple<const char*, Call, Dictionary, const char*> cases[] = {
        {"find",
         [&](auto& s) { return __VeltoIDSessionDoFindPerson(s, criteria, {}, nullptr, nullptr); },
         {{"searchCriteria", criteria}},
         "VeltoIDXMLFindPersonCount"},
        {"request",
         [](auto& s) { return __VeltoIDSessionDoSendCSR(s, "d1", "pem", {}, nullptr, nullptr, nullptr); },
         csr, "VeltoIDXMLSendCSRCount"},
        {"request with delays",
         [&](auto& s) {
             return __VeltoIDSessionDoSendCSR(s, "d1", "pem", delays, nullptr, nullptr, nullptr);
         },
         delayed, "VeltoIDXMLSendCSRCount"},
        {"fetch",
         [](auto& s) { return __VeltoIDSessionDoFetchCSRResult(s, "d1", "t1", {}, nullptr, nullptr); },
         certificate, "VeltoIDXMLFetchCertCount"},
        {"complete",
         [](auto& s) { return __VeltoIDSessionDoCompleteCertificate(s, "d1", "t1", {}, nullptr); },
         certificate, "VeltoIDXMLCompleteCertCount"},
        {"by number",
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
         [&](auto& s) { return __VeltoIDSessionDoSetBreadcrumb(s, "k", data, {}, nullptr); }, withData,
         nullptr},
        {"get breadcrumb", [](auto& s) { return !__VeltoIDSessionDoCopyBreadcrumb(s, "k", {}, nullptr); },
         breadcrumb, nullptr},
    };
    for (const auto& [what, call, sent, counter] : cases) {
        SCOPED_TRACE(what);
        const auto counted = [key = counter] { return key != nullptr ? count(key) : 0; };
        const int64_t before = counted();
        Session working = session();
        EXPECT_TRUE(call(*working));
        EXPECT_EQ(takeOwnParameters(), sent);
        EXPECT_EQ(working->fSessionID, "s1") << "not spoiled";
        EXPECT_EQ(counted(), before + (counter != nullptr ? 1 : 0));
    }
    for (const auto& [stored, sent] : {std::pair(number(60), 60.0), std::pair(Value("61.5"), 61.5),
                                       std::pair(Value("60 s"), 1'209'600.0)}) {
        __VeltoIDDBSetMetaInfoValue(nullptr, "VeltoIDMetaDefaultCertificateRequestedLifetime", stored);
        EXPECT_TRUE(std::get<Call>(cases[1])(*session()));
        EXPECT_EQ(takeOwnParameters()["RequestedCertificateLifetimeInSeconds"], Value::real(sent));
    }
    for (const char* method : methods) server_.fault(method, -9);
    for (const auto& [what, call, sent, counter] : cases) {
        Session failing = session();
        const bool isCopy = std::string_view(what) == "get breadcrumb";
        EXPECT_EQ(call(*failing), isCopy) << what;
        EXPECT_EQ(failing->fSessionID, String()) << what << ": spoiled";
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
