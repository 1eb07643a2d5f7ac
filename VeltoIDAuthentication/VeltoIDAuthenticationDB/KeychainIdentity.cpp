#include "VeltoIDAuthenticationDB/KeychainIdentity.h"

#include "Logging/Log.h"
#include "Protocol/RecordKeys.h"
#include "Values/ValueStream.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

using database::Store;
using platform::keychain::Reopen;

constexpr std::string_view kIdentityKey = "Identity";

/// Null when the keychain cannot be read, empty when it was emptied.
Data presentIdentity(Reopen reopen) {
    return keychainQueue().sync([reopen] {
        const auto identity = platform::keychain::identity(reopen);
        return identity ? Data(*identity) : Data();
    });
}

bool remember(Store& store, const Data& identity) {
    store.keychainIsKnown =
        !identity.bytes().empty() &&
        store.keychainDomain().set(
            {{std::string(kIdentityKey), [identity](auto& sink) { writeValue(identity, sink); }}});
    return store.keychainIsKnown;
}

/// Without stored accounts whose the items are is not known: the accounts may have been lost, or may come
/// back. The clean-up leaves these items alone.
void keepItemsOfOthers(Store& store) {
    Array kept;
    for (const auto& items :
         {copyAllPasswordsFromKeychain(), copyAllKeysFromKeychain(), copyAllCertificatesFromKeychain()})
        for (const Value& item : items.value_or(Array())) kept.append(item);
    if (kept.empty()) return;
    Dictionary metaInfo = store.metaInfo;
    metaInfo.set(kVeltoIDMetaKeptKeychainItemsKey, kept);
    store.replace({{&Store::metaInfo, std::move(metaInfo)}}, Notify::No);
}

/// Whether the remembered keychain is the present one.
bool isRemembered(Store& store) {
    const auto stored = database::readStored(store.keychainDomain(), kIdentityKey);
    if (!stored) return false;
    const Data remembered = stored->asData();
    Data present = presentIdentity(Reopen::No);
    if (remembered && present != remembered) present = presentIdentity(Reopen::Yes);
    if (remembered && present == remembered) return store.keychainIsKnown = true;
    const bool isFree = store.accounts.empty() && store.certificates.empty();
    if (!present || (remembered && !isFree)) return false;
    if (isFree && !remembered) keepItemsOfOthers(store);
    return remember(store, present);
}

bool isOurs(Store& store) {
    if (!usesSystemKeychain()) return true;
    const bool isRight = store.isLoaded() && isRemembered(store);
    if (isRight != store.keychainWasOurs) {
        if (isRight)
            VELTOID_LOG_FROM("keychainIsOurs", kNotice, "The keychain of the stored accounts is back.");
        else
            VELTOID_LOG_FROM("keychainIsOurs", kError,
                             "The keychain cannot be read, or is not the one of the stored accounts: it is "
                             "missing, emptied or exchanged. Nothing is dropped; restore it, or add the "
                             "account again.");
    }
    return store.keychainWasOurs = isRight;
}

}  // namespace

bool keychainIsOurs() { return database::perform(isOurs); }

void noteKeychainInUse() {
    if (!database::loadedStore().keychainIsKnown) (void)keychainIsOurs();
}

ItemState stateOfItem(platform::KeychainItemClass itemClass, const Data& reference) {
    if (!usesSystemKeychain() || !reference) return ItemState::Gone;
    // Before and after: in between it may be exchanged, or come back.
    const bool wasOurs = keychainIsOurs();
    const ItemState state = keychainItemState(itemClass, reference);
    return state != ItemState::Gone || (wasOurs && keychainIsOurs()) ? state : ItemState::Unreadable;
}

String keychainTrouble() {
    if (!usesSystemKeychain()) return {};
    if (!platform::keychain::protection())
        return "it cannot be read now; the log says why. Nothing that is stored is lost";
    if (keychainIsOurs()) return {};
    return "it is not the one of the stored accounts: missing, emptied or exchanged. Restore it, or add the "
           "account again";
}

namespace database {

void adoptKeychain(Store& store) {
    if (!usesSystemKeychain() || !store.isLoaded()) return;
    const auto stored = readStored(store.keychainDomain(), kIdentityKey);
    const Data present = presentIdentity(Reopen::No);
    if (!present || !stored || stored->asData() == present) return;
    if (!stored->asData() && store.accounts.empty() && store.certificates.empty()) keepItemsOfOthers(store);
    remember(store, present);
}

}  // namespace database
}  // namespace veltoid
