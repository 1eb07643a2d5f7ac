// Requests to the agent's service.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "Platform/runtime/SecureMemory.h"
#include "veltoidctl/AgentConnection.h"

namespace veltoidctl {

/// Commands of the agent's service.
inline constexpr int64_t kPingCommand = 0x1;
inline constexpr int64_t kAddCommand = 0x120;
inline constexpr int64_t kInfoCommand = 0x130;
inline constexpr int64_t kFindCommand = 0x140;
inline constexpr int64_t kFindCachedCommand = 0x141;
inline constexpr int64_t kListCommand = 0x150;
inline constexpr int64_t kForgetCommand = 0x160;
inline constexpr int64_t kCertificateCommand = 0x170;
inline constexpr int64_t kVerifyCommand = 0x180;
inline constexpr int64_t kSetBreadcrumbCommand = 0x200;
inline constexpr int64_t kGetBreadcrumbCommand = 0x201;
inline constexpr int64_t kDatabaseCommand = 0x500;
inline constexpr int64_t kStatusCommand = 0x510;

struct Request {
    int64_t command = 0;
    /// Empty: the request carries none. So with the password hash.
    std::string account = {};
    platform::SecretText passwordHash = {};
    std::vector<std::pair<std::string, std::variant<bool, double>>> options = {};
    /// Writes the keys and values that only this command has.
    std::function<void(platform::ValueSink&)> entries = {};
};

/// The agent's reply. Throws Unreachable.
Json send(AgentConnection& agent, const Request& request);

bool succeeded(const Json& reply);

/// Why something could not be had: that the keychain is locked, if it is, else `reason`.
std::string reasonUnlessLocked(const std::string& reason);

}  // namespace veltoidctl
