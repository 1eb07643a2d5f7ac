// What an account needs next.
#pragma once

#include "Protocol/AccountState.h"
#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Examines the account in this order: password, encDsId, pending request, information, certificate (status,
/// dates, the server's word on it, its items in the keychain, its trust), renewal, validation record. Without
/// an account Unknown with an error (-100); any other state comes without one.
///
/// Options (Booleans, default false): "CheckNetwork" (the server may be asked, unless the account is under an
/// embargo), "ForceValidation" (evaluate the certificate even if that was done not long ago);
/// "PreExpirationInterval" (a Number of seconds). What is stored changes only as far as the examination goes:
/// dates of attempts, due dates put off, what the server says. Caller's queue; blocks for the server.
AccountState checkAccountAndDetermineNextAction(const String& accountName, const Dictionary& options,
                                                ErrorOut error = nullptr);

}  // namespace veltoid
