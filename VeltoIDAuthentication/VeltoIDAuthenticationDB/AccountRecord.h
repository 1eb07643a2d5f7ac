// An account record as its readers see it: the stored dictionary under the names of its entries. The view
// shares the stored value and copies nothing; entries of the wrong type count as absent.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Value.h"

namespace veltoid {

class AccountRecord : Dictionary {
  public:
    using Date = std::optional<double>;
    using Seconds = std::optional<double>;

    AccountRecord() = default;
    AccountRecord(String accountName, Dictionary values)
        : Dictionary(std::move(values)), accountName_(std::move(accountName)) {}

    /// The database's key, by which every operation knows the account; null for a record that was never
    /// found.
    const String& accountName() const { return accountName_; }
    const Dictionary& values() const { return *this; }

    String encDsId() const { return string(kVeltoIDAccountDSIDKey); }
    String uuid() const { return string(kVeltoIDAccountUUIDKey); }
    String stableUUID() const { return string(kVeltoIDAccountStableUUIDKey); }
    String serverURL() const { return string(kVeltoIDAccountServerURLKey); }
    bool isDirty() const { return boolean(kVeltoIDDirtyKey).value_or(false); }
    /// Whether name, encDsId and a validated address or phone are known.
    bool isComplete() const {
        return contains(kVeltoIDAccountNameKey) && contains(kVeltoIDAccountDSIDKey) &&
               (contains(kVeltoIDAccountValidatedEmailKey) || contains(kVeltoIDAccountValidatedPhonesKey));
    }

    // Password: an item of the keychain, or (old records) a hash of the record's own.
    Data passwordReference() const { return data(kVeltoIDAccountHashedPasswordKeychainReferenceKey); }
    String ownPasswordHash() const { return string(kVeltoIDAccountHashedPasswordKey); }
    bool hasPassword() const { return passwordReference() || ownPasswordHash(); }

    // Connecting to the server.
    Date lastConnectAttempt() const { return date(kVeltoIDMetaLastConnectAttemptKey); }
    Date earliestConnection() const { return date(kVeltoIDAccountEarliestAllowedConnectionDateKey); }
    bool isClientTooOld() const { return boolean(kVeltoIDAccountClientTooOldKey).value_or(false); }

    // Validation of the account's information.
    Date lastValidation() const { return date(kVeltoIDAccountLastValidationDateKey); }
    Date nextValidation() const { return date(kVeltoIDAccountNextValidationDateKey); }
    bool isValidationForced() const { return boolean(kVeltoIDAccountForceValidationKey).value_or(false); }
    Seconds validForInterval() const { return number(kVeltoIDAccountValidForIntervalKey); }

    // The signed validation record.
    String validationRecordIdentifier() const { return string(kVeltoIDAccountValidationRecordIdentifierKey); }
    Data validationRecordData() const { return data(kVeltoIDAccountValidationRecordDataKey); }
    Date validationRecordValidAsOf() const { return date(kVeltoIDAccountValidationRecordValidAsOfKey); }
    Date validationRecordNextCheck() const { return date(kVeltoIDAccountValidationRecordNextCheckDateKey); }
    Seconds validationRecordNextCheckInterval() const {
        return number(kVeltoIDAccountValidationRecordNextCheckIntervalKey);
    }

    // A certificate request: dates of those that were sent, and what is known of the pending one.
    Date requestGeneration() const { return date(kVeltoIDAccountCSRGenerationDateKey); }
    Seconds requestGenerationInterval() const { return number(kVeltoIDAccountCSRGenerationIntervalKey); }
    const Array* requestDates() const { return array(kVeltoIDAccountCertificateRequestDatesKey); }
    Date requestsHeldUntil() const { return date(kVeltoIDAccountCertificateRequestsHeldUntilKey); }
    Data pendingKeyReference() const { return data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey); }
    String certificateToken() const { return string(kVeltoIDAccountCertificateTokenKey); }
    Date certificateTokenExpiration() const { return date(kVeltoIDAccountCertificateTokenExpirationKey); }
    Date nextCertificateFetch() const { return date(kVeltoIDAccountCertificateNextCertificateFetchDateKey); }
    Seconds nextCertificateFetchDelta() const {
        return number(kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey);
    }

  private:
    String accountName_;
};

}  // namespace veltoid
