// The requests of the authentication service: each unpacks its arguments, calls one operation of the engine
// or the database, and packs the answer.
#pragma once

#include "Platform/bus/MessageService.h"

namespace veltoid {

/// Handles one request of a client, synchronously, on the client's queue.
void handleAuthenticationIPCMessage(platform::IncomingMessage& message);

}  // namespace veltoid
