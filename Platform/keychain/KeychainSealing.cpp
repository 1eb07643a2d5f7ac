#include "Platform/keychain/KeychainSealing.h"

#include <string_view>

#include "Platform/crypto/Crypto.h"
#include "Platform/encoding/BigEndian.h"
#include "Platform/encoding/HexText.h"
#include "Platform/keychain/KeychainClassKeys.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::keychain {

namespace {

/// Presence, length, bytes: no two lists of fields have the same encoding.
void appendField(std::vector<uint8_t>& output, std::optional<std::string_view> field) {
    output.push_back(field ? 1 : 0);
    if (!field) return;
    appendBigEndian(output, field->size(), 8);
    output.insert(output.end(), field->begin(), field->end());
}

ClassKey classKeyOf(Accessibility accessibility) {
    return accessibility == Accessibility::Always ? ClassKey::Always : ClassKey::AfterFirstUnlock;
}

}  // namespace

std::vector<uint8_t> encodeIdentity(const ItemIdentity& identity) {
    std::vector<uint8_t> output;
    appendBigEndian(output, static_cast<uint64_t>(identity.attributes.itemClass), 1);
    appendBigEndian(output, static_cast<uint64_t>(identity.accessibility), 1);
    appendField(output, textOf(identity.id));
    for (const auto text : kKeychainTexts) appendField(output, identity.attributes.*text);
    return output;
}

SecretBytes sealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes value) {
    return seal(classKey(transaction, classKeyOf(identity.accessibility)), encodeIdentity(identity), value);
}

SecretBytes unsealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes sealed) {
    const auto key = readClassKey(transaction, classKeyOf(identity.accessibility));
    auto value = key ? unseal(*key, encodeIdentity(identity), sealed) : std::nullopt;
    if (value) return std::move(*value);
    VELTOID_PLATFORM_LOG(Error, "keychain item " + hexText(identity.id) +
                                    " does not unseal: it is damaged or was changed from outside");
    throw Failure{kKeychainItemCorrupt};
}

}  // namespace platform::keychain
