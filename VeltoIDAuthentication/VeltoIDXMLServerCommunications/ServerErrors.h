// Server faults as the agent's errors.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Where people manage their account.
inline constexpr std::string_view kVeltoIDAccountManagementSite = "https://account.velto.example";

/// The agent's error for a call that failed with this password hash: wrong account or password (-101),
/// disabled account (-102), anything else (-100). What that means for the stored password is judged at once
/// (PasswordRefusal.h). Fault, fault code and response go into the user information. Any queue but the
/// database's.
Error copyAndHandleXMLErrorResponse(const String& accountName, const String& passwordHash,
                                    const std::optional<Dictionary>& response,
                                    const std::optional<Error>& error);

}  // namespace veltoid
