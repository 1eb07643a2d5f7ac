#include "Platform/keychain/KeychainDeviceKey.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>

#include "Platform/crypto/Crypto.h"
#include "Platform/encoding/BigEndian.h"
#include "Platform/runtime/FileDescriptor.h"
#include "Platform/runtime/StateDirectory.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::keychain {
namespace {

// keychain.key: magic, version (big-endian), the first bytes of the key's SHA-256 (so that damage is told
// from a wrong key), key.
constexpr std::string_view kKeyFileMagic = "HWDEVKEY";
constexpr uint32_t kKeyFileVersion = 1;
constexpr size_t kVersionBytes = 4;
constexpr size_t kCheckBytes = 4;
constexpr size_t kKeyFileBytes = kKeyFileMagic.size() + kVersionBytes + kCheckBytes + kSealingKeyBytes;

std::nullopt_t refuse(const std::string& path, const std::string& reason) {
    VELTOID_PLATFORM_LOG(Error, path + ": " + reason + "; the keychain is not available");
    return std::nullopt;
}

SecretBytes checkOf(Bytes key) {
    const SHA256Digest digest = sha256(key);
    return {digest.begin(), digest.begin() + kCheckBytes};
}

SecretBytes encodeKeyFile(Bytes key) {
    SecretBytes bytes(kKeyFileMagic.begin(), kKeyFileMagic.end());
    appendBigEndian(bytes, kKeyFileVersion, kVersionBytes);
    const SecretBytes check = checkOf(key);
    bytes.insert(bytes.end(), check.begin(), check.end());
    bytes.insert(bytes.end(), key.begin(), key.end());
    return bytes;
}

std::optional<SecretBytes> decodeKeyFile(const std::string& path, Bytes bytes) {
    if (bytes.size() < kKeyFileBytes || !textOf(bytes).starts_with(kKeyFileMagic)) {
        return refuse(path, "is not a device key");
    }
    const uint64_t version = bigEndian(bytes.subspan(kKeyFileMagic.size(), kVersionBytes));
    if (version != kKeyFileVersion) return refuse(path, "has the unknown version " + std::to_string(version));
    const Bytes key = bytes.last(kSealingKeyBytes);
    if (bytes.size() != kKeyFileBytes ||
        !std::ranges::equal(checkOf(key), bytes.subspan(kKeyFileMagic.size() + kVersionBytes, kCheckBytes))) {
        return refuse(path, "is damaged");
    }
    return SecretBytes(key.begin(), key.end());
}

std::optional<SecretBytes> readKeyFile(const std::string& path, const FileDescriptor& file) {
    struct stat information {};
    if (fstat(file.number(), &information) == 0 && (information.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
        VELTOID_PLATFORM_LOG(Warning, path + ": was open to other users; its mode is corrected");
        (void)fchmod(file.number(), S_IRUSR | S_IWUSR);
    }
    SecretBytes bytes(kKeyFileBytes + 1);
    const auto size = readFully(file.number(), bytes);
    if (!size) return refuse(path, std::string("cannot be read: ") + std::strerror(errno));
    bytes.resize(*size);
    return decodeKeyFile(path, bytes);
}

/// The file appears under its name only when it is complete, and not at all when another one is there
/// already: a link, unlike a rename, replaces nothing.
bool createKeyFile(const std::string& directory, const std::string& path) {
    const FileDescriptor lock = lockDirectory(directory);
    SecretBytes key(kSealingKeyBytes);
    fillRandom(key);
    const std::string temporary = path + ".new";
    // One may be left from a process that was killed while at it.
    (void)unlink(temporary.c_str());
    const FileDescriptor file(
        open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
    const bool linked = file.isOpen() && writeFully(file.number(), encodeKeyFile(key)) &&
                        fsync(file.number()) == 0 &&
                        (link(temporary.c_str(), path.c_str()) == 0 || errno == EEXIST);
    const int reason = errno;
    (void)unlink(temporary.c_str());
    errno = reason;
    return linked && syncDirectory(directory);
}

}  // namespace

std::optional<SecretBytes> deviceKey(const std::string& directory, bool mayCreate) {
    const std::string path = directory + "/keychain.key";
    for (const bool lastTry : {!mayCreate, true}) {
        const FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
        if (file.isOpen()) return readKeyFile(path, file);
        if (errno != ENOENT) return refuse(path, std::string("cannot be opened: ") + std::strerror(errno));
        if (lastTry) break;
        if (!createKeyFile(directory, path))
            return refuse(path, std::string("cannot be created: ") + std::strerror(errno));
    }
    return refuse(path,
                  "is missing, and with it what opens the stored items: restore it, or remove keychain.db");
}

}  // namespace platform::keychain
