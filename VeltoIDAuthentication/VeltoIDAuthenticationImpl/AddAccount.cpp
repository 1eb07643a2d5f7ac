#include "VeltoIDAuthenticationImpl/AddAccount.h"

#include <algorithm>
#include <set>
#include <string>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/Names.h"
#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "Values/LowerCase.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

using enum AccountState;

// How long an add that waits for its certificate lets pass between two looks at the account (seconds). The
// account check, which does the work, makes at most one pass in five seconds.
constexpr double kMinWait = 0.25;
constexpr double kMaxWait = 3;

std::string describeError(const std::optional<Error>& error) {
    return error ? describeValue(*error) : std::string();
}

bool isAlreadyOnItsWay(const AccountRecord& record, const Dictionary& options) {
    return !getBool(&options, option::kForceCertificateCreation, false) &&
           (record.certificateToken() || hasValidCertificateEntry(record.encDsId()));
}

/// Signs in and fetches the account's information; false, with the error, when the sign-in failed.
bool signIn(const String& accountName, const String& hashedPassword, const Dictionary& options,
            String* encDsId, ErrorOut error) {
    // Released at once: the next calls may use it.
    if (!__VeltoIDSessionDoCreateSession(accountName, hashedPassword, options, encDsId, nullptr, error))
        return false;
    if (*encDsId) __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountDSIDKey, *encDsId);
    if (!getBool(&options, option::kDoNotFetchInformation, false)) {
        const Dictionary fetchOptions =
            copyDictionarySettingValue(options, option::kForceValidationRecordFetch, Value::boolean(true));
        __VeltoIDDoGetMyInfo(accountName, fetchOptions, nullptr);
    }
    return true;
}

/// Whether the add itself asks for a certificate instead of leaving that to the account check.
bool createsRequest(const String& encDsId, const Dictionary& options) {
    if (!encDsId || getBool(&options, option::kDoNotCreateRequest, false) ||
        getBool(&options, option::kCreateRequestAsynchronously, true))
        return false;
    return getBool(&options, option::kForceCertificateCreation, false) || !hasValidCertificateEntry(encDsId);
}

/// The account as it is stored now; nothing, with the error, when it cannot be read.
AddedAccount storedAccount(const String& accountName, ErrorOut error) {
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, error)) return {};
    return {record.encDsId(), record.values(), {}};
}

AddedAccount readd(const String& accountName) {
    std::optional<Error> copyError;
    AddedAccount added = storedAccount(accountName, &copyError);
    VELTOID_LOG_FROM("__VeltoIDDoAddVeltoID", kNotice, "VeltoIDAuth: Already existing account ", accountName,
                     " re-added; ", (added.encDsId ? "succeeded." : "failed, "), describeError(copyError));
    return added;
}

AddedAccount addAnew(const String& accountName, const String& hashedPassword, const Dictionary& options,
                     RequestsSeen seen) {
    std::optional<Error> held;
    String encDsId;
    bool proceeds = getBool(&options, option::kDoNotCheckPassword, false) ||
                    signIn(accountName, hashedPassword, options, &encDsId, &held);
    if (proceeds && createsRequest(encDsId, options)) {
        encDsId = nullptr;
        proceeds = __VeltoIDDoCreateCertificateRequestForVeltoID(accountName, options, &encDsId, &held, seen);
    }
    AddedAccount added = proceeds ? storedAccount(accountName, &held) : AddedAccount{encDsId, {}, {}};
    VELTOID_LOG_FROM("__VeltoIDDoAddVeltoID", kNotice, "VeltoIDAuth: Adding account ", accountName, " ",
                     (added.record ? "succeeded." : "failed, "), describeError(held));
    return added;
}

/// The names whose accounts were replaced by another one, until they are added again. Guarded by the
/// ownership lock.
struct ReplacedAccounts {
    std::set<std::string> names;
};

std::set<std::string>& replacedNames(const OwnershipLock& /*ownership*/) {
    return platform::Lifetime::current().state<ReplacedAccounts>().names;
}

bool isStored(const String& accountName) { return __VeltoIDDBCopyVeltoIDAccount(accountName, nullptr); }

/// Whether the account is still there; -108 with the reason when not.
bool isStillStored(const OwnershipLock& ownership, const String& accountName, ErrorOut error) {
    if (isStored(accountName)) return true;
    const bool isReplaced = replacedNames(ownership).contains(accountName.text());
    return failWith(
        error, makeError(identity_error::kUnknownAccount,
                         {isReplaced ? "replaced by another account" : "forgotten meanwhile", {}, {}}, {},
                         "addOnlyAccount", __FILE_NAME__, __LINE__));
}

/// The agent keeps one account.
bool forgetOtherAccounts(const OwnershipLock& ownership, const String& added, ErrorOut error) {
    const String addedInLowerCase = lowerCased(added);
    for (const Value& name : accountNames()) {
        if (lowerCased(name.asString()) == addedInLowerCase) continue;
        if (!forgetAccount(ownership, name.asString(), {}, error)) return false;
        replacedNames(ownership).insert(name.asString().text());
    }
    return true;
}

/// Lets some time pass before the account is looked at again: until its next action, but not for long.
void waitForNextAction(const String& accountName) {
    const double now = platform::now();
    const double next = copyNextActionDateForAccount(accountName).value_or(now);
    (void)platform::Semaphore().wait(std::clamp(next - now, kMinWait, kMaxWait));
}

/// Only looks at what is stored: the account check asks the server. False when there will be no certificate.
bool waitForCertificate(const String& accountName, double duration, const AddingClient& client) {
    const auto& lifetime = platform::Lifetime::current();
    const double deadline = platform::now() + std::min(duration, kMaxCertificateWait);
    while (platform::now() <= deadline && !lifetime.isEnding() && client.isWaiting() &&
           isStored(accountName)) {
        switch (checkAccountAndDetermineNextAction(accountName, {})) {
            case NoEncodedDSID:
            case PasswordInaccessibleInKeychain:
            case PasswordInvalid:
                return false;
            case CertificateOK:
            case CertificateAssumedOK:
                return true;
            default:
                waitForNextAction(accountName);
        }
    }
    return true;
}

}  // namespace

bool __VeltoIDDoAddVeltoID(const String& accountName, const String& hashedPassword, const Dictionary& options,
                           AddedAccount* added, ErrorOut error) {
    const RequestsSeen seen = requestsSeen(accountName);
    if (!__VeltoIDDBCreateVeltoIDAccount(accountName, hashedPassword, nullptr))
        return failWith(
            error, makeError(identity_error::kUnknown,
                             {"The account could not be stored on this device; the log says why.", {}, {}},
                             {}, __func__, __FILE_NAME__, __LINE__));
    AddedAccount outcome = isAlreadyOnItsWay(accountRecordOf(accountName), options)
                               ? readd(accountName)
                               : addAnew(accountName, hashedPassword, options, seen);
    platform::Notifications::shared().post(kVeltoIDAccountAddedOrRemovedNotification);
    fill(added, std::move(outcome));
    return true;
}

bool addOnlyAccount(const String& accountName, const String& hashedPassword, const Dictionary& options,
                    const AddingClient& client, AddedAccount* added, ErrorOut error) {
    AddedAccount outcome;
    const bool isNew = !isStored(accountName);
    if (accountName) replacedNames(OwnershipLock()).erase(accountName.text());
    const bool isAdded = __VeltoIDDoAddVeltoID(accountName, hashedPassword, options, &outcome, error);
    __VeltoIDDBIncrementMetaInfoCounter(nullptr, options, kVeltoIDAddVeltoIDCountKey, 1);
    if (!isAdded) return false;
    __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountLastValidationDateKey, Value::null());
    client.wakeAccountCheck();
    auto decision = std::make_shared<const OwnershipLock>();
    bool succeeds = isStillStored(*decision, accountName, error);
    if (succeeds && !forgetOtherAccounts(*decision, accountName, error)) {
        succeeds = false;
        if (isNew) forgetAccount(*decision, accountName, {});
    }
    const double wait = getDouble(&options, option::kCertificateWait, 0);
    if (succeeds && wait > 0) {
        decision.reset();
        succeeds = waitForCertificate(accountName, wait, client);
        decision = std::make_shared<const OwnershipLock>();
        succeeds = isStillStored(*decision, accountName, error) && succeeds;
        outcome = storedAccount(accountName, nullptr);
    } else if (!succeeds) {
        outcome = {};
    }
    outcome.decision = std::move(decision);
    fill(added, std::move(outcome));
    return succeeds;
}

}  // namespace veltoid
