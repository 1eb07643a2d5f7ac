// What both services' requests have in common: command, account, options, and the reply.
#pragma once

#include <memory>
#include <optional>
#include <utility>

#include "IPCHelpers/IPCMessage.h"
#include "Platform/bus/MessageService.h"
#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// One request and the reply under construction. On the client's queue.
class Request {
  public:
    /// Reads the message.
    explicit Request(platform::IncomingMessage& message);

    int64_t command() const { return command_; }
    /// False, with the error, when the request holds a date or a number that is not finite: it is refused.
    bool isSound(ErrorOut error) const;
    /// Whether it holds what cannot be stored: a file descriptor.
    bool hasDescriptor() const { return hasDescriptor_; }
    /// Lower-cased; null when absent.
    const String& account() const { return account_; }
    /// Empty when absent.
    const Dictionary& options() const { return options_; }

    String string(std::string_view key) const {
        return request_.copyValue(key, Value::Kind::String).asString();
    }
    Data data(std::string_view key) const { return request_.copyValue(key, Value::Kind::Data).asData(); }
    Value value(std::string_view key) const { return request_.copyValue(key); }
    /// Empty when absent.
    Dictionary dictionary(std::string_view key) const;

    /// Adds an entry to the reply; an absent value adds nothing.
    void answer(const String& key, const Value& value) { reply_.setValue(key, value); }

    /// Whether nobody waits for the reply any more.
    bool isSenderGone() const { return message_.isSenderGone(); }

    /// Keeps something until the reply is on its way, so that no later one overtakes it.
    void holdUntilFinished(std::shared_ptr<const void> held) { held_ = std::move(held); }

    /// Sends the reply with "success", and with "error" when the outcome is a failure that has one.
    void finish(bool success, const std::optional<Error>& error);

  private:
    explicit Request(platform::IncomingMessage& message, MessageValueBuilder read);

    platform::IncomingMessage& message_;
    bool isFinite_;
    bool hasDescriptor_;
    IPCMessage request_;
    IPCMessage reply_;
    int64_t command_ = 0;
    String account_;
    Dictionary options_;
    std::shared_ptr<const void> held_;
};

}  // namespace veltoid
