// The message-passing service: named services whose clients send dictionary messages and get dictionary
// replies, over D-Bus (session bus; the system bus when DBUS_STARTER_BUS_TYPE says so).
//
// A service is a well-known bus name. All of them share the product's object with its message interface and
// the method Send(a{sv}) -> (a{sv}) of that. A peer is a unique bus name; its first message to a service is
// the new-connection event, and the bus saying that the name is gone ends the connection. Messages of other
// users (root excepted) are refused before any handler sees them.
//
// On the wire a value is: boolean b; signed integer x (y n q i u are read too); unsigned t; double d; string
// s (o is read too); data ay; array av (any other array is read too); dictionary a{sv} (any string-keyed one
// is read too); date (d), seconds since 1970-01-01 UTC; null g with an empty signature; UUID (ay) of 16
// bytes; file descriptor h.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <variant>

#include "Platform/bus/PeerConnection.h"

namespace platform {

using ListenerEvent = std::variant<ConnectionError, std::shared_ptr<PeerConnection>>;

/// A named service. Main queue; events arrive there.
class Listener {
  public:
    virtual ~Listener() = default;
    /// One without a name is reached through the connection's unique name.
    static std::shared_ptr<Listener> create(std::string serviceName,
                                            std::function<void(const ListenerEvent&)> handler);

    /// Claims the name; what comes for it is delivered once the event loop runs. False, logged with the
    /// process that has the name, when it cannot be had, or no bus can.
    [[nodiscard]] virtual bool claim() = 0;
};

namespace message_service {

/// Calls `handler` on the main queue when the bus has ended the connection, after the listeners were told.
/// Once, at start.
void onConnectionLost(std::function<void()> handler);

/// Tells every listener that the process is about to be ended. Main queue.
void announceTermination();

/// Gives up the services' names: what is sent to them from then on makes the bus start the next agent. What
/// was sent before is still handled; `done` is called on the main queue when that has been answered or
/// dropped. Main queue, once.
void releaseNames(std::function<void()> done);

}  // namespace message_service

}  // namespace platform
