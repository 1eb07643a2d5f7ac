// What the server's faults mean: as the agent's errors, and for the stored password. This is the one place
// that judges them, and the only one that removes a password because the server refuses it.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Where people manage their account.
inline constexpr std::string_view kVeltoIDAccountManagementSite = "https://account.velto.example";

/// The agent's error for a call that failed with this password hash: wrong account or password (-101),
/// disabled account (-102), anything else (-100). What that means for the stored password is judged at
/// once. Fault, fault code and response go into the user information. Any queue but the database's.
Error copyAndHandleXMLErrorResponse(const String& accountName, const String& passwordHash,
                                    const std::optional<Dictionary>& response,
                                    const std::optional<Error>& error);

/// Whether the server refuses the password (-101) or has disabled the account (-102).
bool refusesPassword(const std::optional<Error>& error);

/// The verdict on a failed call that was made with this password hash: the account's password is removed,
/// which disables the account until a client adds it again, when the server refuses it, has disabled the
/// account, or no longer supports this client (-105); nothing for other errors. Any queue but the database's.
void judgeRefusal(const String& accountName, const String& sentPasswordHash,
                  const std::optional<Error>& error);

/// The same at the end of an operation of the engine: the log says so.
void handleServerError(const String& accountName, const String& sentPasswordHash,
                       const std::optional<Error>& error);

}  // namespace veltoid
