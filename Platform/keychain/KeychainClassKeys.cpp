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

/// Throws when a read has failed: a row that could not be read is not a missing one.
void requireSound(const SQLiteTransaction& transaction) {
    if (transaction.failed()) throw Failure{kKeychainNotAvailable};
}

std::optional<Row> rowOf(SQLiteTransaction& transaction, ClassKey which) {
    auto statement = transaction.prepare("SELECT wrapping, wrapped FROM class_keys WHERE class = ?");
    const bool found = statement.bind(static_cast<int>(which)).step();
    requireSound(transaction);
    if (!found) return std::nullopt;
    const Bytes wrapped = statement.blob(1);
    return Row{static_cast<Wrapping>(statement.integer(0)), {wrapped.begin(), wrapped.end()}};
}

void store(SQLiteTransaction& transaction, ClassKey which, Wrapping wrapping, Bytes wrapped) {
    transaction.prepare("INSERT OR REPLACE INTO class_keys (class, wrapping, wrapped) VALUES (?, ?, ?)")
        .bind(static_cast<int>(which), static_cast<int64_t>(wrapping), wrapped)
        .run();
}

std::vector<uint8_t> wrappingContext(ClassKey which) {
    constexpr std::string_view kPurpose = "keychain class key";
    std::vector<uint8_t> context(kPurpose.begin(), kPurpose.end());
    context.push_back(static_cast<uint8_t>(which));
    return context;
}

[[noreturn]] void refuse(const SQLiteTransaction& transaction, ClassKey which, const char* why) {
    VELTOID_PLATFORM_LOG(Error, "keychain class key " + std::to_string(static_cast<int>(which)) + " of " +
                                    transaction.directory() + " " + why);
    throw Failure{kKeychainNotAvailable};
}

// --- Under the device key

SecretBytes neededDeviceKey(const SQLiteTransaction& transaction, bool mayCreate) {
    auto key = deviceKey(transaction.directory(), mayCreate);
    if (!key) throw Failure{kKeychainNotAvailable};
    return std::move(*key);
}

/// If there are class keys, a device key that is missing was lost: a new one could not open them and is not
/// made.
void storeUnderDeviceKey(SQLiteTransaction& transaction, ClassKey which, Bytes key) {
    const bool first = !transaction.prepare("SELECT 1 FROM class_keys").step();
    requireSound(transaction);
    const SecretBytes device = neededDeviceKey(transaction, first);
    store(transaction, which, Wrapping::DeviceKey, seal(device, wrappingContext(which), key));
}

SecretBytes openWithDeviceKey(const SQLiteTransaction& transaction, ClassKey which, Bytes wrapped) {
    auto key = unseal(neededDeviceKey(transaction, false), wrappingContext(which), wrapped);
    if (!key || key->size() != kSealingKeyBytes)
        refuse(transaction, which, "does not open with the device key");
    return std::move(*key);
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

SecretBytes openWithKeyring(const SQLiteTransaction& transaction, ClassKey which, Bytes wrapped) {
    if (!isWellFormed(wrapped)) refuse(transaction, which, "is damaged");
    const auto kept = kernel_keyring::find(keyringName(wrapped));
    auto key = kept && kept->size() == kSealingKeyBytes ? openWith(*kept, which, wrapped) : std::nullopt;
    if (!key) throw Failure{kKeychainLocked};
    return std::move(*key);
}

}  // namespace

std::optional<SecretBytes> readClassKey(SQLiteTransaction& transaction, ClassKey which) {
    const auto row = rowOf(transaction, which);
    if (!row) return std::nullopt;
    switch (row->wrapping) {
        case Wrapping::DeviceKey:
            return openWithDeviceKey(transaction, which, row->wrapped);
        case Wrapping::Passphrase:
            return openWithKeyring(transaction, which, row->wrapped);
    }
    refuse(transaction, which, "is wrapped in a way that is not known");
}

SecretBytes classKey(SQLiteTransaction& transaction, ClassKey which) {
    if (auto known = readClassKey(transaction, which)) return std::move(*known);
    SecretBytes key(kSealingKeyBytes);
    fillRandom(key);
    storeUnderDeviceKey(transaction, which, key);
    return key;
}

Protection readProtection(SQLiteTransaction& transaction) {
    try {
        (void)readClassKey(transaction, ClassKey::AfterFirstUnlock);
    } catch (const Failure& failure) {
        if (failure.status == kKeychainLocked) return Protection::Locked;
        throw;
    }
    return keptKeyName(transaction).empty() ? Protection::NoPassphrase : Protection::Unlocked;
}

void replaceByPassphrase(SQLiteTransaction& transaction, Bytes passphrase) {
    constexpr ClassKey kWhich = ClassKey::AfterFirstUnlock;
    SecretBytes key = classKey(transaction, kWhich);
    fillRandom(key);
    const ScryptCost cost;
    SecretBytes wrapped = {kPassphraseVersion, cost.logN, cost.blockSize, cost.parallelism};
    wrapped.resize(kHeaderBytes);
    fillRandom(std::span(wrapped).subspan(kSaltAt));
    const auto derived = derive(passphrase, wrapped);
    // Without a keyring it could never be unlocked.
    if (!derived || !kernel_keyring::store(keyringName(wrapped), *derived))
        throw Failure{kKeychainNotAvailable};
    const SecretBytes sealed = seal(*derived, passphraseContext(kWhich, wrapped), key);
    wrapped.insert(wrapped.end(), sealed.begin(), sealed.end());
    store(transaction, kWhich, Wrapping::Passphrase, wrapped);
}

void replaceByDeviceKey(SQLiteTransaction& transaction) {
    SecretBytes key = classKey(transaction, ClassKey::AfterFirstUnlock);
    fillRandom(key);
    storeUnderDeviceKey(transaction, ClassKey::AfterFirstUnlock, key);
}

std::string keptKeyName(SQLiteTransaction& transaction) {
    const auto row = rowOf(transaction, ClassKey::AfterFirstUnlock);
    return row && row->wrapping == Wrapping::Passphrase && isWellFormed(row->wrapped)
               ? keyringName(row->wrapped)
               : std::string();
}

void unlockByPassphrase(SQLiteTransaction& transaction, Bytes passphrase) {
    constexpr ClassKey kWhich = ClassKey::AfterFirstUnlock;
    const auto row = rowOf(transaction, kWhich);
    if (!row || row->wrapping != Wrapping::Passphrase) return;
    if (!isWellFormed(row->wrapped)) refuse(transaction, kWhich, "is damaged");
    const auto derived = derive(passphrase, row->wrapped);
    if (!derived) refuse(transaction, kWhich, "takes more memory than there is to open");
    if (!openWith(*derived, kWhich, row->wrapped)) throw Failure{kKeychainWrongPassphrase};
    if (!kernel_keyring::store(keyringName(row->wrapped), *derived)) throw Failure{kKeychainNotAvailable};
}

}  // namespace platform::keychain
