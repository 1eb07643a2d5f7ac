#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"

#include "Certificates/CertificateRequest.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

constexpr const char* kRequestFunction = "__VeltoIDDoCreateCertificateRequestForVeltoID";

// Seconds.
constexpr double kDefaultDelayAfterFailedSignIn = 10;

Error statusCodeError() { return {String(kOSStatusErrorDomain), -1, {}}; }

/// Has the failure judged and hands it out.
bool fail(const String& accountName, const String& sentPasswordHash, const std::optional<Error>& held,
          ErrorOut error) {
    handleServerError(accountName, sentPasswordHash, held);
    return failWith(error, held.value_or(VELTOID_ERROR(identity_error::kUnknown)));
}

bool isPending(const Dictionary& result) {
    return result.string(kVeltoIDCertificateStatusKey) == kVeltoIDCertificateStatusPending;
}

/// One certificate signing request, from the key to what the server answered at once.
class SigningRequest {
  public:
    SigningRequest(const OwnershipLock& ownership, const String& accountName, const Dictionary& options)
        : ownership_(ownership), accountName_(accountName), options_(options) {}

    bool run(String* encDsId, ErrorOut error) {
        const bool succeeded = perform();
        if (encDsId_) fill(encDsId, encDsId_);
        return succeeded || fail(accountName_, password_, held_, error);
    }

  private:
    bool perform() {
        AccountRecord record;
        if (!__VeltoIDDBCopyVeltoIDAccount(accountName_, &record, &held_) ||
            !admitCertificateRequest(record, &held_))
            return false;
        password_ = __VeltoIDDBCopyHashedPassword(record);
        VELTOID_LOG_FROM(kRequestFunction, kNotice, "VeltoIDAuth: Creating CSR for ", accountName_, ".");
        begin(record);
        const Session session =
            __VeltoIDSessionDoCreateSession(accountName_, password_, options_, &encDsId_, nullptr, &held_);
        if (!session) return false;
        const bool succeeded = encDsId_ && adoptEncDsId(record) && makeKeys() && send(*session);
        if (!succeeded) discardKeys();
        return succeeded;
    }

    /// The request takes the place of one that was pending.
    void begin(const AccountRecord& record) {
        setInRecord({{kVeltoIDAccountCSRGenerationDateKey, Value::date(platform::now())},
                     {kVeltoIDAccountCertificateTokenKey, Value::null()},
                     {kVeltoIDAccountCertificateTokenExpirationKey, Value::null()},
                     {kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::null()}},
                    Notify::No);
        if (!record.requestGenerationInterval())
            setInRecord(
                {{kVeltoIDAccountCSRGenerationIntervalKey, Value::real(kVeltoIDCSRGenerationInterval)}});
        discardPendingKey(ownership_, accountName_);
    }

    bool adoptEncDsId(const AccountRecord& record) {
        return record.encDsId() == encDsId_ ||
               __VeltoIDDBCreateVeltoIDAccount(accountName_, nullptr, encDsId_) ||
               failWith(&held_, statusCodeError());
    }

    bool makeKeys() {
        const int32_t status =
            createKeyPairAndCertificateRequest(accountName_, &request_, &publicKey_, &privateKey_);
        if (status == 0 && request_ && privateKey_) return true;
        VELTOID_LOG_FROM(kRequestFunction, kError,
                         "Failed to generate a CSR or privateKey for the dsID, err=", status, " ",
                         describeValue(request_), " ", privateKey_.description());
        return failWith(&held_, statusCodeError());
    }

    bool send(VeltoIDAuthenticationSessionInfo& session) {
        const double sent = platform::now();
        noteCertificateRequest(accountName_);
        String token;
        CertificateAnswer answer;
        if (!__VeltoIDSessionDoSendCSR(session, encDsId_, request_, options_, &token, &answer, &held_))
            return false;
        setInRecord({{kVeltoIDAccountCSRCreationDateKey, Value::date(sent)}}, Notify::No);
        if (token.view().size() > kMaxCertificateTokenBytes) {
            VELTOID_LOG_FROM(kRequestFunction, kError, "The server's certificate token is refused: it has ",
                             token.view().size(), " bytes.");
            return false;
        }
        if (!keepPrivateKey()) return false;
        if (answer.result && !(token && isPending(*answer.result)))
            return updateAccountWithCertificateResult(ownership_, accountName_, encDsId_, answer, &held_);
        return token ? keepToken(token, answer.delay) : true;
    }

    bool keepPrivateKey() {
        Data reference;
        if (!copyPersistentRefForKey(privateKey_, &reference) &&
            !addKeyToKeychain(accountName_, kPrivateKeyKind, privateKey_, &reference)) {
            VELTOID_LOG_FROM(kRequestFunction, kError,
                             "FAILED adding public or private key to keychain, so ");
            return false;
        }
        return setInRecord({{kVeltoIDCertificatePrivateKeyPersistentReferenceKey, reference}}, Notify::No);
    }

    bool keepToken(const String& token, const Value& delay) {
        VELTOID_LOG_FROM(kRequestFunction, kNotice, "VeltoIDAuth: CSR sent to Velto ID server for account ",
                         accountName_, ", certificateToken=, certToken=", describeValue(token),
                         ", delay=", delay, ".");
        if (setInRecord({{kVeltoIDAccountCertificateTokenKey, token}}))
            setInRecord({{kVeltoIDAccountCertificateTokenExpirationKey,
                          Value::date(platform::now() + kVeltoIDCertificateTokenLifetime)}});
        const auto seconds = tokenDelay(delay);
        setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
                      seconds ? Value::real(*seconds) : Value::null()}});
        const double nextFetch = platform::now() + seconds.value_or(0);
        const bool stored = setInRecord(
            {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(nextFetch)}}, Notify::No);
        requestRelaunch(nextFetch);
        return stored;
    }

    /// Nothing of a failed attempt stays in the keychain.
    void discardKeys() {
        discardPendingKey(ownership_, accountName_);
        for (const Key* key : {&publicKey_, &privateKey_})
            if (Data reference; copyPersistentRefForKey(*key, &reference))
                removeKeyFromKeychainGivenPersistentRef(reference);
    }

    bool setInRecord(const Dictionary& values, Notify notify = Notify::Yes) {
        return __VeltoIDDBSetAccountValues(accountName_, values, notify);
    }

    const OwnershipLock& ownership_;
    const String& accountName_;
    const Dictionary& options_;
    String password_;
    String encDsId_;
    String request_;
    Key publicKey_;
    Key privateKey_;
    std::optional<Error> held_;
};

void putOffFetchAfterFailedSignIn(const AccountRecord& record) {
    const double delta = storedFetchDelta(record).value_or(kDefaultDelayAfterFailedSignIn);
    __VeltoIDDBSetAccountValues(
        record.accountName(),
        {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(platform::now() + delta)},
         {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
          Value::real(delayAfterFailedSignIn(delta))}},
        Notify::No);
}

/// Asks with the token and applies the answer.
bool fetch(const OwnershipLock& ownership, VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
           const String& token, const Dictionary& options, std::optional<Error>* held) {
    CertificateAnswer answer;
    if (!__VeltoIDSessionDoFetchCSRResult(session, encDsId, token, options, &answer, held)) {
        VELTOID_LOG_FROM("__VeltoIDDoFetchCertificateForVeltoID", kNotice,
                         "Failed while fetching result for certificate token ", token,
                         ", error=", *held ? Value(**held) : Value(), " so discarding it.");
        __VeltoIDSessionDoCompleteCertificate(session, encDsId, token, options, nullptr);
        return false;
    }
    if (!updateAccountWithCertificateResult(ownership, session.fAccountName, encDsId, answer, held))
        return false;
    if (isPending(*answer.result)) return failWith(held, VELTOID_ERROR(identity_error::kNotYet));
    __VeltoIDSessionDoCompleteCertificate(session, encDsId, token, options, nullptr);
    return true;
}

}  // namespace

bool __VeltoIDDoCreateCertificateRequestForVeltoID(const String& accountName, const Dictionary& options,
                                                   String* encDsId, ErrorOut error) {
    const OwnershipLock ownership;
    return SigningRequest(ownership, accountName, options).run(encDsId, error);
}

bool __VeltoIDDoFetchCertificateForVeltoID(const String& accountName, FetchTime time,
                                           const Dictionary& options, ErrorOut error) {
    const OwnershipLock ownership;
    std::optional<Error> held;
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, &held))
        return fail(accountName, nullptr, held, error);
    const String token = record.certificateToken();
    if (!token) return true;
    if (time == FetchTime::WhenDue && !AccountSchedule(record, {}, options).isDue(DueReason::PendingFetch)) {
        const Dictionary information = {{kVeltoIDAccountCertificateNextCertificateFetchDateKey,
                                         Value::date(record.nextCertificateFetch().value_or(0))}};
        return failWith(
            error, makeError(identity_error::kNotYet, {}, information, __func__, __FILE_NAME__, __LINE__));
    }
    const String password = __VeltoIDDBCopyHashedPassword(record);
    String encDsId;
    const Session session =
        __VeltoIDSessionDoCreateSession(accountName, password, options, &encDsId, nullptr, &held);
    if (!session) {
        putOffFetchAfterFailedSignIn(record);
        return true;
    }
    return fetch(ownership, *session, encDsId, token, options, &held) ||
           fail(accountName, password, held, error);
}

void __VeltoIDDoFetchEncodedDSIDForVeltoID(const String& accountName, const Dictionary& options,
                                           ErrorOut error) {
    std::optional<Error> held;
    AccountRecord record;
    __VeltoIDDBCopyVeltoIDAccount(accountName, &record, &held);
    if (!AccountSchedule(record, {}, options).isDue(DueReason::SignIn)) {
        held = VELTOID_ERROR(identity_error::kNotYet);
    } else if (const String password = __VeltoIDDBCopyHashedPassword(record)) {
        __VeltoIDDBSetAccountValue(accountName, kVeltoIDMetaLastConnectAttemptKey,
                                   Value::date(platform::now()), Notify::No);
        String encDsId;
        const Session session =
            __VeltoIDSessionDoCreateSession(accountName, password, options, &encDsId, nullptr, &held);
        if (encDsId) __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountDSIDKey, encDsId);
    }
    fillError(error, held.value_or(VELTOID_ERROR(identity_error::kUnknown)));
}

}  // namespace veltoid
