// The signed validation record: a CMS message in which the identity server vouches for what it has validated
// of an account. Any thread; nothing is kept and nothing is logged.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// The signed content; null when the record carries none or its signature does not verify. Who signed is not
/// looked at: the record came over a connection whose server was verified.
Data verifyValidationRecord(const Data& record);

/// The content as a Dictionary; none when it is no property list (XML or binary) or another kind of value.
std::optional<Dictionary> parseValidationRecordPayload(const Data& payload);

}  // namespace veltoid
