#include "Platform/KeychainSealing.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>

#include "Platform/Crypto.h"
#include "Platform/SystemLog.h"

namespace platform::keychain {

namespace {

enum class ClassKey : int { Always = 1, AfterFirstUnlock = 2 };

/// What wraps a class key. Other values are a way that has to be opened first: the class is locked.
constexpr int64_t kWrappedByDeviceKey = 0;

// keychain.key: magic, version (big-endian), the first bytes of the key's SHA-256 (so that damage is told
// from a wrong key), key.
constexpr std::string_view kKeyFileMagic = "HWDEVKEY";
constexpr uint32_t kKeyFileVersion = 1;
constexpr size_t kVersionBytes = 4;
constexpr size_t kCheckBytes = 4;
constexpr size_t kKeyFileBytes = kKeyFileMagic.size() + kVersionBytes + kCheckBytes + kSealingKeyBytes;

void appendNumber(std::vector<uint8_t>& output, uint64_t number, size_t width) {
    for (size_t i = width; i-- > 0;) output.push_back(static_cast<uint8_t>(number >> (8 * i)));
}

/// Presence, length, bytes: no two lists of fields have the same encoding.
void appendField(std::vector<uint8_t>& output, std::optional<std::string_view> field) {
    output.push_back(field ? 1 : 0);
    if (!field) return;
    appendNumber(output, field->size(), 8);
    output.insert(output.end(), field->begin(), field->end());
}

std::string hexText(Bytes bytes) {
    constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    for (const uint8_t byte : bytes) {
        text += kDigits[byte >> 4U];
        text += kDigits[byte & 0x0FU];
    }
    return text;
}

/// The file's descriptor, closed at the end.
class File {
  public:
    File(const std::string& path, int flags, mode_t mode = 0)
        : descriptor_(::open(path.c_str(), flags | O_CLOEXEC, mode)) {}
    ~File() {
        if (isOpen()) ::close(descriptor_);
    }
    File(const File&) = delete;
    File& operator=(const File&) = delete;

    bool isOpen() const { return descriptor_ >= 0; }
    int descriptor() const { return descriptor_; }

    /// Reads until the span is full or the file ends; none on an error (errno).
    std::optional<size_t> read(std::span<uint8_t> bytes) const {
        size_t done = 0;
        while (done < bytes.size()) {
            const ssize_t got = ::read(descriptor_, bytes.data() + done, bytes.size() - done);
            if (got < 0 && errno == EINTR) continue;
            if (got < 0) return std::nullopt;
            if (got == 0) break;
            done += static_cast<size_t>(got);
        }
        return done;
    }

    bool writeDurably(Bytes bytes) const {
        while (!bytes.empty()) {
            const ssize_t put = ::write(descriptor_, bytes.data(), bytes.size());
            if (put < 0 && errno == EINTR) continue;
            if (put < 0) return false;
            bytes = bytes.subspan(static_cast<size_t>(put));
        }
        return fsync(descriptor_) == 0;
    }

  private:
    int descriptor_;
};

std::nullopt_t refuse(const std::string& path, const std::string& reason) {
    VELTOID_PLATFORM_LOG(Error, path + ": " + reason + "; the keychain is not available");
    return std::nullopt;
}

SecretBytes checkOf(Bytes key) {
    const SHA256Digest digest = sha256(key);
    return {digest.begin(), digest.begin() + kCheckBytes};
}

SecretBytes encodeKeyFile(Bytes key) {
    std::vector<uint8_t> header(kKeyFileMagic.begin(), kKeyFileMagic.end());
    appendNumber(header, kKeyFileVersion, kVersionBytes);
    SecretBytes bytes(header.begin(), header.end());
    const SecretBytes check = checkOf(key);
    bytes.insert(bytes.end(), check.begin(), check.end());
    bytes.insert(bytes.end(), key.begin(), key.end());
    return bytes;
}

std::optional<SecretBytes> decodeKeyFile(const std::string& path, Bytes bytes) {
    if (bytes.size() < kKeyFileBytes || !textOf(bytes).starts_with(kKeyFileMagic)) {
        return refuse(path, "is not a device key");
    }
    uint32_t version = 0;
    for (const uint8_t byte : bytes.subspan(kKeyFileMagic.size(), kVersionBytes))
        version = version << 8U | byte;
    if (version != kKeyFileVersion) return refuse(path, "has the unknown version " + std::to_string(version));
    const Bytes key = bytes.last(kSealingKeyBytes);
    if (bytes.size() != kKeyFileBytes ||
        !std::ranges::equal(checkOf(key), bytes.subspan(kKeyFileMagic.size() + kVersionBytes, kCheckBytes))) {
        return refuse(path, "is damaged");
    }
    return SecretBytes(key.begin(), key.end());
}

std::optional<SecretBytes> readKeyFile(const std::string& path, const File& file) {
    struct stat information {};
    if (fstat(file.descriptor(), &information) == 0 && (information.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
        VELTOID_PLATFORM_LOG(Warning, path + ": was open to other users; its mode is corrected");
        (void)fchmod(file.descriptor(), S_IRUSR | S_IWUSR);
    }
    SecretBytes bytes(kKeyFileBytes + 1);
    const auto size = file.read(bytes);
    if (!size) return refuse(path, std::string("cannot be read: ") + std::strerror(errno));
    bytes.resize(*size);
    return decodeKeyFile(path, bytes);
}

/// The file appears under its name only when it is complete, and not at all when another one is there
/// already: a link, unlike a rename, replaces nothing.
bool createKeyFile(const std::string& directory, const std::string& path) {
    const DirectoryLock lock(directory);
    SecretBytes key(kSealingKeyBytes);
    fillRandom(key);
    const std::string temporary = path + ".new";
    // One may be left from a process that was killed while at it.
    (void)unlink(temporary.c_str());
    const File file(temporary, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, S_IRUSR | S_IWUSR);
    const bool linked = file.isOpen() && file.writeDurably(encodeKeyFile(key)) &&
                        (link(temporary.c_str(), path.c_str()) == 0 || errno == EEXIST);
    const int reason = errno;
    (void)unlink(temporary.c_str());
    errno = reason;
    return linked && syncDirectory(directory);
}

std::vector<uint8_t> wrappingContext(ClassKey which) {
    constexpr std::string_view kPurpose = "keychain class key";
    std::vector<uint8_t> context(kPurpose.begin(), kPurpose.end());
    context.push_back(static_cast<uint8_t>(which));
    return context;
}

ClassKey classKeyOf(Accessibility accessibility) {
    return accessibility == Accessibility::Always ? ClassKey::Always : ClassKey::AfterFirstUnlock;
}

/// Reads and unwraps a class key; `found` tells whether there is one.
KeychainStatus readClassKey(SQLiteTransaction& transaction, ClassKey which, bool& found, SecretBytes& key) {
    auto statement = transaction.prepare("SELECT wrapping, wrapped FROM class_keys WHERE class = ?");
    found = statement.bindInteger(static_cast<int>(which)).step();
    if (!found) return transaction.failed() ? kKeychainNotAvailable : kKeychainSuccess;
    if (statement.integer(0) != kWrappedByDeviceKey) return kKeychainLocked;
    const auto device = deviceKey(transaction.directory(), false);
    if (!device) return kKeychainNotAvailable;
    auto unwrapped = unseal(*device, wrappingContext(which), statement.blob(1));
    if (!unwrapped || unwrapped->size() != kSealingKeyBytes) {
        VELTOID_PLATFORM_LOG(Error, "keychain class key " + std::to_string(static_cast<int>(which)) +
                                        " does not open with the device key of " + transaction.directory());
        return kKeychainNotAvailable;
    }
    key = std::move(*unwrapped);
    return kKeychainSuccess;
}

KeychainStatus createClassKey(SQLiteTransaction& transaction, ClassKey which, SecretBytes& key) {
    // With class keys in the table a missing device key is lost, not yet to be made: another one would not
    // open them.
    const bool first = !transaction.prepare("SELECT 1 FROM class_keys").step();
    if (transaction.failed()) return kKeychainNotAvailable;
    const auto device = deviceKey(transaction.directory(), first);
    if (!device) return kKeychainNotAvailable;
    key.resize(kSealingKeyBytes);
    fillRandom(key);
    const SecretBytes wrapped = seal(*device, wrappingContext(which), key);
    transaction.prepare("INSERT INTO class_keys (class, wrapping, wrapped) VALUES (?, ?, ?)")
        .bindInteger(static_cast<int>(which))
        .bindInteger(kWrappedByDeviceKey)
        .bindBlob(wrapped)
        .run();
    return transaction.failed() ? kKeychainNotAvailable : kKeychainSuccess;
}

}  // namespace

std::vector<uint8_t> encodeIdentity(const ItemIdentity& identity) {
    const KeychainAttributes& attributes = identity.attributes;
    std::vector<uint8_t> output;
    appendNumber(output, static_cast<uint64_t>(attributes.itemClass), 1);
    appendNumber(output, static_cast<uint64_t>(identity.accessibility), 1);
    appendField(output, textOf(identity.id));
    for (const auto* field :
         {&attributes.account, &attributes.service, &attributes.label, &attributes.description,
          &attributes.accessGroup, &attributes.keyClass, &attributes.applicationValue}) {
        appendField(output, *field);
    }
    return output;
}

std::optional<SecretBytes> deviceKey(const std::string& directory, bool mayCreate) {
    const std::string path = directory + "/keychain.key";
    for (const bool lastTry : {!mayCreate, true}) {
        const File file(path, O_RDONLY | O_NOFOLLOW);
        if (file.isOpen()) return readKeyFile(path, file);
        if (errno != ENOENT) return refuse(path, std::string("cannot be opened: ") + std::strerror(errno));
        if (lastTry) break;
        if (!createKeyFile(directory, path))
            return refuse(path, std::string("cannot be created: ") + std::strerror(errno));
    }
    return refuse(path,
                  "is missing, and with it what opens the stored items: restore it, or remove keychain.db");
}

KeychainStatus sealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes value,
                        SecretBytes& sealed) {
    const ClassKey which = classKeyOf(identity.accessibility);
    SecretBytes key;
    bool found = false;
    KeychainStatus status = readClassKey(transaction, which, found, key);
    if (status == kKeychainSuccess && !found) status = createClassKey(transaction, which, key);
    if (status == kKeychainSuccess) sealed = seal(key, encodeIdentity(identity), value);
    return status;
}

KeychainStatus unsealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes sealed,
                          SecretBytes& value) {
    SecretBytes key;
    bool found = false;
    const KeychainStatus status = readClassKey(transaction, classKeyOf(identity.accessibility), found, key);
    if (status != kKeychainSuccess) return status;
    auto plain = found ? unseal(key, encodeIdentity(identity), sealed) : std::nullopt;
    if (!plain) {
        VELTOID_PLATFORM_LOG(Error, "keychain item " + hexText(identity.id) +
                                        " does not unseal: it is damaged or was changed from outside");
        return kKeychainItemCorrupt;
    }
    value = std::move(*plain);
    return kKeychainSuccess;
}

}  // namespace platform::keychain
