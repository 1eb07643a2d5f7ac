#include "VeltoIDAuthenticationImpl/AccountSchedule.h"

#include <algorithm>
#include <span>

#include "Platform/runtime/Clock.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kDefaultValidationInterval = 1'209'600;
constexpr double kMinValidationInterval = 3'600;
constexpr double kReconnectInterval = 300;
constexpr double kNeverForOldClients = 3'153'600'000;
constexpr double kValidationAttemptSpacing = 43'200;
constexpr double kRecordDateTolerance = 86'400;
constexpr double kDefaultSuggestedDuration = 2'592'000;

/// Share of a validation record's suggested duration for which it is good.
constexpr double kRecordValidShare = 0.75;
/// Share of a certificate's own lifetime in which it is renewed at the latest.
constexpr double kLastShareOfLifetime = 0.25;

// What is validated again after which interval.
constexpr std::string_view kOfInformation = kVeltoIDMetaAccountValidationIntervalKey;
constexpr std::string_view kOfCertificate = kVeltoIDMetaCertificateValidationIntervalKey;

using enum DueReason;
constexpr DueReason kUnknownToServer[] = {SignIn};
constexpr DueReason kPending[] = {Validation, PendingFetch};
constexpr DueReason kWithoutCertificate[] = {Validation, Request};
constexpr DueReason kWithCertificate[] = {Validation,      Expiry, Renewal, PreExpiry, CertificateValidation,
                                          ValidationRecord};
constexpr DueReason kEmbargoed[] = {Expiry};

/// The reasons that an examination gets to, by how far the account has come.
std::span<const DueReason> reasonsOf(const AccountRecord& record, const CertificateEntry& entry) {
    if (!record.encDsId()) return kUnknownToServer;
    if (record.certificateToken()) return kPending;
    if (!entry.exists()) return kWithoutCertificate;
    return kWithCertificate;
}

}  // namespace

AccountSchedule::AccountSchedule(const AccountRecord& record, const CertificateEntry& entry,
                                 const Dictionary& options)
    : record_(record), entry_(entry), options_(options), now_(platform::now()) {}

AccountSchedule::Date AccountSchedule::at(std::optional<double> date) {
    return date ? Date(Due{*date, false}) : std::nullopt;
}

AccountSchedule::Date AccountSchedule::after(std::optional<double> date, double offset) {
    return date ? Date(Due{*date + offset, true}) : std::nullopt;
}

bool AccountSchedule::isDue(DueReason reason) const {
    const Date date = due(reason);
    return date && (date->isOnlyAfter ? date->date < now_ : date->date <= now_);
}

std::optional<double> AccountSchedule::nextAction() const {
    const auto reason = record_.isDirty() && !endOfEmbargo() ? std::optional(now_) : nextReason();
    if (!reason) return std::nullopt;
    return std::max(*reason, putOffUntil(record_).value_or(*reason));
}

std::optional<double> AccountSchedule::nextReason() const {
    std::optional<double> earliest = endOfEmbargo();
    // While the server wants to be left alone, only the certificate's expiry can lead to an action.
    for (const DueReason reason :
         earliest ? std::span<const DueReason>(kEmbargoed) : reasonsOf(record_, entry_)) {
        const Date date = due(reason);
        if (!date) continue;
        // A renewal that could not be made is tried again as soon as a request is allowed.
        const double from = reason == DueReason::PreExpiry
                                ? std::max(date->date, nextRequestDate(record_).value_or(date->date))
                                : date->date;
        earliest = std::min(earliest.value_or(from), from);
    }
    return earliest;
}

AccountSchedule::Date AccountSchedule::due(DueReason reason) const {
    switch (reason) {
        case DueReason::SignIn:
            return signIn();
        case DueReason::Validation:
            return validation();
        case DueReason::PendingFetch:
            return pendingFetch();
        case DueReason::Request:
            return at(nextRequestDate(record_).value_or(now_));
        case DueReason::Expiry:
            return expiry();
        case DueReason::Renewal:
            return after(entry_.nextRenewalAttempt());
        case DueReason::PreExpiry:
            return preExpiry();
        case DueReason::CertificateValidation:
            return certificateValidation();
        case DueReason::ValidationRecord:
            return validationRecord();
    }
    return std::nullopt;
}

AccountSchedule::Date AccountSchedule::signIn() const {
    const auto attempt = record_.lastConnectAttempt();
    return attempt && *attempt <= now_ ? after(attempt, kReconnectInterval) : rightNow();
}

AccountSchedule::Date AccountSchedule::validation() const {
    if (record_.isValidationForced()) return rightNow();
    if (const auto next = record_.nextValidation()) return isFar(*next) ? rightNow() : at(next);
    // While a certificate is pending, the examination does not look at how old the information is.
    if (record_.certificateToken()) return std::nullopt;
    const auto validated = record_.lastValidation();
    return validated > now_ ? rightNow() : after(validated, validationInterval(kOfInformation));
}

AccountSchedule::Date AccountSchedule::pendingFetch() const {
    if (!record_.certificateToken()) return std::nullopt;
    const auto next = record_.nextCertificateFetch();
    if (!next || *next > now_ + kMaxFetchDelay) return rightNow();
    return at(std::min(*next, record_.certificateTokenExpiration().value_or(*next)));
}

AccountSchedule::Date AccountSchedule::expiry() const {
    if (record_.certificateToken()) return std::nullopt;
    return entry_.isInvalid() ? rightNow() : after(entry_.expires());
}

/// The interval before the expiry that is asked for, but of the certificate's own lifetime only the last
/// quarter, or a short-lived one would be renewed without end. A negative interval counts by its size.
AccountSchedule::Date AccountSchedule::preExpiry() const {
    const auto expires = entry_.expires();
    const auto planned = entry_.nextRenewalAttempt();
    if (!expires || !planned) return std::nullopt;
    const double interval =
        metaInterval(record_.accountName(), options_, kVeltoIDMetaPreExpirationIntervalKey,
                     kVeltoIDDefaultPreExpirationInterval, UnreadableInterval::Zero);
    if (interval <= 0) return at(*expires + interval);
    const double start = *expires - interval;
    // The certificate is read only where its lifetime makes a difference.
    if (start > now_ && start > *planned) return at(start);
    return at(std::max(start, *expires - kLastShareOfLifetime * certificateLifetime()));
}

AccountSchedule::Date AccountSchedule::certificateValidation() const {
    const auto validated = entry_.lastSuccessfulValidation();
    if (!validated || *validated > now_ || entry_.isDirty()) return rightNow();
    const double old = *validated + validationInterval(kOfCertificate);
    if (entry_.lastValidationAttempt() > now_) return at(old);
    const auto attempt = after(entry_.lastValidationAttempt(), kValidationAttemptSpacing);
    return attempt && attempt->date >= old ? attempt : at(old);
}

bool AccountSchedule::isCertificateValidationPutOff() const {
    const auto validated = entry_.lastSuccessfulValidation();
    return validated && *validated + validationInterval(kOfCertificate) <= now_ &&
           !isDue(DueReason::CertificateValidation);
}

AccountSchedule::Date AccountSchedule::validationRecord() const {
    if (__VeltoIDSessionGetServerVersion() < kVeltoIDFirstVersionWithValidationRecords) return std::nullopt;
    if (const auto next = record_.validationRecordNextCheck())
        return at(std::min(*next, record_.lastValidation().value_or(*next) + kMaxRecordCheckInterval));
    const auto validAsOf = record_.validationRecordValidAsOf();
    if (record_.validationRecordData().size() == 0 || !validAsOf || now_ < *validAsOf - kRecordDateTolerance)
        return rightNow();
    return after(validAsOf,
                 kRecordValidShare * getDouble(&record_.values(),
                                               kVeltoIDAccountValidationRecordSuggestedValidIntervalKey,
                                               kDefaultSuggestedDuration));
}

bool AccountSchedule::isInformationFresh() const {
    const auto validated = record_.lastValidation();
    return validated && *validated <= now_ && now_ <= *validated + validationInterval(kOfInformation);
}

double AccountSchedule::validationInterval(std::string_view key) const {
    const double seconds = metaInterval(record_.accountName(), {}, key, kDefaultValidationInterval);
    return seconds > 0 ? std::clamp(seconds, kMinValidationInterval, kDefaultValidationInterval)
                       : kDefaultValidationInterval;
}

double AccountSchedule::certificateLifetime() const {
    std::optional<platform::Certificate> certificate;
    copyCertificateFromKeychainGivenPersistentRef(entry_.reference(), &certificate);
    return certificate ? std::max(certificate->notAfter - certificate->notBefore, 0.0) : 0;
}

std::optional<double> AccountSchedule::endOfEmbargo() const {
    if (record_.isClientTooOld()) return now_ + kNeverForOldClients;
    return record_.embargoEnd(now_);
}

std::optional<double> putOffUntil(const AccountRecord& record) {
    const auto date = record.nextCheck();
    // A later date was stored while the clock was wrong.
    return date && *date <= platform::now() + kMaxBackOff ? date : std::nullopt;
}

std::optional<double> copyNextActionDateForAccount(const String& accountName) {
    const AccountRecord record = accountRecordOf(accountName);
    if (!record.values().contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey)) return std::nullopt;
    return AccountSchedule(record, certificateEntryOf(record.encDsId()), {}).nextAction();
}

}  // namespace veltoid
