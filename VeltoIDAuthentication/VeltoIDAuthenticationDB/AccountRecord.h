// An account record as its readers see it: the stored dictionary under the names of its entries. The view
// shares the stored value and copies nothing; entries of the wrong type count as absent.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Value.h"

namespace veltoid {

class AccountRecord {
  public:
    AccountRecord() = default;
    AccountRecord(String accountName, Dictionary values)
        : accountName_(std::move(accountName)), values_(std::move(values)) {}

    /// The database's key, by which every operation knows the account; null for a record that was never
    /// found.
    const String& accountName() const { return accountName_; }
    const Dictionary& values() const { return values_; }

    String encDsId() const { return values_.string(kVeltoIDAccountDSIDKey); }
    String uuid() const { return values_.string(kVeltoIDAccountUUIDKey); }
    String stableUUID() const { return values_.string(kVeltoIDAccountStableUUIDKey); }
    String serverURL() const { return values_.string(kVeltoIDAccountServerURLKey); }
    bool isDirty() const { return values_.boolean(kVeltoIDDirtyKey).value_or(false); }
    /// Whether name, encDsId and a validated address or phone are known.
    bool isComplete() const {
        return values_.contains(kVeltoIDAccountNameKey) && values_.contains(kVeltoIDAccountDSIDKey) &&
               (values_.contains(kVeltoIDAccountValidatedEmailKey) ||
                values_.contains(kVeltoIDAccountValidatedPhonesKey));
    }

    // Password: an item of the keychain, or (old records) a hash of the record's own.
    Data passwordReference() const { return values_.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey); }
    String ownPasswordHash() const { return values_.string(kVeltoIDAccountHashedPasswordKey); }
    bool hasPassword() const { return passwordReference() || ownPasswordHash(); }

    // Connecting to the server.
    std::optional<double> lastConnectAttempt() const {
        return values_.date(kVeltoIDMetaLastConnectAttemptKey);
    }
    std::optional<double> earliestConnection() const {
        return values_.date(kVeltoIDAccountEarliestAllowedConnectionDateKey);
    }
    bool isClientTooOld() const { return values_.boolean(kVeltoIDAccountClientTooOldKey).value_or(false); }

    // Validation of the account's information.
    std::optional<double> lastValidation() const {
        return values_.date(kVeltoIDAccountLastValidationDateKey);
    }
    std::optional<double> nextValidation() const {
        return values_.date(kVeltoIDAccountNextValidationDateKey);
    }
    bool isValidationForced() const {
        return values_.boolean(kVeltoIDAccountForceValidationKey).value_or(false);
    }
    /// Seconds.
    std::optional<double> validForInterval() const {
        return values_.number(kVeltoIDAccountValidForIntervalKey);
    }

    // The signed validation record.
    String validationRecordIdentifier() const {
        return values_.string(kVeltoIDAccountValidationRecordIdentifierKey);
    }
    Data validationRecordData() const { return values_.data(kVeltoIDAccountValidationRecordDataKey); }
    std::optional<double> validationRecordValidAsOf() const {
        return values_.date(kVeltoIDAccountValidationRecordValidAsOfKey);
    }
    std::optional<double> validationRecordNextCheck() const {
        return values_.date(kVeltoIDAccountValidationRecordNextCheckDateKey);
    }
    /// Seconds.
    std::optional<double> validationRecordNextCheckInterval() const {
        return values_.number(kVeltoIDAccountValidationRecordNextCheckIntervalKey);
    }

    // A certificate request: dates of those that were sent, and what is known of the pending one.
    std::optional<double> requestGeneration() const {
        return values_.date(kVeltoIDAccountCSRGenerationDateKey);
    }
    /// Seconds.
    std::optional<double> requestGenerationInterval() const {
        return values_.number(kVeltoIDAccountCSRGenerationIntervalKey);
    }
    const Array* requestDates() const { return values_.array(kVeltoIDAccountCertificateRequestDatesKey); }
    std::optional<double> requestsHeldUntil() const {
        return values_.date(kVeltoIDAccountCertificateRequestsHeldUntilKey);
    }
    Data pendingKeyReference() const {
        return values_.data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
    }
    String certificateToken() const { return values_.string(kVeltoIDAccountCertificateTokenKey); }
    std::optional<double> certificateTokenExpiration() const {
        return values_.date(kVeltoIDAccountCertificateTokenExpirationKey);
    }
    std::optional<double> nextCertificateFetch() const {
        return values_.date(kVeltoIDAccountCertificateNextCertificateFetchDateKey);
    }
    /// Seconds.
    std::optional<double> nextCertificateFetchDelta() const {
        return values_.number(kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey);
    }

  private:
    String accountName_;
    Dictionary values_;
};

}  // namespace veltoid
