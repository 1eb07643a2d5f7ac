// The account check in simulated time: when it looks at an account, and what it does then.
#include "VeltoIDAuthd/AccountCheck.h"

#include "TestSupport/CertificateFixture.h"
#include "TestSupport/FakeLockState.h"
#include "Values/Base64.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"

namespace veltoid {
namespace {

constexpr double kDay = 86'400;
constexpr double kFortnight = 14 * kDay;
constexpr const char* kNextCheck = "VeltoIDAccountValidationRecordNextCheckDateKey";
constexpr const char* kCheckInterval = "VeltoIDAccountValidationRecordNextCheckIntervalKey";
constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";

class AccountCheckTest : public CertificateTest {
  protected:
    void SetUp() override {
        CertificateTest::SetUp();
        setProcessHooks({.scheduleRelaunch = [](double date) { scheduleRelaunch(date); }});
    }
    void TearDown() override {
        // What the loop has taken of marks is on disk later.
        doNotCompareWithDisk();
        CertificateTest::TearDown();
    }

    void start(double delay = 0) {
        startAccountCheck(delay);
        clock_.advanceBy(0);
    }
    /// Seconds from now.
    double relaunch() {
        clock_.settle();
        return nextLaunchDate().value_or(-1) - now();
    }
    std::string methodsIn(double seconds) {
        clock_.advanceBy(seconds);
        return server_.takeMethods();
    }
    void check() { checkAccount({kName, record()}); }
};

TEST_F(AccountCheckTest, WithoutAccountsItSleepsUntilThereIsOne) {
    __VeltoIDDBRemoveVeltoIDAccount(kName);
    start(10);
    EXPECT_EQ(nextLaunchDate(), std::nullopt);
    clock_.advanceBy(10);
    EXPECT_EQ(relaunch(), kFortnight);
    clock_.advanceBy(30 * kDay);
    EXPECT_EQ(relaunch(), -16 * kDay) << "nothing has woken it";
    EXPECT_EQ(platform::transactions::openCount(), 0);
    issueAtOnce();
    createAccount("d1");
    EXPECT_EQ(methodsIn(4.9), "");
    EXPECT_NE(methodsIn(10.2).find("createCert"), std::string::npos);
    EXPECT_TRUE(certificateEntry().contains("CertificateReference"));
}

class LockedDeviceTest : public AccountCheckTest {
  protected:
    platform::FakeLockState lock_{false};
};

TEST_F(LockedDeviceTest, TheDeviceHasToBeUnlockedFirst) {
    platform::FakeLockState& lock = lock_;
    issueAtOnce();
    setValue("Dirty", flag(true));
    start();
    EXPECT_EQ(relaunch(), kDay);
    EXPECT_EQ(methodsIn(1.5 * kDay), "");
    EXPECT_EQ(relaunch(), 0.5 * kDay);
    EXPECT_TRUE(lock.isWatched());
    lock.unlock();
    EXPECT_NE(methodsIn(6), "");
    EXPECT_FALSE(lock.isWatched());

    lock.lock();
    __VeltoIDDBSetAccountValue(kName, "Dirty", flag(true), Notify::Yes);
    clock_.advanceBy(1.5 * kDay);
    EXPECT_TRUE(lock.isWatched());
    EXPECT_LE(relaunch(), 0.5 * kDay + 10);
    lock.unlock();
    clock_.advanceBy(6);
    EXPECT_TRUE(certificateEntry().contains("LastSuccessfulValidation")) << "what was due is done";
}

TEST_F(AccountCheckTest, PassesKeepTheirDistance) {
    setValues({{"encDsId", Value::null()}, {"LastConnectAttempt", Value::null()}});
    server_.refuse("authenticate", 503);
    start();
    (void)methodsIn(6);
    for (int i = 0; i < 100; ++i) {
        setValues({{"LastConnectAttempt", Value::null()}});
        __VeltoIDDBSetAccountValue(kName, "x", number(i), Notify::Yes);
        wakeAccountCheck();
        clock_.advanceBy(0.1);
    }
    const size_t signIns = server_.take().size();
    EXPECT_TRUE(signIns >= 1 && signIns <= 3) << signIns << " in ten seconds";
}

TEST_F(AccountCheckTest, AnAccountThatAPassCannotHelpIsPutOff) {
    // Forever due, since nobody gives the account a validation record before it has a certificate.
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(101)}});
    server_.fault("createCert", -1);
    start();
    clock_.advanceBy(kDay);
    const auto calls = server_.take();
    EXPECT_LT(calls.size(), 200U) << "in a day";
    EXPECT_GT(calls.size(), 20U) << "but it is not given up";
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    issueAtOnce();
    setValue("CSRGenerationDate", Value::null());
    __VeltoIDDBSetAccountValue(kName, "x", "y", Notify::Yes);
    EXPECT_NE(methodsIn(11).find("createCert"), std::string::npos) << "a change counts at once";
}

TEST_F(AccountCheckTest, AClockThatIsSetMakesItLookAgain) {
    issueAtOnce();
    setValue("EarliestAllowedConnectionDate", date(1'000));
    start();
    clock_.jumpTo(now() - 5'000);
    EXPECT_EQ(methodsIn(2'000), "") << "the date counts, not the time that was slept";
    EXPECT_NE(methodsIn(4'100).find("createCert"), std::string::npos);
    clock_.advanceBy(60);
    (void)server_.take();
    clock_.jumpTo(now() + 80 * kDay);
    EXPECT_NE(methodsIn(30).find("createCert"), std::string::npos) << "the renewal has come meanwhile";
}

TEST_F(AccountCheckTest, EveryStateHasItsConsequence) {
    issueAtOnce();
    setValue("encDsId", Value::null());
    check();
    EXPECT_EQ(server_.takeMethods(), "authenticate");
    EXPECT_EQ(record()["encDsId"], Value("d1"));
    EXPECT_EQ(record()["LastConnectAttempt"], date()) << "not again for a while";

    check();
    EXPECT_NE(server_.takeMethods().find("createCert"), std::string::npos) << "no certificate";
    __VeltoIDDBSetCertificateValue("d1", "Dirty", flag(true), Notify::No);
    check();
    EXPECT_EQ(certificateEntry()["LastSuccessfulValidation"], date());
    EXPECT_EQ(certificateEntry()["Dirty"], flag(false)) << "evaluated and good";

    __VeltoIDDBSetCertificateValue("d1", "NextRenewalAttempt", date(-1), Notify::No);
    const Value key = certificateEntry()["CertificatePrivateKeyReference"];
    check();
    EXPECT_NE(certificateEntry()["CertificatePrivateKeyReference"], key) << "renewed";

    __VeltoIDDBSetCertificateValue("d1", "CertStatus", "CERTIFICATE_INVALID", Notify::No);
    server_.fault("createCert", -1);
    check();
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr)) << "revoked";
    EXPECT_EQ(keys() + certificates(), 0U);
    EXPECT_EQ(log_.count("Removing certificate for Velto ID \"ja?ne"), 0);
    EXPECT_EQ(log_.count(" dsID=\"d1\" because it has expired or been revoked."), 1);

    (void)server_.take();
    check();
    EXPECT_EQ(server_.takeMethods().find("createCert"), std::string::npos) << "too early for another request";

    for (const auto& [ahead, fetches] : {std::pair(5.0, false), std::pair(2 * kDay, false),
                                         std::pair(8 * kDay, true), std::pair(-1.0, true)}) {
        setValues({{"CertificateToken", "t"}, {"NextCertificateFetchDate", date(ahead)}});
        check();
        EXPECT_EQ(server_.takeMethods().find("fetchCert") != std::string::npos, fetches) << ahead;
    }
    server_.fault("authenticate", -20101);
    setValues({{"CertificateToken", Value::null()}, {"ValidationDate", Value::null()}});
    check();
    EXPECT_FALSE(hasPassword());
    EXPECT_FALSE(record().contains("encDsId")) << "the password is refused";
}

TEST_F(AccountCheckTest, AValidationRecordIsTriedLessAndLessOften) {
    const auto fetch = [this] { fetchValidationRecordForAccount({kName, record()}, {}); };
    server_.fault("getMyInfo", -1);
    double expected = 180;
    for (int i = 0; i < 20; ++i) {
        fetch();
        const double next = record().date(kNextCheck).value_or(0) - now();
        const double interval = record().number(kCheckInterval).value_or(0);
        EXPECT_TRUE(next == expected || expected >= kDay) << i << ": " << next;
        EXPECT_LE(next, 2 * kDay);
        EXPECT_TRUE(interval == expected * 1.5 || interval >= kDay) << i << ": " << interval;
        expected = interval;
        clock_.advanceBy(next);
    }
    const testing_support::TestAuthority signer;
    const auto answer = [&](const char* next) {
        const Data signedRecord(signer.sign("<plist><dict/></plist>"));
        server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"},
                                               {"VIDVRecord", base64Encode(signedRecord)},
                                               {"VIDVRecordIdentifier", "v1"},
                                               {"VIDVRecordNextCheckDate", next}});
        fetch();
        return record().date(kNextCheck).value_or(0) - now();
    };
    EXPECT_EQ(answer("2020-01-01T00:00:00Z"), 15) << "the server's own date has passed already";
    EXPECT_EQ(record()[kCheckInterval], number(14'400));
    EXPECT_EQ(answer("2020-01-01T00:00:00Z"), 14'400);
    EXPECT_GT(answer("2090-01-01T00:00:00Z"), 1e9);
    EXPECT_FALSE(record().contains(kCheckInterval));
    EXPECT_EQ(record()[kIdentifier], Value("v1"));
    EXPECT_EQ(log_.count("Fetching VeltoIDValidationRecord for veltoid \"jane@velto.example\""), 23);
}

}  // namespace
}  // namespace veltoid
