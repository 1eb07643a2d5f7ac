#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"

#include <map>
#include <memory>
#include <string>

#include "Certificates/CertificateRequest.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
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

Error statusCodeError(const char* description, int line) {
    return makeStatusError(description, kRequestFunction, __FILE_NAME__, line);
}

/// Whether the server has issued or refused the certificate.
bool isDecided(const Dictionary& result) {
    const String status = result.string(kVeltoIDCertificateStatusKey);
    return status == kVeltoIDCertificateStatusIssued || status == kVeltoIDCertificateStatusFailed;
}

/// Has the failure judged and hands it out.
bool fail(const String& accountName, const String& sentPasswordHash, const std::optional<Error>& held,
          ErrorOut error) {
    handleServerError(accountName, sentPasswordHash, held);
    return failWith(error, held.value_or(VELTOID_ERROR(identity_error::kUnknown)));
}

bool isPending(const Dictionary& result) {
    return result.string(kVeltoIDCertificateStatusKey) == kVeltoIDCertificateStatusPending;
}

/// The account's record, while it is still the account that it was then.
std::optional<AccountRecord> recordOfSame(const AccountRecord& then) {
    AccountRecord now = accountRecordOf(then.accountName());
    if (!now.accountName() || now.uuid() != then.uuid()) return std::nullopt;
    return now;
}

Error overtakenError() {
    return makeError(
        identity_error::kUnknown,
        {"The account was forgotten, or has begun another request, while the server was asked.", {}, {}}, {},
        kRequestFunction, __FILE_NAME__, __LINE__);
}

/// A request, who makes it, and what has come of it.
struct Request {
    const RequestsSeen number;
    const AccountRecord record;
    const String password;

    bool isOver = false;
    bool succeeded = false;
    String encDsId = {};
    std::optional<Error> error = {};
    /// For those who wait for the outcome; each passes the signal on.
    platform::Semaphore end = platform::Semaphore();
};

/// The last request of each account. Under the ownership lock only; outcomes do not change any more once a
/// request is over.
struct Requests {
    RequestsSeen lastNumber = 0;
    std::map<std::string, std::shared_ptr<Request>> last;
};

Requests& requests() { return platform::Lifetime::current().state<Requests>(); }

std::shared_ptr<Request> lastRequest(const OwnershipLock& /*ownership*/, const String& accountName) {
    const auto found = requests().last.find(accountName.text());
    return found != requests().last.end() ? found->second : nullptr;
}

RequestsSeen seenBy(const OwnershipLock& ownership, const String& accountName) {
    const auto last = lastRequest(ownership, accountName);
    if (!last) return 0;
    return last->isOver ? last->number : last->number - 1;
}

/// Puts a new request into the place of the account's last one; those of accounts that are gone are
/// forgotten.
std::shared_ptr<Request> noteRequest(const AccountRecord& record, const String& password) {
    Requests& all = requests();
    std::erase_if(all.last, [](const auto& entry) { return !recordOfSame(entry.second->record); });
    auto request = std::make_shared<Request>(Request{++all.lastNumber, record, password});
    all.last[record.accountName().text()] = request;
    return request;
}

/// One certificate signing request, from the key to what the server answered at once.
class SigningRequest {
  public:
    SigningRequest(Request& request, const Dictionary& options)
        : request_(request), accountName_(request.record.accountName()), options_(options) {}

    bool run() {
        const Session session = __VeltoIDSessionDoCreateSession(accountName_, request_.password, options_,
                                                                &request_.encDsId, nullptr, &held_);
        return (session && request_.encDsId && adoptEncDsId() && makeKeys() && send(*session)) ||
               fail(accountName_, request_.password, held_, &request_.error);
    }

  private:
    /// Whether the answer is still for this account and its last request.
    bool isCurrent(const OwnershipLock& ownership) {
        if (recordOfSame(request_.record) && lastRequest(ownership, accountName_).get() == &request_)
            return true;
        VELTOID_LOG_FROM(kRequestFunction, kNotice, "The server's answer to a certificate request of ",
                         accountName_,
                         " is dropped: the account was forgotten meanwhile, or has begun another one.");
        return failWith(&held_, overtakenError());
    }

    bool adoptEncDsId() {
        const OwnershipLock ownership;
        return isCurrent(ownership) &&
               (request_.record.encDsId() == request_.encDsId ||
                setInRecord({{kVeltoIDAccountDSIDKey, request_.encDsId}}) ||
                failWith(&held_, statusCodeError("The encDsId cannot be stored", __LINE__)));
    }

    bool makeKeys() {
        Key publicKey;
        const int32_t status =
            createKeyPairAndCertificateRequest(accountName_, &text_, &publicKey, &privateKey_);
        if (status == 0 && text_ && privateKey_) return true;
        VELTOID_LOG_FROM(kRequestFunction, kError,
                         "Failed to generate a CSR or privateKey for the dsID, err=", status, " ",
                         describeValue(text_), " ", privateKey_.description());
        return failWith(&held_, statusCodeError("No key or certificate request can be made", __LINE__));
    }

    bool send(VeltoIDAuthenticationSessionInfo& session) {
        const double sent = platform::now();
        noteCertificateRequest(accountName_);
        String token;
        CertificateAnswer answer;
        if (!__VeltoIDSessionDoSendCSR(session, request_.encDsId, text_, options_, &token, &answer, &held_))
            return false;
        const OwnershipLock ownership;
        if (!isCurrent(ownership)) return false;
        setInRecord({{kVeltoIDAccountCSRCreationDateKey, Value::date(sent)}}, Notify::No);
        if (apply(ownership, token, answer)) return true;
        discardPendingKey(ownership, accountName_);
        return false;
    }

    bool apply(const OwnershipLock& ownership, const String& token, const CertificateAnswer& answer) {
        if (token.view().size() > kMaxCertificateTokenBytes) {
            VELTOID_LOG_FROM(kRequestFunction, kError, "The server's certificate token is refused: it has ",
                             token.view().size(), " bytes.");
            return false;
        }
        if (!keepPrivateKey()) return false;
        if (answer.result && !(token && isPending(*answer.result)))
            return updateAccountWithCertificateResult(ownership, accountName_, request_.encDsId, answer,
                                                      &held_);
        return token ? keepToken(token, answer.delay) : true;
    }

    bool keepPrivateKey() {
        Data reference;
        if (!addKeyToKeychain(accountName_, kPrivateKeyKind, privateKey_, &reference)) {
            VELTOID_LOG_FROM(kRequestFunction, kError,
                             "FAILED adding public or private key to keychain, so ");
            return false;
        }
        if (setInRecord({{kVeltoIDCertificatePrivateKeyPersistentReferenceKey, reference}}, Notify::No))
            return true;
        removeKeyFromKeychainGivenPersistentRef(reference);
        return false;
    }

    bool keepToken(const String& token, const Value& delay) {
        VELTOID_LOG_FROM(kRequestFunction, kNotice, "VeltoIDAuth: CSR sent to Velto ID server for account ",
                         accountName_, ", certificateToken=, certToken=", describeValue(token),
                         ", delay=", delay, ".");
        if (setInRecord({{kVeltoIDAccountCertificateTokenKey, token}}))
            setInRecord({{kVeltoIDAccountCertificateTokenExpirationKey,
                          Value::date(platform::now() + kVeltoIDCertificateTokenLifetime)}});
        const double seconds = tokenDelay(delay);
        setInRecord({{kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey, Value::real(seconds)}});
        const double nextFetch = platform::now() + seconds;
        const bool stored = setInRecord(
            {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(nextFetch)}}, Notify::No);
        requestRelaunch(nextFetch);
        return stored;
    }

    bool setInRecord(const Dictionary& values, Notify notify = Notify::Yes) {
        return __VeltoIDDBSetAccountValues(accountName_, values, notify);
    }

    Request& request_;
    const String accountName_;
    const Dictionary& options_;
    String text_;
    Key privateKey_;
    std::optional<Error> held_;
};

/// Begins a request, which takes the place of one that was pending. None, with the error, when that is not
/// permitted.
std::shared_ptr<Request> beginRequest(const OwnershipLock& ownership, const AccountRecord& record,
                                      const String& password, ErrorOut error) {
    if (!admitCertificateRequest(record, error)) return nullptr;
    VELTOID_LOG_FROM(kRequestFunction, kNotice, "VeltoIDAuth: Creating CSR for ", record.accountName(), ".");
    __VeltoIDDBSetAccountValue(record.accountName(), kVeltoIDAccountCSRGenerationDateKey,
                               Value::date(platform::now()), Notify::No);
    __VeltoIDDBSetAccountValues(record.accountName(), noPendingRequest(), Notify::No);
    if (record.requestGenerationInterval().value_or(0) <= 0)
        __VeltoIDDBSetAccountValue(record.accountName(), kVeltoIDAccountCSRGenerationIntervalKey,
                                   Value::real(kVeltoIDCSRGenerationInterval));
    discardPendingKey(ownership, record.accountName());
    return noteRequest(record, password);
}

/// The request whose outcome is the caller's, and whether it is the caller who has to make it.
struct Turn {
    std::shared_ptr<Request> request;
    bool isOurs = false;
};

Turn takeTurn(const String& accountName, std::optional<RequestsSeen> seen, ErrorOut error) {
    const OwnershipLock ownership;
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, error)) return {};
    const String password = __VeltoIDDBCopyHashedPassword(record);
    auto last = lastRequest(ownership, accountName);
    if (last && last->record.uuid() == record.uuid() && last->password == password &&
        last->number > seen.value_or(seenBy(ownership, accountName)))
        return {std::move(last), false};
    return {beginRequest(ownership, record, password, error), true};
}

/// One question for the certificate that a token stands for.
class Fetch {
  public:
    Fetch(const AccountRecord& record, const Dictionary& options)
        : record_(record), token_(record.certificateToken()), options_(options) {}

    bool run(VeltoIDAuthenticationSessionInfo& session, const String& encDsId, std::optional<Error>* held) {
        CertificateAnswer answer;
        const bool isAnswered =
            __VeltoIDSessionDoFetchCSRResult(session, encDsId, token_, options_, &answer, held);
        bool succeeded = false;
        {
            const OwnershipLock ownership;
            const auto now = recordIfStillAsked();
            if (!now) return recordOfSame(record_) || failWith(held, overtakenError());
            if (!isAnswered) return applyFailure(ownership, *now, *held);
            succeeded =
                updateAccountWithCertificateResult(ownership, record_.accountName(), encDsId, answer, held);
        }
        if (!answer.result) return false;
        if (isPending(*answer.result))
            return succeeded && failWith(held, VELTOID_ERROR(identity_error::kNotYet));
        // A server may forget the token then: not before the certificate is stored.
        if (isDecided(*answer.result) && !recordIfStillAsked())
            __VeltoIDSessionDoCompleteCertificate(session, encDsId, token_, options_, nullptr);
        return succeeded;
    }

    void putOff() const {
        const OwnershipLock ownership;
        if (const auto now = recordIfStillAsked()) putOffFetch(now->accountName(), pendingDelay({}, *now));
    }

  private:
    /// The record while the account waits for what the token stands for.
    std::optional<AccountRecord> recordIfStillAsked() const {
        auto now = recordOfSame(record_);
        return now && now->certificateToken() == token_ ? now : std::nullopt;
    }

    bool applyFailure(const OwnershipLock& ownership, const AccountRecord& record,
                      const std::optional<Error>& error) {
        const bool isFault = isOtherFault(error);
        const double since = record.certificateTokenFaultsSince().value_or(platform::now());
        const bool isOver = isFault && platform::now() - since >= kVeltoIDTokenFaultPatience;
        VELTOID_LOG_FROM("__VeltoIDDoFetchCertificateForVeltoID", kNotice,
                         "Failed while fetching result for certificate token ", token_,
                         ", error=", error ? Value(*error) : Value(),
                         isOver ? " so discarding it." : " so asking again later.");
        if (isOver) {
            endPendingRequest(ownership, record.accountName());
        } else {
            if (isFault)
                __VeltoIDDBSetAccountValue(record.accountName(),
                                           kVeltoIDAccountCertificateTokenFaultsSinceKey, Value::date(since),
                                           Notify::No);
            putOffFetch(record.accountName(), pendingDelay({}, record));
        }
        return false;
    }

    const AccountRecord& record_;
    const String token_;
    const Dictionary& options_;
};

}  // namespace

RequestsSeen requestsSeen(const String& accountName) { return seenBy(OwnershipLock(), accountName); }

bool __VeltoIDDoCreateCertificateRequestForVeltoID(const String& accountName, const Dictionary& options,
                                                   String* encDsId, ErrorOut error,
                                                   std::optional<RequestsSeen> seen) {
    std::optional<Error> held;
    const auto [request, isOurs] = takeTurn(accountName, seen, &held);
    if (!request) return fail(accountName, nullptr, held, error);
    if (isOurs) {
        const bool succeeded = SigningRequest(*request, options).run();
        const OwnershipLock ownership;
        request->succeeded = succeeded;
        request->isOver = true;
    } else {
        request->end.wait();
    }
    request->end.signal();
    if (request->encDsId) fill(encDsId, request->encDsId);
    return request->succeeded || failWith(error, *request->error);
}

Dictionary noPendingRequest() {
    Dictionary values;
    for (const std::string_view key :
         {kVeltoIDAccountCertificateTokenKey, kVeltoIDAccountCertificateTokenExpirationKey,
          kVeltoIDAccountCertificateNextCertificateFetchDateKey,
          kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey,
          kVeltoIDAccountCertificateTokenFaultsSinceKey})
        values.set(key, Value::null());
    return values;
}

void endPendingRequest(const OwnershipLock& ownership, const String& accountName) {
    __VeltoIDDBSetAccountValues(accountName, noPendingRequest());
    discardPendingKey(ownership, accountName);
}

bool endExpiredRequest(const String& accountName) {
    const OwnershipLock ownership;
    const AccountRecord record = accountRecordOf(accountName);
    const auto expiration = record.certificateTokenExpiration();
    if (!record.certificateToken() || !expiration || *expiration >= platform::now()) return false;
    VELTOID_LOG(kNotice, "The certificate token of ", accountName, " has expired at ",
                Value::date(*expiration), "; a new request is made.");
    endPendingRequest(ownership, accountName);
    return !accountRecordOf(accountName).certificateToken();
}

bool __VeltoIDDoFetchCertificateForVeltoID(const String& accountName, FetchTime time,
                                           const Dictionary& options, ErrorOut error) {
    std::optional<Error> held;
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, &held))
        return fail(accountName, nullptr, held, error);
    if (!record.certificateToken()) return true;
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
    Fetch fetch(record, options);
    if (!session) {
        fetch.putOff();
        return true;
    }
    return fetch.run(*session, encDsId, &held) || fail(accountName, password, held, error);
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
