// The account check in simulated time: when it looks at an account, and what it does then.
#include "VeltoIDAuthd/AccountCheck.h"

#include "TestSupport/CertificateFixture.h"
#include "TestSupport/FakeLockState.h"
#include "Values/Base64.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountBackOff.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"

namespace veltoid {
namespace {

constexpr double kFortnight = 14 * kDay;
constexpr const char* kCheckInterval = "VeltoIDAccountValidationRecordNextCheckIntervalKey";

class AccountCheckTest : public CertificateTest {
  protected:
    void SetUp() override {
        CertificateTest::SetUp();
        setProcessHooks({.scheduleRelaunch = [](double date) { scheduleRelaunch(date); },
                         .scheduleRequestedLaunch = scheduleRequestedLaunch});
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
    bool asksForCertificateIn(double seconds) {
        return methodsIn(seconds).find("createCert") != std::string::npos;
    }
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
    EXPECT_TRUE(asksForCertificateIn(10.2));
    EXPECT_TRUE(certificateEntry().contains(kCertificateReference));
}

class LockedDeviceTest : public AccountCheckTest {
  protected:
    platform::FakeLockState lock_{false};
};

TEST_F(LockedDeviceTest, TheDeviceHasToBeUnlockedFirst) {
    issueAtOnce();
    setValue("Dirty", kOn);
    start();
    EXPECT_EQ(relaunch(), kDay);
    EXPECT_EQ(methodsIn(1.5 * kDay), "");
    EXPECT_EQ(relaunch(), 0.5 * kDay);
    EXPECT_TRUE(lock_.isWatched());
    lock_.unlock();
    EXPECT_NE(methodsIn(6), "");
    EXPECT_FALSE(lock_.isWatched());

    lock_.lock();
    __VeltoIDDBSetAccountValue(kName, "Dirty", kOn, Notify::Yes);
    clock_.advanceBy(1.5 * kDay);
    EXPECT_TRUE(lock_.isWatched());
    EXPECT_LE(relaunch(), 0.5 * kDay + 10);
    lock_.unlock();
    clock_.advanceBy(6);
    EXPECT_TRUE(certificateEntry().contains(kValidated)) << "what was due is done";
}

TEST_F(AccountCheckTest, PassesKeepTheirDistance) {
    setValues({{"encDsId", kGone}, {"LastConnectAttempt", kGone}});
    server_.refuse("authenticate", 503);
    start();
    (void)methodsIn(6);
    for (int i = 0; i < 100; ++i) {
        setValues({{"LastConnectAttempt", kGone}});
        __VeltoIDDBSetAccountValue(kName, "x", number(i), Notify::Yes);
        noteNews(kName);
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
    setValue("CSRGenerationDate", kGone);
    __VeltoIDDBSetAccountValue(kName, "x", "y", Notify::Yes);
    EXPECT_TRUE(asksForCertificateIn(11)) << "a change counts at once";
}

TEST_F(AccountCheckTest, AChangedCertificateIsLookedAtWithinHalfAMinute) {
    issueAtOnce();
    start();
    clock_.advanceBy(kDay);
    ASSERT_TRUE(hasValidCertificateEntry("d1"));
    (void)server_.take();
    ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d1", "CertStatus", "CERTIFICATE_INVALID", Notify::Yes));
    EXPECT_TRUE(asksForCertificateIn(30));
    EXPECT_TRUE(hasValidCertificateEntry("d1"));
}

TEST_F(AccountCheckTest, AnUnreadableDatabaseIsTriedAgainSoon) {
    issueAtOnce();
    setValue("Dirty", kOn);
    platform::TestLifetime::restart();
    __VeltoIDDBSetUsePreferences(true);
    std::optional<platform::Obstacle> obstacle("preferences.db");
    start();
    EXPECT_EQ(methodsIn(600), "");
    EXPECT_GT(platform::transactions::openCount(), 0) << "it stays meanwhile";
    EXPECT_LE(relaunch(), 60);
    obstacle.reset();
    EXPECT_TRUE(asksForCertificateIn(60));
    EXPECT_TRUE(hasValidCertificateEntry("d1"));
}

TEST_F(AccountCheckTest, WhatWasPutOffStaysSoAcrossRestartsUntilThereIsNews) {
    server_.fault("createCert", -1);
    server_.refuse("authenticate", 503);
    setValues({{"encDsId", kGone}, {"LastConnectAttempt", kGone}});
    double until = 0;
    for (int life = 0; life < 8; ++life) {
        platform::TestLifetime::restart();
        __VeltoIDDBSetUsePreferences(true);
        start();
        clock_.advanceBy(std::max(until - now(), 0.0) + 1);
        EXPECT_EQ(server_.takeMethods(), "authenticate") << "life " << life;
        const double before = until;
        until = copyNextActionDateForAccount(kName).value_or(0);
        EXPECT_GE(until - now(), life < 2 ? 290 : (now() - before) * 0.9) << "later each time";
        EXPECT_LE(until - now(), 3'600);
    }
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, kPassword, nullptr));
    setValue("LastConnectAttempt", kGone);
    EXPECT_NE(methodsIn(10), "") << "adding it again is news";
}

TEST_F(AccountCheckTest, AClockThatIsSetMakesItLookAgain) {
    issueAtOnce();
    setValue(kEmbargo, date(1'000));
    start();
    clock_.jumpTo(now() - 5'000);
    EXPECT_EQ(methodsIn(2'000), "") << "the date counts, not the time that was slept";
    EXPECT_TRUE(asksForCertificateIn(4'100));
    clock_.advanceBy(60);
    (void)server_.take();
    clock_.jumpTo(now() + 80 * kDay);
    EXPECT_TRUE(asksForCertificateIn(30)) << "the renewal has come meanwhile";
}

TEST_F(AccountCheckTest, EveryStateHasItsConsequence) {
    issueAtOnce();
    setValue("encDsId", kGone);
    check();
    EXPECT_EQ(server_.takeMethods(), "authenticate");
    EXPECT_EQ(record()["encDsId"], Value("d1"));
    EXPECT_EQ(record()["LastConnectAttempt"], date()) << "not again for a while";

    check();
    EXPECT_TRUE(asksForCertificateIn(0)) << "no certificate";
    setInEntry({{"Dirty", kOn}});
    check();
    EXPECT_EQ(certificateEntry()[kValidated], date());
    EXPECT_EQ(certificateEntry()["Dirty"], kOff) << "evaluated and good";

    setInEntry({{kRenewal, date(-1)}});
    const Value key = certificateEntry()[kKeyReference];
    check();
    EXPECT_NE(certificateEntry()[kKeyReference], key) << "renewed";

    setInEntry({{"CertStatus", "CERTIFICATE_INVALID"}});
    server_.fault("createCert", -1);
    check();
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr)) << "revoked";
    EXPECT_EQ(keys() + certificates(), 0U);
    EXPECT_EQ(log_.count("Removing certificate for Velto ID \"ja?ne"), 0);
    EXPECT_EQ(log_.count(" dsID=\"d1\" because it has expired or been revoked."), 1);

    (void)server_.take();
    check();
    EXPECT_FALSE(asksForCertificateIn(0)) << "too early for another request";

    for (const auto& [ahead, fetches] : {std::pair(5.0, false), std::pair(2 * kDay, false),
                                         std::pair(8 * kDay, true), std::pair(-1.0, true)}) {
        setValues({{kToken, "t"}, {kFetchDate, date(ahead)}});
        check();
        EXPECT_EQ(server_.takeMethods().find("fetchCert") != std::string::npos, fetches) << ahead;
    }
    server_.fault("authenticate", -20101);
    setValues({{kToken, kGone}, {"ValidationDate", kGone}});
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
    EXPECT_LE(copyNextActionDateForAccount(kName).value_or(1e12), now() + 30 * kDay)
        << "nobody waits for that";
    EXPECT_FALSE(record().contains(kCheckInterval));
    EXPECT_EQ(record()[kIdentifier], Value("v1"));
    EXPECT_EQ(log_.count("Fetching VeltoIDValidationRecord for veltoid \"jane@velto.example\""), 23);
}

}  // namespace
}  // namespace veltoid
