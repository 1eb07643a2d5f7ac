// Whether a certificate comes from the identity service's authority.
//
// The authorities are the certificates in one file, in the product's folder in $XDG_CONFIG_HOME (default
// ~/.config), else in that in /etc. An entry may be an intermediate authority, it may be marked as
// rejected (a "TRUSTED CERTIFICATE" of OpenSSL), and revocation lists ("X509 CRL") may stand beside them. The
// file is read for each evaluation, so that a change counts at once.
#pragma once

#include <optional>
#include <span>

#include "Platform/crypto/Certificate.h"

namespace platform {

/// A larger file is refused.
inline constexpr size_t kMaxAuthorityFileBytes = size_t{4} << 20U;

/// The values are those that logs and clients know.
enum class TrustResult : int {
    Invalid = 0,
    Proceed = 1,
    Confirm = 2,
    /// Revoked, or its authority is rejected.
    Deny = 3,
    /// There is a path to an authority and nothing speaks against it.
    Unspecified = 4,
    /// Expired or not yet valid, and otherwise good.
    RecoverableFailure = 5,
    /// No path to an authority, a bad signature, or not for client authentication.
    FatalFailure = 6,
    OtherError = 7,
};

/// Evaluates the certificate for client authentication now (on the Clock), with the intermediate certificates
/// that came with it. None when there are no authorities, or they cannot be read (a log line says why). Any
/// thread.
std::optional<TrustResult> evaluateTrust(const Certificate& certificate,
                                         std::span<const Certificate> intermediates);

}  // namespace platform
