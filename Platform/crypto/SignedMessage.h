// CMS signed data (RFC 5652).
#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Longer messages are refused.
inline constexpr size_t kMaxSignedMessageBytes = size_t{4} << 20U;

/// The content of a signed message (DER or BER) that carries its content and whose signatures, one at least,
/// all verify with the certificates that it carries; none otherwise. Who the signers are is not looked at: no
/// chain is built and no purpose asked for. Any thread.
std::optional<std::vector<uint8_t>> verifySignedMessage(Bytes message);

}  // namespace platform
