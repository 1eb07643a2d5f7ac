// Requests to the agent's service.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "Platform/runtime/SecureMemory.h"
#include "veltoidctl/AgentConnection.h"
#include "veltoidctl/Arguments.h"

namespace veltoidctl {

struct Request {
    /// One of Protocol/Commands.h.
    int64_t command = 0;
    /// Left out of the request when empty, like the password hash.
    std::string account = {};
    platform::SecretText passwordHash = {};
    std::vector<std::pair<std::string_view, std::variant<bool, double>>> options = {};
    /// Writes the keys and values that only this command has.
    std::function<void(platform::ValueSink&)> entries = {};
};

/// A request about the account that was named, with its password. Throws like readPasswordHash.
Request requestWithPassword(int64_t command, const Arguments& arguments);

/// The agent's reply. Throws Unreachable.
Json send(AgentConnection& agent, const Request& request);

bool succeeded(const Json& reply);

/// The reason for a failure: that the keychain is locked, if it is, else `reason`.
std::string reasonUnlessLocked(const std::string& reason);

}  // namespace veltoidctl
