// The states of an account, as codes ("check") and as names ("status").
#pragma once

#include <string_view>

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
    switch (state) {
        case AccountState::NoEncodedDSID:
            return "NoEncodedDSID";
        case AccountState::PasswordInaccessibleInKeychain:
            return "PasswordInaccessibleInKeychain";
        case AccountState::PasswordInvalid:
            return "PasswordInvalid";
        case AccountState::NoCertificate:
            return "NoCertificate";
        case AccountState::CertificateRevoked:
            return "CertificateRevoked";
        case AccountState::CertificateExpired:
            return "CertificateExpired";
        case AccountState::Unknown:
            return "Unknown";
        case AccountState::CertificateOK:
            return "CertificateOK";
        case AccountState::CertificateAssumedOK:
            return "CertificateAssumedOK";
        case AccountState::CertificateShouldBeRenewed:
            return "CertificateShouldBeRenewed";
        case AccountState::CertificateMustBeRenewed:
            return "CertificateMustBeRenewed";
        case AccountState::ValidationRecordNeedsToBeUpdated:
            return "VeltoIDValidationRecordNeedsToBeUpdated";
        case AccountState::CertificatePending:
            return "CertificatePending";
    }
    return {};
}

}  // namespace veltoid
