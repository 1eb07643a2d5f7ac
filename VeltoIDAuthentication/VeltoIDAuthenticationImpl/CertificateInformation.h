// What clients are told of an account's certificate.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// The certificate entry of the account, or of the encDsId when no account is named, as far as it is known:
/// "encDsId", "CertStatus", "CertType", "SerialNumber", "Expires", "CreationDate", "ModificationDate", and
/// the keychain references "CertificateReference" and "CertificatePrivateKeyReference" (without the system
/// keychain "CertificateData", the DER, instead). Option "CertificateDetails" (Boolean, false): also
/// "IntermediateCertificateReference" and "NextRenewalAttempt". Unknown account, no encDsId, or one that is
/// not the account's: status-code domain, -1; no entry: -100. Caller's queue; no network.
bool __VeltoIDCopyCertificateInfo(const String& accountName, const String& encDsId, const Dictionary& options,
                                  Dictionary* information, ErrorOut error = nullptr);

}  // namespace veltoid
