// The keys of the options that requests carry. Meta information is looked up in the options first, so that
// every key of it may stand there as well.
#pragma once

#include <string_view>

namespace veltoid::option {

using Key = std::string_view;

// Booleans.
inline constexpr Key kCheckNetwork = "CheckNetwork";
inline constexpr Key kDirty = "Dirty";
inline constexpr Key kDoNotCheckPassword = "DoNotCheckPassword";
inline constexpr Key kDoNotFetchInformation = "VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord";
inline constexpr Key kDoNotCreateRequest = "DoNotCreateCSR";
inline constexpr Key kCreateRequestAsynchronously = "CreateCSRAsynchronously";
inline constexpr Key kForceCertificateCreation = "ForceCertificateCreation";
inline constexpr Key kSkipValidation = "SkipValidation";
inline constexpr Key kDeferValidation = "DeferValidation";
inline constexpr Key kForceValidation = "ForceValidation";
inline constexpr Key kForceValidationRecordFetch = "ForceValidationRecordFetch";
inline constexpr Key kValidateCertificateSerialNumber = "ValidateCertificateSerialNumber";
inline constexpr Key kRemoveCertificate = "RemoveCertificateFromKeychain";
inline constexpr Key kRemovePrivateKey = "RemovePrivateKeyFromKeychain";
inline constexpr Key kDoNotUseCachedSession = "DoNotUseCachedSession";
inline constexpr Key kDoNotSaveSessionInfo = "DoNotSaveSessionInfo";
/// Certificate information also tells of the intermediate certificate and of the next renewal.
inline constexpr Key kCertificateDetails = "CertificateDetails";
inline constexpr Key kTerminateServer = "VeltoIDAuthenticationStatusTerminateServer";

/// Seconds: how long an add waits for the certificate.
inline constexpr Key kCertificateWait = "certwaitduration";

/// Strings, passed on to the server with a certificate request.
inline constexpr Key kFetchDelayMinimum = "__CERT_FETCH_DELAY_MIN";
inline constexpr Key kFetchDelayMaximum = "__CERT_FETCH_DELAY_MAX";

/// A URL or String.
inline constexpr Key kServerURL = "ServerURL";

}  // namespace veltoid::option
