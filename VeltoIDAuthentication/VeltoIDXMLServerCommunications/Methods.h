// The remote methods that the account engine calls on an open session. Each runs synchronously on the
// session's queue and blocks for at most 5 seconds. Outputs may be null; they are handed over only on
// success, the error only on failure. A missing or ill-typed entry of a reply leaves its output null or
// empty; the call still succeeds. After a failed call the session serves the same operation but no cache.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDXMLServerCommunications/Session.h"

namespace veltoid {

/// Lifetime that is asked for a certificate (seconds), unless the meta information says otherwise.
inline constexpr double kVeltoIDRequestedCertificateLifetime = 1'209'600;

/// When to ask again for a certificate that is not ready, if the server does not say (seconds).
inline constexpr int64_t kVeltoIDPendingCertificateDelay = 300;

/// What the server says of a certificate or of the request for one: a Dictionary of "Certificate" and
/// "IntermediateCertificate" (PEM), "CertType", "SerialNumber", "CertStatus" (Strings) and "Expires" (Date),
/// each as far as given; none when nothing is. `delay`: the Number of seconds until it is asked again, if
/// any.
struct CertificateAnswer {
    std::optional<Dictionary> result;
    Value delay;
};

/// Asks for the account's details. `encDsId` null: the session's; parameters "SerialNumber" (unless the
/// encDsId's certificate entry has one) and "VeltoIDAccountValidationRecordIdentifierKey" say what the agent
/// has already. The result holds names, addresses, phones, the certificate's state and the signed validation
/// record, as far as given.
bool _VeltoIDSessionDoGetMyInfo(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                const Dictionary& parameters, const Dictionary& options, Dictionary* result,
                                ErrorOut error);

/// Finds people by criteria (criterion name to Array of values). The matches, each with "matched" and "value"
/// at least, also go to the find-person cache; none when the reply has no list of them.
bool __VeltoIDSessionDoFindPerson(VeltoIDAuthenticationSessionInfo& session, const Dictionary& criteria,
                                  const Dictionary& options, std::optional<Array>* matches, ErrorOut error);

/// Sends a certificate signing request (PEM). The server answers with a token to ask with later, or with the
/// certificate. Options "__CERT_FETCH_DELAY_MIN" and "__CERT_FETCH_DELAY_MAX" (Strings) are passed on.
bool __VeltoIDSessionDoSendCSR(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                               const String& request, const Dictionary& options, String* token,
                               CertificateAnswer* answer, ErrorOut error);

/// Asks for the certificate that a token stands for. A certificate that waits for the user's sign-in is a
/// success with "CertStatus" "SIGNIN_PENDING".
bool __VeltoIDSessionDoFetchCSRResult(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                      const String& token, const Dictionary& options,
                                      CertificateAnswer* answer, ErrorOut error);

/// Tells the server that the token is done with.
bool __VeltoIDSessionDoCompleteCertificate(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                           const String& token, const Dictionary& options, ErrorOut error);

/// The PEM text of the certificate with that serial number.
bool __VeltoIDSessionDoFetchCertificateBySerialNumber(VeltoIDAuthenticationSessionInfo& session,
                                                      const String& serialNumber, const Dictionary& options,
                                                      String* certificate, ErrorOut error);

/// Revokes the certificate with that serial number.
bool __VeltoIDSessionDoRevokeCertificate(VeltoIDAuthenticationSessionInfo& session,
                                         const String& serialNumber, const Dictionary& options,
                                         ErrorOut error);

/// What was stored under the key for this account on this device; null, without an error, when nothing was.
Data __VeltoIDSessionDoCopyBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                      const Dictionary& options, ErrorOut error);

/// Stores the data under the key.
bool __VeltoIDSessionDoSetBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                     const Data& data, const Dictionary& options, ErrorOut error);

}  // namespace veltoid
