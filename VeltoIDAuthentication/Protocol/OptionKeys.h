// The keys of the options that requests carry. Meta information is looked up in the options first, so that
// every key of it may stand there as well.
#pragma once

#include <string_view>

namespace veltoid::option {

// Booleans.
inline constexpr std::string_view kCheckNetwork = "CheckNetwork";
inline constexpr std::string_view kDirty = "Dirty";
inline constexpr std::string_view kDoNotCheckPassword = "DoNotCheckPassword";
inline constexpr std::string_view kDoNotFetchInformation =
    "VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord";
inline constexpr std::string_view kDoNotCreateRequest = "DoNotCreateCSR";
inline constexpr std::string_view kCreateRequestAsynchronously = "CreateCSRAsynchronously";
inline constexpr std::string_view kForceCertificateCreation = "ForceCertificateCreation";
inline constexpr std::string_view kSkipValidation = "SkipValidation";
inline constexpr std::string_view kDeferValidation = "DeferValidation";
inline constexpr std::string_view kForceValidation = "ForceValidation";
inline constexpr std::string_view kForceValidationRecordFetch = "ForceValidationRecordFetch";
inline constexpr std::string_view kValidateCertificateSerialNumber = "ValidateCertificateSerialNumber";
inline constexpr std::string_view kRemoveCertificate = "RemoveCertificateFromKeychain";
inline constexpr std::string_view kRemovePrivateKey = "RemovePrivateKeyFromKeychain";
inline constexpr std::string_view kDoNotUseCachedSession = "DoNotUseCachedSession";
inline constexpr std::string_view kDoNotSaveSessionInfo = "DoNotSaveSessionInfo";
/// Certificate information also tells of the intermediate certificate and of the next renewal.
inline constexpr std::string_view kCertificateDetails = "CertificateDetails";
inline constexpr std::string_view kTerminateServer = "VeltoIDAuthenticationStatusTerminateServer";

/// Seconds: how long an add waits for the certificate.
inline constexpr std::string_view kCertificateWait = "certwaitduration";

/// Strings, passed on to the server with a certificate request.
inline constexpr std::string_view kFetchDelayMinimum = "__CERT_FETCH_DELAY_MIN";
inline constexpr std::string_view kFetchDelayMaximum = "__CERT_FETCH_DELAY_MAX";

/// A URL or String.
inline constexpr std::string_view kServerURL = "ServerURL";

}  // namespace veltoid::option
