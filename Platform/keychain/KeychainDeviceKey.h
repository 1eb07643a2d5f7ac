// The device key, which wraps the keychain's class keys: keychain.key, beside the keychain, mode 0600.
// Internal to the keychain.
#pragma once

#include <optional>
#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace platform::keychain {

/// The device key of `directory`. Created when it is missing and `mayCreate`; an existing file is never
/// replaced. None, with a log line, when it cannot be had. Any thread.
std::optional<SecretBytes> deviceKey(const std::string& directory, bool mayCreate);

}  // namespace platform::keychain
