// The status of an account in every state, each brought about as it comes about.
#include "VeltoIDAuthd/AccountStatus.h"

#include "TestSupport/CertificateFixture.h"
#include "TestSupport/FakeLockState.h"
#include "TestSupport/SQLiteEdit.h"
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
         false, false, 300},
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
         true, false, 0},
        {"CertificateOK", [&] { addWith("Dirty", kOn); }, true, false, 0},
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

TEST_F(AccountStatusTest, WhatAStrangeKeychainDoesNotHoldIsNotLost) {
    namespace fs = std::filesystem;
    const auto file = platform::TemporaryStateDirectory::file("keychain.db");
    const fs::path kept = directory_.base() / "kept";
    const auto writeOver = [&](std::string_view text) {
        platform::TemporaryStateDirectory::writeFile(file, text);
    };
    const std::pair<const char*, std::function<void()>> cases[] = {
        {"missing", [&] { fs::remove(file); }},
        {"empty", [&] { writeOver(""); }},
        {"without items", [] { platform::editDatabase("keychain.db", "DELETE FROM items"); }},
        {"another one's",
         [] {
             platform::editDatabase("keychain.db",
                                    "UPDATE identity SET id = x'01'; DELETE FROM items WHERE class = 0");
         }},
        {"damaged", [&] { writeOver(std::string(9'000, 'x')); }},
        {"a folder", [&] { fs::remove(file), fs::create_directory(file); }},
    };
    add(true);
    fs::copy_file(file, kept);
    const auto trouble = [] { return copyAccountStatusesDictionary({})["KeychainTrouble"]; };
    const auto held = [] {
        const Dictionary account = record();
        const Dictionary entry = certificateEntry();
        return Array{account["HashedPasswordRef"], account["encDsId"], entry[kCertificateReference],
                     entry[kKeyReference]};
    };
    const Array before = held();
    EXPECT_EQ(trouble(), Value());
    int troubles = 0;
    for (const bool renamedBack : {true, false}) {
        for (const auto& [what, spoil] : cases) {
            SCOPED_TRACE(what);
            spoil();
            (void)server_.take();
            for (int pass = 0; pass < 2; ++pass) check();
            EXPECT_EQ(held(), before);
            EXPECT_EQ(server_.takeMethods(), "") << "no other certificate is asked for";
            EXPECT_EQ(statusOf({})["AccountState"], Value("PasswordInaccessibleInKeychain"));
            EXPECT_TRUE(trouble().isString());
            EXPECT_EQ(log_.count("The keychain cannot be read, or is not the one"), ++troubles) << "once";
            if (fs::is_directory(file) || renamedBack) {
                fs::remove(file);
                fs::copy_file(kept, kept.string() + "2");
                fs::rename(kept.string() + "2", file);
            } else {
                writeOver(platform::TemporaryStateDirectory::readFile(kept));
            }
            EXPECT_EQ(trouble(), Value()) << "without a restart";
            EXPECT_EQ(statusOf({})["AccountState"], Value("CertificateAssumedOK"));
        }
    }
    fs::remove(file);
    add(true);
    EXPECT_EQ(trouble(), Value()) << "the new keychain is the right one now";
    clock_.advanceBy(2 * kDay);
    check();
    EXPECT_NE(certificateEntry()[kKeyReference], before[3]) << "and what it lacks is lost";
    fs::remove(file);
    EXPECT_TRUE(trouble().isString());
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_EQ(trouble(), Value()) << "nobody misses anything";
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
    EXPECT_EQ(statusOf({})["CertificateRequestsHeldUntil"], date(3'600));
}

}  // namespace
}  // namespace veltoid
