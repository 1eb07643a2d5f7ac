#include "Platform/crypto/Crypto.h"

#include <openssl/evp.h>
#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/encoding/HexText.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTIONS(library, EVP_aes_256_gcm, EVP_CIPHER_CTX_ctrl, EVP_CIPHER_CTX_free, EVP_CIPHER_CTX_new,
                       EVP_CipherFinal_ex, EVP_CipherInit_ex2, EVP_CipherUpdate, EVP_Digest, EVP_PBE_scrypt,
                       EVP_sha256);

constexpr size_t kNonceBytes = 12;
constexpr size_t kTagBytes = 16;
/// The library counts in int: longer input goes in pieces.
constexpr size_t kPieceBytes = size_t{1} << 30U;

using CipherContext = LazyOwner<EVP_CIPHER_CTX, EVP_CIPHER_CTX_free>;

/// Digests and sealing fail only when memory or the library itself is broken: nothing safe can go on without
/// them.
[[noreturn]] void abortOnFailure(const char* what, const std::string& reason) {
    VELTOID_PLATFORM_LOG(Critical, std::string(what) + " failed: " + reason);
    std::abort();
}

bool feed(EVP_CIPHER_CTX* context, uint8_t* output, Bytes input) {
    while (!input.empty()) {
        const auto piece = input.first(std::min(input.size(), kPieceBytes));
        int written = 0;
        if (EVP_CipherUpdate(context, output, &written, piece.data(), static_cast<int>(piece.size())) != 1)
            return false;
        if (output != nullptr) output += written;
        input = input.subspan(piece.size());
    }
    return true;
}

enum class Direction : int { Decrypt = 0, Encrypt = 1 };

/// Writes as many bytes as it reads. GCM is a stream: the final call only forms or checks the tag, but wants
/// somewhere to point at.
bool run(Direction direction, Bytes key, Bytes nonce, Bytes additionalData, Bytes input, uint8_t* output,
         uint8_t* tag) {
    const CipherContext context(EVP_CIPHER_CTX_new());
    uint8_t nothing[1];
    int written = 0;
    const auto passTagWhen = [&](Direction when, int command) {
        return direction != when || EVP_CIPHER_CTX_ctrl(context.get(), command, kTagBytes, tag) == 1;
    };
    return context != nullptr &&
           EVP_CipherInit_ex2(context.get(), EVP_aes_256_gcm(), key.data(), nonce.data(),
                              static_cast<int>(direction), nullptr) == 1 &&
           passTagWhen(Direction::Decrypt, EVP_CTRL_AEAD_SET_TAG) &&
           feed(context.get(), nullptr, additionalData) && feed(context.get(), output, input) &&
           EVP_CipherFinal_ex(context.get(), nothing, &written) == 1 &&
           passTagWhen(Direction::Encrypt, EVP_CTRL_AEAD_GET_TAG);
}

}  // namespace

SHA256Digest sha256(Bytes bytes) {
    SHA256Digest digest{};
    if (EVP_Digest(bytes.data(), bytes.size(), digest.data(), nullptr, EVP_sha256(), nullptr) != 1) {
        abortOnFailure("SHA-256", openssl::takeReason());
    }
    return digest;
}

void fillRandom(std::span<uint8_t> bytes) {
    while (!bytes.empty()) {
        const ssize_t got = getrandom(bytes.data(), bytes.size(), 0);
        if (got > 0) {
            bytes = bytes.subspan(static_cast<size_t>(got));
        } else if (errno != EINTR) {
            abortOnFailure("getrandom", std::strerror(errno));
        }
    }
}

UUIDBytes randomUUID() {
    UUIDBytes uuid{};
    fillRandom(uuid);
    uuid[6] = static_cast<uint8_t>((uuid[6] & 0x0FU) | 0x40U);
    uuid[8] = static_cast<uint8_t>((uuid[8] & 0x3FU) | 0x80U);
    return uuid;
}

std::string canonicalUUIDText(const UUIDBytes& uuid) {
    std::string text = hexText(uuid, kUpperCaseDigits);
    for (const unsigned hyphen : {8U, 13U, 18U, 23U}) text.insert(hyphen, 1, '-');
    return text;
}

SecretBytes seal(Bytes key, Bytes additionalData, Bytes plain) {
    if (key.size() != kSealingKeyBytes) abortOnFailure("sealing", "the key has the wrong size");
    SecretBytes sealed(kNonceBytes + plain.size() + kTagBytes);
    const auto nonce = std::span(sealed).first(kNonceBytes);
    fillRandom(nonce);
    uint8_t* const tag = sealed.data() + kNonceBytes + plain.size();
    if (!run(Direction::Encrypt, key, nonce, additionalData, plain, sealed.data() + kNonceBytes, tag))
        abortOnFailure("sealing", openssl::takeReason());
    return sealed;
}

std::optional<SecretBytes> unseal(Bytes key, Bytes additionalData, Bytes sealed) {
    if (key.size() != kSealingKeyBytes || sealed.size() < kNonceBytes + kTagBytes) return std::nullopt;
    SecretBytes plain(sealed.size() - kNonceBytes - kTagBytes);
    uint8_t tag[kTagBytes];
    std::ranges::copy(sealed.last(kTagBytes), tag);
    if (run(Direction::Decrypt, key, sealed.first(kNonceBytes), additionalData,
            sealed.subspan(kNonceBytes, plain.size()), plain.data(), tag))
        return plain;
    openssl::clearErrors();
    return std::nullopt;
}

std::optional<SecretBytes> deriveKey(Bytes passphrase, Bytes salt, const ScryptCost& cost) {
    if (cost.logN == 0 || cost.logN >= 32) return std::nullopt;
    SecretBytes key(kSealingKeyBytes);
    if (EVP_PBE_scrypt(textOf(passphrase).data(), passphrase.size(), salt.data(), salt.size(),
                       uint64_t{1} << cost.logN, cost.blockSize, cost.parallelism, kMaxScryptBytes,
                       key.data(), key.size()) == 1)
        return key;
    openssl::clearErrors();
    return std::nullopt;
}

}  // namespace platform
