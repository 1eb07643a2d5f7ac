// Certificates from request to renewal, against a real database and keychain, an authority that signs what it
// is asked to, and simulated time.
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"

#include "Certificates/CertificateRequest.h"
#include "TestSupport/CertificateFixture.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using testing_support::pemOf;

constexpr double kDay = 86'400;
constexpr const char* kToken = "CertificateToken";
constexpr const char* kTokenExpiration = "CertificateTokenExpiration";
constexpr const char* kGenerated = "CSRGenerationDate";
constexpr const char* kInterval = "CSRGenerationInterval";
constexpr const char* kCreated = "CSRCreationDate";
constexpr const char* kFetchDate = "NextCertificateFetchDate";
constexpr const char* kDelta = "NextCertificateFetchDelta";
constexpr const char* kKeyReference = "CertificatePrivateKeyReference";
constexpr const char* kCertificateReference = "CertificateReference";
constexpr const char* kIntermediateReference = "IntermediateCertificateReference";

using IssuanceTest = CertificateTest;

TEST_F(IssuanceTest, ACertificateThatIsIssuedAtOnceIsKeptWithAllThatBelongsToIt) {
    issueAtOnce();
    setValue(kDelta, number(5));
    ASSERT_TRUE(request({{"__CERT_FETCH_DELAY_MIN", "5"}}));
    const auto calls = server_.take();
    EXPECT_EQ(calls.back().parameters["__CERT_FETCH_DELAY_MIN"], Value("5"));
    const Dictionary entry = certificateEntry();
    EXPECT_EQ(entry["CertStatus"], Value("CERT_ISSUED"));
    EXPECT_EQ(entry["CertType"], Value("client")) << "whatever the server says is kept";
    EXPECT_EQ(certificateFromPEM(entry.string("Certificate"))->serialNumber, "1A2B3C");
    EXPECT_EQ(entry["LastSuccessfulValidation"], date(-1));
    EXPECT_EQ(entry["NextRenewalAttempt"], date(75 * kDay));
    EXPECT_EQ(entry["Dirty"], flag(true));

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
    for (const char* key :
         {kToken, kTokenExpiration, kGenerated, kInterval, kFetchDate, kDelta, kKeyReference, kCreated})
        EXPECT_FALSE(record().contains(key)) << key;
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
    onRequest([] { return Dictionary{{"CertificateToken", "t1"}, {"Delay", number(20)}}; });
    ASSERT_TRUE(request());
    EXPECT_EQ(server_.takeMethods(), "authenticate createCert");
    EXPECT_EQ(record()[kToken], Value("t1"));
    EXPECT_EQ(in(kTokenExpiration), 14 * kDay);
    EXPECT_EQ(in(kFetchDate), 20);
    EXPECT_EQ(record()[kDelta], number(20));
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
    EXPECT_EQ(in(kFetchDate), 300) << "a fault says nothing of the delay";
    EXPECT_EQ(record()[kDelta], number(450));
    EXPECT_FALSE(record().contains(kGenerated) || record().contains(kInterval));

    server_.answer("fetchCert", Dictionary{{"dsCert", Dictionary{{"CertStatus", "SIGNIN_PENDING"}}}});
    EXPECT_FALSE(fetch(FetchTime::AtOnce)) << "forced before its time";
    EXPECT_EQ(in(kFetchDate), 450);
    EXPECT_EQ(record()[kDelta], number(675));
    clock_.advanceBy(450);
    (void)server_.take();
    server_.answer("fetchCert",
                   Dictionary{{"dsCert", Array{issued(), Dictionary{{"CertStatus", "FAILED"}}}}});
    EXPECT_TRUE(fetch());
    const auto calls = server_.take();
    EXPECT_EQ(calls.at(1).parameters["CertificateToken"], Value("t1"));
    EXPECT_EQ(calls.at(2).method, "downloadCertComplete");
    EXPECT_FALSE(record().contains(kToken) || record().contains(kKeyReference));
    EXPECT_TRUE(certificateEntry().contains(kKeyReference));
    EXPECT_EQ(relaunches_, (std::vector<double>{20, 300, 450}));
    EXPECT_TRUE(fetch()) << "there is nothing to fetch";
    EXPECT_EQ(server_.takeMethods(), "");
}

TEST_F(IssuanceTest, AFailedAttemptLeavesNoKey) {
    struct Case {
        const char* what;
        std::function<void()> prepare;
        const char* methods;
        int64_t code;
        /// When the next request may be made; none: an interval after this one.
        std::optional<double> nextRequest;
    };
    const auto answering = [this](const char* key, const Value& value) {
        onRequest([key, value] { return Dictionary{{key, value}}; });
    };
    const auto dsCert = [](const char* status) { return Dictionary{{"CertStatus", status}}; };
    const Case cases[] = {
        {"refused", [&] { answering("dsCert", dsCert("FAILED")); }, "authenticate createCert", -100, 3600},
        {"unknown", [&] { answering("dsCert", dsCert("?")); }, "authenticate createCert", -100, 0},
        {"a fault", [&] { server_.fault("createCert", -3); }, "authenticate createCert", -100, 0},
        {"no server", [&] { server_.refuse("createCert", 500); }, "authenticate createCert", -100, 0},
        {"a token without end", [&] { answering("CertificateToken", std::string(1U << 20U, 't')); },
         "authenticate createCert", -100, 0},
        {"for another key",
         [&] {
             onRequest([this] {
                 requested_ = platform::generateRSAKeyPair(2048)->publicKey;
                 return Dictionary{{"dsCert", issued()}};
             });
         },
         "authenticate createCert", -100, 3600},
        {"no sign-in", [&] { server_.refuse("authenticate", 500); }, "authenticate", -100, 0},
        {"wrong password", [&] { server_.fault("authenticate", -20101); }, "authenticate", -101, 0},
    };
    for (const Case& each : cases) {
        createAccount("d1");
        // The request takes the place of an older one.
        Data older;
        ASSERT_TRUE(addKeyToKeychain(
            kName, nullptr, Key::privateKey(platform::generateRSAKeyPair(2048)->privateKey), &older));
        setValues({{kToken, "old"},
                   {kTokenExpiration, date()},
                   {kFetchDate, date()},
                   {kKeyReference, older},
                   {kInterval, number(60)}});
        each.prepare();
        EXPECT_FALSE(request()) << each.what;
        EXPECT_EQ(takeCode(), each.code) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        EXPECT_EQ(keys(), 0U) << each.what;
        EXPECT_EQ(certificates(), 0U) << each.what;
        for (const char* key : {kToken, kTokenExpiration, kKeyReference})
            EXPECT_FALSE(record().contains(key)) << each.what << ": " << key;
        EXPECT_EQ(in(kGenerated), *each.nextRequest) << each.what;
        EXPECT_EQ(hasPassword(), each.code != -101) << each.what;
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
    EXPECT_FALSE(request());
    EXPECT_EQ(takeCode(), -108);
    EXPECT_FALSE(fetch());
    EXPECT_EQ(takeCode(), -108);
}

TEST_F(IssuanceTest, ARequestWithoutTokenOrCertificateJustWaits) {
    onRequest([] {
        return Dictionary{{"CertificateToken", number(1)}, {"dsCert", "none"}, {"Delay", "soon"}};
    });
    EXPECT_TRUE(request());
    EXPECT_FALSE(record().contains(kToken) || record().contains(kFetchDate));
    EXPECT_TRUE(record().contains(kKeyReference));
    EXPECT_EQ(keys(), 1U);
}

TEST_F(IssuanceTest, TheServersEncDsIdBecomesTheAccounts) {
    setValue("encDsId", "old");
    onRequest([] { return Dictionary{{"CertificateToken", "t"}}; });
    String encDsId;
    EXPECT_TRUE(__VeltoIDDoCreateCertificateRequestForVeltoID(kName, {}, &encDsId));
    EXPECT_EQ(encDsId, "d1");
    EXPECT_EQ(record()["encDsId"], Value("d1"));
    EXPECT_EQ(in(kFetchDate), 0) << "no delay, no wait";
    EXPECT_FALSE(record().contains(kDelta));
}

TEST_F(IssuanceTest, TheDelayOfATokenIsBelievedUpToADay) {
    struct Case {
        Value delay;
        double stored;
    };
    for (const auto& [delay, stored] :
         {Case{number(0), 0}, Case{number(86'400), 86'400}, Case{number(100'000), 15}, Case{number(-5), 15},
          Case{Value::real(0.5), 0.5}, Case{Value::real(1e300), 15}}) {
        clock_.advanceBy(3'600);
        onRequest([delay = delay] { return Dictionary{{"CertificateToken", "t"}, {"Delay", delay}}; });
        ASSERT_TRUE(request());
        EXPECT_EQ(in(kFetchDate), stored);
        EXPECT_EQ(record().number(kDelta), stored);
    }
}

TEST_F(IssuanceTest, EveryAnswerIsAppliedToTheAccount) {
    struct Case {
        const char* what;
        std::optional<Dictionary> result;
        Value delay;
        Value delta;
        bool tokenIsOver;
        bool succeeds;
        /// Seconds from now; none: the key is gone.
        std::optional<double> fetchDate;
        double leastDelta;
        double mostDelta;
        /// none: gone.
        std::optional<double> generated;
    };
    const auto status = [](const char* text) { return Dictionary{{"CertStatus", text}}; };
    const Dictionary pending = status("SIGNIN_PENDING");
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const double infinity = std::numeric_limits<double>::infinity();
    const Value none;
    const Case cases[] = {
        {"pending", pending, number(60), none, false, true, 60, 90, 90, {}},
        {"pending, noted delay", pending, none, number(100), false, true, 100, 150, 150, {}},
        {"pending, no delay", pending, none, none, false, true, 60, 90, 90, {}},
        {"pending, at once", pending, number(0), none, false, true, 1, 0, 0, {}},
        {"pending, in the past", pending, number(-8), none, false, true, 1, -12, -12, {}},
        {"pending, a long day", pending, number(90'000), none, false, true, 90'000, 86'400, 172'800, {}},
        {"pending, a year", pending, number(31'536'000), none, false, true, 604'800, 86'400, 172'800, {}},
        {"pending, no number", pending, Value::real(nan), number(10), false, true, 10, 15, 15, {}},
        {"pending, for ever", pending, Value::real(infinity), none, false, true, 60, 90, 90, {}},
        {"failed", status("FAILED"), number(60), number(1), false, false, {}, 0, 0, 3600},
        {"unknown", status("?"), none, number(100), false, false, 100, 150, 150, 7},
        {"unknown, no delta", Dictionary{{"CertStatus", number(1)}}, none, none, false, false, 86'400, 86'400,
         172'800, 7},
        {"unknown, no result", {}, none, number(0), false, false, 86'400, 86'400, 172'800, 7},
        {"unknown, long", status("cert_issued"), none, number(90'000), false, false, 90'000, 86'400, 172'800,
         7},
        {"expired", status("?"), none, number(100), true, false, {}, 0, 0, 3600},
        {"failed, expired", status("FAILED"), none, none, true, false, {}, 0, 0, 3600},
        {"pending, expired", pending, none, none, true, true, 60, 90, 90, {}},
    };
    const Key key = Key::privateKey(platform::generateRSAKeyPair(2048)->privateKey);
    for (const Case& each : cases) {
        Data reference;
        ASSERT_TRUE(addKeyToKeychain(kName, nullptr, key, &reference));
        setValues({{kToken, "t1"},
                   {kTokenExpiration, date(each.tokenIsOver ? -1 : 1)},
                   {kGenerated, date(7)},
                   {kInterval, number(60)},
                   {kKeyReference, reference},
                   {kDelta, each.delta.isAbsent() ? Value::null() : each.delta},
                   {kFetchDate, Value::null()}});
        EXPECT_EQ(update(each.result, each.delay), each.succeeds) << each.what;
        EXPECT_EQ(takeCode(), each.succeeds ? 0 : -100) << each.what;
        EXPECT_EQ(record().contains(kToken), each.fetchDate.has_value()) << each.what;
        EXPECT_EQ(record()[kFetchDate], each.fetchDate ? date(*each.fetchDate) : none) << each.what;
        EXPECT_EQ(record()[kGenerated], each.generated ? date(*each.generated) : none) << each.what;
        const double delta = record().number(kDelta).value_or(0);
        EXPECT_TRUE(each.leastDelta <= delta && delta <= each.mostDelta) << each.what << ": " << delta;
        EXPECT_EQ(keys(), each.fetchDate ? 1U : 0U) << each.what;
        EXPECT_EQ(record().contains(kKeyReference), each.fetchDate.has_value()) << each.what;
        EXPECT_EQ(record()["Dirty"], flag(true)) << each.what;
    }
    const std::string name = kName;
    EXPECT_EQ(log_.count("VeltoIDAuth: Failed generating certificate for " + name + ", d1, certToken=t1."),
              2);
    EXPECT_EQ(
        log_.count("UNKNOWN Certificate issuance request for " + name + " dsID=d1 certToken=t1, status=?."),
        2);
}

TEST_F(IssuanceTest, WhatIsMissingInACertificateResultIsMissingInTheEntry) {
    struct Case {
        const char* what;
        Dictionary changes;
        bool hasCertificate;
        bool hasIntermediate;
        Value renewal;
    };
    requested_ = platform::generateRSAKeyPair(2048)->publicKey;
    const Value none = Value::null();
    const Case cases[] = {
        {"nothing", {}, true, true, date(75 * kDay)},
        {"no certificate", {{"Certificate", none}}, false, true, date(75 * kDay)},
        {"no DER",
         {{"Certificate", "-----BEGIN CERTIFICATE-----\nQUJD\n-----END CERTIFICATE-----\n"}},
         false,
         true,
         date(75 * kDay)},
        {"no text", {{"Certificate", number(1)}}, false, true, date(75 * kDay)},
        {"no intermediate", {{"IntermediateCertificate", none}}, true, false, date(75 * kDay)},
        {"no PEM", {{"IntermediateCertificate", "hello"}}, true, false, date(75 * kDay)},
        {"no expiry", {{"Expires", none}}, true, true, {}},
        {"expired", {{"Expires", date(-1)}}, true, true, {}},
        {"for ever",
         {{"Expires", Value::date(253'402'300'799)}},
         true,
         true,
         Value::date(now() + 0.75 * (253'402'300'799 - now()))},
    };
    for (const Case& each : cases) {
        __VeltoIDDBRemoveCertificateInfo("d1");
        Dictionary result = issued();
        result.set("IntermediateCertificate", result["IntermediateCert"]);
        for (const auto& [key, value] : each.changes)
            value.isNull() ? (void)result.remove(key.view()) : result.set(key, value);
        EXPECT_TRUE(update(result)) << each.what;
        const Dictionary entry = certificateEntry();
        EXPECT_EQ(entry.contains(kCertificateReference), each.hasCertificate) << each.what;
        EXPECT_EQ(entry.contains(kIntermediateReference), each.hasIntermediate) << each.what;
        EXPECT_EQ(entry["NextRenewalAttempt"], each.renewal) << each.what;
    }
}

TEST_F(IssuanceTest, ATokenIsFetchedWhenItsTimeHasCome) {
    struct Case {
        const char* what;
        Dictionary values;
        const char* methods;
        int64_t code;
    };
    constexpr const char* kAsked = "authenticate fetchCert downloadCertComplete";
    const Case cases[] = {
        {"no token", {{kToken, Value::null()}}, "", 0},
        {"no text", {{kToken, number(1)}}, "", 0},
        {"three days ahead", {{kFetchDate, date(3 * kDay)}}, "", 99},
        {"eight days ahead", {{kFetchDate, date(8 * kDay)}}, kAsked, -100},
        {"just now", {{kFetchDate, date()}}, kAsked, -100},
        {"no date", {{kFetchDate, "soon"}}, kAsked, -100},
    };
    server_.fault("fetchCert", -7);
    for (const Case& each : cases) {
        setValues({{kToken, "t1"}, {kFetchDate, Value::null()}});
        setValues(each.values);
        EXPECT_EQ(fetch(), each.code == 0) << each.what;
        EXPECT_EQ(takeCode(), each.code) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
    }
    EXPECT_EQ(record()[kToken], Value("t1")) << "until the next result or its expiry";
    EXPECT_EQ(log_.count("Failed while fetching result for certificate token t1, error="), 3);

    server_.refuse("authenticate", 503);
    EXPECT_TRUE(fetch()) << "a server that cannot be reached is tried later";
    EXPECT_EQ(in(kFetchDate), 10);
    EXPECT_EQ(record()[kDelta], number(15));
    clock_.advanceBy(10);
    EXPECT_TRUE(fetch());
    EXPECT_EQ(in(kFetchDate), 15);
    EXPECT_EQ(record().number(kDelta), 22.5);
    setValue(kDelta, number(200'000));
    EXPECT_TRUE(fetch(FetchTime::AtOnce));
    EXPECT_EQ(in(kFetchDate), 200'000);
    EXPECT_TRUE(record().number(kDelta) >= kDay && record().number(kDelta) <= 2 * kDay);
}

TEST_F(IssuanceTest, AnEncDsIdIsLearntByASignInNowAndThen) {
    const auto learn = [this](double sinceLastAttempt) {
        setValues({{"encDsId", Value::null()}, {"LastConnectAttempt", date(-sinceLastAttempt)}});
        __VeltoIDDoFetchEncodedDSIDForVeltoID(kName, {}, &error_);
        return server_.takeMethods();
    };
    for (const double recent : {0.0, 300.0}) {
        EXPECT_EQ(learn(recent), "");
        EXPECT_EQ(takeCode(), 99);
    }
    for (const double longAgo : {301.0, -5.0}) {
        EXPECT_EQ(learn(longAgo), "authenticate");
        EXPECT_EQ(takeCode(), -100) << "always filled";
        EXPECT_EQ(record()["encDsId"], Value("d1"));
    }
    server_.fault("authenticate", -20209);
    EXPECT_EQ(learn(1000), "authenticate");
    EXPECT_EQ(takeCode(), -102);
    EXPECT_FALSE(record().contains("encDsId"));
    EXPECT_EQ(learn(1000), "") << "without a password";
}

TEST_F(IssuanceTest, AnAddAsksForTheCertificateWhenItIsToldTo) {
    struct Case {
        const char* what;
        Dictionary options;
        bool hasCertificate;
        bool asks;
    };
    const Value on = flag(true);
    const Value off = flag(false);
    constexpr const char* kAsynchronously = "CreateCSRAsynchronously";
    const Case cases[] = {
        {"later", {}, false, false},
        {"now", {{kAsynchronously, off}}, false, true},
        {"never", {{kAsynchronously, off}, {"DoNotCreateCSR", on}}, false, false},
        {"not checked", {{kAsynchronously, off}, {"DoNotCheckPassword", on}}, false, false},
        {"forced", {{kAsynchronously, off}, {"ForceCertificateCreation", on}}, true, true},
        {"forced, later", {{"ForceCertificateCreation", on}}, true, false},
    };
    const auto add = [this](const Dictionary& options) {
        AddedAccount added;
        EXPECT_TRUE(__VeltoIDDoAddVeltoID(kName, kPassword, options, &added, &error_));
        return added.encDsId;
    };
    issueAtOnce();
    for (const Case& each : cases) {
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
        if (each.hasCertificate) {
            createAccount("d1");
            ASSERT_TRUE(request());
        }
        (void)server_.take();
        add(each.options);
        EXPECT_EQ(server_.takeMethods().find("createCert") != std::string::npos, each.asks) << each.what;
        EXPECT_EQ(keys(), each.asks || each.hasCertificate ? 1U : 0U) << each.what;
    }
    server_.fault("createCert", -1);
    EXPECT_EQ(add({{kAsynchronously, off}, {"ForceCertificateCreation", on}}), "d1");
    EXPECT_EQ(log_.count("VeltoIDAuth: Adding account " + std::string(kName) + " failed, ERROR:"), 1);
}

TEST_F(IssuanceTest, ForgettingLeavesNoItemBehind) {
    struct Case {
        const char* what;
        Dictionary options;
        size_t keys;
        size_t certificates;
    };
    const Value off = flag(false);
    const Case cases[] = {
        {"all", {}, 0, 0},
        {"keeps the key", {{"RemovePrivateKeyFromKeychain", off}}, 1, 0},
        {"keeps the certificate", {{"RemoveCertificateFromKeychain", off}}, 0, 1},
    };
    issueAtOnce();
    for (const Case& each : cases) {
        createAccount("d1");
        ASSERT_TRUE(request()) << each.what;
        EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, each.options)) << each.what;
        EXPECT_EQ(keys(), each.keys) << each.what;
        EXPECT_EQ(certificates(), each.certificates) << each.what;
        EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr)) << each.what;
    }
    createAccount("d1");
    onRequest([] { return Dictionary{{"CertificateToken", "t"}}; });
    ASSERT_TRUE(request()) << "pending";
    // Made just before the agent was killed: nothing refers to it.
    ASSERT_TRUE(addKeyToKeychain(kName, "private key",
                                 Key::privateKey(platform::generateRSAKeyPair(2048)->privateKey), nullptr));
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_EQ(keys(), 0U);
}

TEST_F(IssuanceTest, ForgettingKeepsWhatAnotherAccountShares) {
    issueAtOnce();
    ASSERT_TRUE(request());
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", "d1"));
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_EQ(keys() + certificates(), 3U);
    EXPECT_TRUE(__VeltoIDForgetVeltoID("other", {}));
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
    EXPECT_FALSE(cleanUp(references, "d1"));
    EXPECT_TRUE(cleanUp({{kCertificateReference, Data(std::vector<uint8_t>{1})},
                         {kKeyReference, Data(std::vector<uint8_t>{1})}},
                        "nobody"));
    EXPECT_EQ(log_.count("Removing certificate and private key  from keychain, and certificate from db, for "
                         "account  / dsID=nobody"),
              1);
    EXPECT_EQ(keys() + certificates(), 3U);
    EXPECT_TRUE(cleanUp({{"CertStatus", "CERTIFICATE_INVALID"}}, "d1"));
    EXPECT_EQ(keys() + certificates(), 0U);
    EXPECT_TRUE(cleanUp({{kCertificateReference, Data(std::vector<uint8_t>{1})}}, "d1"))
        << "it lacks the key";

    setValue("EarliestAllowedConnectionDate", date(1));
    EXPECT_TRUE(__VeltoIDCleanupAccountsAndCertificates({}));
    EXPECT_TRUE(record().contains("EarliestAllowedConnectionDate"));
    clock_.advanceBy(2);
    EXPECT_TRUE(__VeltoIDCleanupAccountsAndCertificates({}));
    EXPECT_FALSE(record().contains("EarliestAllowedConnectionDate"));
}

TEST_F(IssuanceTest, AnAccountThatAsksOverAndOverIsHeldUp) {
    issueAtOnce();
    for (int i = 0; i < 3; ++i) {
        EXPECT_TRUE(request()) << i;
        clock_.advanceBy(600);
    }
    (void)server_.take();
    setValue(kInterval, number(7'200));
    EXPECT_FALSE(request()) << "the fourth within an hour";
    EXPECT_EQ(takeCode(), 99);
    EXPECT_EQ(server_.takeMethods(), "");
    EXPECT_EQ(keys(), 1U) << "what there is stays";
    EXPECT_EQ(record()["CertificateRequestsHeldUntil"], date(7'200));
    EXPECT_EQ(nextRequestDate({kName, record()}), now() + 7'200);
    clock_.advanceBy(7'000);
    EXPECT_FALSE(request());
    EXPECT_EQ(log_.count(" certificates within an hour and wants another one"), 1);
    clock_.advanceBy(200);
    EXPECT_TRUE(request());
    EXPECT_EQ(requestsHeldUntil({kName, record()}), std::nullopt);
    setValue("CertificateRequestsHeldUntil", date(1e9));
    EXPECT_TRUE(request()) << "no clock that was right has noted that";
}

}  // namespace
}  // namespace veltoid
