// Bringing an account onto the device and taking it off again.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Stores account and password hash, signs in to learn the encDsId, and fetches the account's information.
/// True when the account is stored, whatever the server said: the outputs are set as far as they are known.
///
/// Options (Booleans): "ForceCertificateCreation" (false: an account that has a certificate, or asked for
/// one, is not signed in again), "DoNotCheckPassword" (false; true: no sign-in),
/// "VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord" (false; true: no information), "DoNotCreateCSR"
/// (false) and "CreateCSRAsynchronously" (true; with both false the add asks for a certificate itself, unless
/// the account has a valid one and none is forced). Caller's queue; blocks while the server is asked.
bool __VeltoIDDoAddVeltoID(const String& accountName, const String& hashedPassword, const Dictionary& options,
                           String* encDsId, std::optional<Dictionary>* accountRecord,
                           ErrorOut error = nullptr);

/// Removes the account with its password item and, unless another account shares its encDsId, its certificate
/// entry with certificate and key; options "RemoveCertificateFromKeychain" and "RemovePrivateKeyFromKeychain"
/// (Booleans, true) say whether their items go too. Cleans up on the way. -100 for an unknown account.
/// Caller's queue.
bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error = nullptr);

}  // namespace veltoid
