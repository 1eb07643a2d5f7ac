#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kReconnectInterval = 300;
constexpr double kNeverForOldClients = 3'153'600'000;
constexpr double kCSRGenerationIntervalWhenMissing = 3'600;

/// The earliest of the dates that were considered.
class EarliestDate {
  public:
    void consider(std::optional<double> date, double offset = 0) {
        if (date && (!earliest_ || *date + offset < *earliest_)) earliest_ = *date + offset;
    }
    void set(double date) { earliest_ = date; }
    const std::optional<double>& value() const { return earliest_; }

  private:
    std::optional<double> earliest_;
};

/// Collects the dates of one account.
class NextActionDate {
  public:
    NextActionDate(const String& accountName, const Dictionary& record)
        : accountName_(accountName), record_(record), encDsId_(record.string(kVeltoIDAccountDSIDKey)) {}

    std::optional<double> find() {
        if (record_.boolean(kVeltoIDDirtyKey).value_or(false)) earliest_.set(now_);
        if (!encDsId_) considerSignIn();
        const bool embargoed = applyEmbargo();
        if (!embargoed) {
            considerValidation();
            considerValidationRecord();
        }
        considerCertificate(embargoed);
        return earliest_.value();
    }

  private:
    void considerSignIn() {
        if (const auto attempt = record_.date(kVeltoIDMetaLastConnectAttemptKey)) {
            earliest_.consider(attempt, kReconnectInterval);
        } else {
            earliest_.set(now_);
        }
    }

    /// True while nothing but the certificate's expiry can lead to an action.
    bool applyEmbargo() {
        const Value& embargo = record_[kVeltoIDAccountEarliestAllowedConnectionDateKey];
        if (const auto date = embargo.asDate(); date && *date > now_) {
            earliest_.set(*date);
            return true;
        }
        if (!embargo.isAbsent() || !record_.boolean(kVeltoIDAccountClientTooOldKey).value_or(false))
            return false;
        earliest_.set(now_ + kNeverForOldClients);
        return true;
    }

    void considerValidation() {
        if (record_.boolean(kVeltoIDAccountForceValidationKey).value_or(false)) {
            earliest_.set(now_);
        } else if (const auto next = record_.date(kVeltoIDAccountNextValidationDateKey)) {
            earliest_.consider(next);
        } else {
            earliest_.consider(record_.date(kVeltoIDAccountLastValidationDateKey),
                               accountValidationInterval(accountName_));
        }
    }

    void considerValidationRecord() {
        if (__VeltoIDSessionGetServerVersion() < kVeltoIDFirstVersionWithValidationRecords) return;
        if (const auto next = record_.date(kVeltoIDAccountValidationRecordNextCheckDateKey)) {
            earliest_.consider(next);
        } else if (!record_.contains(kVeltoIDAccountValidationRecordIdentifierKey)) {
            earliest_.consider(now_);
        }
    }

    void considerCertificate(bool embargoed) {
        Dictionary entry;
        if (encDsId_ && __VeltoIDDBCopyCertificateInfo(encDsId_, &entry)) {
            earliest_.consider(entry.date(kVeltoIDCertificateExpirationDateKey));
            if (embargoed) return;
            // A renewal that is on its way is asked for when the server said so.
            if (record_.string(kVeltoIDAccountCertificateTokenKey))
                earliest_.consider(record_.date(kVeltoIDAccountCertificateNextCertificateFetchDateKey));
            earliest_.consider(entry.date(kVeltoIDCertificateNextRenewalAttemptDateKey));
            earliest_.consider(entry.date(kVeltoIDCertificateLastSuccessfulValidationDateKey),
                               certificateValidationInterval(accountName_));
        } else if (!embargoed) {
            considerRequest();
        }
    }

    void considerRequest() {
        const auto nextFetch = record_.date(kVeltoIDAccountCertificateNextCertificateFetchDateKey);
        const auto generated = record_.date(kVeltoIDAccountCSRGenerationDateKey);
        if (nextFetch) {
            earliest_.consider(nextFetch);
        } else if (const auto held = requestsHeldUntil(record_)) {
            earliest_.consider(held);
        } else if (generated && *generated <= now_) {
            earliest_.consider(generated, getDouble(&record_, kVeltoIDAccountCSRGenerationIntervalKey,
                                                    kCSRGenerationIntervalWhenMissing));
        } else {
            earliest_.set(now_);
        }
    }

    const String& accountName_;
    const Dictionary& record_;
    const String encDsId_;
    const double now_ = platform::Clock::shared().now();
    EarliestDate earliest_;
};

}  // namespace

bool copyNextActionDateForAccount(const String& accountName, std::optional<double>* date) {
    if (date != nullptr) date->reset();
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record) ||
        !record.contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey))
        return false;
    if (date != nullptr) *date = NextActionDate(accountName, record).find();
    return true;
}

}  // namespace veltoid
