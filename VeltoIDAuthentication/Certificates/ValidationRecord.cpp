#include "Certificates/ValidationRecord.h"

#include "Platform/crypto/SignedMessage.h"
#include "Platform/propertylist/PropertyList.h"
#include "Values/ValueStream.h"

namespace veltoid {

Data verifyValidationRecord(const Data& record) {
    const auto content = platform::verifySignedMessage(record.bytes());
    return content ? Data(*content) : Data();
}

std::optional<Dictionary> parseValidationRecordPayload(const Data& payload) {
    ValueBuilder builder;
    if (!platform::readPropertyList(payload.bytes(), builder)) return std::nullopt;
    const Dictionary* dictionary = builder.value().asDictionary();
    return dictionary != nullptr ? std::optional(*dictionary) : std::nullopt;
}

}  // namespace veltoid
