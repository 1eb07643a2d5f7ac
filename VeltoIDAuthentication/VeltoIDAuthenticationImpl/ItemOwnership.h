// Who owns the key and certificate items of the keychain.
//
// An item lives as long as a record or certificate entry refers to it: the reference in the record while a
// request is pending ("CertificatePrivateKeyReference"), the references in the entry afterwards. Code that
// drops a reference drops the item here. Between the making of an item and the storing of its reference the
// item would look abandoned, so both happen under one lock, without letting go of it.
//
// Nobody asks the server, or waits for anybody who does, under the lock. What was decided before a server
// call is therefore looked at again under the lock afterwards: whether the account is still the one that it
// was, the request still the one that was sent, the certificate still the one that was examined. What is not
// changes nothing any more.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"

namespace veltoid {

/// Held by operations that make, store or drop key and certificate items, for as long as that takes. Taken
/// before any queue; not recursive.
class OwnershipLock {
  public:
    OwnershipLock();
    ~OwnershipLock();
    OwnershipLock(const OwnershipLock&) = delete;
    OwnershipLock& operator=(const OwnershipLock&) = delete;
};

/// What is dropped of an entry; by default all.
struct DroppedItems {
    bool certificate = true;
    bool privateKey = true;
};

/// Deletes the private key of the account's pending request and the record's reference to it.
void discardPendingKey(const OwnershipLock& ownership, const String& accountName);

/// Deletes the items that `before` refers to and `after` does not. An intermediate certificate goes only when
/// no stored entry refers to it.
void discardReplacedItems(const OwnershipLock& ownership, const CertificateEntry& before,
                          const CertificateEntry& after);

/// Removes the encDsId's certificate entry, if there is one, with its items.
void discardCertificate(const OwnershipLock& ownership, const String& encDsId,
                        const DroppedItems& dropped = {});

/// The same, unless another certificate has taken the place of the one that was examined; false then.
bool discardExaminedCertificate(const OwnershipLock& ownership, const CertificateEntry& examined);

/// Removes, with their keychain items, the certificate entries that no account owns, that are invalid, or
/// that lack certificate or key; every password, key and certificate in the keychain that neither record nor
/// entry refers to, whatever has left it behind, unless somebody wanted it to be kept (ForgetAccount.h); what
/// is counted for names that no account has. Lifts connection embargoes that are over. Does nothing while the
/// database cannot be read. The options are not looked at. True. Caller's queue.
bool __VeltoIDCleanupAccountsAndCertificates(const Dictionary& options, ErrorOut error = nullptr);

/// The same for callers that hold the ownership lock.
void cleanUpAccountsAndCertificates(const OwnershipLock& ownership);

}  // namespace veltoid
