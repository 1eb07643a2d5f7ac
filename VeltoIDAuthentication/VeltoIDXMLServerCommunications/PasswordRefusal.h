// What an answer of the server means for the stored password. This is the one place that judges it, and the
// only one that removes a password because the server refuses it.
#pragma once

#include <optional>

#include "Values/Error.h"

namespace veltoid {

/// Whether the server refuses the password (-101) or has disabled the account (-102).
bool refusesPassword(const std::optional<Error>& error);

/// The verdict on a failed call that was made with this password hash: the account's password is removed,
/// which disables the account until a client adds it again, when the server refuses it, has disabled the
/// account, or no longer supports this client (-105). Nothing for any other error. Any queue but the
/// database's.
void judgeRefusal(const String& accountName, const String& sentPasswordHash,
                  const std::optional<Error>& error);

/// The same at the end of an operation of the engine: the log says so.
void handleServerError(const String& accountName, const String& sentPasswordHash,
                       const std::optional<Error>& error);

}  // namespace veltoid
