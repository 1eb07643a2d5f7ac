// Requests as clients send them, and the replies that they get.
#include "VeltoIDAuthd/AuthenticationService.h"

#include <functional>
#include <mutex>
#include <tuple>
#include <vector>

#include "Protocol/Commands.h"
#include "TestSupport/FakeIdentityServer.h"
#include "TestSupport/FakeMessage.h"
#include "TestSupport/FakeNotifications.h"
#include "TestSupport/SideBySide.h"
#include "VeltoIDAuthd/AccountStatus.h"
#include "VeltoIDAuthd/PasswordCheckService.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

class ServiceTest : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
        server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"}, {"firstNm", "Jane"}});
    }

    using Handler = void (*)(platform::IncomingMessage&);

    static Dictionary send(Value command, Dictionary request = {},
                           Handler handle = handleAuthenticationIPCMessage) {
        request.set("command", std::move(command));
        FakeMessage message(request);
        handle(message);
        EXPECT_EQ(message.replies(), 1);
        return message.reply();
    }
    static Dictionary send(int64_t command, const Dictionary& request = {}) {
        return send(number(command), request);
    }

    static int64_t errorCode(const Dictionary& reply) {
        const Dictionary* error = reply.dictionary("error");
        if (error == nullptr) return 0;
        EXPECT_EQ(keysOf(*error), (std::set<std::string>{"Code", "Domain", "UserInfo"}));
        return (*error)["Code"].asInt64().value_or(0);
    }

    static Dictionary firstStatus() {
        const Dictionary status = *send(command::kStatus).dictionary("status");
        const Dictionary* accounts = status.dictionary("AccountStatuses");
        return accounts->empty() ? Dictionary() : *accounts->begin()->value.asDictionary();
    }

    platform::FakeNotifications notifications_;
};

constexpr const char* kAction = "AccountRequiresUserAction";
const Dictionary kSuccess = {{"success", kOn}};
const Dictionary kFailure = {{"success", kOff}};

TEST_F(ServiceTest, OnlyKnownCommandsSucceed) {
    const std::pair<Value, bool> cases[] = {{number(1), true},   {Value::uint64(1), true}, {number(2), false},
                                            {number(-1), false}, {number(0x9998), false},  {"1", false},
                                            {{}, false},         {Value::real(1.5), false}};
    for (const auto& [command, succeeds] : cases)
        EXPECT_EQ(send(command), succeeds ? kSuccess : kFailure) << testing::PrintToString(command);
}

TEST_F(ServiceTest, SetsDatabaseValues) {
    createAccount("d1");
    __VeltoIDDBSetCertificateInfo("d1", std::nullopt);
    const auto inRecord = [] { return record()["k"]; };
    const auto inEntry = [] { return certificateEntry()["k"]; };
    const auto inMeta = [] { return meta("k"); };
    const auto inSection = [] { return meta("k", "item"); };
    const struct {
        const char* what;
        Value domain, item, key;
        /// By the command that fails when nothing can be set, and by the one that does not.
        bool sets, succeedsIfPossible;
        std::function<Value()> stored;
        int signals;
    } cases[] = {
        {"an account", "Accounts", kName, "k", true, true, inRecord, 1},
        {"no such account", "Accounts", "x", "k", false, false, inRecord, 0},
        {"a certificate", "Certificates", "d1", "k", true, true, inEntry, 1},
        {"no such certificate", "Certificates", "x", "k", false, false, inEntry, 0},
        {"the device", "MetaInfo", {}, "k", true, true, inMeta, 0},
        {"a section", "MetaInfo", "item", "k", true, true, inSection, 0},
        {"no domain", {}, kName, "k", false, true, inRecord, 0},
        {"no key", "Accounts", kName, {}, false, true, inRecord, 0},
        {"no item", "Accounts", {}, "k", false, true, inRecord, 0},
        {"an unknown domain", "Other", kName, "k", false, true, inRecord, 0},
        {"a key of the wrong kind", "MetaInfo", {}, number(1), false, true, inMeta, 0},
    };
    for (const auto& [what, domain, item, key, sets, succeedsIfPossible, stored, signals] : cases) {
        SCOPED_TRACE(what);
        for (const int64_t command : {command::kSetValue, command::kSetValueQuietly}) {
            (void)takeSignals();
            Dictionary request = {{"domain", domain}, {"item", item}, {"key", key}};
            const Dictionary removal = request;
            request.set("value", "v");
            const bool succeeds = command == command::kSetValue ? sets : succeedsIfPossible;
            EXPECT_EQ(send(command, request), succeeds ? kSuccess : kFailure) << command;
            EXPECT_EQ(stored(), sets ? Value("v") : Value()) << command;
            EXPECT_EQ(takeSignals(), signals) << command;
            send(command, removal);
            EXPECT_TRUE(stored().isAbsent()) << command << ": no value removes";
        }
    }
    (void)takeSignals();
    const Dictionary quietly = {{"Dirty", kOff}};
    send(command::kSetValue,
         {{"domain", "Accounts"}, {"item", kName}, {"key", "k"}, {"value", "v"}, {"options", quietly}});
    EXPECT_EQ(record()["k"], Value("v"));
    EXPECT_EQ(takeSignals(), 0);
}

TEST_F(ServiceTest, AnswersFromWhatIsStored) {
    constexpr const char* kRecordType = "VeltoIDValidatedItemsRecordDataCertificateType";
    const Value data = Data(std::vector<uint8_t>{1, 2});
    const Dictionary criteria = {{"email", Array{"a"}}};
    const Dictionary person = {{"matched", "email"}, {"value", "a"}};
    EXPECT_EQ(send(command::kFindCached, {{"criteria", criteria}}), kFailure);
    __VeltoIDDBAddFindPersonResultsToCache(Array{person});
    const Dictionary found = send(command::kFindCached, {{"criteria", criteria}});
    EXPECT_EQ((*found.array("result"))[0].asDictionary()->string("value"), "a");
    EXPECT_EQ(send(command::kFindCached, {{"criteria", "email"}}), kFailure);

    const Dictionary recordRequest = {{"VeltoID", kName}, {"CertificateType", kRecordType}};
    const Dictionary certificateRequest = {{"VeltoID", kName}};
    EXPECT_EQ(send(command::kCertificate, recordRequest), kFailure);
    EXPECT_EQ(errorCode(send(command::kCertificate, certificateRequest)), -1);
    createAccount("d1");
    EXPECT_EQ(send(command::kCertificate, recordRequest),
              (Dictionary{{"success", kOn}, {"result", Dictionary()}}));
    setValues({{kData, data}, {kAsOf, date()}});
    EXPECT_EQ(send(command::kCertificate, recordRequest)["result"],
              Value(Dictionary{{kData, data}, {kAsOf, date()}}));
    EXPECT_EQ(errorCode(send(command::kCertificate, certificateRequest)), -100) << "no certificate";
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"SerialNumber", "7"}});
    for (const Dictionary& request : {certificateRequest, Dictionary{{"encDsId", "d1"}}}) {
        const Dictionary reply = send(command::kCertificate, request);
        ASSERT_TRUE(reply["result"].isDictionary());
        EXPECT_EQ(reply.dictionary("result")->string("SerialNumber"), "7");
    }
}

TEST_F(ServiceTest, WhatNeedsTheServerFailsWithoutOne) {
    createAccount("d1");
    const Dictionary request = {{"VeltoID", kName},
                                {"hashedpassword", kPassword},
                                {"identifier", "k"},
                                {"criteria", Dictionary()},
                                {"breadcrumb", Data(std::vector<uint8_t>{1})}};
    for (const int64_t command : {command::kFind, command::kSetBreadcrumb, command::kGetBreadcrumb})
        EXPECT_EQ(errorCode(send(command, request)), -100) << command;
    EXPECT_EQ(server_.takeMethods(),
              "authenticate findPerson authenticate saveBreadcrumbEk authenticate fetchBreadcrumbEk");
    EXPECT_EQ(count("VeltoIDFindCount"), 1);
}

// --- Several clients

/// Notes the replies of adds in the order in which they are sent.
class AddRequest : public FakeMessage {
  public:
    AddRequest(const std::string& name, std::vector<std::pair<std::string, Dictionary>>& replies)
        : FakeMessage({{"command", number(command::kAdd)}, {"VeltoID", name}, {"hashedpassword", "hash"}}),
          name_(name),
          replies_(replies) {}

    void reply(platform::ValueWriter writer) override {
        static std::mutex mutex;
        FakeMessage::reply(std::move(writer));
        const std::lock_guard lock(mutex);
        replies_.emplace_back(name_, FakeMessage::reply());
    }

  private:
    const std::string name_;
    std::vector<std::pair<std::string, Dictionary>>& replies_;
};

TEST_F(ServiceTest, OfAddsAtOnceTheOneThatIsAnsweredLastStays) {
    for (int round = 0; round < 20; ++round) {
        std::vector<std::pair<std::string, Dictionary>> replies;
        platform::sideBySide(4, [&](int i) {
            AddRequest request("name" + std::to_string(i), replies);
            handleAuthenticationIPCMessage(request);
        });
        std::string last;
        for (const auto& [name, reply] : replies) {
            if (reply["success"] == kOn) {
                last = name;
                continue;
            }
            EXPECT_EQ(errorCode(reply), -108);
            EXPECT_EQ(reply.dictionary("error")->dictionary("UserInfo")->string(kErrorFailureReasonKey),
                      "replaced by another account");
            EXPECT_FALSE(reply.contains("encDsId"));
        }
        ASSERT_EQ(accountNames(), Array{last}) << "round " << round;
    }
}

TEST_F(ServiceTest, WaitingForTheCertificateEndsWithTheClientAndAsksNobody) {
    struct Impatient : FakeMessage {
        using FakeMessage::FakeMessage;
        bool isSenderGone() const override { return platform::now() > goneAt; }
        double goneAt = 0;
    };
    for (const auto& [patience, wait, seconds] :
         {std::tuple(20.0, 1e9, 20.0), std::tuple(1e9, 30.0, 30.0), std::tuple(1e9, 1e9, 3'600.0)}) {
        Impatient message({{"command", number(command::kAdd)},
                           {"VeltoID", kName},
                           {"hashedpassword", kPassword},
                           {"options", Dictionary{{"certwaitduration", Value::real(wait)}}}});
        const double begin = now();
        message.goneAt = begin + patience;
        platform::WorkQueue("client").async([&] { handleAuthenticationIPCMessage(message); });
        clock_.settle();
        while (message.replies() == 0) clock_.advanceBy(1);
        EXPECT_NEAR(now() - begin, seconds, 4);
        EXPECT_EQ(message.reply()["success"], kOn);
        EXPECT_EQ(server_.takeMethods(), "authenticate authenticate getMyInfo")
            << "by the add, not by waiting";
    }
}

// --- Status

TEST_F(ServiceTest, StatusOfAnAccount) {
    createAccount(nullptr);
    setValues(
        {{"Dirty", kGone}, {"LastConnectAttempt", date(-100)}, {"ValidationDate", "whatever is stored"}});
    EXPECT_EQ(firstStatus(), (Dictionary{{"ValidationDate", "whatever is stored"},
                                         {"NextActionTime", date(200)},
                                         {"AccountState", "NoEncodedDSID"},
                                         {kAction, kOff}}));
    setValue("encDsId", "d1");
    EXPECT_EQ(firstStatus()["AccountState"], Value("NoCertificate"));
    setValues({{kToken, "t"}, {kFetchDate, date(70)}});
    EXPECT_EQ(firstStatus()["AccountState"], Value("CertificatePending"));
    EXPECT_EQ(firstStatus()["NextFetchAttempt"], date(70));
    ASSERT_TRUE(removePasswordFromKeychainGivenPersistentRef(record().data("HashedPasswordRef")));
    EXPECT_EQ(firstStatus()["AccountState"], Value("PasswordInaccessibleInKeychain"));
    EXPECT_EQ(firstStatus()[kAction], kOn) << "the device is unlocked";
    EXPECT_TRUE(log_.contains("or the password has been removed from the keychain; no next action."));
    __VeltoIDDBRemovePassword(kName);
    EXPECT_EQ(firstStatus()["AccountState"], Value("PasswordInvalid"));
    EXPECT_TRUE(log_.contains(std::string(kName) + " doesn't have a password; no next action."));
    EXPECT_EQ(firstStatus()[kAction], kOn);
    EXPECT_FALSE(firstStatus().contains("NextActionTime"));

    const auto overriddenBy = [](const Value& value) {
        __VeltoIDDBSetMetaInfoValue(nullptr, kAction, value);
        return firstStatus()[kAction];
    };
    EXPECT_EQ(overriddenBy("0"), kOff);
    EXPECT_EQ(
        log_.count("copyAccountStatusesDictionaryVeltoIDAccountStatusRequiresUserAction override value 0"),
        1);
    EXPECT_EQ(overriddenBy("no"), kOn);
    createAccount("d1");
    EXPECT_EQ(overriddenBy(number(0)), kOff) << "an override is a text";
}

}  // namespace
}  // namespace veltoid
