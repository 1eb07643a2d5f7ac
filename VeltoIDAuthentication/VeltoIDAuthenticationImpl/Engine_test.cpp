// The account engine: adding and forgetting, people and breadcrumbs, passwords, dates.
#include "TestSupport/EngineFixture.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"
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
    const Dictionary noInformation = {{"VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord", kOn}};
    constexpr const char* kAll = "authenticate authenticate getMyInfo";
    const struct {
        const char* what;
        Dictionary options;
        Server server;
        const char* methods;
        bool signsIn, succeeds;
    } cases[] = {
        {"no options", {}, Server::Up, kAll, true, true},
        {"no information", noInformation, Server::Up, "authenticate", true, true},
        {"no sign-in", {{"DoNotCheckPassword", kOn}}, Server::Up, "", false, true},
        {"an option of the wrong kind", {{"DoNotCheckPassword", number(1)}}, Server::Up, kAll, true, true},
        {"no information to be had", {}, Server::NoAnswer, kAll, true, true},
        {"no server", {}, Server::Down, "authenticate", false, false},
        {"wrong password", {}, Server::RefusesPassword, "authenticate", false, false},
    };
    for (const auto& [what, options, server, methods, signsIn, succeeds] : cases) {
        SCOPED_TRACE(what);
        serverIs(server);
        EXPECT_TRUE(add(options));
        EXPECT_EQ(error_, std::nullopt);
        EXPECT_EQ(server_.takeMethods(), methods);
        EXPECT_EQ(added_.encDsId, signsIn ? String("d1") : String());
        EXPECT_EQ(record().string("encDsId"), added_.encDsId);
        EXPECT_EQ(added_.record, succeeds ? std::optional(record()) : std::nullopt);
        EXPECT_EQ(hasPassword(), server != Server::RefusesPassword);
        const std::string line = std::string("VeltoIDAuth: Adding account ") + kName +
                                 (succeeds ? " succeeded." : " failed, ERROR:");
        EXPECT_NE(log_.lines().back().text.find(line), std::string::npos);
        EXPECT_TRUE(takePosted().ends_with("added/removed "));
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
}

TEST_F(Adding, FetchesTheValidationRecordAnew) {
    createAccount();
    setValues({{kIdentifier, "v1"}, {kData, kRecordData}});
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
    setValue(kToken, "t");
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "new hash");
    EXPECT_EQ(added_.encDsId, "d1");
    EXPECT_EQ(added_.record, record());
    EXPECT_EQ(takePosted(), "added/removed ");
    const std::string known = "VeltoIDAuth: Already existing account " + std::string(kName) + " re-added; ";
    EXPECT_EQ(log_.count(known + "succeeded."), 1);
    EXPECT_NE(readd({{"ForceCertificateCreation", kOn}}), "");

    setValue(kToken, {});
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERT_ISSUED"}});
    EXPECT_EQ(readd(), "");
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERTIFICATE_INVALID"}});
    EXPECT_NE(readd(), "");
    setValues({{kToken, "t"}, {"encDsId", kGone}});
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(log_.count(" re-added; failed, "), 1) << "it has no encDsId";
}

TEST_F(Adding, AnAccountIsKnownByItsOwnNameWhateverItsRecordOrTheServerSays) {
    for (const Value& entry : {kGone, Value("john@velto.example"), number(1)}) {
        SCOPED_TRACE(testing::PrintToString(entry));
        ASSERT_TRUE(add());
        setValue("VeltoID", entry);
        Dictionary information;
        EXPECT_TRUE(__VeltoIDDoGetMyInfo(kName, {{"SkipValidation", kOn}}, &information));
        EXPECT_EQ(information["VeltoID"], Value(kName));
        ASSERT_TRUE(add({{"ForceCertificateCreation", kOn}}));
        EXPECT_EQ(record()["VeltoID"], Value(kName));
        setValue("VeltoID", entry);
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
        EXPECT_TRUE(record().empty());
    }
    for (const char* alias : {"JANE@VELTO.EXAMPLE", "someone.else@velto.example"}) {
        SCOPED_TRACE(alias);
        server_.answer("getMyInfo",
                       Dictionary{{"encDsId", "d1"}, {"VeltoID", alias}, {"ValidatedEmail", kEmails}});
        ASSERT_TRUE(add());
        const Value uuid = record()["AccountStableUUID"];
        Dictionary information;
        EXPECT_TRUE(__VeltoIDDoGetMyInfo(kName, {{"ForceValidation", kOn}}, &information));
        EXPECT_EQ(information["VeltoID"], Value(kName));
        EXPECT_EQ(record()["VeltoID"], Value(kName));
        EXPECT_EQ(record()["ServerVeltoID"], Value(alias));
        EXPECT_EQ(record()["AccountStableUUID"], uuid);
        EXPECT_EQ(accountNames(), Array{kName});
        serverIs(Server::RefusesPassword);
        EXPECT_FALSE(__VeltoIDDoVerifyPassword(kName, kPassword, {}));
        EXPECT_FALSE(hasPassword());
        serverIs(Server::Up);
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    }
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

    for (const auto& [name, posted] : {std::pair(String(kName), "changed "), std::pair(String(), "")}) {
        error.reset();
        EXPECT_FALSE(__VeltoIDForgetVeltoID(name, {}, &error));
        EXPECT_EQ(error->code, -100);
        EXPECT_EQ(takePosted(), posted);
    }
}

TEST_F(EngineTest, ForgettingThatCannotBeStoredIsAnErrorAndChangesNothing) {
    createAccount("d1");
    const Dictionary before = record();
    std::optional<Error> error;
    {
        const platform::Obstacle obstacle("preferences.db");
        EXPECT_FALSE(__VeltoIDForgetVeltoID(kName, {}, &error));
    }
    EXPECT_EQ(error->code, -100);
    EXPECT_TRUE(error->userInfo.contains(kErrorFailureReasonKey));
    EXPECT_EQ(record(), before);
}

TEST_F(EngineTest, TheCleanUpFindsWhatBelongsToNobody) {
    createAccount("d1");
    ASSERT_TRUE(addPasswordToKeychain("nobody", "hash", nullptr, nullptr));
    for (const char* name : {"nobody", kName}) {
        __VeltoIDDBSetMetaInfoValue(name, kVeltoIDXMLGetMyInfoCountKey, number(1));
        __VeltoIDDBSetMetaInfoValue(String(std::string(name) + "'s"), "ServerURL", kURL);
    }
    __VeltoIDCleanupAccountsAndCertificates({});
    EXPECT_EQ(copyAllPasswordsFromKeychain(), Array{record().data("HashedPasswordRef")});
    const auto hasSection = [](const std::string& name) {
        return database::perform([&](const database::Store& store) { return store.metaInfo.contains(name); });
    };
    EXPECT_TRUE(hasSection(kName) && hasSection("nobody's"));
    EXPECT_FALSE(hasSection("nobody"));
    ASSERT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_FALSE(hasSection(kName));
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
    const auto fetch = [&](const String& password) {
        error.reset();
        return __VeltoIDDoCopyBreadcrumb(kName, password, "k", {}, &error);
    };
    server_.answer("saveBreadcrumbEk", Dictionary{{"x", "y"}});
    server_.answer("fetchBreadcrumbEk", Dictionary{{"ek", "QUJD"}});
    EXPECT_TRUE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(error, std::nullopt);
    EXPECT_EQ(fetch(kPassword), data);
    EXPECT_EQ(error, std::nullopt);
    server_.answer("fetchBreadcrumbEk", Dictionary{{"x", "y"}});
    EXPECT_FALSE(fetch(kPassword));
    EXPECT_EQ(error->code, -100);
    server_.fault("saveBreadcrumbEk", -20209);
    EXPECT_FALSE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(error->code, -102);
    (void)server_.take();
    EXPECT_FALSE(fetch(nullptr));
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
    constexpr const char* kIncorrect = "is incorrect or the account has been disabled";
    const struct {
        Error error;
        String sentHash;
        bool isTaken;
        const char* line;
    } cases[] = {
        {VELTOID_ERROR(-101), kPassword, true, kIncorrect},
        {VELTOID_ERROR(-101), "another hash", false, kIncorrect},
        {VELTOID_ERROR(-101), nullptr, false, kIncorrect},
        {VELTOID_ERROR(-102), kPassword, true, kIncorrect},
        {VELTOID_ERROR(-102), "another hash", true, kIncorrect},
        {VELTOID_ERROR(-105), kPassword, true, "no longer supports this client"},
        {VELTOID_ERROR(-105), "another hash", true, "no longer supports this client"},
        {VELTOID_ERROR(-100), kPassword, false, "removing"},
        {Error{kXMLErrorDomain, -101, {}}, kPassword, false, "removing"},
    };
    for (const auto& [error, sentHash, isTaken, line] : cases) {
        createAccount("d1");
        const auto lines = log_.count(line);
        handleServerError(kName, sentHash, error);
        EXPECT_EQ(hasPassword(), !isTaken) << error.code << sentHash.view();
        EXPECT_EQ(log_.count(line) - lines, isTaken ? 1 : 0) << error.code << sentHash.view();
    }
    handleServerError(kName, kPassword, std::nullopt);
    EXPECT_TRUE(hasPassword());
    std::optional<Error> error;
    serverIs(Server::RefusesPassword);
    EXPECT_FALSE(__VeltoIDDoVerifyPassword(kName, "mistyped", {}, &error));
    EXPECT_EQ(error->code, -101);
    EXPECT_TRUE(hasPassword());
}

TEST_F(EngineTest, ARefusalOfTheOldPasswordLeavesTheNewOne) {
    createAccount("d1");
    setValue("ValidationDate", kGone);
    server_.answerWith("authenticate", [this](const Dictionary&) {
        EXPECT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, "new hash", nullptr));
        return FakeIdentityServer::faultOf(-20101);
    });
    checkAccount({kName, record()});
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "new hash");
    EXPECT_EQ(record()["encDsId"], Value("d1"));
}

// --- What an account needs next

TEST_F(EngineTest, TheNextActionIsTheEarliestOfManyDates) {
    // What is left to do for an account whose certificate was just validated.
    constexpr double kFortnight = 1'209'600;
    constexpr const char* kRequested = "CSRGenerationDate";
    const Dictionary entry;
    const struct {
        const char* what;
        Dictionary values;
        std::optional<Dictionary> entry;
        /// Seconds from now.
        double due;
        int32_t serverVersion = 100;
    } cases[] = {
        {"nothing else", {}, entry, kFortnight},
        {"dirty", {{"Dirty", kOn}}, entry, 0},
        {"no encDsId", {{"encDsId", kGone}}, {}, 0},
        {"tried", {{"encDsId", kGone}, {"LastConnectAttempt", date(-100)}, {kRequested, date(0)}}, {}, 200},
        {"forced validation", {{"ForceValidation", kOn}, {"NextValidationDate", date(50)}}, entry, 0},
        {"next validation", {{"NextValidationDate", date(50)}, {"ValidationDate", date(0)}}, entry, 50},
        {"last validation", {{"ValidationDate", date(-100)}}, entry, kFortnight - 100},
        {"validation planned by a wrong clock", {{"NextValidationDate", date(1.5e9)}}, entry, 0},
        {"a request of a wrong clock", {{kRequested, date(1.5e9)}}, {}, 0},
        {"an evaluation of a wrong clock",
         {},
         Dictionary{{kValidated, date(-2e6)}, {kAttempt, date(1.5e9)}},
         -790'400},
        {"embargo for ever", {{kEmbargo, date(1.5e9)}}, {}, 0},
        {"embargo", {{kEmbargo, date(1000)}, {"ForceValidation", kOn}, {"Dirty", kOn}}, entry, 1000},
        {"embargo, expiry", {{kEmbargo, date(99)}}, Dictionary{{"Expires", date(9)}, {kRenewal, date(5)}}, 9},
        {"embargo, no certificate", {{kEmbargo, date(1000)}}, {}, 1000},
        {"embargo is over", {{kEmbargo, date(-1)}, {"ClientTooOld", kOn}}, entry, kFortnight},
        {"too old",
         {{"ClientTooOld", kOn}, {"ClientTooOldVersion", Value::real(727.8)}, {"ForceValidation", kOn}},
         {},
         3'153'600'000},
        {"an expiry", {}, Dictionary{{"Expires", date(500)}}, 500},
        {"a renewal", {}, Dictionary{{"Expires", date(500)}, {kRenewal, date(400)}}, 400},
        {"a validated certificate", {}, Dictionary{{kValidated, date(-50)}}, kFortnight - 50},
        {"a certificate never validated", {}, Dictionary{{kValidated, kGone}}, 0},
        {"tried 6 h ago", {}, Dictionary{{kValidated, date(-2e6)}, {kAttempt, date(-21'600)}}, 21'600},
        {"an invalid one", {}, Dictionary{{"CertStatus", "CERTIFICATE_INVALID"}}, 0},
        {"a renewal put off, near the end",
         {},
         Dictionary{{"Expires", date(130'000)}, {kRenewal, date(9e4)}},
         9e4},
        {"no certificate", {}, {}, 0},
        {"a fetch", {{kToken, "t"}, {kFetchDate, date(30)}, {kRequested, date(-10)}}, {}, 30},
        {"a fetch without date", {{kToken, "t"}}, {}, 0},
        {"a fetch that is too far ahead to be believed", {{kToken, "t"}, {kFetchDate, date(700'000)}}, {}, 0},
        {"a fetch comes first",
         {{kToken, "t"}, {kFetchDate, date(30)}},
         Dictionary{{"Expires", date(-1)}},
         30},
        {"a request", {{kRequested, date(-10)}}, {}, 86'390},
        {"an interval", {{kRequested, date(-10)}, {"CSRGenerationInterval", number(60)}}, {}, 50},
        {"a request after a refusal", {{kRequested, date(3600)}}, {}, 90'000},
        {"requests held up", {{"CertificateRequestsHeldUntil", date(70)}}, {}, 70},
        {"an old server's record", {{kNextCheck, date(40)}}, entry, kFortnight},
        {"a record", {{kNextCheck, date(40)}}, entry, 40, 101},
        {"a record without data", {{kIdentifier, "v"}}, entry, 0, 101},
        {"a record of 100 s",
         {{kData, kRecordData}, {kAsOf, date(0)}, {kDuration, number(100)}},
         entry,
         75,
         101},
        {"no record", {}, entry, 0, 101},
    };
    for (const auto& [what, values, entry, due, serverVersion] : cases) {
        SCOPED_TRACE(what);
        server_.answer("authenticate",
                       Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(serverVersion)}});
        __VeltoIDDoVerifyPassword("somebody", kPassword, {});
        ASSERT_EQ(__VeltoIDSessionGetServerVersion(), serverVersion);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        createAccount("d1");
        setValue("Dirty", {});
        setValues(values);
        __VeltoIDDBRemoveCertificateInfo("d1");
        if (entry) {
            __VeltoIDDBSetCertificateInfo("d1", std::nullopt);
            __VeltoIDDBSetCertificateValue("d1", kValidated, date(), Notify::No);
            for (const auto& [key, value] : *entry)
                __VeltoIDDBSetCertificateValue("d1", key, value, Notify::No);
            __VeltoIDDBSetCertificateValue("d1", "Dirty", kGone, Notify::No);
        }
        setValue("Dirty", values["Dirty"]);
        EXPECT_EQ(copyNextActionDateForAccount(kName), now() + due);
    }
    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountValidationInterval", number(7200));
    setValue("ValidationDate", date(-30));
    setValue(kNextCheck, date(10'000));
    EXPECT_EQ(copyNextActionDateForAccount(kName), now() + 7170);
    EXPECT_EQ(copyNextActionDateForAccount("nobody"), std::nullopt);
    ASSERT_TRUE(__VeltoIDDBRemovePassword(kName));
    EXPECT_EQ(copyNextActionDateForAccount(kName), std::nullopt) << "without a password nothing can be done";
}

}  // namespace
}  // namespace veltoid
