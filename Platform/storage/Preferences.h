// Preference domains: named sets of keys with one value each, for this user on this machine, kept in one
// SQLite file (preferences.db of the state directory). Opened on first
// use.
//
// A file that cannot be read as a database is moved aside (never deleted) and logged; one written by a newer
// version is refused and left alone. What was set survives the process at once, and a power cut after
// synchronize.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/encoding/ValueSink.h"

namespace platform {

/// One domain. Failures are logged by this interface with the file's name and the reason, never with a value.
/// All operations may be called from any thread; they serialise among themselves.
class Preferences {
  public:
    explicit Preferences(std::string domain) : domain_(std::move(domain)) {}

    enum class ReadResult {
        Found,
        Absent,
        /// There is one, but its bytes make no value (logged).
        Damaged,
        /// The store cannot be read now: there may be a value.
        Failed,
    };

    /// Writes the value under `key` into the sink. What has reached the sink counts only when it was found.
    ReadResult read(std::string_view key, ValueSink& sink) const;

    /// None when the store cannot be read now.
    std::optional<std::vector<std::string>> keys() const;

    /// Sets all of the given keys or, on failure, none.
    bool set(const std::vector<std::pair<std::string, ValueWriter>>& values) const;

    /// Removes all of the given keys or, on failure, none.
    bool remove(const std::vector<std::string>& keys) const;

    /// Takes the key out of the domain and keeps its bytes under the domain's name with ".damaged" and the
    /// key with the date appended, so that they can be looked at.
    bool setAside(std::string_view key) const;

    /// Makes everything set so far durable on disk.
    bool synchronize() const;

  private:
    std::string domain_;
};

}  // namespace platform
