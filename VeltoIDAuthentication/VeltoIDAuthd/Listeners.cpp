#include "VeltoIDAuthd/Listeners.h"

#include <memory>

#include "Platform/bus/MessageService.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "VeltoIDAuthd/AuthenticationService.h"
#include "VeltoIDAuthd/ClientRequest.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using platform::ConnectionError;
using platform::PeerConnection;

using RequestHandler = std::function<void(platform::IncomingMessage& message)>;

/// A ping waits for nothing.
bool isAnsweredAtOnce(platform::IncomingMessage& incoming) {
    return incoming.peekInteger(message::kCommand) == command::kPing;
}

void serve(PeerConnection& peer, const RequestHandler& handle) {
    peer.setTargetQueue(platform::WorkQueue("client " + std::to_string(peer.processID())));
    // The queue ends with the last event that uses it: the end of the connection needs no action.
    peer.setEventHandler([handle](const platform::PeerEvent& event) {
        if (const auto* message = std::get_if<std::shared_ptr<platform::IncomingMessage>>(&event))
            handle(**message);
    });
    peer.setAnsweredAtOnce(isAnsweredAtOnce);
    peer.resume();
}

/// After anything but the notice that the process is about to end, clients may not reach it any more.
void handleAuthenticationListenerError(ConnectionError error) {
    if (error != ConnectionError::TerminationImminent) computeRelaunchFromAccounts();
    __VeltoIDDBSynchronize();
}

}  // namespace

bool registerAuthenticationListener(const std::string& serviceName) {
    const auto listener = platform::Listener::create(serviceName, [](const platform::ListenerEvent& event) {
        if (const auto* error = std::get_if<ConnectionError>(&event)) {
            handleAuthenticationListenerError(*error);
        } else {
            serve(*std::get<std::shared_ptr<PeerConnection>>(event), handleAuthenticationIPCMessage);
        }
    });
    return listener->claim();
}

bool registerPasswordCheckListener(const LinkedIdentityHandler& linkedIdentity) {
    const RequestHandler handle = [linkedIdentity](platform::IncomingMessage& message) {
        handlePasswordCheckIPCMessage(message, linkedIdentity);
    };
    const auto listener = platform::Listener::create(
        kVeltoIDPasswordCheckServiceName, [handle](const platform::ListenerEvent& event) {
            if (const auto* peer = std::get_if<std::shared_ptr<PeerConnection>>(&event))
                serve(**peer, handle);
        });
    return listener->claim();
}

}  // namespace veltoid
