// The outcome of an XML-RPC call as the server gave it.
#pragma once

#include "Platform/runtime/SecureMemory.h"
#include "Values/Value.h"

namespace veltoid {

/// Immutable: may be read from any thread.
class XMLRPCResponse {
  public:
    /// Parses the body. A response exists also when that fails; its object is then absent.
    explicit XMLRPCResponse(platform::SecretBytes data);

    bool isFault() const { return myIsFault; }
    const Value& object() const { return myObject; }

    /// The whole body, for diagnostics; null when it is not UTF-8. It may hold secrets: it is nothing for a
    /// log.
    String body() const;

    /// What the fault says of itself; absent when this is no fault or it says nothing.
    const Value& faultCode() const { return faultEntry("faultCode"); }
    const Value& faultString() const { return faultEntry("faultString"); }

  private:
    const Value& faultEntry(std::string_view key) const;

    platform::SecretBytes myBody;
    Value myObject;
    bool myIsFault = false;
};

}  // namespace veltoid
