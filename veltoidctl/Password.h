// Passwords on their way from a person to the agent.
#pragma once

#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace veltoidctl {

enum class PasswordSource {
    /// Asked for at the terminal, without echo.
    Prompt,
    /// The first line of standard input.
    StandardInput,
    /// The first line of standard input, which already is the hash.
    HashedStandardInput,
};

/// The password hash to send: lower-case hexadecimal SHA-256 of the UTF-8 password. Everything read is wiped.
/// Throws std::runtime_error when there is no terminal to ask at, or no line.
platform::SecretText readPasswordHash(PasswordSource source, const std::string& account);

/// A password as it is, for something new: at the terminal it is asked for twice. Throws std::runtime_error
/// like readPasswordHash, and when it was not the same twice.
platform::SecretText readNewPassword(PasswordSource source, const std::string& purpose);

/// A password as it is. Throws like readPasswordHash.
platform::SecretText readPassword(PasswordSource source, const std::string& question);

}  // namespace veltoidctl
