// Keys of the account database: top level, account records, certificate entries, meta information. Replies
// carry them as they are.
#pragma once

#include <array>
#include <string_view>

namespace veltoid {

inline constexpr std::string_view kVeltoIDDBDefaultDomain = "com.velto.harbwell.veltoidauthenticationinfo";

// Top level of the preference domain.
inline constexpr std::string_view kVeltoIDDBVersionKey = "Version";
inline constexpr std::string_view kVeltoIDDBCreationDateKey = "CreationDate";
inline constexpr std::string_view kVeltoIDDBAccountsKey = "Accounts";
inline constexpr std::string_view kVeltoIDDBCertificatesKey = "AuthCertificates";
inline constexpr std::string_view kVeltoIDDBMetaInfoKey = "MetaInfo";
/// What the certificates are called where nothing is stored.
inline constexpr std::string_view kVeltoIDDBUnstoredCertificatesKey = "Certificates";
inline constexpr std::string_view kVeltoIDDBAccessorVersionsKey = "AccessorVersions";

// Account records.
inline constexpr std::string_view kVeltoIDAccountNameKey = "VeltoID";
inline constexpr std::string_view kVeltoIDAccountDSIDKey = "encDsId";
inline constexpr std::string_view kVeltoIDAccountHashedPasswordKey = "HashedPassword";
inline constexpr std::string_view kVeltoIDAccountHashedPasswordKeychainReferenceKey = "HashedPasswordRef";
inline constexpr std::string_view kVeltoIDAccountFirstNameKey = "FirstName";
inline constexpr std::string_view kVeltoIDAccountLastNameKey = "LastName";
inline constexpr std::string_view kVeltoIDAccountPrimaryEmailKey = "PrimaryEmail";
/// The key is spelled so in every stored database.
inline constexpr std::string_view kVeltoIDAccountEmailAddressesKey = "EmailAddresess";
inline constexpr std::string_view kVeltoIDAccountValidatedEmailKey = "ValidatedEmail";
inline constexpr std::string_view kVeltoIDAccountValidatedPhonesKey = "ValidatedPhones";
inline constexpr std::string_view kVeltoIDAccountCreationDateKey = "CreationDate";
inline constexpr std::string_view kVeltoIDAccountModificationDateKey = "ModificationDate";
inline constexpr std::string_view kVeltoIDAccountLastValidationDateKey = "ValidationDate";
inline constexpr std::string_view kVeltoIDAccountNextValidationDateKey = "NextValidationDate";
inline constexpr std::string_view kVeltoIDAccountForceValidationKey = "ForceValidation";
inline constexpr std::string_view kVeltoIDAccountCertificateTokenKey = "CertificateToken";
inline constexpr std::string_view kVeltoIDAccountCertificateTokenExpirationKey = "CertificateTokenExpiration";
inline constexpr std::string_view kVeltoIDAccountCSRGenerationDateKey = "CSRGenerationDate";
/// Seconds.
inline constexpr std::string_view kVeltoIDAccountCSRGenerationIntervalKey = "CSRGenerationInterval";
/// Dates of the last requests that were sent, and until when further ones are held up.
inline constexpr std::string_view kVeltoIDAccountCertificateRequestDatesKey = "CertificateRequestDates";
inline constexpr std::string_view kVeltoIDAccountCertificateRequestsHeldUntilKey =
    "CertificateRequestsHeldUntil";
inline constexpr std::string_view kVeltoIDAccountCSRCreationDateKey = "CSRCreationDate";
inline constexpr std::string_view kVeltoIDAccountCertificateNextCertificateFetchDateKey =
    "NextCertificateFetchDate";
/// Seconds.
inline constexpr std::string_view kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey =
    "NextCertificateFetchDelta";
inline constexpr std::string_view kVeltoIDAccountEarliestAllowedConnectionDateKey =
    "EarliestAllowedConnectionDate";
inline constexpr std::string_view kVeltoIDAccountClientTooOldKey = "ClientTooOld";
inline constexpr std::string_view kVeltoIDAccountValidForIntervalKey = "ValidForInterval";
inline constexpr std::string_view kVeltoIDAccountCertificateIsValidKey = "CertificateIsValid";
inline constexpr std::string_view kVeltoIDAccountValidationRecordIdentifierKey =
    "VeltoIDAccountValidationRecordIdentifierKey";
inline constexpr std::string_view kVeltoIDAccountValidationRecordDataKey =
    "VeltoIDAccountValidationRecordData";
inline constexpr std::string_view kVeltoIDAccountValidationRecordNextCheckDateKey =
    "VeltoIDAccountValidationRecordNextCheckDateKey";
/// Seconds.
inline constexpr std::string_view kVeltoIDAccountValidationRecordNextCheckIntervalKey =
    "VeltoIDAccountValidationRecordNextCheckIntervalKey";
inline constexpr std::string_view kVeltoIDAccountValidationRecordValidAsOfKey =
    "VeltoIDAccountValidationRecordValidAsOfKey";
/// Seconds.
inline constexpr std::string_view kVeltoIDAccountValidationRecordSuggestedValidIntervalKey =
    "VeltoIDAccountValidationRecordSuggestedValidIntervalKey";
inline constexpr std::string_view kVeltoIDAccountUUIDKey = "AccountUUID";
inline constexpr std::string_view kVeltoIDAccountStableUUIDKey = "AccountStableUUID";
inline constexpr std::string_view kVeltoIDAccountServerURLKey = "ServerURL";
inline constexpr std::string_view kVeltoIDDirtyKey = "Dirty";

// What earlier agents kept in account records.
inline constexpr std::string_view kVeltoIDAccountOldCertificateKey = "Certificate";
inline constexpr std::string_view kVeltoIDAccountOldCertificatesKey = "Certificates";
inline constexpr std::string_view kVeltoIDAccountOldPrivateKeyKey = "PrivateKey";

// Certificate entries.
inline constexpr std::string_view kVeltoIDCertificateCertificatePersistentReferenceKey =
    "CertificateReference";
inline constexpr std::string_view kVeltoIDCertificatePrivateKeyPersistentReferenceKey =
    "CertificatePrivateKeyReference";
inline constexpr std::string_view kVeltoIDCertificateIntermediateCertificateReferenceKey =
    "IntermediateCertificateReference";
inline constexpr std::string_view kVeltoIDCertificateNextRenewalAttemptDateKey = "NextRenewalAttempt";
inline constexpr std::string_view kVeltoIDCertificateStatusKey = "CertStatus";
inline constexpr std::string_view kVeltoIDCertificateExpirationDateKey = "Expires";
inline constexpr std::string_view kVeltoIDCertificateSerialNumberKey = "SerialNumber";
inline constexpr std::string_view kVeltoIDCertificateLastSuccessfulValidationDateKey =
    "LastSuccessfulValidation";
inline constexpr std::string_view kVeltoIDCertificateLastValidationAttemptDateKey = "LastValidationAttempt";
inline constexpr std::string_view kVeltoIDCertificateCreationDateKey = "CreationDate";
inline constexpr std::string_view kVeltoIDCertificateModificationDateKey = "ModificationDate";
inline constexpr std::string_view kVeltoIDCertificateTypeKey = "CertType";
inline constexpr std::string_view kVeltoIDCertificateDateKey = "Date";
/// Certificates as PEM text: an answer of the server has the first two, an entry may have the last.
inline constexpr std::string_view kVeltoIDCertificateCertificateKey = "Certificate";
inline constexpr std::string_view kVeltoIDCertificateIntermediateCertificateKey = "IntermediateCertificate";
inline constexpr std::string_view kVeltoIDCertificatePEMKey = "CertificatePEM";

/// Statuses of certificates, and of requests for one.
inline constexpr std::string_view kVeltoIDCertificateStatusPending = "SIGNIN_PENDING";
inline constexpr std::string_view kVeltoIDCertificateStatusFailed = "FAILED";
inline constexpr std::string_view kVeltoIDCertificateStatusIssued = "CERT_ISSUED";
inline constexpr std::string_view kVeltoIDCertificateStatusInvalid = "CERTIFICATE_INVALID";

// Meta information.
inline constexpr std::string_view kVeltoIDMetaUserUUIDKey = "UserUUID";
inline constexpr std::string_view kVeltoIDDBServerURLKey = "ServerURL";
inline constexpr std::string_view kVeltoIDMetaPreExpirationIntervalKey = "PreExpirationInterval";
inline constexpr std::string_view kVeltoIDMetaAccountPresumedValidIntervalKey =
    "AccountPresumedValidInterval";
// Intervals, in seconds.
inline constexpr std::string_view kVeltoIDMetaAccountValidationIntervalKey = "AccountValidationInterval";
inline constexpr std::string_view kVeltoIDMetaCertificateValidationIntervalKey =
    "CertificateValidationInterval";
inline constexpr std::string_view kVeltoIDMetaCertificateRenewalIntervalKey = "CertificateRenewalInterval";
inline constexpr std::string_view kVeltoIDMetaCertificateAssumedOKIntervalKey =
    "CertificateValidationAssumedOKInterval";
inline constexpr std::string_view kVeltoIDMetaRelaunchIntervalKey = "DefaultRelaunchInterval";
inline constexpr std::string_view kVeltoIDMetaValidationRecordRetryIntervalKey =
    "VeltoIDMetaInfoValidationRecordRenewalAttemptInterval";
inline constexpr std::string_view kVeltoIDMetaCertificateLifetimeKey =
    "VeltoIDMetaDefaultCertificateRequestedLifetime";
inline constexpr std::string_view kVeltoIDMetaSendServerMetaInformationItemsKey =
    "VeltoIDMetaSendServerMetaInformationItems";
inline constexpr std::string_view kVeltoIDMetaSendServerAccountInformationItemsKey =
    "VeltoIDMetaSendServerAccountInformationItems";
inline constexpr std::string_view kVeltoIDMetaLastConnectAttemptKey = "LastConnectAttempt";
inline constexpr std::string_view kVeltoIDMetaLastSuccessfulConnectKey = "LastSuccessfulConnect";
inline constexpr std::string_view kVeltoIDMetaAccountRequiresUserActionKey = "AccountRequiresUserAction";

// Counters of the meta information.
inline constexpr std::string_view kVeltoIDMetaConnectionAttemptCountKey = "VeltoIDMetaConnectionAttemptCount";
inline constexpr std::string_view kVeltoIDMetaSuccessfulConnectionCountKey =
    "VeltoIDMetaSuccessfulConnectionCount";
inline constexpr std::string_view kVeltoIDMetaUnsuccessfulConnectionCountKey =
    "VeltoIDMetaUnsuccessfulConnectionCount";
inline constexpr std::string_view kVeltoIDXMLAuthenticateCountKey = "VeltoIDXMLAuthenticateCount";
inline constexpr std::string_view kVeltoIDXMLSessionReusedCountKey = "VeltoIDXMLSessionReusedCount";
inline constexpr std::string_view kVeltoIDXMLGetMyInfoCountKey = "VeltoIDXMLGetMyInfoCount";
inline constexpr std::string_view kVeltoIDXMLFindPersonCountKey = "VeltoIDXMLFindPersonCount";
inline constexpr std::string_view kVeltoIDXMLSendCSRCountKey = "VeltoIDXMLSendCSRCount";
inline constexpr std::string_view kVeltoIDXMLCompleteCertCountKey = "VeltoIDXMLCompleteCertCount";
inline constexpr std::string_view kVeltoIDXMLFetchCertCountKey = "VeltoIDXMLFetchCertCount";
inline constexpr std::string_view kVeltoIDFindCountKey = "VeltoIDFindCount";
inline constexpr std::string_view kVeltoIDFindCachedCountKey = "VeltoIDFindCachedCount";
inline constexpr std::string_view kVeltoIDAddVeltoIDCountKey = "VeltoIDAddVeltoIDCount";
inline constexpr std::string_view kVeltoIDForgetVeltoIDCountKey = "VeltoIDForgetVeltoIDCount";
inline constexpr std::string_view kVeltoIDGetMyInfoCountKey = "VeltoIDGetMyInfoCount";

/// What may be reported to the server, when the server asks for it.
inline constexpr std::array<std::string_view, 12> kVeltoIDReportableMetaInformation = {
    kVeltoIDMetaLastConnectAttemptKey,
    kVeltoIDMetaLastSuccessfulConnectKey,
    kVeltoIDMetaAccountPresumedValidIntervalKey,
    kVeltoIDMetaAccountValidationIntervalKey,
    kVeltoIDMetaCertificateValidationIntervalKey,
    kVeltoIDMetaCertificateRenewalIntervalKey,
    kVeltoIDMetaUserUUIDKey,
    kVeltoIDMetaCertificateAssumedOKIntervalKey,
    kVeltoIDMetaRelaunchIntervalKey,
    kVeltoIDMetaValidationRecordRetryIntervalKey,
    kVeltoIDMetaSendServerMetaInformationItemsKey,
    kVeltoIDMetaSendServerAccountInformationItemsKey,
};

}  // namespace veltoid
