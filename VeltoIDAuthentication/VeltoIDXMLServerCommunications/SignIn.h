// Signing an account in to the identity server.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDXMLServerCommunications/Session.h"

namespace veltoid {

/// Signs in with the password hash, or takes a cached session that is still valid. Refuses, before any
/// network traffic, while the account is under a connection embargo (-103) or marked as too old a client
/// (-104). Applies what the reply says about the account: embargo, encDsId, certificate and validation
/// record.
///
/// Options: "ServerURL" (URL or String), "DoNotUseCachedSession", "DoNotSaveSessionInfo" (Booleans, default
/// false). On success the encDsId and, after a new sign-in, the reply are handed out; on failure the error.
/// Null without account name or password hash (no error then). Runs on the account's queue; blocks for at
/// most 5 seconds.
Session __VeltoIDSessionDoCreateSession(const String& accountName, const String& passwordHash,
                                        const Dictionary& options, String* encDsId = nullptr,
                                        std::optional<Dictionary>* result = nullptr,
                                        ErrorOut error = nullptr);

/// The protocol version of the last authenticate reply, of an earlier agent too; 0 before any. Any queue but
/// the database's.
int32_t __VeltoIDSessionGetServerVersion();

}  // namespace veltoid
