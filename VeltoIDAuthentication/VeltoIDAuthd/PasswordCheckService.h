// The password-check service: a ping, the verification of a password, and the provisioning of a linked
// identity.
#pragma once

#include <functional>

#include "Platform/bus/MessageService.h"
#include "VeltoIDAuthd/ClientRequest.h"

namespace veltoid {

/// The verification that both services offer: false without an error when account or password is missing.
bool verifyRequestedPassword(Request& request, ErrorOut error);

/// Updates the provisioning of the linked identity that the reference names.
using LinkedIdentityHandler = std::function<bool(const Data& identityReference, ErrorOut error)>;

/// Handles one request of a client, synchronously, on the client's queue. An empty handler means that the
/// platform has no such service: its requests fail with -114.
void handlePasswordCheckIPCMessage(platform::IncomingMessage& message,
                                   const LinkedIdentityHandler& linkedIdentity = {});

}  // namespace veltoid
