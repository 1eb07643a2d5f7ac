#include "XMLRPC/XMLRPCConnectionManager.h"

#include <utility>

#include "Platform/runtime/Lifetime.h"

namespace veltoid {

XMLRPCConnectionManager& XMLRPCConnectionManager::sharedManager() {
    return platform::Lifetime::current().state<XMLRPCConnectionManager>();
}

String XMLRPCConnectionManager::spawnConnectionWithXMLRPCRequest(
    std::shared_ptr<XMLRPCRequest> request, std::shared_ptr<XMLRPCConnectionDelegate> delegate) {
    const auto connection =
        XMLRPCConnection::initWithXMLRPCRequest(std::move(request), std::move(delegate), *this);
    if (!connection) return nullptr;
    {
        const std::lock_guard lock(mutex_);
        myConnections.emplace(connection->identifier().text(), connection);
    }
    // Held before it starts: it closes itself when it is done, which may be at once.
    connection->start();
    return connection->identifier();
}

std::vector<String> XMLRPCConnectionManager::activeConnectionIdentifiers() const {
    const std::lock_guard lock(mutex_);
    std::vector<String> identifiers;
    identifiers.reserve(myConnections.size());
    for (const auto& [identifier, connection] : myConnections) identifiers.emplace_back(identifier);
    return identifiers;
}

size_t XMLRPCConnectionManager::numberOfActiveConnections() const {
    const std::lock_guard lock(mutex_);
    return myConnections.size();
}

std::shared_ptr<XMLRPCConnection> XMLRPCConnectionManager::connectionForIdentifier(
    const String& identifier) const {
    const std::lock_guard lock(mutex_);
    const auto position = myConnections.find(identifier.view());
    return position == myConnections.end() ? nullptr : position->second;
}

void XMLRPCConnectionManager::closeConnectionForIdentifier(const String& identifier) {
    std::shared_ptr<XMLRPCConnection> connection;
    {
        const std::lock_guard lock(mutex_);
        const auto position = myConnections.find(identifier.view());
        if (position == myConnections.end()) return;
        connection = std::move(position->second);
        myConnections.erase(position);
    }
    connection->cancel();
}

void XMLRPCConnectionManager::closeConnections() {
    decltype(myConnections) connections;
    {
        const std::lock_guard lock(mutex_);
        connections.swap(myConnections);
    }
    for (const auto& [identifier, connection] : connections) connection->cancel();
}

}  // namespace veltoid
