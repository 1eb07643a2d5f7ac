#include "Platform/keychain/KeychainClassKeys.h"

#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/crypto/Crypto.h"
#include "Platform/encoding/HexText.h"
#include "Platform/keychain/KernelKeyring.h"
#include "Platform/keychain/KeychainDeviceKey.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::keychain {
namespace {

enum class Wrapping : int64_t { DeviceKey = 0, Passphrase = 1 };

// What a passphrase wraps: version, cost (log N, block size, parallelism), salt, sealed key.
constexpr uint8_t kPassphraseVersion = 1;
constexpr size_t kCostAt = 1;
constexpr size_t kSaltAt = 4;
constexpr size_t kSaltBytes = 16;
constexpr size_t kHeaderBytes = kSaltAt + kSaltBytes;

/// The row of a class key.
struct Row {
    Wrapping wrapping = Wrapping::DeviceKey;
    SecretBytes wrapped;
};

/// None when there is none; a failure shows in the transaction.
std::optional<Row> rowOf(SQLiteTransaction& transaction, ClassKey which) {
    auto statement = transaction.prepare("SELECT wrapping, wrapped FROM class_keys WHERE class = ?");
    if (!statement.bind(static_cast<int>(which)).step()) return std::nullopt;
    const Bytes wrapped = statement.blob(1);
    return Row{static_cast<Wrapping>(statement.integer(0)), {wrapped.begin(), wrapped.end()}};
}

KeychainStatus store(SQLiteTransaction& transaction, ClassKey which, Wrapping wrapping, Bytes wrapped) {
    transaction.prepare("INSERT OR REPLACE INTO class_keys (class, wrapping, wrapped) VALUES (?, ?, ?)")
        .bind(static_cast<int>(which), static_cast<int64_t>(wrapping), wrapped)
        .run();
    return transaction.failed() ? kKeychainNotAvailable : kKeychainSuccess;
}

std::vector<uint8_t> wrappingContext(ClassKey which) {
    constexpr std::string_view kPurpose = "keychain class key";
    std::vector<uint8_t> context(kPurpose.begin(), kPurpose.end());
    context.push_back(static_cast<uint8_t>(which));
    return context;
}

KeychainStatus unusable(SQLiteTransaction& transaction, ClassKey which, const char* why) {
    VELTOID_PLATFORM_LOG(Error, "keychain class key " + std::to_string(static_cast<int>(which)) + " of " +
                                    transaction.directory() + " " + why);
    return kKeychainNotAvailable;
}

// --- Under the device key

/// With class keys in the table a missing device key is lost, not yet to be made: another one would not open
/// them.
std::optional<SecretBytes> deviceKeyToWrapWith(SQLiteTransaction& transaction) {
    const bool first = !transaction.prepare("SELECT 1 FROM class_keys").step();
    if (transaction.failed()) return std::nullopt;
    return deviceKey(transaction.directory(), first);
}

KeychainStatus storeUnderDeviceKey(SQLiteTransaction& transaction, ClassKey which, Bytes key) {
    const auto device = deviceKeyToWrapWith(transaction);
    if (!device) return kKeychainNotAvailable;
    return store(transaction, which, Wrapping::DeviceKey, seal(*device, wrappingContext(which), key));
}

KeychainStatus openWithDeviceKey(SQLiteTransaction& transaction, ClassKey which, Bytes wrapped,
                                 SecretBytes& key) {
    const auto device = deviceKey(transaction.directory(), false);
    if (!device) return kKeychainNotAvailable;
    auto unwrapped = unseal(*device, wrappingContext(which), wrapped);
    if (!unwrapped || unwrapped->size() != kSealingKeyBytes)
        return unusable(transaction, which, "does not open with the device key");
    key = std::move(*unwrapped);
    return kKeychainSuccess;
}

// --- Under a passphrase

bool isWellFormed(Bytes wrapped) {
    return wrapped.size() > kHeaderBytes && wrapped.front() == kPassphraseVersion;
}

/// No two passphrases that were set share a salt, and it stays the same for every process.
std::string keyringName(Bytes wrapped) {
    return std::string(Lifetime::current().product().keyringPrefix) +
           hexText(wrapped.subspan(kSaltAt, kSaltBytes));
}

std::optional<SecretBytes> derive(Bytes passphrase, Bytes header) {
    return deriveKey(passphrase, header.subspan(kSaltAt, kSaltBytes),
                     {header[kCostAt], header[kCostAt + 1], header[kCostAt + 2]});
}

/// The header is sealed together with the key, so that the cost of guessing cannot be lowered.
std::vector<uint8_t> passphraseContext(ClassKey which, Bytes header) {
    std::vector<uint8_t> context = wrappingContext(which);
    context.insert(context.end(), header.begin(), header.end());
    return context;
}

std::optional<SecretBytes> openWith(Bytes derivedKey, ClassKey which, Bytes wrapped) {
    auto key = unseal(derivedKey, passphraseContext(which, wrapped.first(kHeaderBytes)),
                      wrapped.subspan(kHeaderBytes));
    return key && key->size() == kSealingKeyBytes ? std::move(key) : std::nullopt;
}

KeychainStatus openWithKeyring(SQLiteTransaction& transaction, ClassKey which, Bytes wrapped,
                               SecretBytes& key) {
    if (!isWellFormed(wrapped)) return unusable(transaction, which, "is damaged");
    const auto kept = kernel_keyring::find(keyringName(wrapped));
    auto opened = kept && kept->size() == kSealingKeyBytes ? openWith(*kept, which, wrapped) : std::nullopt;
    if (!opened) return kKeychainLocked;
    key = std::move(*opened);
    return kKeychainSuccess;
}

}  // namespace

KeychainStatus readClassKey(SQLiteTransaction& transaction, ClassKey which, bool& found, SecretBytes& key) {
    const auto row = rowOf(transaction, which);
    found = row.has_value();
    if (!found) return transaction.failed() ? kKeychainNotAvailable : kKeychainSuccess;
    switch (row->wrapping) {
        case Wrapping::DeviceKey:
            return openWithDeviceKey(transaction, which, row->wrapped, key);
        case Wrapping::Passphrase:
            return openWithKeyring(transaction, which, row->wrapped, key);
    }
    return unusable(transaction, which, "is wrapped in a way that is not known");
}

KeychainStatus classKey(SQLiteTransaction& transaction, ClassKey which, SecretBytes& key) {
    bool found = false;
    const KeychainStatus status = readClassKey(transaction, which, found, key);
    if (status != kKeychainSuccess || found) return status;
    key.resize(kSealingKeyBytes);
    fillRandom(key);
    return storeUnderDeviceKey(transaction, which, key);
}

KeychainStatus readProtection(SQLiteTransaction& transaction, Protection& protection) {
    bool found = false;
    SecretBytes key;
    const KeychainStatus status = readClassKey(transaction, ClassKey::AfterFirstUnlock, found, key);
    protection = status == kKeychainLocked          ? Protection::Locked
                 : keptKeyName(transaction).empty() ? Protection::NoPassphrase
                                                    : Protection::Unlocked;
    return status == kKeychainLocked ? kKeychainSuccess : status;
}

KeychainStatus replaceByPassphrase(SQLiteTransaction& transaction, Bytes passphrase) {
    constexpr ClassKey kWhich = ClassKey::AfterFirstUnlock;
    SecretBytes key;
    if (const KeychainStatus status = classKey(transaction, kWhich, key); status != kKeychainSuccess)
        return status;
    fillRandom(key);
    const ScryptCost cost;
    SecretBytes wrapped = {kPassphraseVersion, cost.logN, cost.blockSize, cost.parallelism};
    wrapped.resize(kHeaderBytes);
    fillRandom(std::span(wrapped).subspan(kSaltAt));
    const auto derived = derive(passphrase, wrapped);
    // Without a keyring it could never be unlocked.
    if (!derived || !kernel_keyring::store(keyringName(wrapped), *derived)) return kKeychainNotAvailable;
    const SecretBytes sealed = seal(*derived, passphraseContext(kWhich, wrapped), key);
    wrapped.insert(wrapped.end(), sealed.begin(), sealed.end());
    return store(transaction, kWhich, Wrapping::Passphrase, wrapped);
}

KeychainStatus replaceByDeviceKey(SQLiteTransaction& transaction) {
    SecretBytes key;
    const KeychainStatus status = classKey(transaction, ClassKey::AfterFirstUnlock, key);
    if (status != kKeychainSuccess) return status;
    fillRandom(key);
    return storeUnderDeviceKey(transaction, ClassKey::AfterFirstUnlock, key);
}

std::string keptKeyName(SQLiteTransaction& transaction) {
    const auto row = rowOf(transaction, ClassKey::AfterFirstUnlock);
    return row && row->wrapping == Wrapping::Passphrase && isWellFormed(row->wrapped)
               ? keyringName(row->wrapped)
               : std::string();
}

KeychainStatus unlockByPassphrase(SQLiteTransaction& transaction, Bytes passphrase) {
    constexpr ClassKey kWhich = ClassKey::AfterFirstUnlock;
    const auto row = rowOf(transaction, kWhich);
    if (transaction.failed()) return kKeychainNotAvailable;
    if (!row || row->wrapping != Wrapping::Passphrase) return kKeychainSuccess;
    if (!isWellFormed(row->wrapped)) return unusable(transaction, kWhich, "is damaged");
    const auto derived = derive(passphrase, row->wrapped);
    if (!derived) return unusable(transaction, kWhich, "takes more memory than there is to open");
    if (!openWith(*derived, kWhich, row->wrapped)) return kKeychainWrongPassphrase;
    return kernel_keyring::store(keyringName(row->wrapped), *derived) ? kKeychainSuccess
                                                                      : kKeychainNotAvailable;
}

}  // namespace platform::keychain
