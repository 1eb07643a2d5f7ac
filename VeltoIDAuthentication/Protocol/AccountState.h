// The states of an account, as codes ("check") and as names ("status").
#pragma once

#include <string_view>
#include <utility>

namespace veltoid {

/// The state tells what is to be done for the account next.
enum class AccountState : int {
    NoEncodedDSID = -6,
    PasswordInaccessibleInKeychain = -5,
    /// There is none, or the server refuses it.
    PasswordInvalid = -4,
    NoCertificate = -3,
    CertificateRevoked = -2,
    CertificateExpired = -1,
    /// No decision.
    Unknown = 0,
    /// Evaluated now.
    CertificateOK = 1,
    /// Not evaluated now, but not long ago.
    CertificateAssumedOK = 2,
    CertificateShouldBeRenewed = 3,
    CertificateMustBeRenewed = 4,
    ValidationRecordNeedsToBeUpdated = 5,
    /// A request for one is pending.
    CertificatePending = 10,
};

/// The name that clients see.
constexpr std::string_view nameOf(AccountState state) {
    constexpr std::pair<AccountState, std::string_view> kNames[] = {
        {AccountState::NoEncodedDSID, "NoEncodedDSID"},
        {AccountState::PasswordInaccessibleInKeychain, "PasswordInaccessibleInKeychain"},
        {AccountState::PasswordInvalid, "PasswordInvalid"},
        {AccountState::NoCertificate, "NoCertificate"},
        {AccountState::CertificateRevoked, "CertificateRevoked"},
        {AccountState::CertificateExpired, "CertificateExpired"},
        {AccountState::Unknown, "Unknown"},
        {AccountState::CertificateOK, "CertificateOK"},
        {AccountState::CertificateAssumedOK, "CertificateAssumedOK"},
        {AccountState::CertificateShouldBeRenewed, "CertificateShouldBeRenewed"},
        {AccountState::CertificateMustBeRenewed, "CertificateMustBeRenewed"},
        {AccountState::ValidationRecordNeedsToBeUpdated, "VeltoIDValidationRecordNeedsToBeUpdated"},
        {AccountState::CertificatePending, "CertificatePending"},
    };
    for (const auto& [known, name] : kNames)
        if (known == state) return name;
    return {};
}

}  // namespace veltoid
