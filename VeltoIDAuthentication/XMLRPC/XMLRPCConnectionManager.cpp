#include "XMLRPC/XMLRPCConnectionManager.h"

#include <utility>

#include "Platform/runtime/Lifetime.h"

namespace veltoid {

XMLRPCConnectionManager& XMLRPCConnectionManager::sharedManager() {
    return platform::Lifetime::current().state<XMLRPCConnectionManager>();
}

String XMLRPCConnectionManager::spawnConnectionWithXMLRPCRequest(
    std::shared_ptr<XMLRPCRequest> request, std::shared_ptr<XMLRPCConnectionDelegate> delegate) {
    const auto connection = XMLRPCConnection::initWithXMLRPCRequest(
        std::move(request), std::move(delegate),
        [this](const String& identifier) { closeConnectionForIdentifier(identifier); });
    if (!connection) return nullptr;
    {
        const std::lock_guard lock(mutex_);
        connections_.emplace(connection->identifier().text(), connection);
    }
    // Held before it starts: it may end at once.
    connection->start();
    return connection->identifier();
}

std::vector<String> XMLRPCConnectionManager::activeConnectionIdentifiers() const {
    const std::lock_guard lock(mutex_);
    std::vector<String> identifiers;
    identifiers.reserve(connections_.size());
    for (const auto& [identifier, connection] : connections_) identifiers.emplace_back(identifier);
    return identifiers;
}

size_t XMLRPCConnectionManager::numberOfActiveConnections() const {
    const std::lock_guard lock(mutex_);
    return connections_.size();
}

std::shared_ptr<XMLRPCConnection> XMLRPCConnectionManager::connectionForIdentifier(
    const String& identifier) const {
    const std::lock_guard lock(mutex_);
    const auto position = connections_.find(identifier.view());
    return position == connections_.end() ? nullptr : position->second;
}

void XMLRPCConnectionManager::closeConnectionForIdentifier(const String& identifier) {
    std::shared_ptr<XMLRPCConnection> connection;
    {
        const std::lock_guard lock(mutex_);
        const auto position = connections_.find(identifier.view());
        if (position == connections_.end()) return;
        connection = std::move(position->second);
        connections_.erase(position);
    }
    connection->cancel();
}

void XMLRPCConnectionManager::closeConnections() {
    decltype(connections_) connections;
    {
        const std::lock_guard lock(mutex_);
        connections.swap(connections_);
    }
    for (const auto& [identifier, connection] : connections) connection->cancel();
}

}  // namespace veltoid
