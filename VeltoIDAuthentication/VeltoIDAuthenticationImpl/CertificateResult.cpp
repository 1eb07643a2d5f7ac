// Applying what the server says of a certificate request.

#include <algorithm>

#include "Certificates/CertificateRequest.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/Names.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"

namespace veltoid {
namespace {

constexpr const char* kFunction = "updateAccountWithCertificateResult";
constexpr const char* kIntermediateLabel = "Velto ID authorization intermediate certificate";
/// Share of a certificate's remaining lifetime after which it is renewed.
constexpr double kRenewalShare = 0.75;

/// One answer and the account that it is for.
class CertificateResult {
  public:
    CertificateResult(const OwnershipLock& ownership, const String& accountName, const String& encDsId,
                      const CertificateAnswer& answer)
        : ownership_(ownership),
          accountName_(accountName),
          encDsId_(encDsId),
          result_(answer.result.value_or(Dictionary())),
          delay_(answer.delay),
          record_(accountRecordOf(accountName)),
          certificate_(certificateFromPEM(result_.string(kVeltoIDCertificateCertificateKey))) {}

    bool apply() {
        const String status = result_.string(kVeltoIDCertificateStatusKey);
        if (status == kVeltoIDCertificateStatusIssued) return isForAnotherKey() ? giveUp() : applyIssued();
        if (status == kVeltoIDCertificateStatusPending) return applyPending();
        return status == kVeltoIDCertificateStatusFailed ? giveUp() : applyUnknown();
    }

  private:
    bool applyIssued() {
        const CertificateEntry before = certificateEntryOf(encDsId_);
        if (!certificate_ && before.reference()) {
            VELTOID_LOG_FROM(kFunction, kError, "The server's renewal for ", accountName_,
                             " holds no certificate that can be read; the old one stays.");
            return giveUp();
        }
        VELTOID_LOG_FROM(kFunction, kNotice, "VeltoIDAuth: Adding certificate for ", accountName_, ", ",
                         encDsId_,
                         " to keychain, serial#=", result_.string(kVeltoIDCertificateSerialNumberKey));
        Dictionary values = valuesOfEntry();
        const bool stored = storeItems(values) && storeEntry(before, values);
        const CertificateEntry made(encDsId_, values);
        // What nothing refers to goes: the old items, or the new ones. The key is still the pending
        // request's.
        discardReplacedItems(ownership_, stored ? before : withoutKey(made), certificateEntryOf(encDsId_));
        if (stored)
            endRequest();
        else if (token())
            putOffFetch(accountName_, pendingDelay({}, record_));
        else
            discardPendingKey(ownership_, accountName_);
        return stored;
    }

    static CertificateEntry withoutKey(const CertificateEntry& entry) {
        Dictionary values = entry.values();
        values.remove(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
        return {entry.encDsId(), values};
    }

    /// Everything that the server said of the certificate stays with it, and nothing of an older one.
    Dictionary valuesOfEntry() const {
        Dictionary values = {{kVeltoIDCertificateSerialNumberKey, Value::null()},
                             {kVeltoIDCertificateExpirationDateKey, Value::null()},
                             {kVeltoIDCertificateNextRenewalAttemptDateKey, Value::null()}};
        for (const auto& [key, value] : result_) values.set(key, value);
        values.set(kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(platform::now() - 1));
        values.set(kVeltoIDCertificatePrivateKeyPersistentReferenceKey, record_.pendingKeyReference());
        auto expires = result_.date(kVeltoIDCertificateExpirationDateKey);
        if (certificate_)
            expires = std::min(expires.value_or(certificate_->notAfter), certificate_->notAfter);
        if (!expires) return values;
        values.set(kVeltoIDCertificateExpirationDateKey, Value::date(*expires));
        if (*expires > platform::now())
            values.set(kVeltoIDCertificateNextRenewalAttemptDateKey,
                       Value::date(platform::now() + kRenewalShare * (*expires - platform::now())));
        return values;
    }

    /// The certificates go into the keychain, their references into the values. Text that is no certificate
    /// is passed over: the entry tells that there is none.
    bool storeItems(Dictionary& values) const {
        Data reference;
        if (certificate_) {
            if (!addCertificateToKeychain(*certificate_, certificateLabelForAccount(accountName_),
                                          &reference))
                return false;
            values.set(kVeltoIDCertificateCertificatePersistentReferenceKey, reference);
        }
        const auto intermediate =
            certificateFromPEM(result_.string(kVeltoIDCertificateIntermediateCertificateKey));
        if (intermediate && (copyPersistentRefForCertificate(*intermediate, &reference) ||
                             addCertificateToKeychain(*intermediate, kIntermediateLabel, &reference)))
            values.set(kVeltoIDCertificateIntermediateCertificateReferenceKey, reference);
        return true;
    }

    /// At once, so that the entry never has the certificate of one request and the key of another.
    bool storeEntry(const CertificateEntry& before, const Dictionary& values) const {
        if ((!before.exists() && !__VeltoIDDBSetCertificateInfo(encDsId_, Dictionary())) ||
            !__VeltoIDDBSetCertificateValues(encDsId_, values))
            return false;
        if (certificate_) platform::Notifications::shared().post(kVeltoIDAccountChangeNotification);
        return true;
    }

    /// Last, so that an agent that is killed before asks for the certificate once more.
    void endRequest() {
        Dictionary values = noPendingRequest();
        for (const std::string_view key :
             {kVeltoIDCertificatePrivateKeyPersistentReferenceKey, kVeltoIDAccountCSRGenerationDateKey,
              kVeltoIDAccountCSRGenerationIntervalKey, kVeltoIDAccountCSRCreationDateKey})
            values.set(key, Value::null());
        setInRecord(values);
    }

    /// Without its key the certificate would be of no use.
    bool isForAnotherKey() const {
        Key pending;
        if (!certificate_ ||
            !copyKeyFromKeychainGivenPersistentRef(record_.pendingKeyReference(), &pending) ||
            pending.publicPart == Data(certificate_->publicKey))
            return false;
        VELTOID_LOG_FROM(kFunction, kError, "The certificate that the server issued for ", accountName_,
                         " is not for the key that was requested.");
        return true;
    }

    bool applyPending() {
        const bool stored = putOffFetch(accountName_, pendingDelay(delay_, record_));
        setInRecord({{kVeltoIDAccountCSRGenerationDateKey, Value::null()},
                     {kVeltoIDAccountCSRGenerationIntervalKey, Value::null()},
                     {kVeltoIDAccountCertificateTokenFaultsSinceKey, Value::null()}},
                    Notify::No);
        return stored;
    }

    bool giveUp() {
        VELTOID_LOG_FROM(kFunction, kNotice, "VeltoIDAuth: Failed generating certificate for ", accountName_,
                         ", ", encDsId_, ", certToken=", token(), ".");
        VELTOID_LOG_FROM(kFunction, kWarning, "Certificate issuance request for ", accountName_,
                         " dsID=", encDsId_, " certToken=", token(), " failed to be issued by the server.");
        dropRequest();
        return false;
    }

    bool applyUnknown() {
        VELTOID_LOG_FROM(kFunction, kNotice,
                         "VeltoIDAuth: Unknown state after trying to fetch certifitate for ", accountName_,
                         ", ", encDsId_, " ");
        VELTOID_LOG_FROM(kFunction, kWarning, "UNKNOWN Certificate issuance request for ", accountName_,
                         " dsID=", encDsId_, " certToken=", token(), ", status=", statusText(), ".");
        const auto expiration = record_.certificateTokenExpiration();
        if (expiration && *expiration < platform::now()) {
            dropRequest();
        } else {
            putOffFetch(accountName_, pendingDelay({}, record_));
        }
        return false;
    }

    /// Back to no request at all; the next one is made in an hour.
    void dropRequest() {
        setInRecord(
            {{kVeltoIDAccountCSRGenerationDateKey, Value::date(platform::now() + kVeltoIDCSRRetryDelay)},
             {kVeltoIDAccountCSRGenerationIntervalKey, Value::real(0)}});
        endPendingRequest(ownership_, accountName_);
    }

    String token() const { return record_.certificateToken(); }

    std::string statusText() const {
        const Value& status = result_[kVeltoIDCertificateStatusKey];
        return status.isString() ? status.asString().text() : describeValue(status);
    }

    bool setInRecord(const Dictionary& values, Notify notify = Notify::Yes) {
        return __VeltoIDDBSetAccountValues(accountName_, values, notify);
    }

    const OwnershipLock& ownership_;
    const String& accountName_;
    const String& encDsId_;
    const Dictionary result_;
    const Value& delay_;
    const AccountRecord record_;
    const std::optional<platform::Certificate> certificate_;
};

}  // namespace

bool updateAccountWithCertificateResult(const OwnershipLock& ownership, const String& accountName,
                                        const String& encDsId, const CertificateAnswer& answer,
                                        ErrorOut error) {
    return CertificateResult(ownership, accountName, encDsId, answer).apply() ||
           failWith(error, VELTOID_ERROR(identity_error::kUnknown));
}

}  // namespace veltoid
