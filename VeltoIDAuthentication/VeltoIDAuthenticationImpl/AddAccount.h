// Bringing an account onto the device.
#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {

/// What is known of an account that was added.
struct AddedAccount {
    /// As far as the server has told it.
    String encDsId;
    /// The record's values.
    std::optional<Dictionary> record;
    /// Of a client's request: while this is held, no other request makes the answer untrue.
    std::shared_ptr<const OwnershipLock> decision;
};

/// The longest that an add waits for its certificate (seconds).
inline constexpr double kMaxCertificateWait = 3'600;

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

/// What an add needs of the process.
struct AddingClient {
    /// Makes the next pass of the account check come early.
    std::function<void()> wakeAccountCheck;
    /// Whether somebody waits for the answer, and may go on doing so.
    std::function<bool()> isWaiting;
};

/// What a client's request to add an account does. Adds it as above, has the account check look at it,
/// forgets every other account (the agent keeps one: of several that are added at once the last to get here),
/// and waits for the certificate as long as option "certwaitduration" says (seconds; default 0, at most
/// kMaxCertificateWait) and the client waits; the account check does the work meanwhile. False, without an
/// error, when there will be no certificate unless a user or client acts; a certificate that is still on its
/// way is a success. -108 when another account has taken this one's place, or it was forgotten.
bool addOnlyAccount(const String& accountName, const String& hashedPassword, const Dictionary& options,
                    const AddingClient& client, AddedAccount* added, ErrorOut error = nullptr);

}  // namespace veltoid
