// Tables of the entries that one dictionary takes over from another.
#pragma once

#include <span>

#include "Values/Value.h"

namespace veltoid {

struct TakenEntry {
    std::string_view key;
    /// An entry of another kind is left out.
    Value::Kind kind;
    std::string_view takenAs = key;
};

inline void takeEntries(const Dictionary& from, std::span<const TakenEntry> entries, Dictionary& to) {
    for (const TakenEntry& entry : entries)
        if (const Value& value = from[entry.key]; value.kind() == entry.kind) to.set(entry.takenAs, value);
}

}  // namespace veltoid
