#include "VeltoIDKeychainItems/KeychainCertificates.h"

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Values/Digest.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::Certificate;
using platform::KeychainAttributes;
using platform::KeychainItemClass;
using platform::KeychainStatus;

KeychainAttributes identityOf(const Certificate& certificate) {
    KeychainAttributes attributes = keychain_items::itemsOf(KeychainItemClass::Certificate);
    attributes.applicationValue = sha256Text(Data(certificate.der));
    return attributes;
}

/// The reference of the certificate's item; null when the keychain refuses.
Data addOrUpdate(const Certificate& certificate, const String& label) {
    keychain_items::WantedItem item{identityOf(certificate),
                                    {platform::SecretBytes(certificate.der.begin(), certificate.der.end()),
                                     Accessibility::Always, label.text(), kKeychainAccessGroup},
                                    identityOf(certificate),
                                    Accessibility::Always};
    item.attributes.label = label.text();
    item.attributes.accessGroup = kKeychainAccessGroup;
    Data reference;
    const KeychainStatus status = keychain_items::addOrUpdate(
        item, &reference, [&](keychain_items::Step step, const Data& found, KeychainStatus why) {
            if (step != keychain_items::Step::Replace) return;
            const Dictionary attributes = {{"accessGroup", kKeychainAccessGroup}, {"label", label}};
            VELTOID_LOG_FROM("addCertificateToKeychain", kNotice, "SetItemUpdate(",
                             keychain_items::describeItemQuery("cert", found), ", attrs=", attributes,
                             " err=", why, " so deleting and re-adding item.");
        });
    if (status != platform::kKeychainSuccess)
        VELTOID_LOG_FROM("addCertificateToKeychain", kError, "Certificate ", describeValue(label),
                         " not added to keychain; err=", status);
    return reference;
}

}  // namespace

bool addCertificateToKeychain(const Certificate& certificate, const String& label,
                              Data* persistentReference) {
    if (!label) return false;
    return keychain_items::handOut(
        persistentReference, [&] { return usesSystemKeychain() ? addOrUpdate(certificate, label) : Data(); });
}

bool copyPersistentRefForCertificate(const Certificate& certificate, Data* persistentReference) {
    return keychain_items::handOut(persistentReference, [&] {
        return usesSystemKeychain() ? keychain_items::copyReference(identityOf(certificate)) : Data();
    });
}

bool copyCertificateFromKeychainGivenPersistentRef(const Data& persistentReference,
                                                   std::optional<Certificate>* certificate) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        platform::SecretBytes data;
        const auto query =
            keychain_items::queryForReference(KeychainItemClass::Certificate, persistentReference);
        if (!usesSystemKeychain() ||
            platform::keychain::copyMatchingData(query, &data) != platform::kKeychainSuccess)
            return false;
        if (certificate != nullptr) *certificate = platform::readCertificate(data);
        return true;
    });
}

bool removeCertificateFromKeychainGivenPersistentRef(const Data& persistentReference) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        // Kept in memory there is none: it counts as gone.
        if (!usesSystemKeychain()) return true;
        const KeychainStatus status = platform::keychain::remove(
            keychain_items::queryForReference(KeychainItemClass::Certificate, persistentReference));
        if (status == platform::kKeychainSuccess || status == platform::kKeychainItemNotFound) return true;
        VELTOID_LOG_FROM("removeCertificateFromKeychainGivenPersistentRef", kError, "Error #", status,
                         " from keychain::remove(), removeCertificateFromKeychainGivenPersistentRef #",
                         __LINE__);
        return false;
    });
}

std::optional<Array> copyAllCertificatesFromKeychain() {
    return keychain_items::copyReferences(keychain_items::itemsOf(KeychainItemClass::Certificate));
}

std::optional<Array> copyCertificatesFromKeychainGivenLabel(const String& label) {
    return keychain_items::copyReferences(
        keychain_items::itemsOf(KeychainItemClass::Certificate, label.text()));
}

}  // namespace veltoid
