// The password-check service: a ping, the verification of a password, and the provisioning of a linked
// identity.
#pragma once

#include <functional>

#include "Platform/bus/MessageService.h"
#include "VeltoIDAuthd/ClientRequest.h"

namespace veltoid {

/// Handles one request of a client, synchronously, on the client's queue.
void handlePasswordCheckIPCMessage(platform::IncomingMessage& message);

/// The verification that both services offer: false without an error when account or password is missing.
bool verifyRequestedPassword(const Request& request, ErrorOut error);

/// Updates the provisioning of the linked identity that the reference names.
using LinkedIdentityHandler = std::function<bool(const Data& identityReference, ErrorOut error)>;

/// Without a handler the platform has no such service, and requests fail with -114. Called once, at start.
void setLinkedIdentityHandler(LinkedIdentityHandler handler);

}  // namespace veltoid
