// Finding people through the identity server.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Asks the server for people by criteria (criterion name to Array of values), as the given account, or,
/// without a name, as the first one that has password and encDsId. A name without password takes the
/// account's. No account at all: -2. Other errors are the session's (also passed to handleServerError), else
/// -100. The results stay none when the server gave none. Caller's queue; blocks while the server is asked.
bool __VeltoIDDoFindPerson(const String& accountName, const String& hashedPassword,
                           const Dictionary& criteria, const Dictionary& options,
                           std::optional<Array>* results, ErrorOut error = nullptr);

}  // namespace veltoid
