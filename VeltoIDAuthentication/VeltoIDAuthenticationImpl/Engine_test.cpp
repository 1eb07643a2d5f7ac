// The account engine: adding and forgetting, people and breadcrumbs, passwords, dates.
#include "TestSupport/EngineFixture.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/ServerRequests.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

// --- Adding

class Adding : public EngineTest {
  protected:
    bool add(const Dictionary& options = {}, const String& password = kPassword) {
        added_ = {};
        error_.reset();
        return __VeltoIDDoAddVeltoID(kName, password, options, &added_, &error_);
    }

    AddedAccount added_;
    std::optional<Error> error_;
};

TEST_F(Adding, StoresTheAccountWhateverTheServerSays) {
    struct Case {
        const char* what;
        Dictionary options;
        Server server;
        const char* methods;
        bool signsIn;
        bool succeeds;
    };
    const Dictionary noInformation = {{"VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord", kOn}};
    constexpr const char* kAll = "authenticate authenticate getMyInfo";
    const Case cases[] = {
        {"no options", {}, Server::Up, kAll, true, true},
        {"no information", noInformation, Server::Up, "authenticate", true, true},
        {"no sign-in", {{"DoNotCheckPassword", kOn}}, Server::Up, "", false, true},
        {"an option of the wrong kind", {{"DoNotCheckPassword", number(1)}}, Server::Up, kAll, true, true},
        {"no information to be had", {}, Server::NoAnswer, kAll, true, true},
        {"no server", {}, Server::Down, "authenticate", false, false},
        {"wrong password", {}, Server::RefusesPassword, "authenticate", false, false},
    };
    for (const Case& each : cases) {
        serverIs(each.server);
        EXPECT_TRUE(add(each.options)) << each.what;
        EXPECT_EQ(error_, std::nullopt) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        EXPECT_EQ(added_.encDsId, each.signsIn ? String("d1") : String()) << each.what;
        EXPECT_EQ(record().string("encDsId"), added_.encDsId) << each.what;
        EXPECT_EQ(added_.record, each.succeeds ? std::optional(record()) : std::nullopt) << each.what;
        EXPECT_EQ(hasPassword(), each.server != Server::RefusesPassword) << each.what;
        const std::string line = std::string("VeltoIDAuth: Adding account ") + kName +
                                 (each.succeeds ? " succeeded." : " failed, ERROR:");
        EXPECT_NE(log_.lines().back().text.find(line), std::string::npos) << each.what;
        EXPECT_TRUE(takePosted().ends_with("added/removed ")) << each.what;
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
}

TEST_F(Adding, FetchesTheValidationRecordAnew) {
    createAccount();
    setValue(kIdentifier, "v1");
    setValue(kData, Data(std::vector<uint8_t>{1}));
    ASSERT_TRUE(add({{"ForceValidationRecordFetch", kOff}}));
    const auto calls = server_.take();
    ASSERT_EQ(calls.back().method, "getMyInfo");
    EXPECT_EQ(calls.back().parameters["ClientVIDVRecordIdentifier"], Value("")) << "as if there were none";
    EXPECT_EQ(record()["FirstName"], Value("Jane"));
}

TEST_F(Adding, AnAccountWithItsCertificateOnTheWayIsNotSignedInAgain) {
    createAccount("d1");
    const auto readd = [&](const Dictionary& options = {}) {
        EXPECT_TRUE(add(options, "new hash"));
        return server_.takeMethods();
    };
    setValue("CertificateToken", "t");
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "new hash");
    EXPECT_EQ(added_.encDsId, "d1");
    EXPECT_EQ(added_.record, record());
    EXPECT_EQ(takePosted(), "added/removed ");
    EXPECT_EQ(
        log_.count("VeltoIDAuth: Already existing account " + std::string(kName) + " re-added; succeeded."),
        1);
    EXPECT_NE(readd({{"ForceCertificateCreation", kOn}}), "");

    setValue("CertificateToken", {});
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERT_ISSUED"}});
    EXPECT_EQ(readd(), "");
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERTIFICATE_INVALID"}});
    EXPECT_NE(readd(), "");
    setValue("CertificateToken", "t");
    setValue("encDsId", {});
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(log_.count(" re-added; failed, "), 1) << "it has no encDsId";
}

// --- Forgetting

TEST_F(EngineTest, ForgettingTakesEverythingAlong) {
    createAccount("d1");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", nullptr, "other"));
    for (const char* encDsId : {"d1", "other"}) storeCertificateEntry(encDsId);
    const Data reference = record().data("HashedPasswordRef");
    std::optional<Error> error;
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}, &error));
    EXPECT_EQ(error, std::nullopt);
    EXPECT_EQ(takePosted(), "added/removed changed ");
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount(kName, nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("other", nullptr));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_TRUE(log_.contains("VeltoIDAuth: Forgetting account " + std::string(kName) + "."));

    EXPECT_FALSE(__VeltoIDForgetVeltoID(kName, {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(takePosted(), "changed ");
    error.reset();
    EXPECT_FALSE(__VeltoIDForgetVeltoID(nullptr, {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(takePosted(), "");
}

TEST_F(EngineTest, ForgettingKeepsACertificateThatAnotherAccountShares) {
    createAccount("d1");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", "d1"));
    storeCertificateEntry("d1");
    const Data reference = record().data("HashedPasswordRef");
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_TRUE(__VeltoIDForgetVeltoID("other", {}));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
}

// --- People and breadcrumbs

TEST_F(EngineTest, PeopleAreFoundOnBehalfOfAnAccount) {
    const auto find = [this](const String& name, const String& password) {
        std::optional<Error> error;
        std::optional<Array> results;
        const bool found =
            __VeltoIDDoFindPerson(name, password, {{"email", Array{"a"}}}, {}, &results, &error);
        EXPECT_EQ(found, !error);
        EXPECT_EQ(results, found ? std::optional(Array{"somebody"}) : std::nullopt);
        return error ? error->code : 0;
    };
    server_.answer("findPerson", Dictionary{{"matches", Array{"somebody"}}});
    EXPECT_EQ(find(nullptr, "any"), -2) << "no account at all";
    EXPECT_EQ(find("nobody", nullptr), -100);
    EXPECT_EQ(find("nobody", "any"), 0) << "the server knows better";
    createAccount("d1");
    (void)server_.take();
    EXPECT_EQ(find(nullptr, nullptr), 0);
    EXPECT_EQ(server_.take().front().parameters["pwdHash"], Value(kPassword));
    EXPECT_EQ(find(kName, "given"), 0);
    EXPECT_EQ(server_.take().front().parameters["pwdHash"], Value("given"));
    serverIs(Server::RefusesPassword);
    EXPECT_EQ(find(nullptr, nullptr), -101);
    EXPECT_FALSE(hasPassword());
}

TEST_F(EngineTest, ABreadcrumbIsStoredAndFetched) {
    const Data data(platform::bytesOf("ABC"));
    std::optional<Error> error;
    server_.answer("saveBreadcrumbEk", Dictionary{{"x", "y"}});
    server_.answer("fetchBreadcrumbEk", Dictionary{{"ek", "QUJD"}});
    EXPECT_TRUE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(__VeltoIDDoCopyBreadcrumb(kName, kPassword, "k", {}, &error), data);
    EXPECT_EQ(error, std::nullopt);
    server_.answer("fetchBreadcrumbEk", Dictionary{{"x", "y"}});
    EXPECT_FALSE(__VeltoIDDoCopyBreadcrumb(kName, kPassword, "k", {}, &error));
    EXPECT_EQ(error->code, -100);
    server_.fault("saveBreadcrumbEk", -20209);
    EXPECT_FALSE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(error->code, -102);
    (void)server_.take();
    EXPECT_FALSE(__VeltoIDDoCopyBreadcrumb(kName, nullptr, "k", {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(server_.takeMethods(), "");
}

// --- Errors of the server, passwords

TEST_F(EngineTest, VerifyingAPasswordAlwaysAsksTheServer) {
    server_.answer("authenticate",
                   Dictionary{{"encDsId", "d1"}, {"dsSessionValidityDuration", number(1000)}});
    const auto verify = [](const String& name, const String& password) {
        std::optional<Error> error;
        const bool verified =
            __VeltoIDDoVerifyPassword(name, password, {{"DoNotUseCachedSession", kOff}}, &error);
        EXPECT_EQ(verified, !error.has_value());
        return error ? error->code : 0;
    };
    EXPECT_EQ(verify(kName, kPassword), 0);
    EXPECT_EQ(verify(kName, kPassword), 0);
    EXPECT_NE(__VeltoIDSessionDoCreateSession(kName, kPassword, {}), nullptr);
    EXPECT_EQ(server_.takeMethods(), "authenticate authenticate authenticate") << "nor is a session kept";
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount(kName, nullptr));
    server_.fault("authenticate", -20101);
    EXPECT_EQ(verify(kName, kPassword), -101);
    server_.refuse("authenticate", 500);
    EXPECT_EQ(verify(kName, kPassword), -100);
    EXPECT_EQ(verify(nullptr, kPassword), -99);
    EXPECT_EQ(verify(kName, nullptr), -99);
    EXPECT_EQ(server_.takeMethods(), "authenticate authenticate");
}

TEST_F(EngineTest, OnlyARefusalTakesThePassword) {
    struct Case {
        Error error;
        bool isTaken;
        const char* line;
    };
    const Case cases[] = {
        {identityError(-101), true, "is incorrect or the account has been disabled"},
        {identityError(-102), true, "is incorrect or the account has been disabled"},
        {identityError(-105), true, "no longer supports this client"},
        {identityError(-100), false, "removing"},
        {Error{kXMLErrorDomain, -101, {}}, false, "removing"},
    };
    for (const Case& each : cases) {
        createAccount("d1");
        const auto lines = log_.count(each.line);
        handleServerError(kName, kPassword, each.error);
        EXPECT_EQ(hasPassword(), !each.isTaken) << each.error.code;
        EXPECT_EQ(log_.count(each.line) - lines, each.isTaken ? 1 : 0) << each.error.code;
    }
    handleServerError(kName, kPassword, std::nullopt);
    EXPECT_TRUE(hasPassword());
}

// --- What an account needs next

TEST_F(EngineTest, TheNextActionIsTheEarliestOfManyDates) {
    // What is left to do for an account whose certificate was just validated.
    constexpr double kFortnight = 1'209'600;
    struct Case {
        const char* what;
        Dictionary values;
        std::optional<Dictionary> entry;
        /// Seconds from now.
        std::optional<double> next;
        bool isNewServer = false;
    };
    const Value none = Value::null();
    constexpr const char* kRequested = "CSRGenerationDate";
    constexpr const char* kRenewal = "NextRenewalAttempt";
    constexpr const char* kFetch = "NextCertificateFetchDate";
    constexpr const char* kToken = "CertificateToken";
    constexpr const char* kValidated = "LastSuccessfulValidation";
    constexpr const char* kAttempt = "LastValidationAttempt";
    constexpr const char* kAsOf = "VeltoIDAccountValidationRecordValidAsOfKey";
    constexpr const char* kDuration = "VeltoIDAccountValidationRecordSuggestedValidIntervalKey";
    const auto in = [this](double seconds) { return date(seconds); };
    const Dictionary entry;
    const Case cases[] = {
        {"nothing else", {}, entry, kFortnight},
        {"dirty", {{"Dirty", kOn}}, entry, 0},
        {"no encDsId", {{"encDsId", none}}, {}, 0},
        {"tried", {{"encDsId", none}, {"LastConnectAttempt", in(-100)}, {kRequested, in(0)}}, {}, 200},
        {"forced validation", {{"ForceValidation", kOn}, {"NextValidationDate", in(50)}}, entry, 0},
        {"next validation", {{"NextValidationDate", in(50)}, {"ValidationDate", in(0)}}, entry, 50},
        {"last validation", {{"ValidationDate", in(-100)}}, entry, kFortnight - 100},
        {"embargo", {{kEmbargo, in(1000)}, {"ForceValidation", kOn}, {"Dirty", kOn}}, entry, 1000},
        {"embargo, expiry", {{kEmbargo, in(99)}}, Dictionary{{"Expires", in(9)}, {kRenewal, in(5)}}, 9},
        {"embargo, no certificate", {{kEmbargo, in(1000)}}, {}, 1000},
        {"embargo is over", {{kEmbargo, in(-1)}, {"ClientTooOld", kOn}}, entry, kFortnight},
        {"too old", {{"ClientTooOld", kOn}, {"ForceValidation", kOn}}, {}, 3'153'600'000},
        {"an expiry", {}, Dictionary{{"Expires", in(500)}}, 500},
        {"a renewal", {}, Dictionary{{"Expires", in(500)}, {kRenewal, in(400)}}, 400},
        {"a validated certificate", {}, Dictionary{{kValidated, in(-50)}}, kFortnight - 50},
        {"a certificate never validated", {}, Dictionary{{kValidated, none}}, 0},
        {"tried 6 h ago", {}, Dictionary{{kValidated, in(-2e6)}, {kAttempt, in(-21'600)}}, 21'600},
        {"an invalid one", {}, Dictionary{{"CertStatus", "CERTIFICATE_INVALID"}}, 0},
        {"a renewal put off, near the end",
         {},
         Dictionary{{"Expires", in(130'000)}, {kRenewal, in(9e4)}},
         9e4},
        {"no certificate", {}, {}, 0},
        {"a fetch", {{kToken, "t"}, {kFetch, in(30)}, {kRequested, in(-10)}}, {}, 30},
        {"a fetch without date", {{kToken, "t"}}, {}, 0},
        {"a fetch that is too far ahead to be believed", {{kToken, "t"}, {kFetch, in(700'000)}}, {}, 0},
        {"a fetch comes first", {{kToken, "t"}, {kFetch, in(30)}}, Dictionary{{"Expires", in(-1)}}, 30},
        {"a request", {{kRequested, in(-10)}}, {}, 86'390},
        {"an interval", {{kRequested, in(-10)}, {"CSRGenerationInterval", number(60)}}, {}, 50},
        {"a request after a refusal", {{kRequested, in(3600)}}, {}, 90'000},
        {"requests held up", {{"CertificateRequestsHeldUntil", in(70)}}, {}, 70},
        {"an old server's record", {{kNextCheck, in(40)}}, entry, kFortnight},
        {"a record", {{kNextCheck, in(40)}}, entry, 40, true},
        {"a record without data", {{kIdentifier, "v"}}, entry, 0, true},
        {"a record of 100 s",
         {{kData, kRecordData}, {kAsOf, in(0)}, {kDuration, number(100)}},
         entry,
         75,
         true},
        {"no record", {}, entry, 0, true},
    };
    for (const Case& each : cases) {
        const bool isNewServer = each.isNewServer;
        server_.answer("authenticate",
                       Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(isNewServer ? 101 : 100)}});
        __VeltoIDDoVerifyPassword("somebody", kPassword, {});
        ASSERT_EQ(__VeltoIDSessionGetServerVersion(), isNewServer ? 101 : 100);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        createAccount("d1");
        setValue("Dirty", {});
        setValues(each.values);
        __VeltoIDDBRemoveCertificateInfo("d1");
        if (each.entry) {
            __VeltoIDDBSetCertificateInfo("d1", std::nullopt);
            __VeltoIDDBSetCertificateValue("d1", kValidated, date(), Notify::No);
            for (const auto& [key, value] : *each.entry)
                __VeltoIDDBSetCertificateValue("d1", key, value, Notify::No);
        }
        const auto next = nextActionOf(kName);
        EXPECT_EQ(next ? Value::date(*next) : Value(), each.next ? date(*each.next) : Value()) << each.what;
    }
    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountValidationInterval", number(100));
    setValue("ValidationDate", date(-30));
    setValue(kNextCheck, date(1000));
    EXPECT_EQ(nextActionOf(kName), now() + 70);
    EXPECT_EQ(nextActionOf("nobody"), std::nullopt);
    ASSERT_TRUE(__VeltoIDDBRemovePassword(kName));
    EXPECT_EQ(nextActionOf(kName), std::nullopt) << "without a password nothing can be done";
}

}  // namespace
}  // namespace veltoid
