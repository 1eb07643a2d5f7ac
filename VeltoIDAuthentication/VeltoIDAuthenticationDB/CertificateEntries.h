// Certificate entries: what is known of an account's client certificate, in the section "AuthCertificates"
// under the account's encDsId. Bodies run on the database queue; entries come out as copies.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/Notify.h"

namespace veltoid {

/// An entry as its readers see it: the stored dictionary under the names of its entries. Shares the stored
/// value and copies nothing; entries of the wrong type count as absent.
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

    /// Whether nothing has taken the place of this certificate, or of none, by then.
    bool isSameCertificateAs(const CertificateEntry& later) const {
        return encDsId_ == later.encDsId_ && serialNumber() == later.serialNumber() &&
               reference() == later.reference() && privateKeyReference() == later.privateKeyReference();
    }

  private:
    bool has(std::string_view status) const {
        return (*this)[kVeltoIDCertificateStatusKey].asText() == status;
    }

    String encDsId_;
};

/// An issued certificate counts as valid until one day after it has expired (seconds).
inline constexpr double kVeltoIDCertificateExpirationGrace = 86'400;

/// The keys of all entries, possibly none. -106 when they cannot be read.
bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut error = nullptr);

/// Creates or updates the entry from the server's certificate result ("CertificateReference", "Expires",
/// "CertStatus", "SerialNumber"); without one the entry is emptied. Marks it dirty, writes and notifies.
/// False without encDsId.
bool __VeltoIDDBSetCertificateInfo(const String& encDsId, const std::optional<Dictionary>& info);

/// Sets one value, an absent or Null one removing it; a change stamps "ModificationDate", marks the entry
/// dirty when it notifies, and is written. False without encDsId, key or entry.
bool __VeltoIDDBSetCertificateValue(const String& encDsId, const String& key, const Value& value,
                                    Notify notify = Notify::Yes);

/// The same for several keys at once.
bool __VeltoIDDBSetCertificateValues(const String& encDsId, const Dictionary& values,
                                     Notify notify = Notify::Yes);

/// The same while the encDsId still has this certificate: what was learnt of one is not said of its
/// successor.
bool __VeltoIDDBSetCertificateValues(const CertificateEntry& examined, const Dictionary& values,
                                     Notify notify = Notify::Yes);

/// True and a copy of the entry when there is one.
bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, CertificateEntry* entry);
/// The same; without one, an entry that does not exist.
CertificateEntry certificateEntryOf(const String& encDsId);

/// True when an entry was removed.
bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId);

/// Whether the encDsId has an entry that is issued and, a day of grace included, has not expired, with a
/// certificate that has not ended by its own account.
bool hasValidCertificateEntry(const String& encDsId);

}  // namespace veltoid
