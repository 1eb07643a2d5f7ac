// What clients are told of an account: who it is, answered from its record while that is fresh, else asked
// from the server; and its certificate.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"

namespace veltoid {

/// How long account information counts as fresh (seconds), unless the meta information says otherwise.
inline constexpr double kVeltoIDPresumedValidInterval = 28'800;
/// The least that an account's own validity interval may be (seconds).
inline constexpr double kMinValidInterval = 60;

/// Answers the account's information (names, addresses, phones, certificate) from its record, asking the
/// server first when an option says so or the information is not both fresh and complete. Name null: the
/// first account with a password.
///
/// Options (Booleans, default false): "SkipValidation" (never ask; answer fresh and complete information
/// only), "DeferValidation" (do not ask now; answer complete information and mark the account), then
/// "ForceValidationRecordFetch", "ValidateCertificateSerialNumber" and "ForceValidation" (ask). A server that
/// cannot be reached does not fail a known account. Caller's queue; blocks while the server is asked.
bool __VeltoIDDoGetMyInfo(const String& accountName, const Dictionary& options, Dictionary* result,
                          ErrorOut error = nullptr);

/// Applies the server's answer to the account's record and certificate entry, and posts the change
/// notification when something that clients see changed. `asked`: the certificate that the server was asked
/// about, if any; what it says is not said of another one that the account has got meanwhile.
void updateAccountWithGetMyInfoResult(const String& accountName, const Dictionary& answer,
                                      const std::optional<CertificateEntry>& asked = {});

/// The certificate entry of the account, or of the encDsId when no account is named, as far as it is known:
/// "encDsId", "CertStatus", "CertType", "SerialNumber", "Expires", "CreationDate", "ModificationDate", and
/// the keychain references "CertificateReference" and "CertificatePrivateKeyReference" (without the system
/// keychain "CertificateData", the DER, instead). Option "CertificateDetails" (Boolean, false): also
/// "IntermediateCertificateReference" and "NextRenewalAttempt". Unknown account, no encDsId, or one that is
/// not the account's: status-code domain, -1; no entry: -100. Caller's queue; no network.
bool __VeltoIDCopyCertificateInfo(const String& accountName, const String& encDsId, const Dictionary& options,
                                  Dictionary* information, ErrorOut error = nullptr);

/// The names of all accounts, none being no error.
bool __VeltoIDCopyVeltoIDs(const Dictionary& options, Array* names, ErrorOut error = nullptr);

}  // namespace veltoid
