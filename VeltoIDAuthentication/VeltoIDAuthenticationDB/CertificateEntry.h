// A certificate entry as its readers see it: the stored dictionary under the names of its entries. The view
// shares the stored value and copies nothing; entries of the wrong type count as absent.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Value.h"

namespace veltoid {

class CertificateEntry : Dictionary {
  public:
    using Date = std::optional<double>;

    CertificateEntry() = default;
    CertificateEntry(String encDsId, Dictionary values)
        : Dictionary(std::move(values)), encDsId_(std::move(encDsId)) {}

    /// Whether the database has the entry.
    bool exists() const { return static_cast<bool>(encDsId_); }
    /// The database's key; null when there is no entry.
    const String& encDsId() const { return encDsId_; }
    const Dictionary& values() const { return *this; }

    // The items in the keychain.
    Data reference() const { return data(kVeltoIDCertificateCertificatePersistentReferenceKey); }
    Data privateKeyReference() const { return data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey); }
    Data intermediateReference() const {
        return data(kVeltoIDCertificateIntermediateCertificateReferenceKey);
    }

    String serialNumber() const { return string(kVeltoIDCertificateSerialNumberKey); }
    bool isIssued() const { return has(kVeltoIDCertificateStatusIssued); }
    bool isInvalid() const { return has(kVeltoIDCertificateStatusInvalid); }
    Date expires() const { return date(kVeltoIDCertificateExpirationDateKey); }
    Date nextRenewalAttempt() const { return date(kVeltoIDCertificateNextRenewalAttemptDateKey); }
    Date lastSuccessfulValidation() const { return date(kVeltoIDCertificateLastSuccessfulValidationDateKey); }
    Date lastValidationAttempt() const { return date(kVeltoIDCertificateLastValidationAttemptDateKey); }
    bool isDirty() const { return boolean(kVeltoIDDirtyKey).value_or(false); }

  private:
    bool has(std::string_view status) const {
        return (*this)[kVeltoIDCertificateStatusKey].asText() == status;
    }

    String encDsId_;
};

}  // namespace veltoid
