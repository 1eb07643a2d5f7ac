// A dictionary message: a request, a reply, or the connection-level error that came instead of one.
#pragma once

#include <memory>
#include <optional>
#include <span>

#include "IPCHelpers/MessageValue.h"
#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// What a wrapper owns; shared between wrappers of the same message.
using MessageObject = std::shared_ptr<MessageValue>;

/// Used on one queue at a time. A wrapper that holds nothing reads as an empty message and ignores writes.
class IPCMessage {
  public:
    /// A new, empty dictionary message.
    IPCMessage();

    /// Wraps the message object. A null one is logged, and the wrapper then holds nothing.
    explicit IPCMessage(MessageObject message);

    /// A dictionary message of the keys and the values at the same positions; the shorter of the two counts.
    IPCMessage(std::span<const String> keys, std::span<const MessageValue> values);

    const MessageObject& message() const { return message_; }

    /// Stores the value under `key`, replacing an entry, when both are given and the value can be carried.
    void setValue(const String& key, const Value& value);

    /// The entry, converted; absent when there is none, when it cannot be converted, or when it is not of the
    /// expected kind.
    Value copyValue(std::string_view key, std::optional<Value::Kind> expectedKind = std::nullopt) const;

    /// The String under `key`, in lower case: accounts whose names differ in case alone, whatever the
    /// alphabet, are one.
    String copyAccountName(std::string_view key) const;

    /// Stores the error as a dictionary under "error".
    void setError(const Error& error);

    /// The error that a reply carries; one of code -11 when it carries none, with the description of a
    /// connection-level error when it is one.
    Error copyError() const;

    /// Whether the message is a connection-level error.
    bool isError() const;

  private:
    MessageObject message_;
};

}  // namespace veltoid
