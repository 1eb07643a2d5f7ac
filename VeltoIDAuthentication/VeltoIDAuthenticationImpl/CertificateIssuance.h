// How an account gets its client certificate: a signing request goes to the server, which answers with the
// certificate or with a token; the token is asked with until the certificate is issued or refused; every
// answer is applied to the account's record and to its certificate entry.
//
// What the record says while that goes on: "CertificateToken" with "CertificateTokenExpiration" (a request is
// pending), "NextCertificateFetchDate" and "NextCertificateFetchDelta" (when to ask next, and how far to put
// it off then), "CSRGenerationDate" and "CSRGenerationInterval" (when the next request may be made),
// "CertificatePrivateKeyReference" (the pending request's key), "CertificateTokenFaultsSince" (since when the
// server answers with faults). When the certificate is there, all of it goes, and the entry has certificate,
// intermediate certificate and key.
//
// A question that is not answered is asked again, later each time. The server is told that an answer has
// arrived ("downloadCertComplete") when it is stored or was a refusal, not before: a server may forget the
// token then. A token that is over (expired, or unknown to the server for half an hour: a fault does not say
// which it is) is given up without a word, and the next check makes a new request.
//
// All operations run on the caller's queue and block while the server is asked (up to 5 seconds a call). The
// server is asked without any lock: an answer that comes when the account has been forgotten, or has begun
// another request, is dropped, and what was made for it with it.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"
#include "VeltoIDXMLServerCommunications/Methods.h"

namespace veltoid {

// Seconds.
inline constexpr double kVeltoIDCertificateTokenLifetime = 1'209'600;
inline constexpr double kVeltoIDCSRGenerationInterval = 3'600;
/// After a refusal, or a token that expired, until the next request.
inline constexpr double kVeltoIDCSRRetryDelay = 3'600;
/// How long a server may answer with faults until its token counts as unknown to it.
inline constexpr double kVeltoIDTokenFaultPatience = 1'800;

/// Longer tokens are refused: they would be stored and logged.
inline constexpr size_t kMaxCertificateTokenBytes = size_t{16} << 10U;

/// What has become of an account's requests so far, for who decides now whether one is to be sent later.
using RequestsSeen = uint64_t;
RequestsSeen requestsSeen(const String& accountName);

/// Generates a key pair, sends a certificate signing request and applies the answer: the certificate, a
/// token, or a refusal. Keys made for an attempt that fails are deleted. The error (also passed to
/// handleServerError) is the session's, else one of the status-code domain or -100. The encDsId is handed out
/// as far as it is known.
///
/// Of several callers at once, one sends the request; the others wait for its outcome, which is theirs too.
/// So is the outcome of a request that somebody else has made since `seen` (without one: since the call)
/// with the same password.
bool __VeltoIDDoCreateCertificateRequestForVeltoID(const String& accountName, const Dictionary& options,
                                                   String* encDsId, ErrorOut error = nullptr,
                                                   std::optional<RequestsSeen> seen = {});

/// Applies what the server says of the request: by "CertStatus" the certificate is stored, the next fetch put
/// off, the token given up, or, for anything else, the token kept until it expires. True when the certificate
/// is stored or the request pending. Otherwise -100, and nothing of a request that was given up stays in the
/// keychain. A certificate for another key than the pending one counts as a refusal, and so does a renewal
/// without a readable one: the account keeps what it has. What cannot be stored now, and has a token, is
/// asked for again. "Expires" of the entry is no later than the certificate's own end.
bool updateAccountWithCertificateResult(const OwnershipLock& ownership, const String& accountName,
                                        const String& encDsId, const CertificateAnswer& answer,
                                        ErrorOut error = nullptr);

/// What a pending request has in the record, beside its key, each as Null.
Dictionary noPendingRequest();

/// Gives up the account's pending request: its token, its key, and what was planned for it.
void endPendingRequest(const OwnershipLock& ownership, const String& accountName);

/// The same for a request whose token has expired. True when there was one.
bool endExpiredRequest(const String& accountName);

enum class FetchTime { WhenDue, AtOnce };

/// Asks the server for the certificate that the account's token stands for, and applies the answer. True also
/// when there is no token any more, or no session could be opened. Without an answer the next fetch is put
/// off for longer and longer. Error 99: it is not time yet (with "NextCertificateFetchDate"), or the request
/// is still pending.
bool __VeltoIDDoFetchCertificateForVeltoID(const String& accountName, FetchTime time,
                                           const Dictionary& options, ErrorOut error = nullptr);

/// Signs in to learn and store the account's encDsId. The error is always filled: the session's, 99 within
/// 300 s of the record's "LastConnectAttempt", or -100.
void __VeltoIDDoFetchEncodedDSIDForVeltoID(const String& accountName, const Dictionary& options,
                                           ErrorOut error = nullptr);

}  // namespace veltoid
