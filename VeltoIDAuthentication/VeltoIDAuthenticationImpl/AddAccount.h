// Bringing an account onto the device.
#pragma once

#include <functional>
#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// What is known of an account that was added.
struct AddedAccount {
    /// As far as the server has told it.
    String encDsId;
    /// The record's values.
    std::optional<Dictionary> record;
};

/// Stores account and password hash, signs in to learn the encDsId, and fetches the account's information.
/// True when the account is stored, whatever the server said.
///
/// Options (Booleans): "ForceCertificateCreation" (false: an account that has a certificate, or asked for
/// one, is not signed in again), "DoNotCheckPassword" (false; true: no sign-in),
/// "VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord" (false; true: no information), "DoNotCreateCSR"
/// (false) and "CreateCSRAsynchronously" (true; with both false the add asks for a certificate itself, unless
/// the account has a valid one and none is forced). Caller's queue; blocks while the server is asked.
bool __VeltoIDDoAddVeltoID(const String& accountName, const String& hashedPassword, const Dictionary& options,
                           AddedAccount* added, ErrorOut error = nullptr);

/// What a client's request to add an account does. Adds it as above, has the account check look at it,
/// forgets every other account (the agent keeps one), and waits for the certificate as long as option
/// "certwaitduration" says (seconds; default 0). False, without an error, when there will be no certificate
/// unless a user or client acts; a certificate that is still on its way is a success. `wakeAccountCheck`
/// makes the next pass come early.
bool addOnlyAccount(const String& accountName, const String& hashedPassword, const Dictionary& options,
                    const std::function<void()>& wakeAccountCheck, AddedAccount* added,
                    ErrorOut error = nullptr);

}  // namespace veltoid
