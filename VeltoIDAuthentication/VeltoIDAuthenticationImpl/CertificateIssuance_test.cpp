// Certificates from request to renewal, against a real database and keychain, an authority that signs what it
// is asked to, and simulated time.
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"

#include <atomic>
#include <thread>

#include "Certificates/CertificateRequest.h"
#include "TestSupport/CertificateFixture.h"
#include "TestSupport/SQLiteEdit.h"
#include "TestSupport/SideBySide.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

using testing_support::pemOf;

constexpr const char* kTokenExpiration = "CertificateTokenExpiration";
constexpr const char* kGenerated = "CSRGenerationDate";
constexpr const char* kInterval = "CSRGenerationInterval";
constexpr const char* kCreated = "CSRCreationDate";
constexpr const char* kDelta = "NextCertificateFetchDelta";
constexpr const char* kForced = "ForceCertificateCreation";
constexpr const char* kIntermediateReference = "IntermediateCertificateReference";

const std::set<std::string> kNone;

class IssuanceTest : public CertificateTest {
  protected:
    void answerRequests(const Dictionary& reply) {
        onRequest([reply] { return reply; });
    }
    /// Which of these are in the record.
    static std::set<std::string> stored(std::initializer_list<const char*> keys) {
        std::set<std::string> found;
        for (const char* key : keys)
            if (record().contains(key)) found.insert(key);
        return found;
    }
    /// A new key in the keychain, as one that was made for a request.
    static Data storedKey(const String& kind = nullptr) {
        static const Key key = Key::privateKey(platform::generateRSAKeyPair(2048)->privateKey);
        Data reference;
        EXPECT_TRUE(addKeyToKeychain(kName, kind, key, &reference));
        return reference;
    }
    using Delays = std::pair<double, double>;
    /// The delay until the next fetch, and the one after that.
    Delays delays() const { return {in(kFetchDate), record().number(kDelta).value_or(-1)}; }
};

TEST_F(IssuanceTest, ACertificateThatIsIssuedAtOnceIsKeptWithAllThatBelongsToIt) {
    issueAtOnce();
    setValue(kDelta, number(5));
    ASSERT_TRUE(request({{"__CERT_FETCH_DELAY_MIN", "5"}}));
    EXPECT_EQ(server_.take().back().parameters["__CERT_FETCH_DELAY_MIN"], Value("5"));
    const Dictionary entry = certificateEntry();
    for (const auto& [key, value] : Dictionary{{"CertStatus", "CERT_ISSUED"},
                                               {"CertType", "client"},  // whatever the server says is kept
                                               {kValidated, date(-1)},
                                               {kRenewal, date(75 * kDay)},
                                               {"Dirty", kOn}})
        EXPECT_EQ(entry[key.view()], value) << key.view();
    EXPECT_EQ(certificateFromPEM(entry.string("Certificate"))->serialNumber, "1A2B3C");

    Key key;
    std::optional<platform::Certificate> certificate;
    std::optional<platform::Certificate> above;
    ASSERT_TRUE(copyKeyFromKeychainGivenPersistentRef(entry.data(kKeyReference), &key));
    ASSERT_TRUE(
        copyCertificateFromKeychainGivenPersistentRef(entry.data(kCertificateReference), &certificate));
    ASSERT_TRUE(copyCertificateFromKeychainGivenPersistentRef(entry.data(kIntermediateReference), &above));
    EXPECT_EQ(key.publicPart, Data(certificate->publicKey));
    EXPECT_EQ(above->der, intermediate_.certificate());
    EXPECT_EQ(copyCertificatesFromKeychainGivenLabel("Velto ID authorization certificate for " +
                                                     std::string(kName)),
              Array{entry.data(kCertificateReference)});
    EXPECT_EQ(copyCertificatesFromKeychainGivenLabel("Velto ID authorization intermediate certificate"),
              Array{entry.data(kIntermediateReference)});
    EXPECT_EQ(stored({kToken, kTokenExpiration, kGenerated, kInterval, kFetchDate, kDelta, kKeyReference,
                      kCreated}),
              kNone);
    EXPECT_EQ(notifications_.take(),
              std::vector<std::string>{"HWVeltoIDAccountConfigurationChangeNotification"});
    EXPECT_TRUE(log_.contains("VeltoIDAuth: Adding certificate for " + std::string(kName) +
                              ", d1 to keychain, serial#=1A2B3C"));

    Dictionary information;
    ASSERT_TRUE(__VeltoIDCopyCertificateInfo(kName, nullptr, {}, &information));
    EXPECT_EQ(keysOf(information), (std::set<std::string>{"encDsId", "CertStatus", "CertType", "SerialNumber",
                                                          "Expires", "CreationDate", "ModificationDate",
                                                          kCertificateReference, kKeyReference}));
    EXPECT_TRUE(__VeltoIDCopyCertificateInfo(nullptr, "d1", {}, nullptr));
    EXPECT_FALSE(__VeltoIDCopyCertificateInfo(kName, "other", {}, nullptr, &error_));
    EXPECT_EQ(error_->domain, kOSStatusErrorDomain);
    EXPECT_FALSE(__VeltoIDCopyCertificateInfo(nullptr, "other", {}, nullptr, &error_));
    EXPECT_EQ(error_->code, -100);
}

TEST_F(IssuanceTest, ARenewalTakesThePlaceOfWhatWasThere) {
    issueAtOnce();
    ASSERT_TRUE(request());
    const Dictionary before = certificateEntry();
    ASSERT_TRUE(request());
    const Dictionary after = certificateEntry();
    EXPECT_NE(after[kKeyReference], before[kKeyReference]);
    EXPECT_NE(after[kCertificateReference], before[kCertificateReference]);
    EXPECT_EQ(after[kIntermediateReference], before[kIntermediateReference]) << "the same one";
    EXPECT_EQ(copyAllKeysFromKeychain(), Array{after.data(kKeyReference)});
    EXPECT_EQ(certificates(), 2U);
}

TEST_F(IssuanceTest, ATokenIsAskedWithUntilTheCertificateIsThere) {
    answerRequests({{kToken, "t1"}, {"Delay", number(20)}});
    ASSERT_TRUE(request());
    EXPECT_EQ(server_.takeMethods(), "authenticate createCert");
    EXPECT_EQ(record()[kToken], Value("t1"));
    EXPECT_EQ(in(kTokenExpiration), 14 * kDay);
    EXPECT_EQ(delays(), Delays(20, 20));
    EXPECT_EQ(in(kGenerated), 0);
    EXPECT_EQ(record()[kInterval], number(3600));
    EXPECT_EQ(in(kCreated), 0);
    EXPECT_EQ(keys(), 1U);
    EXPECT_FALSE(fetch()) << "not before its time";
    EXPECT_EQ(takeCode(), 99);
    EXPECT_EQ(error_->userInfo[kFetchDate], date(20));
    EXPECT_EQ(server_.takeMethods(), "");

    clock_.advanceBy(20);
    server_.fault("fetchCert", -4164);
    EXPECT_FALSE(fetch());
    EXPECT_EQ(takeCode(), 99);
    EXPECT_EQ(delays(), Delays(300, 450)) << "a fault says nothing of the delay";
    EXPECT_EQ(stored({kGenerated, kInterval}), kNone);

    server_.answer("fetchCert", Dictionary{{"dsCert", Dictionary{{"CertStatus", "SIGNIN_PENDING"}}}});
    EXPECT_FALSE(fetch(FetchTime::AtOnce)) << "forced before its time";
    EXPECT_EQ(delays(), Delays(450, 675));
    clock_.advanceBy(450);
    (void)server_.take();
    server_.answer("fetchCert",
                   Dictionary{{"dsCert", Array{issued(), Dictionary{{"CertStatus", "FAILED"}}}}});
    EXPECT_TRUE(fetch());
    const auto calls = server_.take();
    EXPECT_EQ(calls.at(1).parameters["CertificateToken"], Value("t1"));
    EXPECT_EQ(calls.at(2).method, "downloadCertComplete");
    EXPECT_EQ(stored({kToken, kKeyReference}), kNone);
    EXPECT_TRUE(certificateEntry().contains(kKeyReference));
    EXPECT_EQ(relaunches_, (std::vector<double>{20, 300, 450}));
    EXPECT_TRUE(fetch()) << "there is nothing to fetch";
    EXPECT_EQ(server_.takeMethods(), "");
}

TEST_F(IssuanceTest, AFailedAttemptLeavesNoKey) {
    const auto dsCert = [](const char* status) {
        return Dictionary{{"dsCert", Dictionary{{"CertStatus", status}}}};
    };
    const Dictionary endless = {{kToken, std::string(1U << 20U, 't')}};
    constexpr const char* kAsked = "authenticate createCert";
    // The last column says when the next request may be made.
    const std::tuple<const char*, std::function<void()>, const char*, int64_t, double> cases[] = {
        {"refused", [&] { answerRequests(dsCert("FAILED")); }, kAsked, -100, 3600},
        {"unknown", [&] { answerRequests(dsCert("?")); }, kAsked, -100, 0},
        {"a fault", [&] { server_.fault("createCert", -3); }, kAsked, -100, 0},
        {"no server", [&] { server_.refuse("createCert", 500); }, kAsked, -100, 0},
        {"a token without end", [&] { answerRequests(endless); }, kAsked, -100, 0},
        {"for another key",
         [&] {
             onRequest([this] {
                 requested_ = platform::generateRSAKeyPair(2048)->publicKey;
                 return Dictionary{{"dsCert", issued()}};
             });
         },
         kAsked, -100, 3600},
        {"no sign-in", [&] { server_.refuse("authenticate", 500); }, "authenticate", -100, 0},
        {"wrong password", [&] { server_.fault("authenticate", -20101); }, "authenticate", -101, 0},
    };
    for (const auto& [what, prepare, methods, code, nextRequest] : cases) {
        SCOPED_TRACE(what);
        createAccount("d1");
        // The request takes the place of an older one.
        setValues({{kToken, "old"},
                   {kTokenExpiration, date()},
                   {kFetchDate, date()},
                   {kKeyReference, storedKey()},
                   {kInterval, number(60)}});
        prepare();
        EXPECT_FALSE(request());
        EXPECT_EQ(takeCode(), code);
        EXPECT_EQ(server_.takeMethods(), methods);
        EXPECT_EQ(keys() + certificates(), 0U);
        EXPECT_EQ(stored({kToken, kTokenExpiration, kKeyReference}), kNone);
        EXPECT_EQ(in(kGenerated), nextRequest);
        EXPECT_EQ(hasPassword(), code != -101);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
    EXPECT_FALSE(request());
    EXPECT_EQ(takeCode(), -108);
    EXPECT_FALSE(fetch());
    EXPECT_EQ(takeCode(), -108);
}

TEST_F(IssuanceTest, ARequestWithoutTokenOrCertificateJustWaits) {
    answerRequests({{kToken, number(1)}, {"dsCert", "none"}, {"Delay", "soon"}});
    EXPECT_TRUE(request());
    EXPECT_EQ(stored({kToken, kFetchDate}), kNone);
    EXPECT_TRUE(record().contains(kKeyReference));
    EXPECT_EQ(keys(), 1U);
}

TEST_F(IssuanceTest, TheServersEncDsIdBecomesTheAccounts) {
    setValue("encDsId", "old");
    answerRequests({{kToken, "t"}});
    String encDsId;
    EXPECT_TRUE(__VeltoIDDoCreateCertificateRequestForVeltoID(kName, {}, &encDsId));
    EXPECT_EQ(encDsId, "d1");
    EXPECT_EQ(record()["encDsId"], Value("d1"));
    EXPECT_EQ(delays(), Delays(60, 60)) << "no delay given";
}

TEST_F(IssuanceTest, TheDelayOfATokenIsBelievedUpToADay) {
    const std::pair<Value, double> cases[] = {{number(0), 60},        {number(86'400), 86'400},
                                              {number(100'000), 15},  {number(-5), 15},
                                              {Value::real(0.5), 15}, {Value::real(1e300), 15}};
    for (const auto& [delay, stored] : cases) {
        clock_.advanceBy(3'600);
        answerRequests({{kToken, "t"}, {"Delay", delay}});
        ASSERT_TRUE(request());
        EXPECT_EQ(delays(), Delays(stored, stored));
    }
}

TEST_F(IssuanceTest, EveryAnswerIsAppliedToTheAccount) {
    const auto status = [](const char* text) { return Dictionary{{"CertStatus", text}}; };
    const Dictionary pending = status("SIGNIN_PENDING");
    const Dictionary noText = {{"CertStatus", number(1)}};
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const double infinity = std::numeric_limits<double>::infinity();
    const Value none;
    const struct {
        const char* what;
        std::optional<Dictionary> result;
        Value delay, notedDelta;
        bool tokenIsOver, succeeds;
        /// Seconds from now; none: the key is gone.
        std::optional<double> fetchDate;
        double leastDelta, mostDelta;
        /// none: gone.
        std::optional<double> generated;
    } cases[] = {
        {"pending", pending, number(60), none, false, true, 60, 90, 90, {}},
        {"pending, noted delay", pending, none, number(100), false, true, 100, 150, 150, {}},
        {"pending, no delay", pending, none, none, false, true, 60, 90, 90, {}},
        {"pending, at once", pending, number(0), none, false, true, 60, 90, 90, {}},
        {"pending, in the past", pending, number(-8), none, false, true, 60, 90, 90, {}},
        {"pending, very soon", pending, number(2), none, false, true, 15, 22.5, 22.5, {}},
        {"pending, a long day", pending, number(90'000), none, false, true, 90'000, 90'000, 90'000, {}},
        {"pending, a year", pending, number(31'536'000), none, false, true, 604'800, 604'800, 604'800, {}},
        {"pending, no number", pending, Value::real(nan), number(10), false, true, 15, 22.5, 22.5, {}},
        {"pending, for ever", pending, Value::real(infinity), none, false, true, 60, 90, 90, {}},
        {"failed", status("FAILED"), number(60), number(1), false, false, {}, 0, 0, 3600},
        {"unknown", status("?"), none, number(100), false, false, 100, 150, 150, 7},
        {"unknown, no delta", noText, none, none, false, false, 60, 90, 90, 7},
        {"unknown, no result", {}, none, number(0), false, false, 15, 22.5, 22.5, 7},
        {"long", status("cert_issued"), none, number(90'000), false, false, 3'600, 3'600, 3'600, 7},
        {"expired", status("?"), none, number(100), true, false, {}, 0, 0, 3600},
        {"failed, expired", status("FAILED"), none, none, true, false, {}, 0, 0, 3600},
        {"pending, expired", pending, none, none, true, true, 60, 90, 90, {}},
    };
    for (const auto& [what, result, delay, notedDelta, tokenIsOver, succeeds, fetchDate, leastDelta,
                      mostDelta, generated] : cases) {
        SCOPED_TRACE(what);
        setValues({{kToken, "t1"},
                   {kTokenExpiration, date(tokenIsOver ? -1 : 1)},
                   {kGenerated, date(7)},
                   {kInterval, number(60)},
                   {kKeyReference, storedKey()},
                   {kDelta, notedDelta.isAbsent() ? kGone : notedDelta},
                   {kFetchDate, kGone}});
        EXPECT_EQ(update(result, delay), succeeds);
        EXPECT_EQ(takeCode(), succeeds ? 0 : -100);
        EXPECT_EQ(record().contains(kToken), fetchDate.has_value());
        EXPECT_EQ(record()[kFetchDate], fetchDate ? date(*fetchDate) : none);
        EXPECT_EQ(record()[kGenerated], generated ? date(*generated) : none);
        const double delta = record().number(kDelta).value_or(0);
        EXPECT_TRUE(leastDelta <= delta && delta <= mostDelta) << delta;
        EXPECT_EQ(keys(), fetchDate ? 1U : 0U);
        EXPECT_EQ(record().contains(kKeyReference), fetchDate.has_value());
        EXPECT_EQ(record()["Dirty"], flag(true));
    }
    const std::string name = kName;
    for (const std::string& line :
         {"VeltoIDAuth: Failed generating certificate for " + name + ", d1, certToken=t1.",
          "UNKNOWN Certificate issuance request for " + name + " dsID=d1 certToken=t1, status=?."})
        EXPECT_EQ(log_.count(line), 2) << line;
}

TEST_F(IssuanceTest, WhatIsMissingInACertificateResultIsMissingInTheEntry) {
    requested_ = platform::generateRSAKeyPair(2048)->publicKey;
    const Value usual = date(75 * kDay);
    const Value given = date(100 * kDay);
    const Value end = Value::date(253'402'300'799);
    // Of the certificate itself.
    const Value itsEnd = Value::date(4'070'908'800);
    const Value nearItsEnd = date(0.75 * (4'070'908'800 - now()));
    const std::tuple<const char*, Dictionary, bool, bool, Value, Value> cases[] = {
        {"nothing", {}, true, true, given, usual},
        {"no certificate", {{"Certificate", kGone}}, false, true, given, usual},
        {"no DER", {{"Certificate", pemOf({'A', 'B', 'C'})}}, false, true, given, usual},
        {"no text", {{"Certificate", number(1)}}, false, true, given, usual},
        {"no intermediate", {{"IntermediateCertificate", kGone}}, true, false, given, usual},
        {"no PEM", {{"IntermediateCertificate", "hello"}}, true, false, given, usual},
        {"no expiry", {{"Expires", kGone}}, true, true, itsEnd, nearItsEnd},
        {"an expiry in words", {{"Expires", "soon"}}, true, true, itsEnd, nearItsEnd},
        {"expired", {{"Expires", date(-1)}}, true, true, date(-1), {}},
        {"for ever", {{"Expires", end}}, true, true, itsEnd, nearItsEnd},
    };
    for (const auto& [what, changes, hasCertificate, hasIntermediate, expires, renewal] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBRemoveCertificateInfo("d1");
        Dictionary result = issued();
        result.set("IntermediateCertificate", result["IntermediateCert"]);
        for (const auto& [key, value] : changes)
            value.isNull() ? (void)result.remove(key.view()) : result.set(key, value);
        EXPECT_TRUE(update(result));
        const Dictionary entry = certificateEntry();
        EXPECT_EQ(entry.contains(kCertificateReference), hasCertificate);
        EXPECT_EQ(entry.contains(kIntermediateReference), hasIntermediate);
        EXPECT_EQ(entry["Expires"], expires);
        EXPECT_EQ(entry[kRenewal], renewal);
    }
}

TEST_F(IssuanceTest, ARenewalWithoutAReadableCertificateLeavesWhatThereIs) {
    issueAtOnce();
    ASSERT_TRUE(request());
    const CertificateEntry before = certificateEntryOf("d1");
    for (const Value& certificate : {kGone, Value(pemOf({'A', 'B', 'C'})), number(1)}) {
        SCOPED_TRACE(testing::PrintToString(certificate));
        clock_.advanceBy(3'600);
        onRequest([&] { return Dictionary{{"dsCert", issued({{"Certificate", certificate}})}}; });
        EXPECT_FALSE(request());
        EXPECT_EQ(takeCode(), -100);
        EXPECT_EQ(certificateEntryOf("d1").values(), before.values());
        EXPECT_EQ(copyAllKeysFromKeychain(), Array{before.privateKeyReference()});
        EXPECT_TRUE(copyCertificateFromKeychainGivenPersistentRef(before.reference(), nullptr));
        EXPECT_EQ(in(kGenerated), 3'600) << "it counts as a refusal";
    }
}

TEST_F(IssuanceTest, ACertificateEndsByItsOwnAccountWhateverItsEntrySays) {
    requested_ = platform::generateRSAKeyPair(2048)->publicKey;
    const std::string ended = pemOf(intermediate_.issue(requested_, {.notAfter = "20250101000000Z"}));
    ASSERT_TRUE(update(issued({{"Certificate", ended}})));
    setInEntry({{kKeyReference, storedKey()}});
    for (const Value& expires : {certificateEntry()["Expires"], date(1e7), kGone, Value("never")}) {
        SCOPED_TRACE(testing::PrintToString(expires));
        // As an agent before this one has stored it; in the last case the evaluation is put off.
        setInEntry({{"Expires", expires}, {kValidated, date()}, {"Dirty", kGone}});
        if (expires.isString()) setInEntry({{kValidated, date(-1e8)}, {kAttempt, date()}});
        EXPECT_FALSE(hasValidCertificateEntry("d1"));
        EXPECT_EQ(checkAccountAndDetermineNextAction(kName, {}), AccountState::CertificateExpired);
        EXPECT_LE(copyNextActionDateForAccount(kName), now());
    }
}

TEST_F(IssuanceTest, ATokenIsFetchedWhenItsTimeHasCome) {
    constexpr const char* kAsked = "authenticate fetchCert";
    const std::tuple<const char*, Dictionary, const char*, int64_t> cases[] = {
        {"no token", {{kToken, kGone}}, "", 0},
        {"no text", {{kToken, number(1)}}, "", 0},
        {"three days ahead", {{kFetchDate, date(3 * kDay)}}, "", 99},
        {"eight days ahead", {{kFetchDate, date(8 * kDay)}}, kAsked, -100},
        {"just now", {{kFetchDate, date()}}, kAsked, -100},
        {"no date", {{kFetchDate, "soon"}}, kAsked, -100},
    };
    server_.fault("fetchCert", -7);
    for (const auto& [what, values, methods, code] : cases) {
        SCOPED_TRACE(what);
        setValues({{kToken, "t1"}, {kFetchDate, kGone}, {kDelta, kGone}});
        setValues(values);
        EXPECT_EQ(fetch(), code == 0);
        EXPECT_EQ(takeCode(), code);
        EXPECT_EQ(server_.takeMethods(), methods);
    }
    EXPECT_EQ(record()[kToken], Value("t1")) << "until the next result or its expiry";
    EXPECT_EQ(log_.count("Failed while fetching result for certificate token t1, error="), 3);

    clock_.advanceBy(60);
    setValue(kDelta, kGone);
    server_.refuse("authenticate", 503);
    EXPECT_TRUE(fetch()) << "a server that cannot be reached is tried later";
    EXPECT_EQ(delays(), Delays(60, 90));
    clock_.advanceBy(60);
    EXPECT_TRUE(fetch());
    EXPECT_EQ(delays(), Delays(90, 135));
    setValue(kDelta, number(200'000));
    EXPECT_TRUE(fetch(FetchTime::AtOnce));
    EXPECT_EQ(delays(), Delays(3'600, 3'600));
}

TEST_F(IssuanceTest, WhatIsNotAnsweredIsAskedAgain) {
    const std::pair<const char*, platform::FakeHTTPAnswer> cases[] = {
        {"no answer in time", {.delaySeconds = platform::kForever}},
        {"closed", {.status = 0, .error = platform::HTTPError{52, "empty"}}},
        {"a status", {503}},
        {"rubbish", {200, "<html>"}},
        {"no result", {200, "<methodResponse><params><param><value>hello</value></param></params>"}},
    };
    for (const auto& [what, answer] : cases) {
        SCOPED_TRACE(what);
        answerRequests({{kToken, "t1"}, {"Delay", number(20)}});
        ASSERT_TRUE(request());
        server_.set("fetchCert", answer);
        (void)server_.take();
        for (const double delta : {30.0, 45.0}) {
            clock_.advanceBy(in(kFetchDate));
            platform::WorkQueue("fetch").async([&] { EXPECT_FALSE(fetch()); });
            clock_.advanceBy(5);
            EXPECT_EQ(takeCode(), -100);
            EXPECT_EQ(server_.takeMethods(), "authenticate fetchCert");
            EXPECT_EQ(record()[kDelta], Value::real(delta));
            EXPECT_GT(in(kFetchDate), 0);
        }
        EXPECT_EQ(keys(), 1U);
        server_.answer("fetchCert", Dictionary{{"dsCert", issued()}});
        EXPECT_TRUE(fetch(FetchTime::AtOnce));
        EXPECT_EQ(server_.takeMethods(), "authenticate fetchCert downloadCertComplete");
        EXPECT_TRUE(hasValidCertificateEntry("d1"));
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
        createAccount("d1");
    }
}

TEST_F(IssuanceTest, ATokenThatIsOverMakesRoomForANewRequest) {
    answerRequests({{kToken, "t1"}, {"Delay", number(20)}});
    ASSERT_TRUE(request());
    server_.fault("fetchCert", -9);
    (void)server_.take();
    const double begin = now();
    while (record()[kToken] == Value("t1")) {
        ASSERT_LT(now(), begin + 2 * 3'600) << "a token that the server does not know";
        clock_.advanceBy(std::max(in(kFetchDate), 0.0));
        checkAccount({kName, record()});
    }
    EXPECT_GE(now(), begin + 1'800) << "a fault may pass";
    EXPECT_EQ(server_.takeMethods().find("downloadCertComplete"), std::string::npos);
    EXPECT_EQ(keys(), 0U);
    EXPECT_EQ(stored({kToken, kTokenExpiration, kFetchDate, kDelta, "CertificateTokenFaultsSince"}), kNone);
    answerRequests({{kToken, "t2"}});
    clock_.advanceBy(3'600);
    checkAccount({kName, record()});
    EXPECT_EQ(record()[kToken], Value("t2"));

    setValues({{kTokenExpiration, date(100)}, {kFetchDate, date(3'600)}, {"Dirty", kGone}});
    EXPECT_EQ(copyNextActionDateForAccount(kName), now() + 100);
    clock_.advanceBy(3'600);
    answerRequests({{kToken, "t3"}});
    (void)server_.take();
    checkAccount({kName, record()});
    EXPECT_EQ(record()[kToken], Value("t3"));
    EXPECT_EQ(server_.takeMethods().find("fetchCert"), std::string::npos);
    EXPECT_EQ(keys(), 1U);
}

TEST_F(IssuanceTest, ACertificateThatCannotBeStoredNowIsFetchedAgain) {
    answerRequests({{kToken, "t1"}});
    ASSERT_TRUE(request());
    server_.answer("fetchCert", Dictionary{{"dsCert", issued()}});
    (void)server_.take();
    platform::editDatabase("keychain.db",
                           "CREATE TRIGGER busy BEFORE INSERT ON items BEGIN "
                           "SELECT RAISE(ABORT, 'not now'); END");
    EXPECT_FALSE(fetch(FetchTime::AtOnce));
    EXPECT_EQ(server_.takeMethods(), "authenticate fetchCert");
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    platform::editDatabase("keychain.db", "DROP TRIGGER busy");
    EXPECT_TRUE(fetch(FetchTime::AtOnce));
    EXPECT_EQ(server_.takeMethods(), "authenticate fetchCert downloadCertComplete");
    EXPECT_EQ(keys(), 1U);
    EXPECT_EQ(certificates(), 2U);
}

TEST_F(IssuanceTest, AnEncDsIdIsLearntByASignInNowAndThen) {
    const auto learn = [this](double sinceLastAttempt) {
        setValues({{"encDsId", kGone}, {"LastConnectAttempt", date(-sinceLastAttempt)}});
        __VeltoIDDoFetchEncodedDSIDForVeltoID(kName, {}, &error_);
        return server_.takeMethods();
    };
    for (const auto& [ago, asks] :
         {std::pair(0.0, false), std::pair(300.0, false), std::pair(301.0, true), std::pair(-5.0, true)}) {
        EXPECT_EQ(learn(ago), asks ? "authenticate" : "") << ago;
        EXPECT_EQ(takeCode(), asks ? -100 : 99) << ago << ": always filled";
        EXPECT_EQ(record()["encDsId"], asks ? Value("d1") : Value()) << ago;
    }
    server_.fault("authenticate", -20209);
    EXPECT_EQ(learn(1000), "authenticate");
    EXPECT_EQ(takeCode(), -102);
    EXPECT_FALSE(record().contains("encDsId"));
    EXPECT_EQ(learn(1000), "") << "without a password";
}

TEST_F(IssuanceTest, AnAddAsksForTheCertificateWhenItIsToldTo) {
    constexpr const char* kAsynchronously = "CreateCSRAsynchronously";
    const std::tuple<const char*, Dictionary, bool, bool> cases[] = {
        {"later", {}, false, false},
        {"now", {{kAsynchronously, kOff}}, false, true},
        {"never", {{kAsynchronously, kOff}, {"DoNotCreateCSR", kOn}}, false, false},
        {"not checked", {{kAsynchronously, kOff}, {"DoNotCheckPassword", kOn}}, false, false},
        {"forced", {{kAsynchronously, kOff}, {kForced, kOn}}, true, true},
        {"forced, later", {{kForced, kOn}}, true, false},
    };
    const auto add = [this](const Dictionary& options) {
        AddedAccount added;
        EXPECT_TRUE(__VeltoIDDoAddVeltoID(kName, kPassword, options, &added, &error_));
        return added.encDsId;
    };
    issueAtOnce();
    for (const auto& [what, options, hasCertificate, asks] : cases) {
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
        if (hasCertificate) {
            createAccount("d1");
            ASSERT_TRUE(request());
        }
        (void)server_.take();
        add(options);
        EXPECT_EQ(server_.takeMethods().find("createCert") != std::string::npos, asks) << what;
        EXPECT_EQ(keys(), asks || hasCertificate ? 1U : 0U) << what;
    }
    server_.fault("createCert", -1);
    EXPECT_EQ(add({{kAsynchronously, kOff}, {kForced, kOn}}), "d1");
    EXPECT_EQ(log_.count("VeltoIDAuth: Adding account " + std::string(kName) + " failed, ERROR:"), 1);
}

TEST_F(IssuanceTest, ForgettingLeavesNoItemBehind) {
    const std::tuple<const char*, Dictionary, size_t, size_t> cases[] = {
        {"all", {}, 0, 0},
        {"keeps the key", {{"RemovePrivateKeyFromKeychain", kOff}}, 1, 0},
        {"keeps the certificate", {{"RemoveCertificateFromKeychain", kOff}}, 0, 1},
    };
    issueAtOnce();
    for (const auto& [what, options, keptKeys, keptCertificates] : cases) {
        SCOPED_TRACE(what);
        createAccount("d1");
        ASSERT_TRUE(request());
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, options));
        EXPECT_EQ(keys(), keptKeys);
        EXPECT_EQ(certificates(), keptCertificates);
        EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    }
    createAccount("d1");
    answerRequests({{kToken, "t"}});
    ASSERT_TRUE(request()) << "pending";
    // Made just before the agent was killed: nothing refers to it.
    (void)storedKey("private key");
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_EQ(keys(), 0U);
}

TEST_F(IssuanceTest, ForgettingKeepsWhatAnotherAccountShares) {
    issueAtOnce();
    ASSERT_TRUE(request());
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", "d1"));
    const Data password = record().data("HashedPasswordRef");
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_EQ(keys() + certificates(), 3U);
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(password, nullptr));
    EXPECT_TRUE(__VeltoIDForgetVeltoID("other", {}));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_EQ(keys() + certificates(), 0U);
}

TEST_F(IssuanceTest, CleaningUpTakesWhatIsOfNoUse) {
    issueAtOnce();
    ASSERT_TRUE(request());
    const Dictionary references = {{kCertificateReference, certificateEntry()[kCertificateReference]},
                                   {kKeyReference, certificateEntry()[kKeyReference]}};
    const auto cleanUp = [](const Dictionary& values, const String& encDsId) {
        __VeltoIDDBSetCertificateInfo(encDsId, Dictionary());
        for (const auto& [key, value] : values)
            __VeltoIDDBSetCertificateValue(encDsId, key, value, Notify::No);
        EXPECT_TRUE(__VeltoIDCleanupAccountsAndCertificates({}));
        return !__VeltoIDDBCopyCertificateInfo(encDsId, nullptr);
    };
    const Data unknown(std::vector<uint8_t>{1});
    EXPECT_FALSE(cleanUp(references, "d1"));
    EXPECT_TRUE(cleanUp({{kCertificateReference, unknown}, {kKeyReference, unknown}}, "nobody"));
    EXPECT_EQ(log_.count("Removing certificate and private key  from keychain, and certificate from db, for "
                         "account  / dsID=nobody"),
              1);
    EXPECT_EQ(keys() + certificates(), 3U);
    EXPECT_TRUE(cleanUp({{"CertStatus", "CERTIFICATE_INVALID"}}, "d1"));
    EXPECT_EQ(keys() + certificates(), 0U);
    EXPECT_TRUE(cleanUp({{kCertificateReference, unknown}}, "d1")) << "it lacks the key";

    setValue(kEmbargo, date(1));
    EXPECT_TRUE(__VeltoIDCleanupAccountsAndCertificates({}));
    EXPECT_TRUE(record().contains(kEmbargo));
    clock_.advanceBy(2);
    EXPECT_TRUE(__VeltoIDCleanupAccountsAndCertificates({}));
    EXPECT_EQ(stored({kEmbargo}), kNone);
}

TEST_F(IssuanceTest, AnAccountThatAsksOverAndOverIsHeldUp) {
    issueAtOnce();
    for (int i = 0; i < 3; ++i) {
        EXPECT_TRUE(request()) << i;
        clock_.advanceBy(600);
    }
    (void)server_.take();
    EXPECT_FALSE(request()) << "the fourth within an hour";
    EXPECT_EQ(takeCode(), 99);
    EXPECT_EQ(server_.takeMethods(), "");
    EXPECT_EQ(keys(), 1U) << "what there is stays";
    EXPECT_EQ(record()["CertificateRequestsHeldUntil"], date(3'600));
    EXPECT_EQ(nextRequestDate({kName, record()}), now() + 3'600);
    clock_.advanceBy(3'500);
    EXPECT_FALSE(request());
    EXPECT_EQ(log_.count(" certificates within an hour and wants another one"), 1);
    clock_.advanceBy(100);
    EXPECT_TRUE(request());
    EXPECT_EQ(requestsHeldUntil({kName, record()}), std::nullopt);
    EXPECT_FALSE(request()) << "from then on one at a time";
    setValue("CertificateRequestsHeldUntil", date(1e9));
    EXPECT_TRUE(request()) << "no clock that was right has noted that";
}

// What follows happens while the server answers, on the thread that waits for the answer.

TEST_F(IssuanceTest, AnAnswerForAnAccountThatIsGoneIsDropped) {
    const std::pair<const char*, std::function<void()>> events[] = {
        {"forgotten", [] { EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {})); }},
        {"forgotten and added again",
         [] {
             EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
             createAccount("d1");
         }},
    };
    const Dictionary token = {{kToken, "t1"}};
    const std::tuple<const char*, const char*, std::function<Dictionary()>> answers[] = {
        {"sign-in", "authenticate",
         [] {
             return Dictionary{{"encDsId", "d1"}};
         }},
        {"certificate", "createCert",
         [this] {
             return Dictionary{{"dsCert", issued()}};
         }},
        {"token", "createCert", [&] { return token; }},
        {"fetched", "fetchCert",
         [this] {
             return Dictionary{{"dsCert", issued()}};
         }},
    };
    for (const auto& [event, happens] : events)
        for (const auto& [answer, method, reply] : answers) {
            SCOPED_TRACE(std::string(event) + " before the " + answer);
            createAccount("d1");
            server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
            const bool isFetch = method == std::string("fetchCert");
            if (isFetch) {
                answerRequests(token);
                ASSERT_TRUE(request());
            }
            server_.answerWith(method, [&, &happens = happens, &reply = reply](const Dictionary& given) {
                if (const String text = given.string("CSR"))
                    requested_ = testing_support::readRequest(text.text()).publicKey;
                happens();
                return reply();
            });
            (void)server_.take();
            EXPECT_FALSE(isFetch ? fetch(FetchTime::AtOnce) : request());
            EXPECT_EQ(takeCode(), -100);
            EXPECT_EQ(keys() + certificates(), 0U);
            EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
            EXPECT_EQ(stored({kToken, kFetchDate, kKeyReference, kCreated, kGenerated}), kNone);
            EXPECT_EQ(record().empty(), event == std::string("forgotten"));
            EXPECT_EQ(server_.takeMethods().find("downloadCertComplete"), std::string::npos);
            __VeltoIDForgetVeltoID(kName, {});
        }
}

TEST_F(IssuanceTest, OneRequestAnswersAllWhoAskedForOneAtOnce) {
    const std::tuple<const char*, std::function<Dictionary()>, bool> answers[] = {
        {"a token",
         [] {
             return Dictionary{{kToken, "t1"}};
         },
         true},
        {"a certificate",
         [this] {
             return Dictionary{{"dsCert", issued()}};
         },
         true},
        {"a refusal",
         [] {
             return Dictionary{{"dsCert", Dictionary{{"CertStatus", "FAILED"}}}};
         },
         false},
    };
    for (const auto& [what, reply, succeeds] : answers) {
        SCOPED_TRACE(what);
        clock_.advanceBy(3'600);
        onRequest(reply);
        const auto seen = requestsSeen(kName);
        std::atomic<int> successes = 0;
        (void)server_.take();
        platform::sideBySide(4, [&](int) {
            String encDsId;
            std::optional<Error> error;
            if (__VeltoIDDoCreateCertificateRequestForVeltoID(kName, {}, &encDsId, &error, seen))
                ++successes;
            else
                EXPECT_EQ(error->code, -100);
            EXPECT_EQ(encDsId, "d1");
        });
        EXPECT_EQ(successes, succeeds ? 4 : 0);
        EXPECT_EQ(server_.takeMethods(), "authenticate createCert");
    }
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    answerRequests({{kToken, "t2"}});
    platform::sideBySide(4, [&](int) {
        AddedAccount added;
        EXPECT_TRUE(__VeltoIDDoAddVeltoID(kName, kPassword, {{"CreateCSRAsynchronously", kOff}}, &added));
        EXPECT_EQ(added.encDsId, "d1");
        ASSERT_TRUE(added.record);
        EXPECT_EQ(added.record->string(kToken), "t2");
    });
    const std::string methods = server_.takeMethods();
    EXPECT_EQ(methods.find("createCert"), methods.rfind("createCert")) << methods;
    EXPECT_EQ(keys(), 1U);
}

TEST_F(IssuanceTest, AnotherPasswordOrAccountHasARequestOfItsOwn) {
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", nullptr));
    onRequest([this] {
        onRequest([] { return Dictionary{{kToken, "t2"}}; });
        EXPECT_TRUE(__VeltoIDDoCreateCertificateRequestForVeltoID("other", {}, nullptr));
        return Dictionary{{kToken, "t1"}};
    });
    EXPECT_TRUE(request()) << "while that of another account is in work";
    EXPECT_EQ(record()[kToken], Value("t1"));
    EXPECT_EQ(__VeltoIDDBCopyAccountValue("other", kToken), Value("t2"));
    EXPECT_EQ(keys(), 2U);

    std::thread later;
    onRequest([&] {
        const auto seen = requestsSeen(kName);
        EXPECT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, "another password", nullptr));
        onRequest([] { return Dictionary{{kToken, "t4"}}; });
        later = std::thread([seen] {
            EXPECT_TRUE(__VeltoIDDoCreateCertificateRequestForVeltoID(kName, {}, nullptr, nullptr, seen));
        });
        while (requestsSeen(kName) == seen) std::this_thread::yield();
        return Dictionary{{kToken, "t3"}};
    });
    EXPECT_FALSE(request()) << "its place was taken";
    later.join();
    EXPECT_EQ(record()[kToken], Value("t4"));
    EXPECT_EQ(keys(), 2U);
}

TEST_F(IssuanceTest, WhatWasIssuedMeanwhileIsNotWhatWasExamined) {
    issueAtOnce();
    ASSERT_TRUE(request());
    const auto renewed = [this](const char* serialNumber) {
        const auto pair = platform::generateRSAKeyPair(2048);
        requested_ = pair->publicKey;
        Data reference;
        EXPECT_TRUE(addKeyToKeychain(kName, nullptr, Key::privateKey(pair->privateKey), &reference));
        setValue(kKeyReference, reference);
        EXPECT_TRUE(update(issued({{"SerialNumber", serialNumber}})));
    };
    const auto isGood = [&](const char* serialNumber) {
        const CertificateEntry entry = certificateEntryOf("d1");
        return entry.isIssued() && entry.serialNumber() == serialNumber && entry.expires() > now() &&
               copyCertificateFromKeychainGivenPersistentRef(entry.reference(), nullptr) &&
               copyKeyFromKeychainGivenPersistentRef(entry.privateKeyReference(), nullptr);
    };
    const Dictionary isInvalid = {{"encDsId", "d1"}, {"CertificateIsValid", kOff}};
    for (const char* method : {"getMyInfo", "authenticate"}) {
        SCOPED_TRACE(method);
        server_.answerWith(method, [&](const Dictionary&) {
            renewed(method);
            return isInvalid;
        });
        setValue("ForceValidation", kOn);
        setInEntry({{"Dirty", kOn}});
        checkAccount({kName, record()});
        EXPECT_TRUE(isGood(method));
        server_.answer(method, Dictionary{{"encDsId", "d1"}});
    }
    EXPECT_EQ(keys(), 1U);
    EXPECT_EQ(certificates(), 2U);
    const CertificateEntry examined = certificateEntryOf("d1");
    renewed("3");
    EXPECT_FALSE(discardExaminedCertificate(OwnershipLock(), examined));
    EXPECT_TRUE(isGood("3"));

    setValue(kToken, "t1");
    server_.answerWith("fetchCert", [&](const Dictionary&) {
        renewed("4");
        return Dictionary{{"dsCert", issued({{"SerialNumber", "5"}})}};
    });
    (void)server_.take();
    EXPECT_TRUE(fetch(FetchTime::AtOnce)) << "somebody else has fetched it";
    EXPECT_TRUE(isGood("4"));
    EXPECT_EQ(server_.takeMethods(), "authenticate fetchCert");
}

}  // namespace
}  // namespace veltoid
