// The status of an account in every state, each brought about as it comes about.
#include "VeltoIDAuthd/AccountStatus.h"

#include "TestSupport/CertificateFixture.h"
#include "TestSupport/FakeLockState.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

class AccountStatusTest : public CertificateTest {
  protected:
    void SetUp() override {
        CertificateTest::SetUp();
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        issueAtOnce();
    }
    void TearDown() override {
        doNotCompareWithDisk();
        CertificateTest::TearDown();
    }

    /// Adds the account, as a client does.
    void add(bool withCertificate) {
        const Dictionary options = {{"CreateCSRAsynchronously", flag(!withCertificate)}};
        EXPECT_TRUE(__VeltoIDDoAddVeltoID(kName, kPassword, options, nullptr));
        (void)__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll);
    }
    void check() const { checkAccount({kName, record()}); }

    static Dictionary statusOf(const Dictionary& options) {
        return *copyAccountStatusesDictionary(options).dictionary("AccountStatuses")->dictionary(kName);
    }
};

TEST_F(AccountStatusTest, TellsEveryStateThatAnAccountCanBeIn) {
    const auto addAndPass = [this](double seconds) {
        add(true);
        clock_.advanceBy(seconds);
    };
    const auto addWith = [this](const char* key, const Value& value) {
        add(true);
        setInEntry({{key, value}});
    };
    const struct {
        const char* state;
        std::function<void()> comeAbout;
        bool asksTheServer, requiresAction;
        /// When something happens next, from now; none: nothing will.
        std::optional<double> next;
    } cases[] = {
        {"NoEncodedDSID",
         [&] {
             server_.refuse("authenticate", 503);
             add(false);
             check();
             (void)__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll);
         },
         false, false, 0},
        {"PasswordInaccessibleInKeychain",
         [&] {
             add(true);
             removePasswordFromKeychainGivenPersistentRef(record().data("HashedPasswordRef"));
         },
         false, true, 14 * kDay - 1},
        {"PasswordInvalid",
         [&] {
             add(true);
             server_.fault("authenticate", -20101);
             clock_.advanceBy(15 * kDay);
             check();
         },
         true,
         true,
         {}},
        {"NoCertificate", [&] { add(false); }, false, false, 0},
        {"CertificateRevoked",
         [&] {
             addAndPass(15 * kDay);
             server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"CertificateIsValid", kOff}});
         },
         true, false, -kDay - 1},
        {"CertificateExpired", [&] { addAndPass(101 * kDay); }, false, false, -87 * kDay - 1},
        {"Unknown",
         [&] {
             addWith("Dirty", kOn);
             std::filesystem::remove(directory_.base() / "harbwell" / "identity-authority.pem");
         },
         true, false, 14 * kDay - 1},
        {"CertificateOK", [&] { addWith("Dirty", kOn); }, true, false, 14 * kDay - 1},
        {"CertificateAssumedOK", [&] { add(true); }, false, false, 14 * kDay - 1},
        {"CertificateShouldBeRenewed",
         [&] {
             addWith(kValidated, date(75 * kDay));
             clock_.advanceBy(75 * kDay + 1);
         },
         false, false, -61 * kDay - 1},
        {"VeltoIDValidationRecordNeedsToBeUpdated",
         [&] {
             server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(101)}});
             add(true);
         },
         false, false, 0},
        {"CertificatePending",
         [&] {
             onRequest([] { return Dictionary{{"CertificateToken", "t"}, {"Delay", number(70)}}; });
             add(true);
         },
         false, false, 70},
    };
    for (const auto& [state, comeAbout, asksTheServer, requiresAction, next] : cases) {
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(100)}});
        issueAtOnce();
        trust(root_);
        comeAbout();
        const Dictionary status = statusOf({{"CheckNetwork", flag(asksTheServer)}});
        EXPECT_EQ(status["AccountState"], Value(state));
        EXPECT_EQ(status["AccountRequiresUserAction"], flag(requiresAction)) << state;
        EXPECT_EQ(status["NextActionTime"], next ? date(*next) : Value()) << state;
        EXPECT_EQ(status.contains("NextFetchAttempt"), std::string_view(state) == "CertificatePending");
        __VeltoIDForgetVeltoID(kName, {});
        clock_.advanceBy(2 * kDay);
    }
}

class LockedDeviceStatusTest : public AccountStatusTest {
  protected:
    const platform::FakeLockState lock_{false};
};

TEST_F(LockedDeviceStatusTest, SaysNothingOfAPasswordThatMayYetBecomeReadable) {
    add(false);
    removePasswordFromKeychainGivenPersistentRef(record().data("HashedPasswordRef"));
    EXPECT_EQ(statusOf({})["AccountState"], Value("PasswordInaccessibleInKeychain"));
    EXPECT_FALSE(statusOf({}).contains("AccountRequiresUserAction"));
    EXPECT_EQ(copyAccountStatusesDictionary({})["DeviceUnlockedSinceBoot"], kOff);
}

TEST_F(AccountStatusTest, TellsWhatHasChangedAndWhatIsHeldUp) {
    add(false);
    EXPECT_FALSE(copyAccountStatusesDictionary({}).contains("DirtyAccounts"));
    setValue("Dirty", kOn);
    for (const char* key : {"DirtyAccounts", "DirtyAccountsAndCertificates"})
        EXPECT_EQ(copyAccountStatusesDictionary({})[key], Value(Array{kName})) << "told, not taken";
    for (int i = 0; i < 3; ++i) EXPECT_TRUE(request());
    EXPECT_FALSE(statusOf({}).contains("CertificateRequestsHeldUntil"));
    EXPECT_FALSE(request());
    EXPECT_EQ(statusOf({})["CertificateRequestsHeldUntil"], date(kDay));
}

}  // namespace
}  // namespace veltoid
