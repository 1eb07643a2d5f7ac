#include "VeltoIDAuthd/AccountStatus.h"

#include <unistd.h>

#include "Logging/Log.h"
#include "Platform/keychain/LockState.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"

namespace veltoid {
namespace {

/// Whether the override says that the user must act; none without an override.
std::optional<bool> userActionOverride() {
    const String text = __VeltoIDDBCopyMetaInfoValue(nullptr, {}, kVeltoIDMetaAccountRequiresUserActionKey,
                                                     Value::Kind::String)
                            .asString();
    if (!text) return std::nullopt;
    const bool required = text != "0";
    VELTOID_LOG_FROM("copyAccountStatusesDictionary", kWarning,
                     "copyAccountStatusesDictionaryVeltoIDAccountStatusRequiresUserAction override value ",
                     (required ? 1 : 0));
    return required;
}

/// None while the password may yet become readable.
std::optional<bool> requiresUserAction(AccountState state) {
    if (const auto override = userActionOverride()) return override;
    if (state == AccountState::PasswordInaccessibleInKeychain)
        return platform::LockState::shared().hasBeenUnlockedSinceBoot() ? std::optional(true) : std::nullopt;
    return state == AccountState::PasswordInvalid;
}

Dictionary copyAccountStatus(const String& name, const Dictionary& options) {
    Dictionary status;
    const AccountRecord record = accountRecordOf(name);
    status.set(kVeltoIDAccountLastValidationDateKey, record.values()[kVeltoIDAccountLastValidationDateKey]);
    if (const auto next = copyNextActionDateForAccount(name))
        status.set(message::kNextActionTime, Value::date(*next));

    const AccountState state = checkAccountAndDetermineNextAction(name, options);
    status.set(message::kAccountState, nameOf(state));
    if (state == AccountState::CertificatePending)
        if (const auto nextFetch = record.nextCertificateFetch())
            status.set(message::kNextFetchAttempt, Value::date(*nextFetch));
    if (const auto held = requestsHeldUntil(record))
        status.set(kVeltoIDAccountCertificateRequestsHeldUntilKey, Value::date(*held));
    if (const auto required = requiresUserAction(state))
        status.set(message::kRequiresUserAction, Value::boolean(*required));
    return status;
}

Dictionary copyStatusOfEveryAccount(const Dictionary& options) {
    Dictionary statuses;
    Array names;
    __VeltoIDCopyVeltoIDs(options, &names);
    for (const Value& name : names)
        if (name.isString()) statuses.set(name.asString(), copyAccountStatus(name.asString(), options));
    return statuses;
}

}  // namespace

Dictionary copyDeviceStatusDictionary() {
    return {{message::kUnlockedSinceBoot,
             Value::boolean(platform::LockState::shared().hasBeenUnlockedSinceBoot())}};
}

Dictionary copyAccountStatusesDictionary(const Dictionary& options) {
    Dictionary status;
    status.set(message::kAccountStatuses, copyStatusOfEveryAccount(options));
    if (const auto dirty = __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::Keep)) {
        status.set(message::kDirtyAccounts, *dirty);
        status.set(message::kDirtyAccountsAndCertificates, *dirty);
    }
    for (const std::string_view key :
         {kVeltoIDMetaLastSuccessfulConnectKey, kVeltoIDMetaLastConnectAttemptKey})
        status.set(key, __VeltoIDDBCopyMetaInfoValue(nullptr, options, key));
    status.set(message::kLaunchTime, Value::date(launchDate()));
    if (const auto next = nextLaunchDate()) status.set(message::kNextLaunchTime, Value::date(*next));
    status.set(message::kProcessID, Value::int64(getpid()));
    for (const auto& [key, value] : copyDeviceStatusDictionary()) status.set(key, value);
    status.set(message::kKeychainTrouble, keychainTrouble());
    return status;
}

}  // namespace veltoid
