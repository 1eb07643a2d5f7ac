#include "VeltoIDAuthd/AuthenticationService.h"

#include <algorithm>
#include <cstdlib>

#include "IPCHelpers/Transaction.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "Values/LowerCase.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/AccountStatus.h"
#include "VeltoIDAuthd/ClientRequest.h"
#include "VeltoIDAuthd/PasswordCheckService.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthd/Shutdown.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AddForget.h"
#include "VeltoIDAuthenticationImpl/Breadcrumbs.h"
#include "VeltoIDAuthenticationImpl/CertificateInformation.h"
#include "VeltoIDAuthenticationImpl/FindPerson.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"

namespace veltoid {
namespace {

constexpr const char* kHandlerName = "handleAuthenticationIPCMessage";

// How long an add that waits for its certificate lets pass between two looks at the account (seconds). The
// account check, which does the work, makes a pass every five seconds at the most.
constexpr double kShortestWait = 0.25;
constexpr double kLongestWait = 3;

/// Long enough for the reply to leave before the process ends (seconds).
constexpr double kTerminationDelay = 0.1;

struct Outcome {
    bool success = false;
    std::optional<Error> error;
};

void countFor(const String& account, const Request& request, std::string_view counter) {
    __VeltoIDDBIncrementMetaInfoCounter(account, request.options(), counter, 1);
}

Outcome ping(Request& /*request*/) { return {true, {}}; }

/// Sets what the request names; the given answer when that is nothing that can be set.
bool setDatabaseValue(const Request& request, bool whenNothingIsSet) {
    const String domain = request.string("domain");
    const String item = request.string("item");
    const String key = request.string("key");
    const Value value = request.value("value");
    const bool notify = getBool(&request.options(), "Dirty", true);
    if (!domain || !key) return whenNothingIsSet;
    if (domain == "MetaInfo") return __VeltoIDDBSetMetaInfoValue(item, key, value);
    if (item && domain == "Accounts") return __VeltoIDDBSetAccountValue(item, key, value, notify);
    if (item && domain == "Certificates") return __VeltoIDDBSetCertificateValue(item, key, value, notify);
    return whenNothingIsSet;
}

Outcome setValueOrFail(Request& request) { return {setDatabaseValue(request, false), {}}; }

Outcome setValueIfPossible(Request& request) { return {setDatabaseValue(request, true), {}}; }

/// The agent keeps one account.
void forgetOtherAccounts(const String& added) {
    Array names;
    __VeltoIDDBCopyVeltoIDs(&names);
    const String addedInLowerCase = lowerCased(added);
    for (const Value& name : names)
        if (name.isString() && lowerCased(name.asString()) != addedInLowerCase)
            __VeltoIDForgetVeltoID(name.asString(), {{"RemovePrivateKeyFromKeychain", Value::boolean(true)}});
}

/// Lets some time pass before the account is looked at again: until its next action, but not for long.
void waitForNextAction(const String& accountName) {
    const double now = platform::Clock::shared().now();
    std::optional<double> next;
    if (!copyNextActionDateForAccount(accountName, &next) || !next || *next <= now)
        next = now + kShortestWait;
    const platform::Semaphore nobodySignals;
    (void)nobodySignals.wait(std::clamp(*next - now, kShortestWait, kLongestWait));
}

/// Waits for the account's certificate as long as option "certwaitduration" says; false when there will be
/// none without somebody's doing. While the certificate is on its way this is a success.
bool waitForCertificate(const Request& request) {
    const double duration = getDouble(&request.options(), "certwaitduration", 0);
    if (!(duration > 0)) return true;
    Dictionary options = request.options();
    options.set("CheckNetwork", Value::boolean(true));
    const auto& clock = platform::Clock::shared();
    const auto& lifetime = platform::Lifetime::current();
    for (const double deadline = clock.now() + duration; clock.now() <= deadline && !lifetime.isEnding();) {
        wakeAccountCheck();
        switch (checkAccountAndDetermineNextAction(request.account(), options)) {
            case AccountState::NoEncodedDSID:
            case AccountState::PasswordInaccessibleInKeychain:
            case AccountState::PasswordInvalid:
                return false;
            case AccountState::CertificateOK:
            case AccountState::CertificateAssumedOK:
                return true;
            default:
                waitForNextAction(request.account());
        }
    }
    return true;
}

Outcome addAccount(Request& request) {
    Outcome outcome;
    String encDsId;
    std::optional<Dictionary> record;
    outcome.success = __VeltoIDDoAddVeltoID(request.account(), request.string("hashedpassword"),
                                            request.options(), &encDsId, &record, &outcome.error);
    countFor(nullptr, request, kVeltoIDAddVeltoIDCountKey);
    if (!outcome.success) return outcome;
    __VeltoIDDBSetAccountValue(request.account(), kVeltoIDAccountLastValidationDateKey, Value::null(), true);
    request.answer("encDsId", encDsId);
    if (record) request.answer("accountinfo", *record);
    wakeAccountCheck();
    forgetOtherAccounts(request.account());
    outcome.success = waitForCertificate(request);
    return outcome;
}

Outcome getMyInfo(Request& request) {
    Outcome outcome;
    Dictionary info;
    outcome.success = __VeltoIDDoGetMyInfo(request.account(), request.options(), &info, &outcome.error);
    countFor(request.account(), request, kVeltoIDGetMyInfoCountKey);
    if (outcome.success) request.answer("info", info);
    return outcome;
}

Dictionary criteriaOf(const Request& request) {
    const Value criteria = request.value("criteria");
    const Dictionary* dictionary = criteria.asDictionary();
    return dictionary != nullptr ? *dictionary : Dictionary();
}

Outcome findPerson(Request& request) {
    Outcome outcome;
    std::optional<Array> results;
    outcome.success = __VeltoIDDoFindPerson(request.account(), request.string("hashedpassword"),
                                            criteriaOf(request), request.options(), &results, &outcome.error);
    countFor(request.account(), request, kVeltoIDFindCountKey);
    if (outcome.success && results) request.answer("result", *results);
    return outcome;
}

Outcome findCachedPerson(Request& request) {
    const auto results = __VeltoIDDBCopyCachedFindPersonResults(criteriaOf(request));
    countFor(request.account(), request, kVeltoIDFindCachedCountKey);
    if (!results || results->empty()) return {};
    request.answer("result", *results);
    return {true, {}};
}

Outcome listAccounts(Request& request) {
    Outcome outcome;
    Array names;
    outcome.success = __VeltoIDCopyVeltoIDs(request.options(), &names, &outcome.error);
    if (outcome.success) request.answer("result", names);
    return outcome;
}

Outcome forgetAccount(Request& request) {
    Outcome outcome;
    Dictionary record;
    if (__VeltoIDDBCopyVeltoIDAccount(request.account(), &record, &outcome.error)) {
        const String name = record.string(kVeltoIDAccountNameKey);
        outcome.success = __VeltoIDForgetVeltoID(name, request.options(), &outcome.error);
        if (outcome.success) {
            request.answer("VeltoID", name);
            request.answer("encDSID", record.string(kVeltoIDAccountDSIDKey));
            request.answer("accountInfo", record);
        }
    }
    countFor(nullptr, request, kVeltoIDForgetVeltoIDCountKey);
    return outcome;
}

/// The signed record that vouches for the account's validated items.
Outcome copyValidationRecord(Request& request) {
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(request.account(), &record)) return {};
    Dictionary result;
    for (const std::string_view key :
         {kVeltoIDAccountValidationRecordDataKey, kVeltoIDAccountValidationRecordValidAsOfKey})
        result.set(key, record[key]);
    request.answer("result", result);
    return {true, {}};
}

Outcome copyCertificateInformation(Request& request) {
    if (request.string("CertificateType") == "VeltoIDValidatedItemsRecordDataCertificateType")
        return copyValidationRecord(request);
    Outcome outcome;
    Dictionary result;
    outcome.success = __VeltoIDCopyCertificateInfo(request.account(), request.string("encDsId"),
                                                   request.options(), &result, &outcome.error);
    if (outcome.success) request.answer("result", result);
    return outcome;
}

Outcome setBreadcrumb(Request& request) {
    Outcome outcome;
    outcome.success = __VeltoIDDoSetBreadcrumb(request.account(), request.string("hashedpassword"),
                                               request.string("identifier"), request.data("breadcrumb"),
                                               request.options(), &outcome.error);
    return outcome;
}

Outcome copyBreadcrumb(Request& request) {
    Outcome outcome;
    const Data breadcrumb =
        __VeltoIDDoCopyBreadcrumb(request.account(), request.string("hashedpassword"),
                                  request.string("identifier"), request.options(), &outcome.error);
    outcome.success = static_cast<bool>(breadcrumb);
    if (outcome.success) request.answer("breadcrumb", breadcrumb);
    return outcome;
}

Outcome verifyPassword(Request& request) {
    Outcome outcome;
    outcome.success = verifyRequestedPassword(request, &outcome.error);
    return outcome;
}

Outcome copyAllContents(Request& request) {
    std::optional<Dictionary> contents;
    const bool success = __VeltoIDDBCopyAllContents(&contents);
    if (contents) request.answer("result", *contents);
    return {success, {}};
}

Outcome check(Request& request) {
    const AccountState state = checkAccountAndDetermineNextAction(request.account(), request.options());
    request.answer("status", Value::int64(static_cast<int64_t>(state)));
    return {true, {}};
}

void terminateAfterReply() {
    platform::WorkQueue::main().asyncAfter(kTerminationDelay, [] {
        VELTOID_LOG_FROM(
            kHandlerName, kNotice,
            "Shutting down server after receiving kVeltoIDAuthenticationStatusTerminateServerKey "
            "request.");
        shutDownByCommand();
    });
}

Outcome status(Request& request) {
    const bool terminates = getBool(&request.options(), "VeltoIDAuthenticationStatusTerminateServer", false);
    if (terminates) computeRelaunchFromAccounts();
    request.answer("status", terminates ? copyDeviceStatusDictionary()
                                        : copyAccountStatusesDictionary(request.options()));
    if (terminates) terminateAfterReply();
    return {true, {}};
}

struct Command {
    int64_t number;
    Outcome (*run)(Request& request);
};

constexpr int64_t kTerminateCommand = 0x9999;

constexpr Command kCommands[] = {
    {kVeltoIDPingCommand, ping},
    {0xFE, setValueOrFail},
    {0xFF, setValueIfPossible},
    {0x120, addAccount},
    {0x130, getMyInfo},
    {0x140, findPerson},
    {0x141, findCachedPerson},
    {0x150, listAccounts},
    {0x160, forgetAccount},
    {0x170, copyCertificateInformation},
    {0x180, verifyPassword},
    {0x200, setBreadcrumb},
    {0x201, copyBreadcrumb},
    {0x500, copyAllContents},
    {0x501, check},
    {0x510, status},
};

Outcome dispatch(Request& request) {
    const auto* command = std::find_if(std::begin(kCommands), std::end(kCommands), [&](const Command& known) {
        return known.number == request.command();
    });
    return command != std::end(kCommands) ? command->run(request) : Outcome();
}

}  // namespace

void handleAuthenticationIPCMessage(platform::IncomingMessage& message) {
    const Transaction guard(kHandlerName);
    Request request(message);
    if (request.command() == kTerminateCommand) {
        computeRelaunchFromAccounts();
        return shutDownByCommand();
    }
    const Outcome outcome = dispatch(request);
    request.finish(outcome.success, outcome.error);
}

}  // namespace veltoid
