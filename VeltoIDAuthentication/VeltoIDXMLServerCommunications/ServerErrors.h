// What the server's faults mean: as the agent's errors, and for the stored password. This is the one place
// that judges them, and the only one that removes a password because the server refuses it.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Where people manage their account.
inline constexpr std::string_view kVeltoIDAccountManagementSite = "https://account.velto.example";

/// What is said of an answer that is no XML-RPC, or no Dictionary.
inline constexpr const char* kUnusableAnswer = "The server's answer cannot be understood";

/// The agent's error for a call that failed with this password hash: wrong account or password (-101),
/// disabled account (-102), anything else (-100). What that means for the stored password is judged at
/// once. Fault, fault code and response go into the user information; for -100 the description tells a fault,
/// a server that cannot be reached, one that closes the connection, and an answer that is none apart. Any
/// queue but the database's.
Error copyAndHandleXMLErrorResponse(const String& accountName, const String& passwordHash,
                                    const std::optional<Dictionary>& response,
                                    const std::optional<Error>& error);

/// Whether the server refuses the password (-101) or has disabled the account (-102).
bool refusesPassword(const std::optional<Error>& error);

/// Whether the server itself has answered the call, with a fault that says nothing of the password.
bool isOtherFault(const std::optional<Error>& error);

/// Judges the failure of an operation of the engine that used this password hash, as above; the log says what
/// becomes of the account. Any queue but the database's.
void handleServerError(const String& accountName, const String& sentPasswordHash,
                       const std::optional<Error>& error);

}  // namespace veltoid
