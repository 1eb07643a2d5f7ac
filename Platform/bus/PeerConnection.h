// A client's connection to a service, and the requests that come over it.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string_view>
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

    /// Whether the sender's connection has ended since. Any thread.
    virtual bool isSenderGone() const { return false; }
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

}  // namespace platform
