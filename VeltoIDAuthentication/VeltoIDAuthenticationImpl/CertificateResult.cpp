// Applying what the server says of a certificate request.

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
          record_(accountRecordOf(accountName)) {}

    bool apply() {
        const String status = result_.string(kVeltoIDCertificateStatusKey);
        if (status == kVeltoIDCertificateStatusIssued) return isForAnotherKey() ? giveUp() : applyIssued();
        if (status == kVeltoIDCertificateStatusPending) return applyPending();
        return status == kVeltoIDCertificateStatusFailed ? giveUp() : applyUnknown();
    }

  private:
    bool applyIssued() {
        VELTOID_LOG_FROM(kFunction, kNotice, "VeltoIDAuth: Adding certificate for ", accountName_, ", ",
                         encDsId_,
                         " to keychain, serial#=", result_.string(kVeltoIDCertificateSerialNumberKey));
        const CertificateEntry before = certificateEntryOf(encDsId_);
        const bool stored = storeEntry() && storeCertificate() && storeIntermediate() && movePrivateKey();
        if (stored) {
            planRenewal();
            discardReplacedItems(ownership_, before, certificateEntryOf(encDsId_));
        } else {
            discardPendingKey(ownership_, accountName_);
        }
        endRequest();
        return stored;
    }

    /// Everything that the server said of the certificate stays with it.
    bool storeEntry() {
        if (!__VeltoIDDBSetCertificateInfo(encDsId_, result_)) return false;
        for (const auto& [key, value] : result_) setInEntry(key, value);
        setInEntry(kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(platform::now() - 1));
        return true;
    }

    bool setInEntry(const String& key, const Value& value) {
        return __VeltoIDDBSetCertificateValue(encDsId_, key, value);
    }

    /// Text that is no certificate is passed over: the entry tells that there is none.
    bool storeCertificate() {
        const auto certificate = certificateFromPEM(result_.string(kVeltoIDCertificateCertificateKey));
        if (!certificate) return true;
        Data reference;
        if (!addCertificateToKeychain(*certificate, certificateLabelForAccount(accountName_), &reference))
            return false;
        setInEntry(kVeltoIDCertificateCertificatePersistentReferenceKey, reference);
        platform::Notifications::shared().post(kVeltoIDAccountChangeNotification);
        return true;
    }

    bool storeIntermediate() {
        const auto certificate =
            certificateFromPEM(result_.string(kVeltoIDCertificateIntermediateCertificateKey));
        Data reference;
        if (certificate && (copyPersistentRefForCertificate(*certificate, &reference) ||
                            addCertificateToKeychain(*certificate, kIntermediateLabel, &reference)))
            setInEntry(kVeltoIDCertificateIntermediateCertificateReferenceKey, reference);
        return true;
    }

    bool movePrivateKey() {
        const Data reference = record_.pendingKeyReference();
        if (!reference) return true;
        return setInEntry(kVeltoIDCertificatePrivateKeyPersistentReferenceKey, reference) &&
               setInRecord({{kVeltoIDCertificatePrivateKeyPersistentReferenceKey, Value::null()}},
                           Notify::No);
    }

    void planRenewal() {
        const auto expires = result_.date(kVeltoIDCertificateExpirationDateKey);
        if (expires && *expires > platform::now())
            setInEntry(kVeltoIDCertificateNextRenewalAttemptDateKey,
                       Value::date(platform::now() + kRenewalShare * (*expires - platform::now())));
    }

    /// Last, so that an agent that is killed before asks for the certificate once more.
    void endRequest() {
        setInRecord({{kVeltoIDAccountCertificateTokenKey, Value::null()},
                     {kVeltoIDAccountCertificateTokenExpirationKey, Value::null()},
                     {kVeltoIDAccountCSRGenerationDateKey, Value::null()},
                     {kVeltoIDAccountCSRGenerationIntervalKey, Value::null()},
                     {kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::null()},
                     {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey, Value::null()},
                     {kVeltoIDAccountCSRCreationDateKey, Value::null()}});
    }

    /// Without its key the certificate would be of no use.
    bool isForAnotherKey() const {
        const auto certificate = certificateFromPEM(result_.string(kVeltoIDCertificateCertificateKey));
        Key pending;
        if (!certificate || !copyKeyFromKeychainGivenPersistentRef(record_.pendingKeyReference(), &pending) ||
            pending.publicPart == Data(certificate->publicKey))
            return false;
        VELTOID_LOG_FROM(kFunction, kError, "The certificate that the server issued for ", accountName_,
                         " is not for the key that was requested.");
        return true;
    }

    bool applyPending() {
        const double delay = pendingDelay(delay_, record_);
        const double nextFetch = platform::now() + (delay > 0 ? delay : 1);
        const bool stored =
            setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(nextFetch)}});
        if (stored)
            setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
                          Value::real(delayAfterPending(delay))}},
                        Notify::No);
        setInRecord({{kVeltoIDAccountCSRGenerationDateKey, Value::null()},
                     {kVeltoIDAccountCSRGenerationIntervalKey, Value::null()}},
                    Notify::No);
        requestRelaunch(nextFetch);
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
            putOffFetch();
        }
        return false;
    }

    /// Back to no request at all; the next one is made in an hour at the earliest.
    void dropRequest() {
        setInRecord(
            {{kVeltoIDAccountCertificateTokenKey, Value::null()},
             {kVeltoIDAccountCertificateTokenExpirationKey, Value::null()},
             {kVeltoIDAccountCSRGenerationDateKey, Value::date(platform::now() + kVeltoIDCSRRetryDelay)},
             {kVeltoIDAccountCSRGenerationIntervalKey, Value::null()},
             {kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::null()},
             {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey, Value::null()}});
        discardPendingKey(ownership_, accountName_);
    }

    void putOffFetch() {
        const double delta = storedFetchDelta(record_).value_or(kMaxPollingDelay);
        setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchDateKey,
                      Value::date(platform::now() + (delta > 0 ? delta : kMaxPollingDelay))},
                     {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
                      Value::real(delta > 0 ? delayAfterPending(delta) : randomPollingDelay())}});
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
};

}  // namespace

bool updateAccountWithCertificateResult(const OwnershipLock& ownership, const String& accountName,
                                        const String& encDsId, const CertificateAnswer& answer,
                                        ErrorOut error) {
    return CertificateResult(ownership, accountName, encDsId, answer).apply() ||
           failWith(error, VELTOID_ERROR(identity_error::kUnknown));
}

}  // namespace veltoid
