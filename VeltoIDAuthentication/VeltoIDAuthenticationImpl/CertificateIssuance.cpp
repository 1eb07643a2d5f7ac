#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"

#include "Certificates/CertificateRequest.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/RecordKeys.h"
#include "VeltoIDAuthenticationImpl/PollBackOff.h"
#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"
#include "VeltoIDAuthenticationImpl/ServerErrorHandling.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

constexpr const char* kRequestFunction = "__VeltoIDDoCreateCertificateRequestForVeltoID";

// Seconds.
constexpr double kDefaultDelayAfterFailedSignIn = 10;
constexpr double kReconnectInterval = 300;

double now() { return platform::Clock::shared().now(); }

Error statusCodeError() { return {String(kOSStatusErrorDomain), -1, {}}; }

/// Passes the failure on to whoever has to react to it, and hands it out.
bool fail(const String& accountName, const std::optional<Error>& held, ErrorOut error) {
    handleServerError(accountName, held);
    fillError(error, held ? *held : VELTOID_ERROR(identity_error::kUnknown));
    return false;
}

bool isPending(const Dictionary& result) {
    return result.string(kVeltoIDCertificateStatusKey) == kVeltoIDCertificateStatusPending;
}

/// One certificate signing request, from the key to what the server answered at once.
class SigningRequest {
  public:
    SigningRequest(const OwnershipLock& ownership, const String& accountName, const Dictionary& options)
        : ownership_(ownership), accountName_(accountName), options_(options) {}

    bool run() {
        Dictionary record;
        if (!__VeltoIDDBCopyVeltoIDAccount(accountName_, &record, &held_) ||
            !admitCertificateRequest(accountName_, record, &held_))
            return false;
        const String password = __VeltoIDDBCopyHashedPassword(record);
        VELTOID_LOG_FROM(kRequestFunction, kNotice,
                         "VeltoIDAuth: Creating CSR for " << accountName_.view() << ".");
        begin(record);
        Session session =
            __VeltoIDSessionDoCreateSession(accountName_, password, options_, &encDsId_, nullptr, &held_);
        if (!session) return false;
        const bool succeeded = encDsId_ && adoptEncDsId(record) && makeKeys() && send(*session);
        if (!succeeded) discardKeys();
        __VeltoIDSessionRelease(std::move(session));
        return succeeded;
    }

    const String& encDsId() const { return encDsId_; }
    const std::optional<Error>& error() const { return held_; }

  private:
    /// The request takes the place of one that was pending.
    void begin(const Dictionary& record) {
        setInRecord({{kVeltoIDAccountCSRGenerationDateKey, Value::date(now())},
                     {kVeltoIDAccountCertificateTokenKey, Value::null()},
                     {kVeltoIDAccountCertificateTokenExpirationKey, Value::null()},
                     {kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::null()}},
                    false);
        const auto interval = record.number(kVeltoIDAccountCSRGenerationIntervalKey);
        if (!interval)
            setInRecord(
                {{kVeltoIDAccountCSRGenerationIntervalKey, Value::real(kVeltoIDCSRGenerationInterval)}},
                true);
        discardPendingKey(ownership_, accountName_);
    }

    bool adoptEncDsId(const Dictionary& record) {
        if (record.string(kVeltoIDAccountDSIDKey) == encDsId_ ||
            __VeltoIDDBCreateVeltoIDAccount(accountName_, nullptr, encDsId_))
            return true;
        held_ = statusCodeError();
        return false;
    }

    bool makeKeys() {
        const int32_t status =
            createKeyPairAndCertificateRequest(accountName_, &request_, &publicKey_, &privateKey_);
        if (status == 0 && request_ && privateKey_) return true;
        VELTOID_LOG_FROM(kRequestFunction, kError,
                         "Failed to generate a CSR or privateKey for the dsID, err="
                             << status << " " << describeValue(request_) << " "
                             << describeValue(privateKey_.description()));
        held_ = statusCodeError();
        return false;
    }

    bool send(VeltoIDAuthenticationSessionInfo& session) {
        const double sent = now();
        noteCertificateRequest(accountName_);
        String token;
        CertificateAnswer answer;
        if (!__VeltoIDSessionDoSendCSR(session, encDsId_, request_, options_, &token, &answer, &held_))
            return false;
        setInRecord({{kVeltoIDAccountCSRCreationDateKey, Value::date(sent)}}, false);
        if (token.view().size() > kVeltoIDMaxCertificateTokenBytes) {
            VELTOID_LOG_FROM(
                kRequestFunction, kError,
                "The server's certificate token is refused: it has " << token.view().size() << " bytes.");
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
        return setInRecord({{kVeltoIDCertificatePrivateKeyPersistentReferenceKey, reference}}, false);
    }

    bool keepToken(const String& token, const Value& delay) {
        VELTOID_LOG_FROM(kRequestFunction, kNotice,
                         "VeltoIDAuth: CSR sent to Velto ID server for account "
                             << accountName_.view() << ", certificateToken=, certToken="
                             << describeValue(token) << ", delay=" << describeValue(delay) << ".");
        if (setInRecord({{kVeltoIDAccountCertificateTokenKey, token}}, true))
            setInRecord({{kVeltoIDAccountCertificateTokenExpirationKey,
                          Value::date(now() + kVeltoIDCertificateTokenLifetime)}},
                        true);
        const auto seconds = tokenDelay(delay);
        setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
                      seconds ? Value::real(*seconds) : Value::null()}},
                    true);
        const double nextFetch = now() + seconds.value_or(0);
        const bool stored = setInRecord(
            {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(nextFetch)}}, false);
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

    bool setInRecord(const Dictionary& values, bool dirty) {
        return __VeltoIDDBSetAccountValues(accountName_, values, dirty);
    }

    const OwnershipLock& ownership_;
    const String& accountName_;
    const Dictionary& options_;
    String encDsId_;
    String request_;
    Key publicKey_;
    Key privateKey_;
    std::optional<Error> held_;
};

/// When the next fetch is allowed, if that is later than now and can be believed.
std::optional<double> laterFetchDate(const Dictionary& record) {
    const auto date = record.date(kVeltoIDAccountCertificateNextCertificateFetchDateKey);
    if (!date || *date <= now() || *date > now() + kMaxFetchDelay) return std::nullopt;
    return date;
}

void putOffFetchAfterFailedSignIn(const String& accountName, const Dictionary& record) {
    const double delta = storedFetchDelta(record).value_or(kDefaultDelayAfterFailedSignIn);
    __VeltoIDDBSetAccountValues(
        accountName,
        {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(now() + delta)},
         {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
          Value::real(delayAfterFailedSignIn(delta))}},
        false);
}

/// Asks with the token and applies the answer.
bool fetch(const OwnershipLock& ownership, VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
           const String& token, const Dictionary& options, std::optional<Error>* held) {
    const String accountName = session.fAccountName;
    CertificateAnswer answer;
    if (!__VeltoIDSessionDoFetchCSRResult(session, encDsId, token, options, &answer, held)) {
        VELTOID_LOG_FROM("__VeltoIDDoFetchCertificateForVeltoID", kNotice,
                         "Failed while fetching result for certificate token "
                             << token.view() << ", error="
                             << (*held ? describeValue(**held) : describeValue({})) << " so discarding it.");
        __VeltoIDSessionDoCompleteCertificate(session, encDsId, token, options, nullptr);
        return false;
    }
    if (!updateAccountWithCertificateResult(ownership, accountName, encDsId, answer, held)) return false;
    if (isPending(*answer.result)) {
        *held = VELTOID_ERROR(identity_error::kNotYet);
        return false;
    }
    __VeltoIDSessionDoCompleteCertificate(session, encDsId, token, options, nullptr);
    return true;
}

bool wasTriedRecently(const Dictionary& record) {
    const auto attempt = record.date(kVeltoIDMetaLastConnectAttemptKey);
    return attempt && *attempt <= now() && now() <= *attempt + kReconnectInterval;
}

}  // namespace

bool __VeltoIDDoCreateCertificateRequestForVeltoID(const String& accountName, const Dictionary& options,
                                                   String* encDsId, ErrorOut error) {
    const OwnershipLock ownership;
    SigningRequest request(ownership, accountName, options);
    const bool succeeded = request.run();
    if (encDsId != nullptr && request.encDsId()) *encDsId = request.encDsId();
    return succeeded || fail(accountName, request.error(), error);
}

bool __VeltoIDDoFetchCertificateForVeltoID(const String& accountName, bool force, const Dictionary& options,
                                           ErrorOut error) {
    const OwnershipLock ownership;
    std::optional<Error> held;
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, &held)) return fail(accountName, held, error);
    const String token = record.string(kVeltoIDAccountCertificateTokenKey);
    if (!token) return true;
    if (const auto date = laterFetchDate(record); date && !force) {
        const Dictionary information = {
            {kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(*date)}};
        fillError(error,
                  makeError(identity_error::kNotYet, {}, information, __func__, __FILE_NAME__, __LINE__));
        return false;
    }
    String encDsId;
    Session session = __VeltoIDSessionDoCreateSession(accountName, __VeltoIDDBCopyHashedPassword(record),
                                                      options, &encDsId, nullptr, &held);
    if (!session) {
        putOffFetchAfterFailedSignIn(accountName, record);
        return true;
    }
    const bool succeeded = fetch(ownership, *session, encDsId, token, options, &held);
    __VeltoIDSessionRelease(std::move(session));
    return succeeded || fail(accountName, held, error);
}

void __VeltoIDDoFetchEncodedDSIDForVeltoID(const String& accountName, const Dictionary& options,
                                           ErrorOut error) {
    std::optional<Error> held;
    Dictionary record;
    __VeltoIDDBCopyVeltoIDAccount(accountName, &record, &held);
    if (wasTriedRecently(record)) {
        held = VELTOID_ERROR(identity_error::kNotYet);
    } else if (const String password = __VeltoIDDBCopyHashedPassword(record)) {
        __VeltoIDDBSetAccountValue(accountName, kVeltoIDMetaLastConnectAttemptKey, Value::date(now()), false);
        String encDsId;
        Session session =
            __VeltoIDSessionDoCreateSession(accountName, password, options, &encDsId, nullptr, &held);
        if (encDsId) __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountDSIDKey, encDsId, true);
        __VeltoIDSessionRelease(std::move(session));
    }
    fillError(error, held ? *held : VELTOID_ERROR(identity_error::kUnknown));
}

}  // namespace veltoid
