// What clients ask of the identity server in one session each: people, small pieces of data that the server
// keeps for them per account and device, and whether a password is right. Caller's queue; blocks while the
// server is asked.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Asks the server for people by criteria (criterion name to Array of values), as the given account, or,
/// without a name, as the first one that has password and encDsId. A name without password takes the
/// account's. No account at all: -2. Other errors are the session's (also passed to handleServerError), else
/// -100. The results stay none when the server gave none.
bool __VeltoIDDoFindPerson(const String& accountName, const String& hashedPassword,
                           const Dictionary& criteria, const Dictionary& options,
                           std::optional<Array>* results, ErrorOut error = nullptr);

/// Signs in and stores the data under the key. The error is the session's, else -100.
bool __VeltoIDDoSetBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                              const Data& data, const Dictionary& options, ErrorOut error = nullptr);

/// Signs in and fetches what is stored under the key; null, with an error (the session's, else -100), when
/// nothing is.
Data __VeltoIDDoCopyBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                               const Dictionary& options, ErrorOut error = nullptr);

/// Signs in anew with the password and gives the session up again. -99 without account name or password;
/// otherwise the session's error, or -101.
bool __VeltoIDDoVerifyPassword(const String& accountName, const String& hashedPassword,
                               const Dictionary& options, ErrorOut error = nullptr);

}  // namespace veltoid
