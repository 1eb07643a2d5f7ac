// Secrets that the kernel keeps for this user until the device is switched off: the user keyring. Processes
// of the user can read them, files and swap never hold them. See keyrings(7).
#pragma once

#include <optional>
#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace platform::kernel_keyring {

/// Any thread. False, with a log line, when the kernel refuses; an earlier secret of that name is replaced.
bool store(const std::string& name, Bytes secret);

/// None when there is none of that name, or none that can be read.
std::optional<SecretBytes> find(const std::string& name);

/// False, with a log line, when there is one and it stays.
bool remove(const std::string& name);

}  // namespace platform::kernel_keyring
