// The keys of what the identity server is sent and answers.
#pragma once

#include <string_view>

namespace veltoid::wire {

using Key = std::string_view;

// Of every call.
inline constexpr Key kSession = "dsSession";
inline constexpr Key kProtocolVersion = "VeltoIDAuthProtocolVersion";
inline constexpr Key kFrameworkVersion = "TamrixVersion";
inline constexpr Key kClientTime = "ClientTime";
inline constexpr Key kProductName = "ProductName";
inline constexpr Key kSystemVersion = "SystemVersion";

// Of calls and replies.
inline constexpr Key kMetaInformation = "MetaInformation";
inline constexpr Key kAccountInformation = "AccountInformation";
inline constexpr Key kEncDsId = "encDsId";
inline constexpr Key kCertificateToken = "CertificateToken";
inline constexpr Key kSerialNumber = "SerialNumber";
inline constexpr Key kBreadcrumb = "ek";

// Commands that any reply may carry.
inline constexpr Key kSessionValidity = "dsSessionValidityDuration";
inline constexpr Key kNewURL = "NewURL";
inline constexpr Key kNextLaunchInterval = "NextLaunchTimeInterval";
inline constexpr Key kFlushAndExit = "FlushAndExit";

// Calls.
inline constexpr Key kAccount = "veltoConnect";
inline constexpr Key kPasswordHash = "pwdHash";
inline constexpr Key kUserUUID = "UserUUID";
inline constexpr Key kClientDateTime = "ClientDateTime";
inline constexpr Key kKnownRecordIdentifier = "ClientVIDVRecordIdentifier";
inline constexpr Key kKnownSerialNumber = "CertificateSerialNumber";
inline constexpr Key kAccountUUID = "AccountUUID";
inline constexpr Key kAccountStableUUID = "AccountStableUUID";
inline constexpr Key kMachineUUID = "machineUUID";
inline constexpr Key kBreadcrumbKey = "breadcrumbKey";
inline constexpr Key kSearchCriteria = "searchCriteria";
inline constexpr Key kFetchedSerialNumber = "certSerialNumber";
inline constexpr Key kRequest = "CSR";
inline constexpr Key kRequestedLifetime = "RequestedCertificateLifetimeInSeconds";
inline constexpr Key kFetchDelayMinimum = "__CERT_FETCH_DELAY_MIN";
inline constexpr Key kFetchDelayMaximum = "__CERT_FETCH_DELAY_MAX";

// Replies to a sign-in.
inline constexpr Key kVersion = "Version";
inline constexpr Key kClientTooOld = "ClientTooOld";
inline constexpr Key kDoNotConnectBefore = "DoNotConnectBeforeX";
inline constexpr Key kDoNotConnectFor = "DoNotConnectForX";
inline constexpr Key kRecordIdentifier = "VeltoIDRecordIdentifier";
inline constexpr Key kCertificateIsValid = "CertificateIsValid";
inline constexpr Key kCertificateNoLongerValid = "CertificateNoLongerValid";

// Details of an account.
inline constexpr Key kFirstName = "firstNm";
inline constexpr Key kLastName = "lastNm";
inline constexpr Key kPrimaryEmail = "PrimaryEmail";
inline constexpr Key kAllEmails = "AllEmails";
inline constexpr Key kValidatedEmail = "ValidatedEmail";
inline constexpr Key kValidatedPhones = "ValidatedPhones";
inline constexpr Key kAccountName = "VeltoID";
inline constexpr Key kValidForInterval = "ValidForInterval";
inline constexpr Key kValidationRecord = "VIDVRecord";
inline constexpr Key kValidationRecordIdentifier = "VIDVRecordIdentifier";
inline constexpr Key kValidationRecordNextCheck = "VIDVRecordNextCheckDate";

// Certificates, and people.
inline constexpr Key kDelay = "Delay";
inline constexpr Key kCertificateEntry = "dsCert";
inline constexpr Key kCertificate = "Certificate";
inline constexpr Key kIntermediateCertificate = "IntermediateCert";
inline constexpr Key kCertificateType = "CertType";
inline constexpr Key kCertificateStatus = "CertStatus";
inline constexpr Key kCertificateExpiration = "Expires";
inline constexpr Key kMatches = "matches";

}  // namespace veltoid::wire
