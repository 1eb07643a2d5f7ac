// The engine's one reaction to the server's verdict that a password can no longer be used.
#pragma once

#include <optional>

#include "Values/Error.h"

namespace veltoid {

/// Removes the account's password, which disables the account until a client adds it again, when the server
/// no longer supports this client (-105), refuses the password (-101) or has disabled the account (-102).
/// Nothing for any other error or none. Caller's queue.
void handleServerError(const String& accountName, const std::optional<Error>& error);

}  // namespace veltoid
