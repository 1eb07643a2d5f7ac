// A certificate entry as its readers see it: the stored dictionary under the names of its entries. The view
// shares the stored value and copies nothing; entries of the wrong type count as absent.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Value.h"

namespace veltoid {

class CertificateEntry {
  public:
    CertificateEntry() = default;
    CertificateEntry(String encDsId, Dictionary values)
        : encDsId_(std::move(encDsId)), values_(std::move(values)) {}

    /// Whether the database has the entry.
    bool exists() const { return static_cast<bool>(encDsId_); }
    /// The database's key; null when there is no entry.
    const String& encDsId() const { return encDsId_; }
    const Dictionary& values() const { return values_; }

    // The items in the keychain.
    Data reference() const { return values_.data(kVeltoIDCertificateCertificatePersistentReferenceKey); }
    Data privateKeyReference() const {
        return values_.data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
    }
    Data intermediateReference() const {
        return values_.data(kVeltoIDCertificateIntermediateCertificateReferenceKey);
    }

    String serialNumber() const { return values_.string(kVeltoIDCertificateSerialNumberKey); }
    bool isIssued() const { return has(kVeltoIDCertificateStatusIssued); }
    bool isInvalid() const { return has(kVeltoIDCertificateStatusInvalid); }
    std::optional<double> expires() const { return values_.date(kVeltoIDCertificateExpirationDateKey); }
    std::optional<double> nextRenewalAttempt() const {
        return values_.date(kVeltoIDCertificateNextRenewalAttemptDateKey);
    }
    std::optional<double> lastSuccessfulValidation() const {
        return values_.date(kVeltoIDCertificateLastSuccessfulValidationDateKey);
    }
    std::optional<double> lastValidationAttempt() const {
        return values_.date(kVeltoIDCertificateLastValidationAttemptDateKey);
    }
    bool isDirty() const { return values_.boolean(kVeltoIDDirtyKey).value_or(false); }

  private:
    bool has(std::string_view status) const {
        return values_[kVeltoIDCertificateStatusKey].asText() == status;
    }

    String encDsId_;
    Dictionary values_;
};

}  // namespace veltoid
