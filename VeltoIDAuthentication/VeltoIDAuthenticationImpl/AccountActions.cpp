#include "VeltoIDAuthenticationImpl/AccountActions.h"

#include <algorithm>
#include <cmath>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Logging/LogText.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"

namespace veltoid {
namespace {

using enum AccountState;

// Seconds.
constexpr double kRenewalInterval = 86'400;
constexpr double kMinRenewalInterval = 3'600;
constexpr double kRecordRetryInterval = 180;
constexpr double kRecordCheckSoon = 15;
constexpr double kRecordIntervalAfterServersDate = 14'400;

constexpr double kRecordRetryGrowth = 1.5;

constexpr std::string_view kNextCheckInterval = kVeltoIDAccountValidationRecordNextCheckIntervalKey;
constexpr std::string_view kNextCheckDate = kVeltoIDAccountValidationRecordNextCheckDateKey;

/// What cannot be read now, or not in this keychain, is not lost.
void dropLostPassword(const AccountRecord& record) {
    if (stateOfItem(platform::KeychainItemClass::GenericPassword, record.passwordReference()) !=
        ItemState::Gone)
        return;
    setAccountValuesIf(
        [](const AccountRecord& stored, const AccountRecord& examined) {
            return stored.passwordReference() == examined.passwordReference();
        },
        record, {{kVeltoIDAccountHashedPasswordKeychainReferenceKey, Value::null()}});
}

/// The account cannot be used until its password is given again, unless that has happened meanwhile. A
/// password that the server refused was removed before; a hash that the record itself has, without an item in
/// the keychain, goes here.
void disable(const AccountRecord& record) {
    setAccountValuesIf(
        [](const AccountRecord& stored, const AccountRecord& /*examined*/) {
            return !stored.passwordReference();
        },
        record, {{kVeltoIDAccountHashedPasswordKey, Value::null()}, {kVeltoIDAccountDSIDKey, Value::null()}});
}

/// The certificate has just been evaluated and is good.
void noteValidation(const CertificateEntry& examined) {
    __VeltoIDDBSetCertificateValues(
        examined,
        {{kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(platform::now())},
         {kVeltoIDDirtyKey, Value::boolean(false)}},
        Notify::No);
}

/// What is tried next after an attempt that failed.
Dictionary laterAttempt(const AccountRecord& record) {
    const auto stored = record.validationRecordNextCheckInterval();
    const double interval =
        stored && *stored > 0 && std::isfinite(*stored)
            ? *stored
            : std::max(metaInterval(nullptr, {}, kVeltoIDMetaValidationRecordRetryIntervalKey,
                                    kRecordRetryInterval),
                       kRecordRetryInterval);
    const double grown = std::min(interval * kRecordRetryGrowth, randomPollingDelay());
    return {{kNextCheckDate, Value::date(platform::now() + interval)},
            {kNextCheckInterval, Value::real(grown)}};
}

/// What becomes of the certificate that the account has: one that has expired or was revoked is removed.
enum class OldCertificate { Keep, Remove };

/// What was examined, and which requests had been made by then.
struct Examined {
    CertificateEntry certificate;
    RequestsSeen requests = 0;
};

/// Asks for a new certificate, unless it is not time yet. The old one is removed first, or else the next
/// attempt is planned first; another one, that somebody has got meanwhile, is left alone.
void renewCertificateForAccount(const String& accountName, const Examined& examined,
                                const Dictionary& options, OldCertificate old) {
    if (old == OldCertificate::Remove) {
        if (!discardExaminedCertificate(OwnershipLock(), examined.certificate)) return;
        VELTOID_LOG(kNotice, "Removing certificate for Velto ID ", describeAccountForLog(accountName),
                    " dsID=", describeValue(examined.certificate.encDsId()),
                    " because it has expired or been revoked.");
    } else {
        const double given =
            metaInterval(nullptr, {}, kVeltoIDMetaCertificateRenewalIntervalKey, kRenewalInterval);
        const double interval =
            given > 0 ? std::clamp(given, kMinRenewalInterval, kRenewalInterval) : kRenewalInterval;
        __VeltoIDDBSetCertificateValues(
            examined.certificate,
            {{kVeltoIDCertificateNextRenewalAttemptDateKey, Value::date(platform::now() + interval)}},
            Notify::No);
    }
    const auto next = nextRequestDate(accountRecordOf(accountName));
    if (!next || platform::now() >= *next)
        __VeltoIDDoCreateCertificateRequestForVeltoID(accountName, options, nullptr, nullptr,
                                                      examined.requests);
}

/// A renewal that waits for its time must not hold up the validation record.
void fetchDueValidationRecord(const String& accountName, const Dictionary& options) {
    const AccountRecord record = accountRecordOf(accountName);
    if (!record.certificateToken() && AccountSchedule(record, certificateEntryOf(record.encDsId()), options)
                                          .isDue(DueReason::ValidationRecord))
        fetchValidationRecordForAccount(record, options);
}

}  // namespace

void checkAccount(const AccountRecord& record) {
    const Dictionary options = {{option::kCheckNetwork, Value::boolean(true)}};
    const String& accountName = record.accountName();
    const Examined examined{certificateEntryOf(record.encDsId()), requestsSeen(accountName)};
    switch (checkAccountAndDetermineNextAction(accountName, options)) {
        case NoEncodedDSID:
            return __VeltoIDDoFetchEncodedDSIDForVeltoID(accountName, options);
        case PasswordInaccessibleInKeychain:
            return dropLostPassword(record);
        case PasswordInvalid:
            return disable(record);
        case CertificateRevoked:
        case CertificateExpired:
            return renewCertificateForAccount(accountName, examined, options, OldCertificate::Remove);
        case NoCertificate:
            return renewCertificateForAccount(accountName, examined, options, OldCertificate::Keep);
        case CertificateShouldBeRenewed:
        case CertificateMustBeRenewed:
            renewCertificateForAccount(accountName, examined, options, OldCertificate::Keep);
            return fetchDueValidationRecord(accountName, options);
        case CertificateOK:
            return noteValidation(examined.certificate);
        case ValidationRecordNeedsToBeUpdated:
            return fetchValidationRecordForAccount(record, options);
        case CertificatePending:
            if (endExpiredRequest(accountName)) return checkAccount(accountRecordOf(accountName));
            __VeltoIDDoFetchCertificateForVeltoID(accountName, FetchTime::WhenDue, options);
            return;
        case Unknown:
        case CertificateAssumedOK:
            return;
    }
}

void fetchValidationRecordForAccount(const AccountRecord& record, const Dictionary& options) {
    const String& accountName = record.accountName();
    VELTOID_LOG(kNotice, "Fetching VeltoIDValidationRecord for veltoid ", describeValue(accountName));
    Dictionary fetchOptions = options;
    fetchOptions.set(option::kForceValidationRecordFetch, Value::boolean(true));
    if (const Value& interval = record.values()[kNextCheckInterval]; interval.isNumber())
        fetchOptions.set(kNextCheckInterval, interval);
    const double before = platform::now();
    __VeltoIDDoGetMyInfo(accountName, fetchOptions, nullptr);
    const AccountRecord after = accountRecordOf(accountName);
    // Information of a known account is given out whether the server answers or not: the date tells.
    const bool isAnswered = after.lastValidation().value_or(before - 1) >= before;
    const auto nextCheck = after.validationRecordNextCheck();
    if (isAnswered && nextCheck && *nextCheck > platform::now() && after.validationRecordIdentifier()) {
        __VeltoIDDBSetAccountValues(accountName, {{kNextCheckInterval, Value::null()}});
    } else if (isAnswered && nextCheck &&
               record.validationRecordNextCheckInterval() != kRecordIntervalAfterServersDate) {
        __VeltoIDDBSetAccountValues(accountName,
                                    {{kNextCheckDate, Value::date(platform::now() + kRecordCheckSoon)},
                                     {kNextCheckInterval, Value::real(kRecordIntervalAfterServersDate)}});
    } else {
        __VeltoIDDBSetAccountValues(accountName, laterAttempt(record));
    }
}

}  // namespace veltoid
