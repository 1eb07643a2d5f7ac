// Digests, random bytes and sealing (OpenSSL; random bytes come from the kernel).
#pragma once

#include <array>
#include <optional>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

using SHA256Digest = std::array<uint8_t, 32>;
using UUIDBytes = std::array<uint8_t, 16>;

inline constexpr size_t kSealingKeyBytes = 32;

/// Any thread.
SHA256Digest sha256(Bytes bytes);

/// Fills the span with random bytes; aborts when the kernel gives none, since nothing safe can go on without.
void fillRandom(std::span<uint8_t> bytes);

/// A random (version 4) UUID, RFC 4122.
UUIDBytes randomUUID();

/// 36 characters, upper-case hexadecimal, hyphens after the 8th, 12th, 16th and 20th digit.
std::string canonicalUUIDText(const UUIDBytes& uuid);

/// AES-256-GCM with a fresh random nonce: nonce (12 bytes), ciphertext, tag (16 bytes). `key` holds
/// kSealingKeyBytes.
SecretBytes seal(Bytes key, Bytes additionalData, Bytes plain);

/// None when key, additional data or sealed bytes are not the ones that were sealed together.
std::optional<SecretBytes> unseal(Bytes key, Bytes additionalData, Bytes sealed);

/// How costly it is to try a passphrase (RFC 7914): memory of 128 * 2^logN * blockSize bytes, and time.
struct ScryptCost {
    uint8_t logN = 16;
    uint8_t blockSize = 8;
    uint8_t parallelism = 1;
};

/// Deriving takes at most so much memory; a cost beyond it is refused.
inline constexpr size_t kMaxScryptBytes = size_t{256} << 20U;

/// A key of kSealingKeyBytes that only who knows the passphrase can derive. None when the cost is refused or
/// there is no memory for it.
std::optional<SecretBytes> deriveKey(Bytes passphrase, Bytes salt, const ScryptCost& cost);

}  // namespace platform
