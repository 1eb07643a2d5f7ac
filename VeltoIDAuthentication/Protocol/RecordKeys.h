// Keys of the account database: top level, account records, certificate entries, meta information. Replies
// carry them as they are.
#pragma once

#include <array>
#include <string_view>

namespace veltoid {

using RecordKey = std::string_view;

inline constexpr RecordKey kVeltoIDDBDefaultDomain = "com.velto.harbwell.veltoidauthenticationinfo";

// Top level of the preference domain.
inline constexpr RecordKey kVeltoIDDBVersionKey = "Version";
inline constexpr RecordKey kVeltoIDDBCreationDateKey = "CreationDate";
inline constexpr RecordKey kVeltoIDDBAccountsKey = "Accounts";
inline constexpr RecordKey kVeltoIDDBCertificatesKey = "AuthCertificates";
inline constexpr RecordKey kVeltoIDDBMetaInfoKey = "MetaInfo";
/// What the certificates are called where nothing is stored.
inline constexpr RecordKey kVeltoIDDBUnstoredCertificatesKey = "Certificates";
inline constexpr RecordKey kVeltoIDDBAccessorVersionsKey = "AccessorVersions";

// Account records.
/// The name under which the record is stored, which alone counts; and the one that the server uses, where
/// that is another one.
inline constexpr RecordKey kVeltoIDAccountNameKey = "VeltoID";
inline constexpr RecordKey kVeltoIDAccountServerNameKey = "ServerVeltoID";
inline constexpr RecordKey kVeltoIDAccountDSIDKey = "encDsId";
inline constexpr RecordKey kVeltoIDAccountHashedPasswordKey = "HashedPassword";
inline constexpr RecordKey kVeltoIDAccountHashedPasswordKeychainReferenceKey = "HashedPasswordRef";
inline constexpr RecordKey kVeltoIDAccountFirstNameKey = "FirstName";
inline constexpr RecordKey kVeltoIDAccountLastNameKey = "LastName";
inline constexpr RecordKey kVeltoIDAccountPrimaryEmailKey = "PrimaryEmail";
/// The key is spelled so in every stored database.
inline constexpr RecordKey kVeltoIDAccountEmailAddressesKey = "EmailAddresess";
inline constexpr RecordKey kVeltoIDAccountValidatedEmailKey = "ValidatedEmail";
inline constexpr RecordKey kVeltoIDAccountValidatedPhonesKey = "ValidatedPhones";
inline constexpr RecordKey kVeltoIDAccountCreationDateKey = "CreationDate";
inline constexpr RecordKey kVeltoIDAccountModificationDateKey = "ModificationDate";
inline constexpr RecordKey kVeltoIDAccountLastValidationDateKey = "ValidationDate";
inline constexpr RecordKey kVeltoIDAccountNextValidationDateKey = "NextValidationDate";
inline constexpr RecordKey kVeltoIDAccountForceValidationKey = "ForceValidation";
inline constexpr RecordKey kVeltoIDAccountCertificateTokenKey = "CertificateToken";
inline constexpr RecordKey kVeltoIDAccountCertificateTokenExpirationKey = "CertificateTokenExpiration";
/// Since when the server answers questions for the token with faults.
inline constexpr RecordKey kVeltoIDAccountCertificateTokenFaultsSinceKey = "CertificateTokenFaultsSince";
inline constexpr RecordKey kVeltoIDAccountCSRGenerationDateKey = "CSRGenerationDate";
/// Seconds.
inline constexpr RecordKey kVeltoIDAccountCSRGenerationIntervalKey = "CSRGenerationInterval";
/// Dates of the last requests that were sent, and until when further ones are held up.
inline constexpr RecordKey kVeltoIDAccountCertificateRequestDatesKey = "CertificateRequestDates";
inline constexpr RecordKey kVeltoIDAccountCertificateRequestsHeldUntilKey = "CertificateRequestsHeldUntil";
inline constexpr RecordKey kVeltoIDAccountCSRCreationDateKey = "CSRCreationDate";
inline constexpr RecordKey kVeltoIDAccountCertificateNextCertificateFetchDateKey = "NextCertificateFetchDate";
/// Seconds.
inline constexpr RecordKey kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey =
    "NextCertificateFetchDelta";
inline constexpr RecordKey kVeltoIDAccountEarliestAllowedConnectionDateKey = "EarliestAllowedConnectionDate";
inline constexpr RecordKey kVeltoIDAccountClientTooOldKey = "ClientTooOld";
/// The version of the agent that this was said of; said of another one, it does not count.
inline constexpr RecordKey kVeltoIDAccountClientTooOldVersionKey = "ClientTooOldVersion";
/// When the account check looks at the account again at the earliest, and how far that was put off (seconds).
inline constexpr RecordKey kVeltoIDAccountNextCheckDateKey = "NextAccountCheckDate";
inline constexpr RecordKey kVeltoIDAccountCheckBackOffKey = "AccountCheckBackOff";
inline constexpr RecordKey kVeltoIDAccountValidForIntervalKey = "ValidForInterval";
inline constexpr RecordKey kVeltoIDAccountCertificateIsValidKey = "CertificateIsValid";
inline constexpr RecordKey kVeltoIDAccountValidationRecordIdentifierKey =
    "VeltoIDAccountValidationRecordIdentifierKey";
inline constexpr RecordKey kVeltoIDAccountValidationRecordDataKey = "VeltoIDAccountValidationRecordData";
inline constexpr RecordKey kVeltoIDAccountValidationRecordNextCheckDateKey =
    "VeltoIDAccountValidationRecordNextCheckDateKey";
/// Seconds.
inline constexpr RecordKey kVeltoIDAccountValidationRecordNextCheckIntervalKey =
    "VeltoIDAccountValidationRecordNextCheckIntervalKey";
inline constexpr RecordKey kVeltoIDAccountValidationRecordValidAsOfKey =
    "VeltoIDAccountValidationRecordValidAsOfKey";
/// Seconds.
inline constexpr RecordKey kVeltoIDAccountValidationRecordSuggestedValidIntervalKey =
    "VeltoIDAccountValidationRecordSuggestedValidIntervalKey";
inline constexpr RecordKey kVeltoIDAccountUUIDKey = "AccountUUID";
inline constexpr RecordKey kVeltoIDAccountStableUUIDKey = "AccountStableUUID";
inline constexpr RecordKey kVeltoIDAccountServerURLKey = "ServerURL";
inline constexpr RecordKey kVeltoIDDirtyKey = "Dirty";

// What earlier agents kept in account records.
inline constexpr RecordKey kVeltoIDAccountOldCertificateKey = "Certificate";
inline constexpr RecordKey kVeltoIDAccountOldCertificatesKey = "Certificates";
inline constexpr RecordKey kVeltoIDAccountOldPrivateKeyKey = "PrivateKey";

// Certificate entries.
inline constexpr RecordKey kVeltoIDCertificateCertificatePersistentReferenceKey = "CertificateReference";
inline constexpr RecordKey kVeltoIDCertificatePrivateKeyPersistentReferenceKey =
    "CertificatePrivateKeyReference";
inline constexpr RecordKey kVeltoIDCertificateIntermediateCertificateReferenceKey =
    "IntermediateCertificateReference";
inline constexpr RecordKey kVeltoIDCertificateNextRenewalAttemptDateKey = "NextRenewalAttempt";
inline constexpr RecordKey kVeltoIDCertificateStatusKey = "CertStatus";
inline constexpr RecordKey kVeltoIDCertificateExpirationDateKey = "Expires";
inline constexpr RecordKey kVeltoIDCertificateSerialNumberKey = "SerialNumber";
inline constexpr RecordKey kVeltoIDCertificateLastSuccessfulValidationDateKey = "LastSuccessfulValidation";
inline constexpr RecordKey kVeltoIDCertificateLastValidationAttemptDateKey = "LastValidationAttempt";
inline constexpr RecordKey kVeltoIDCertificateCreationDateKey = "CreationDate";
inline constexpr RecordKey kVeltoIDCertificateModificationDateKey = "ModificationDate";
inline constexpr RecordKey kVeltoIDCertificateTypeKey = "CertType";
inline constexpr RecordKey kVeltoIDCertificateDateKey = "Date";
/// Certificates as PEM text: an answer of the server has the first two, an entry may have the last.
inline constexpr RecordKey kVeltoIDCertificateCertificateKey = "Certificate";
inline constexpr RecordKey kVeltoIDCertificateIntermediateCertificateKey = "IntermediateCertificate";
inline constexpr RecordKey kVeltoIDCertificatePEMKey = "CertificatePEM";

/// Statuses of certificates, and of requests for one.
inline constexpr RecordKey kVeltoIDCertificateStatusPending = "SIGNIN_PENDING";
inline constexpr RecordKey kVeltoIDCertificateStatusFailed = "FAILED";
inline constexpr RecordKey kVeltoIDCertificateStatusIssued = "CERT_ISSUED";
inline constexpr RecordKey kVeltoIDCertificateStatusInvalid = "CERTIFICATE_INVALID";

// Meta information.
inline constexpr RecordKey kVeltoIDMetaUserUUIDKey = "UserUUID";
inline constexpr RecordKey kVeltoIDDBServerURLKey = "ServerURL";
inline constexpr RecordKey kVeltoIDMetaPreExpirationIntervalKey = "PreExpirationInterval";
inline constexpr RecordKey kVeltoIDMetaAccountPresumedValidIntervalKey = "AccountPresumedValidInterval";
// Intervals, in seconds.
inline constexpr RecordKey kVeltoIDMetaAccountValidationIntervalKey = "AccountValidationInterval";
inline constexpr RecordKey kVeltoIDMetaCertificateValidationIntervalKey = "CertificateValidationInterval";
inline constexpr RecordKey kVeltoIDMetaCertificateRenewalIntervalKey = "CertificateRenewalInterval";
inline constexpr RecordKey kVeltoIDMetaCertificateAssumedOKIntervalKey =
    "CertificateValidationAssumedOKInterval";
inline constexpr RecordKey kVeltoIDMetaRelaunchIntervalKey = "DefaultRelaunchInterval";
inline constexpr RecordKey kVeltoIDMetaValidationRecordRetryIntervalKey =
    "VeltoIDMetaInfoValidationRecordRenewalAttemptInterval";
inline constexpr RecordKey kVeltoIDMetaCertificateLifetimeKey =
    "VeltoIDMetaDefaultCertificateRequestedLifetime";
inline constexpr RecordKey kVeltoIDMetaSendServerMetaInformationItemsKey =
    "VeltoIDMetaSendServerMetaInformationItems";
inline constexpr RecordKey kVeltoIDMetaSendServerAccountInformationItemsKey =
    "VeltoIDMetaSendServerAccountInformationItems";
inline constexpr RecordKey kVeltoIDMetaLastConnectAttemptKey = "LastConnectAttempt";
inline constexpr RecordKey kVeltoIDMetaLastSuccessfulConnectKey = "LastSuccessfulConnect";
/// The protocol version that the server last spoke.
inline constexpr RecordKey kVeltoIDMetaServerVersionKey = "ServerVersion";
/// When the server last asked to have the agent running.
inline constexpr RecordKey kVeltoIDMetaRequestedLaunchDateKey = "RequestedLaunchDate";
inline constexpr RecordKey kVeltoIDMetaAccountRequiresUserActionKey = "AccountRequiresUserAction";
/// References to items of the keychain that somebody wanted to keep when their account was forgotten.
inline constexpr RecordKey kVeltoIDMetaKeptKeychainItemsKey = "KeptKeychainItems";

// Counters of the meta information.
inline constexpr RecordKey kVeltoIDMetaConnectionAttemptCountKey = "VeltoIDMetaConnectionAttemptCount";
inline constexpr RecordKey kVeltoIDMetaSuccessfulConnectionCountKey = "VeltoIDMetaSuccessfulConnectionCount";
inline constexpr RecordKey kVeltoIDMetaUnsuccessfulConnectionCountKey =
    "VeltoIDMetaUnsuccessfulConnectionCount";
inline constexpr RecordKey kVeltoIDXMLAuthenticateCountKey = "VeltoIDXMLAuthenticateCount";
inline constexpr RecordKey kVeltoIDXMLSessionReusedCountKey = "VeltoIDXMLSessionReusedCount";
inline constexpr RecordKey kVeltoIDXMLGetMyInfoCountKey = "VeltoIDXMLGetMyInfoCount";
inline constexpr RecordKey kVeltoIDXMLFindPersonCountKey = "VeltoIDXMLFindPersonCount";
inline constexpr RecordKey kVeltoIDXMLSendCSRCountKey = "VeltoIDXMLSendCSRCount";
inline constexpr RecordKey kVeltoIDXMLCompleteCertCountKey = "VeltoIDXMLCompleteCertCount";
inline constexpr RecordKey kVeltoIDXMLFetchCertCountKey = "VeltoIDXMLFetchCertCount";
inline constexpr RecordKey kVeltoIDFindCountKey = "VeltoIDFindCount";
inline constexpr RecordKey kVeltoIDFindCachedCountKey = "VeltoIDFindCachedCount";
inline constexpr RecordKey kVeltoIDAddVeltoIDCountKey = "VeltoIDAddVeltoIDCount";
inline constexpr RecordKey kVeltoIDForgetVeltoIDCountKey = "VeltoIDForgetVeltoIDCount";
inline constexpr RecordKey kVeltoIDGetMyInfoCountKey = "VeltoIDGetMyInfoCount";

/// What may be reported to the server, when the server asks for it.
inline constexpr std::array<RecordKey, 12> kVeltoIDReportableMetaInformation = {
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
