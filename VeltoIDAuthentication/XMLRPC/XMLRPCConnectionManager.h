// Owns the event-driven XML-RPC connections that are under way.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <vector>

#include "XMLRPC/XMLRPCConnection.h"

namespace veltoid {

/// All operations may be called from any thread.
class XMLRPCConnectionManager {
  public:
    /// The one of this lifetime.
    static XMLRPCConnectionManager& sharedManager();

    /// Starts an exchange whose outcome goes to the delegate. The identifier of the connection; null when
    /// there is no HTTP session to be had.
    String spawnConnectionWithXMLRPCRequest(std::shared_ptr<XMLRPCRequest> request,
                                            std::shared_ptr<XMLRPCConnectionDelegate> delegate);

    std::vector<String> activeConnectionIdentifiers() const;
    size_t numberOfActiveConnections() const;
    /// Null when no connection of that identifier is held.
    std::shared_ptr<XMLRPCConnection> connectionForIdentifier(const String& identifier) const;

    /// Cancels the connection and lets go of it; nothing when it is not held.
    void closeConnectionForIdentifier(const String& identifier);
    void closeConnections();

    void lifetimeEnds() { closeConnections(); }

  private:
    mutable std::mutex mutex_;
    /// By identifier; guarded by the mutex, which is never held while a connection is called.
    std::map<std::string, std::shared_ptr<XMLRPCConnection>, std::less<>> connections_;
};

}  // namespace veltoid
