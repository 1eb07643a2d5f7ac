// Meta information: device-wide values, intervals and switches from the server, counters, and per-account
// sections of the same keys. Look-ups fall back to built-in defaults. Bodies run on the database queue;
// writes never notify.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// Where the identity server is reached unless something else is set.
inline constexpr std::string_view kVeltoIDDefaultServerURL =
    "https://identity.velto.example/dsservices/dsxmlrpc";

/// How long before its expiry a certificate is renewed (seconds), unless something else is set.
inline constexpr double kVeltoIDDefaultPreExpirationInterval = 129'600.0;

/// The value of `key`: from the options, the section's dictionary, the top level, the defaults; the first one
/// of the required kind (a default of another kind ends the search). Absent when there is none. Null section:
/// top level only.
Value __VeltoIDDBCopyMetaInfoValue(const String& section, const Dictionary& options, const String& key,
                                   std::optional<Value::Kind> requiredKind = std::nullopt);

/// Stores the value in the section's dictionary (created when missing), or at the top level without one; an
/// absent or Null value removes it. False without key.
bool __VeltoIDDBSetMetaInfoValue(const String& section, const String& key, const Value& value);

/// Adds `delta` (wrapping) to the counter as the look-up finds it and stores it, unless the section is a name
/// that no stored account has; the new value. Read and write are two operations, so that of two concurrent
/// increments one may be lost. 0 and no change without key.
int64_t __VeltoIDDBIncrementMetaInfoCounter(const String& section, const Dictionary& options,
                                            const String& key, int64_t delta);

/// Removes the sections of names that no account has and that hold nothing but counters.
void __VeltoIDDBForgetUnknownNames();

/// What an interval counts as that is set to something other than a number.
enum class UnreadableInterval { Default, Zero };

/// The Number of seconds under `key`, looked up as above; the default when there is none. A text that writes
/// a number, as every value of the agent's command line is a text, is that number. One that is not finite
/// counts as something other than a number.
double metaInterval(const String& section, const Dictionary& options, std::string_view key,
                    double defaultValue, UnreadableInterval unreadable = UnreadableInterval::Default);

/// The reportable meta information that has values; none when none has.
std::optional<Dictionary> __VeltoIDDBCopyMetaInformation(const String& section, const Dictionary& options);

}  // namespace veltoid
