// The message-passing service: named services whose clients send dictionary messages and get dictionary
// replies, over D-Bus (session bus; the system bus when DBUS_STARTER_BUS_TYPE says so).
//
// A service is a well-known bus name. All of them share the object /com/velto/harbwell/veltoid with the
// interface com.velto.harbwell.veltoid.MessageService and its method Send(a{sv}) -> (a{sv}). A peer is a
// unique bus name; its first message to a service is the new-connection event, and the bus saying that the
// name is gone ends the connection. Messages of other users (root excepted) are refused before any handler
// sees them.
//
// On the wire a value is: boolean b; signed integer x (y n q i u are read too); unsigned t; double d; string
// s (o is read too); data ay; array av (any other array is read too); dictionary a{sv} (any string-keyed one
// is read too); date (d), seconds since 1970-01-01 UTC; null g with an empty signature; UUID (ay) of 16
// bytes; file descriptor h.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "Platform/encoding/ValueSink.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {

/// Containers nested deeper than this are not converted; their place is taken by null.
inline constexpr int kMaxMessageDepth = 32;

enum class ConnectionError { Invalid, Interrupted, TerminationImminent };

/// A request. Used by one thread at a time.
class IncomingMessage {
  public:
    virtual ~IncomingMessage() = default;

    /// The signed integer under `key`, found without converting the rest.
    virtual std::optional<int64_t> peekInteger(std::string_view key) = 0;

    /// Writes the dictionary into the sink. May be called once.
    virtual void read(ValueSink& sink) = 0;

    /// Sends the dictionary that `writer` writes as the reply, from any thread; the first reply counts. A
    /// message that is dropped without one leaves its sender waiting until the connection ends.
    virtual void reply(ValueWriter writer) = 0;
};

using PeerEvent = std::variant<ConnectionError, std::shared_ptr<IncomingMessage>>;

/// A client's connection to one service. Set up on the main queue, inside the new-connection event.
class PeerConnection {
  public:
    virtual ~PeerConnection() = default;

    virtual pid_t processID() const = 0;
    virtual uid_t userID() const = 0;

    /// Where the events of this connection are handled.
    virtual void setTargetQueue(WorkQueue queue) = 0;
    virtual void setEventHandler(std::function<void(const PeerEvent&)> handler) = 0;

    /// Messages for which `test` answers true are handled on the bus thread when the target queue is idle, as
    /// that queue's task: for requests that are answered without waiting for anything, where waking another
    /// thread would cost more than the answer.
    virtual void setAnsweredAtOnce(std::function<bool(IncomingMessage&)> test) = 0;

    /// Starts delivery; until then events wait.
    virtual void resume() = 0;
};

using ListenerEvent = std::variant<ConnectionError, std::shared_ptr<PeerConnection>>;

/// A named service. Main queue; events arrive there.
class Listener {
  public:
    virtual ~Listener() = default;
    /// One without a name is reached through the connection's unique name.
    static std::shared_ptr<Listener> create(std::string serviceName,
                                            std::function<void(const ListenerEvent&)> handler);

    /// Claims the name and starts delivery. Failing to reach the bus or to get the name is an Invalid event.
    virtual void resume() = 0;
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
