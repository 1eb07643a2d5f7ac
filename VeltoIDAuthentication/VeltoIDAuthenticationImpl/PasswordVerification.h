// Checking a password with the server, without keeping anything.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Signs in anew with the password and gives the session up again. -99 without account name or password;
/// otherwise the session's error, or -101. Caller's queue; blocks while the server is asked.
bool __VeltoIDDoVerifyPassword(const String& accountName, const String& hashedPassword,
                               const Dictionary& options, ErrorOut error = nullptr);

}  // namespace veltoid
