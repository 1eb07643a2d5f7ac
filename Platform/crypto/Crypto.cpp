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
                       EVP_DecryptFinal_ex, EVP_DecryptInit_ex2, EVP_DecryptUpdate, EVP_Digest,
                       EVP_EncryptFinal_ex, EVP_EncryptInit_ex2, EVP_EncryptUpdate, EVP_PBE_scrypt,
                       EVP_sha256);

constexpr size_t kNonceBytes = 12;
constexpr size_t kTagBytes = 16;
/// The library counts in int: longer input goes in pieces.
constexpr size_t kPieceBytes = size_t{1} << 30U;

using CipherContext = LazyOwner<EVP_CIPHER_CTX, EVP_CIPHER_CTX_free>;

using CipherUpdate = int (*)(EVP_CIPHER_CTX*, unsigned char*, int*, const unsigned char*, int);

/// Digests and sealing fail only when memory or the library itself is broken: nothing safe can go on without
/// them.
[[noreturn]] void abortOnFailure(const char* what, const std::string& reason) {
    VELTOID_PLATFORM_LOG(Critical, std::string(what) + " failed: " + reason);
    std::abort();
}

bool feed(EVP_CIPHER_CTX* context, CipherUpdate update, uint8_t* output, Bytes input) {
    while (!input.empty()) {
        const auto piece = input.first(std::min(input.size(), kPieceBytes));
        int written = 0;
        if (update(context, output, &written, piece.data(), static_cast<int>(piece.size())) != 1)
            return false;
        if (output != nullptr) output += written;
        input = input.subspan(piece.size());
    }
    return true;
}

/// GCM is a stream: the final call only checks or forms the tag, but wants somewhere to point at.
bool encrypt(Bytes key, Bytes additionalData, Bytes plain, uint8_t* sealed) {
    const CipherContext context(EVP_CIPHER_CTX_new());
    uint8_t* const ciphertext = sealed + kNonceBytes;
    uint8_t nothing[1];
    int written = 0;
    return context != nullptr &&
           EVP_EncryptInit_ex2(context.get(), EVP_aes_256_gcm(), key.data(), sealed, nullptr) == 1 &&
           feed(context.get(), EVP_EncryptUpdate, nullptr, additionalData) &&
           feed(context.get(), EVP_EncryptUpdate, ciphertext, plain) &&
           EVP_EncryptFinal_ex(context.get(), nothing, &written) == 1 &&
           EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_AEAD_GET_TAG, kTagBytes, ciphertext + plain.size()) ==
               1;
}

bool decrypt(Bytes key, Bytes additionalData, Bytes sealed, SecretBytes& plain) {
    const CipherContext context(EVP_CIPHER_CTX_new());
    const Bytes ciphertext = sealed.subspan(kNonceBytes, plain.size());
    uint8_t tag[kTagBytes];
    std::copy_n(sealed.last(kTagBytes).begin(), kTagBytes, tag);
    uint8_t nothing[1];
    int written = 0;
    return context != nullptr &&
           EVP_DecryptInit_ex2(context.get(), EVP_aes_256_gcm(), key.data(), sealed.data(), nullptr) == 1 &&
           feed(context.get(), EVP_DecryptUpdate, nullptr, additionalData) &&
           feed(context.get(), EVP_DecryptUpdate, plain.data(), ciphertext) &&
           EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_AEAD_SET_TAG, kTagBytes, tag) == 1 &&
           EVP_DecryptFinal_ex(context.get(), nothing, &written) == 1;
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
    fillRandom(std::span(sealed).first(kNonceBytes));
    if (!encrypt(key, additionalData, plain, sealed.data())) abortOnFailure("sealing", openssl::takeReason());
    return sealed;
}

std::optional<SecretBytes> unseal(Bytes key, Bytes additionalData, Bytes sealed) {
    if (key.size() != kSealingKeyBytes || sealed.size() < kNonceBytes + kTagBytes) return std::nullopt;
    SecretBytes plain(sealed.size() - kNonceBytes - kTagBytes);
    if (!decrypt(key, additionalData, sealed, plain)) {
        openssl::clearErrors();
        return std::nullopt;
    }
    return plain;
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
