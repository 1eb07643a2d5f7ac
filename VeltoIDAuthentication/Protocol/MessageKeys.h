// The keys of requests and replies. Replies also carry whole account records, whose keys are the database's
// own.
#pragma once

#include <string_view>

namespace veltoid::message {

using Key = std::string_view;

// Requests.
inline constexpr Key kCommand = "command";
inline constexpr Key kAccount = "VeltoID";
inline constexpr Key kHashedPassword = "hashedpassword";
inline constexpr Key kOptions = "options";
inline constexpr Key kCriteria = "criteria";
inline constexpr Key kEncDsId = "encDsId";
inline constexpr Key kCertificateType = "CertificateType";
inline constexpr Key kBreadcrumbKey = "identifier";
inline constexpr Key kBreadcrumb = "breadcrumb";
inline constexpr Key kIdentityReference = "identityReferenceData";

// Setting a value of the database: one of the sections below, the account or certificate in it, the value's
// key, and the new value.
inline constexpr Key kSection = "domain";
inline constexpr Key kItem = "item";
inline constexpr Key kKey = "key";
inline constexpr Key kValue = "value";
inline constexpr Key kAccountsSection = "Accounts";
inline constexpr Key kCertificatesSection = "Certificates";
inline constexpr Key kMetaInfoSection = "MetaInfo";

/// The value of kCertificateType that asks for the signed record of validated items.
inline constexpr Key kValidationRecordType = "VeltoIDValidatedItemsRecordDataCertificateType";

// Replies.
inline constexpr Key kSuccess = "success";
inline constexpr Key kError = "error";
inline constexpr Key kResult = "result";
inline constexpr Key kInfo = "info";
inline constexpr Key kStatus = "status";
/// The account's record: after adding it, and after forgetting it.
inline constexpr Key kAddedAccount = "accountinfo";
inline constexpr Key kForgottenAccount = "accountInfo";
inline constexpr Key kForgottenEncDsId = "encDSID";

// An error in a reply.
inline constexpr Key kErrorDomain = "Domain";
inline constexpr Key kErrorCode = "Code";
inline constexpr Key kErrorUserInfo = "UserInfo";

// Account information, beside keys of the record.
inline constexpr Key kAllEmails = "AllEmails";
inline constexpr Key kCertificatePEM = "CertificatePEM";
inline constexpr Key kCertificateExpiration = "CertificateExpiration";
inline constexpr Key kCertificateDate = "CertificateDate";

// A person that was found: the criterion, the value that it matched, and the name.
inline constexpr Key kMatched = "matched";
inline constexpr Key kMatchedValue = "value";
inline constexpr Key kPersonFirstName = "firstNm";
inline constexpr Key kPersonLastName = "lastNm";

// Certificate information, beside keys of the certificate entry.
inline constexpr Key kCertificateData = "CertificateData";

// Status: of the agent, and of each account.
inline constexpr Key kAccountStatuses = "AccountStatuses";
inline constexpr Key kDirtyAccounts = "DirtyAccounts";
inline constexpr Key kDirtyAccountsAndCertificates = "DirtyAccountsAndCertificates";
inline constexpr Key kLaunchTime = "LaunchTime";
inline constexpr Key kNextLaunchTime = "NextLaunchTime";
inline constexpr Key kProcessID = "pid";
inline constexpr Key kUnlockedSinceBoot = "DeviceUnlockedSinceBoot";
/// Why secrets cannot be read though the device is unlocked; absent when they can.
inline constexpr Key kKeychainTrouble = "KeychainTrouble";
inline constexpr Key kAccountState = "AccountState";
inline constexpr Key kNextActionTime = "NextActionTime";
inline constexpr Key kNextFetchAttempt = "NextFetchAttempt";
inline constexpr Key kRequiresUserAction = "AccountRequiresUserAction";

}  // namespace veltoid::message
