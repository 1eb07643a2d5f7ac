// The keys of what the identity server is sent and answers.
#pragma once

#include <string_view>

namespace veltoid::wire {

// Of every call.
inline constexpr std::string_view kSession = "dsSession";
inline constexpr std::string_view kProtocolVersion = "VeltoIDAuthProtocolVersion";
inline constexpr std::string_view kFrameworkVersion = "TamrixVersion";
inline constexpr std::string_view kClientTime = "ClientTime";
inline constexpr std::string_view kProductName = "ProductName";
inline constexpr std::string_view kSystemVersion = "SystemVersion";

// Of calls and replies.
inline constexpr std::string_view kMetaInformation = "MetaInformation";
inline constexpr std::string_view kAccountInformation = "AccountInformation";
inline constexpr std::string_view kEncDsId = "encDsId";
inline constexpr std::string_view kCertificateToken = "CertificateToken";
inline constexpr std::string_view kSerialNumber = "SerialNumber";
inline constexpr std::string_view kBreadcrumb = "ek";

// Commands that any reply may carry.
inline constexpr std::string_view kSessionValidity = "dsSessionValidityDuration";
inline constexpr std::string_view kNewURL = "NewURL";
inline constexpr std::string_view kNextLaunchInterval = "NextLaunchTimeInterval";
inline constexpr std::string_view kFlushAndExit = "FlushAndExit";

// Calls.
inline constexpr std::string_view kAccount = "veltoConnect";
inline constexpr std::string_view kPasswordHash = "pwdHash";
inline constexpr std::string_view kUserUUID = "UserUUID";
inline constexpr std::string_view kClientDateTime = "ClientDateTime";
inline constexpr std::string_view kKnownRecordIdentifier = "ClientVIDVRecordIdentifier";
inline constexpr std::string_view kKnownSerialNumber = "CertificateSerialNumber";
inline constexpr std::string_view kAccountUUID = "AccountUUID";
inline constexpr std::string_view kAccountStableUUID = "AccountStableUUID";
inline constexpr std::string_view kMachineUUID = "machineUUID";
inline constexpr std::string_view kBreadcrumbKey = "breadcrumbKey";
inline constexpr std::string_view kSearchCriteria = "searchCriteria";
inline constexpr std::string_view kFetchedSerialNumber = "certSerialNumber";
inline constexpr std::string_view kRequest = "CSR";
inline constexpr std::string_view kRequestedLifetime = "RequestedCertificateLifetimeInSeconds";
inline constexpr std::string_view kFetchDelayMinimum = "__CERT_FETCH_DELAY_MIN";
inline constexpr std::string_view kFetchDelayMaximum = "__CERT_FETCH_DELAY_MAX";

// Replies to a sign-in.
inline constexpr std::string_view kVersion = "Version";
inline constexpr std::string_view kClientTooOld = "ClientTooOld";
inline constexpr std::string_view kDoNotConnectBefore = "DoNotConnectBeforeX";
inline constexpr std::string_view kDoNotConnectFor = "DoNotConnectForX";
inline constexpr std::string_view kRecordIdentifier = "VeltoIDRecordIdentifier";
inline constexpr std::string_view kCertificateIsValid = "CertificateIsValid";
inline constexpr std::string_view kCertificateNoLongerValid = "CertificateNoLongerValid";

// Details of an account.
inline constexpr std::string_view kFirstName = "firstNm";
inline constexpr std::string_view kLastName = "lastNm";
inline constexpr std::string_view kPrimaryEmail = "PrimaryEmail";
inline constexpr std::string_view kAllEmails = "AllEmails";
inline constexpr std::string_view kValidatedEmail = "ValidatedEmail";
inline constexpr std::string_view kValidatedPhones = "ValidatedPhones";
inline constexpr std::string_view kAccountName = "VeltoID";
inline constexpr std::string_view kValidForInterval = "ValidForInterval";
inline constexpr std::string_view kValidationRecord = "VIDVRecord";
inline constexpr std::string_view kValidationRecordIdentifier = "VIDVRecordIdentifier";
inline constexpr std::string_view kValidationRecordNextCheck = "VIDVRecordNextCheckDate";

// Certificates, and people.
inline constexpr std::string_view kDelay = "Delay";
inline constexpr std::string_view kCertificateEntry = "dsCert";
inline constexpr std::string_view kCertificate = "Certificate";
inline constexpr std::string_view kIntermediateCertificate = "IntermediateCert";
inline constexpr std::string_view kCertificateType = "CertType";
inline constexpr std::string_view kCertificateStatus = "CertStatus";
inline constexpr std::string_view kCertificateExpiration = "Expires";
inline constexpr std::string_view kMatches = "matches";

}  // namespace veltoid::wire
