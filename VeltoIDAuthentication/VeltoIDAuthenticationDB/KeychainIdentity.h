// Which keychain the stored references are from. The database remembers its identity, so that a keychain that
// is missing, emptied, exchanged or newly made is not taken for one whose items are gone: nothing that refers
// to them is dropped, and all is well again when the right one is back. Adding an account makes the present
// one the right one; so does its first sight, where none is remembered or nothing stored could refer to it.
#pragma once

#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {

/// Whether the keychain can be read and is the right one; logged when that changes. Any queue above the
/// database's.
bool keychainIsOurs();

/// To be called when an item was read: cheap once the keychain is remembered.
void noteKeychainInUse();

/// Like keychainItemState, but an item that is missing from another keychain is unreadable, not gone.
ItemState stateOfItem(platform::KeychainItemClass itemClass, const Data& reference);

/// What is the matter with the keychain, for people; null when nothing is, or it only is locked.
String keychainTrouble();

namespace database {

/// The present keychain is the right one from now on. On the database queue.
void adoptKeychain(Store& store);

}  // namespace database
}  // namespace veltoid
