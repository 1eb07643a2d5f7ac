// The identifiers by which the server knows an account on this device.
#pragma once

#include "Values/Value.h"

namespace veltoid::database {

/// Adds "AccountUUID" (random, once) and "AccountStableUUID" (from the name in lower case and the device's
/// "UserUUID", once that exists) to the record where missing. True when it added one.
bool deriveAccountUUIDs(const String& name, Dictionary& record, const Dictionary& metaInfo);

}  // namespace veltoid::database
