// Small pieces of data that clients keep with the identity server, per account and device. Caller's queue;
// blocks while the server is asked.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Signs in and stores the data under the key. The error is the session's, else -100.
bool __VeltoIDDoSetBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                              const Data& data, const Dictionary& options, ErrorOut error = nullptr);

/// Signs in and fetches what is stored under the key; null, with an error (the session's, else -100), when
/// nothing is.
Data __VeltoIDDoCopyBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                               const Dictionary& options, ErrorOut error = nullptr);

}  // namespace veltoid
