// Server faults as the agent's errors.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Where people manage their account.
inline constexpr std::string_view kVeltoIDAccountManagementSite = "https://account.velto.example";

/// The agent's error for a failed call: wrong account or password (-101) and disabled account (-102) also
/// remove the stored password of the account; anything else is -100. Fault, fault code and response go into
/// the user information. Any queue but the database's.
Error copyAndHandleXMLErrorResponse(const String& accountName, const std::optional<Dictionary>& response,
                                    const std::optional<Error>& error);

}  // namespace veltoid
