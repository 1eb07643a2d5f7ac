#include "VeltoIDAuthd/AccountActions.h"

#include <algorithm>
#include <cmath>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Logging/LogText.h"
#include "Platform/keychain/LockState.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kDay = 86'400;
constexpr double kRenewalInterval = 86'400;
constexpr double kRecordRetryInterval = 180;
constexpr double kRecordCheckSoon = 15;
constexpr double kRecordIntervalAfterServersDate = 14'400;

constexpr double kRecordRetryGrowth = 1.5;

constexpr std::string_view kNextCheckInterval = kVeltoIDAccountValidationRecordNextCheckIntervalKey;
constexpr std::string_view kNextCheckDate = kVeltoIDAccountValidationRecordNextCheckDateKey;

double now() { return platform::Clock::shared().now(); }

/// A pending certificate is fetched when its date has come; a date that is more than a day ahead is not
/// believed.
void fetchPendingCertificate(const String& accountName, const Dictionary& record, const Dictionary& options) {
    const auto date = record.date(kVeltoIDAccountCertificateNextCertificateFetchDateKey);
    if (date && *date >= now() && *date <= now() + kDay) return;
    __VeltoIDDoFetchCertificateForVeltoID(accountName, false, options);
}

/// The keychain may have been unlocked, or locked, since the account was examined.
void dropLostPassword(const String& accountName, const Dictionary& record) {
    const Data reference = record.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey);
    if (!platform::LockState::shared().hasBeenUnlockedSinceBoot() ||
        copyPasswordFromKeychainGivenPersistentRef(reference, nullptr))
        return;
    __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountHashedPasswordKeychainReferenceKey, Value::null(),
                               true);
}

/// The account is of no use until somebody gives it its password again.
void dropPassword(const String& accountName, const Dictionary& record) {
    if (record.contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey) ||
        record.contains(kVeltoIDAccountHashedPasswordKey))
        __VeltoIDDBRemovePassword(accountName);
    __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountDSIDKey, Value::null(), true);
}

/// The certificate has just been evaluated and is good.
void noteValidation(const String& encDsId) {
    __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateLastSuccessfulValidationDateKey,
                                   Value::date(now()), false);
    __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDDirtyKey, Value::boolean(false), false);
}

/// What is tried next after an attempt that failed.
Dictionary laterAttempt(const Dictionary& record) {
    const auto stored = record.number(kNextCheckInterval);
    const double interval =
        stored && *stored > 0 && std::isfinite(*stored)
            ? *stored
            : metaSeconds("VeltoIDMetaInfoValidationRecordRenewalAttemptInterval", kRecordRetryInterval);
    const double grown =
        std::min(std::max(interval * kRecordRetryGrowth, kRecordRetryInterval), randomPollingDelay());
    return {{kNextCheckDate, Value::date(now() + interval)}, {kNextCheckInterval, Value::real(grown)}};
}

}  // namespace

double metaSeconds(std::string_view key, double defaultValue) {
    const Value stored = __VeltoIDDBCopyMetaInfoValue(nullptr, {}, key);
    if (stored.isAbsent()) return defaultValue;
    const double seconds = stored.asDouble().value_or(0);
    return std::isfinite(seconds) ? seconds : 0;
}

void checkAccount(const String& accountName, const Dictionary& record) {
    const Dictionary options = {{"CheckNetwork", Value::boolean(true)}};
    const String encDsId = record.string(kVeltoIDAccountDSIDKey);
    switch (checkAccountAndDetermineNextAction(accountName, options)) {
        case AccountState::NoEncodedDSID:
            return __VeltoIDDoFetchEncodedDSIDForVeltoID(accountName, options);
        case AccountState::PasswordInaccessibleInKeychain:
            return dropLostPassword(accountName, record);
        case AccountState::PasswordInvalid:
            return dropPassword(accountName, record);
        case AccountState::CertificateRevoked:
        case AccountState::CertificateExpired:
            renewCertificateForAccount(accountName, encDsId, options, true);
            return;
        case AccountState::NoCertificate:
        case AccountState::CertificateShouldBeRenewed:
        case AccountState::CertificateMustBeRenewed:
            renewCertificateForAccount(accountName, encDsId, options, false);
            return;
        case AccountState::CertificateOK:
            return noteValidation(encDsId);
        case AccountState::ValidationRecordNeedsToBeUpdated:
            return fetchValidationRecordForAccount(accountName, record, options);
        case AccountState::CertificatePending:
            return fetchPendingCertificate(accountName, record, options);
        case AccountState::Unknown:
        case AccountState::CertificateAssumedOK:
            return;
    }
}

bool renewCertificateForAccount(const String& accountName, const String& encDsId, const Dictionary& options,
                                bool expiredOrRevoked) {
    if (expiredOrRevoked) {
        VELTOID_LOG(kNotice, "Removing certificate for Velto ID "
                                 << describeAccountForLog(accountName) << " dsID=" << describeValue(encDsId)
                                 << " because it has expired or been revoked.");
        discardCertificate(OwnershipLock(), encDsId);
    } else {
        const double interval = metaSeconds("CertificateRenewalInterval", kRenewalInterval);
        __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateNextRenewalAttemptDateKey,
                                       Value::date(now() + interval), false);
    }
    Dictionary record;
    __VeltoIDDBCopyVeltoIDAccount(accountName, &record);
    if (const auto next = nextRequestDate(record); next && now() < *next) return false;
    return __VeltoIDDoCreateCertificateRequestForVeltoID(accountName, options, nullptr);
}

void fetchValidationRecordForAccount(const String& accountName, const Dictionary& record,
                                     const Dictionary& options) {
    VELTOID_LOG(kNotice, "Fetching VeltoIDValidationRecord for veltoid " << describeValue(accountName));
    Dictionary fetchOptions = options;
    fetchOptions.set("ForceValidationRecordFetch", Value::boolean(true));
    if (const Value& interval = record[kNextCheckInterval]; interval.isNumber())
        fetchOptions.set(kNextCheckInterval, interval);
    const double before = now();
    __VeltoIDDoGetMyInfo(accountName, fetchOptions, nullptr);
    Dictionary after;
    __VeltoIDDBCopyVeltoIDAccount(accountName, &after);
    // Information of a known account is given out whether the server answers or not: the date tells.
    const bool isAnswered = after.date(kVeltoIDAccountLastValidationDateKey).value_or(before - 1) >= before;
    const auto nextCheck = after.date(kNextCheckDate);
    if (isAnswered && nextCheck && *nextCheck > now() &&
        after.string(kVeltoIDAccountValidationRecordIdentifierKey)) {
        __VeltoIDDBSetAccountValues(accountName, {{kNextCheckInterval, Value::null()}}, true);
    } else if (isAnswered && nextCheck &&
               record.number(kNextCheckInterval) != kRecordIntervalAfterServersDate) {
        __VeltoIDDBSetAccountValues(accountName,
                                    {{kNextCheckDate, Value::date(now() + kRecordCheckSoon)},
                                     {kNextCheckInterval, Value::real(kRecordIntervalAfterServersDate)}},
                                    true);
    } else {
        __VeltoIDDBSetAccountValues(accountName, laterAttempt(record), true);
    }
}

}  // namespace veltoid
