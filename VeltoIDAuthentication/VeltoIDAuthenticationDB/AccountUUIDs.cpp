#include "VeltoIDAuthenticationDB/AccountUUIDs.h"

#include "Protocol/RecordKeys.h"
#include "Values/Digest.h"
#include "Values/LowerCase.h"

namespace veltoid::database {

bool deriveAccountUUIDs(const String& name, Dictionary& record, const Dictionary& metaInfo) {
    bool changed = false;
    if (!record.string(kVeltoIDAccountUUIDKey)) {
        record.set(kVeltoIDAccountUUIDKey, randomUUIDText());
        record.remove(kVeltoIDAccountStableUUIDKey);
        changed = true;
    }
    const String userUUID = metaInfo.string(kVeltoIDMetaUserUUIDKey);
    if (userUUID && !record.string(kVeltoIDAccountStableUUIDKey)) {
        const Data digest = sha256OfString(lowerCased(name).text() + userUUID.text());
        platform::UUIDBytes folded{};
        for (size_t i = 0; i < folded.size(); ++i)
            folded[i] = static_cast<uint8_t>(digest.bytes()[2 * i] ^ digest.bytes()[2 * i + 1]);
        record.set(kVeltoIDAccountStableUUIDKey, platform::canonicalUUIDText(folded));
        changed = true;
    }
    return changed;
}

}  // namespace veltoid::database
