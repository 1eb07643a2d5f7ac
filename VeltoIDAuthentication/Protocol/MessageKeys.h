// The keys of requests and replies. Replies also carry whole account records, whose keys are the database's
// own.
#pragma once

#include <string_view>

namespace veltoid::message {

// Requests.
inline constexpr std::string_view kCommand = "command";
inline constexpr std::string_view kAccount = "VeltoID";
inline constexpr std::string_view kHashedPassword = "hashedpassword";
inline constexpr std::string_view kOptions = "options";
inline constexpr std::string_view kCriteria = "criteria";
inline constexpr std::string_view kEncDsId = "encDsId";
inline constexpr std::string_view kCertificateType = "CertificateType";
inline constexpr std::string_view kBreadcrumbKey = "identifier";
inline constexpr std::string_view kBreadcrumb = "breadcrumb";
inline constexpr std::string_view kIdentityReference = "identityReferenceData";

// Setting a value of the database: where (one of the sections below), of what, which, and to what.
inline constexpr std::string_view kSection = "domain";
inline constexpr std::string_view kItem = "item";
inline constexpr std::string_view kKey = "key";
inline constexpr std::string_view kValue = "value";
inline constexpr std::string_view kAccountsSection = "Accounts";
inline constexpr std::string_view kCertificatesSection = "Certificates";
inline constexpr std::string_view kMetaInfoSection = "MetaInfo";

/// The value of kCertificateType that asks for the signed record of validated items.
inline constexpr std::string_view kValidationRecordType = "VeltoIDValidatedItemsRecordDataCertificateType";

// Replies.
inline constexpr std::string_view kSuccess = "success";
inline constexpr std::string_view kError = "error";
inline constexpr std::string_view kResult = "result";
inline constexpr std::string_view kInfo = "info";
inline constexpr std::string_view kStatus = "status";
/// The account's record: after adding it, and after forgetting it.
inline constexpr std::string_view kAddedAccount = "accountinfo";
inline constexpr std::string_view kForgottenAccount = "accountInfo";
inline constexpr std::string_view kForgottenEncDsId = "encDSID";

// An error in a reply.
inline constexpr std::string_view kErrorDomain = "Domain";
inline constexpr std::string_view kErrorCode = "Code";
inline constexpr std::string_view kErrorUserInfo = "UserInfo";

// Account information, beside keys of the record.
inline constexpr std::string_view kAllEmails = "AllEmails";
inline constexpr std::string_view kCertificatePEM = "CertificatePEM";
inline constexpr std::string_view kCertificateExpiration = "CertificateExpiration";
inline constexpr std::string_view kCertificateDate = "CertificateDate";

// Certificate information, beside keys of the certificate entry.
inline constexpr std::string_view kCertificateData = "CertificateData";

// Status: of the agent, and of each account.
inline constexpr std::string_view kAccountStatuses = "AccountStatuses";
inline constexpr std::string_view kDirtyAccounts = "DirtyAccounts";
inline constexpr std::string_view kDirtyAccountsAndCertificates = "DirtyAccountsAndCertificates";
inline constexpr std::string_view kLaunchTime = "LaunchTime";
inline constexpr std::string_view kNextLaunchTime = "NextLaunchTime";
inline constexpr std::string_view kProcessID = "pid";
inline constexpr std::string_view kUnlockedSinceBoot = "DeviceUnlockedSinceBoot";
inline constexpr std::string_view kAccountState = "AccountState";
inline constexpr std::string_view kNextActionTime = "NextActionTime";
inline constexpr std::string_view kNextFetchAttempt = "NextFetchAttempt";
inline constexpr std::string_view kRequiresUserAction = "AccountRequiresUserAction";

}  // namespace veltoid::message
