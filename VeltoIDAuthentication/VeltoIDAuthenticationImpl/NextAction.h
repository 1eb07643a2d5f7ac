// What an account needs next, and when.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// State of an account, as far as it can be told from what is stored on the device.
enum class AccountState : int {
    NoEncodedDSID = -6,
    PasswordInaccessibleInKeychain = -5,
    PasswordInvalid = -4,
    NoCertificate = -3,
    CertificateRevoked = -2,
    CertificateExpired = -1,
    Unknown = 0,
    CertificateOK = 1,
    CertificateAssumedOK = 2,
    CertificateShouldBeRenewed = 3,
    CertificateMustBeRenewed = 4,
    ValidationRecordNeedsToBeUpdated = 5,
    CertificatePending = 10,
};

/// The state of the account; Unknown comes with an error (-100) when no account was given, and without one
/// for an account whose certificate would have to be examined. Caller's queue; no network.
AccountState checkAccountAndDetermineNextAction(const String& accountName, const Dictionary& options,
                                                ErrorOut error = nullptr);

/// When the account next needs attention (seconds since 1970; none: no action is foreseen). False for an
/// account without password reference. Caller's queue.
bool copyNextActionDateForAccount(const String& accountName, std::optional<double>* date);

}  // namespace veltoid
