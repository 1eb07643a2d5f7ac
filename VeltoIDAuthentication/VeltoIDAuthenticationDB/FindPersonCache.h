// People that the identity server has found, by the criterion that found them, so that the same question
// needs no second answer. An entry is the dictionary that the server sent, with "ValidDate" (when it was
// stored); its "ValidInterval" says for how many seconds it is good: two weeks if it says nothing, a year at
// most, never if it is negative or no number at all.
//
// All operations may be called from any thread; one lock serialises them. It is never held while anything
// else of the database is called, nor while the cache is written.
//
// The cache is kept in a preference domain of its own, under one key, and read from there by the first
// operation; while it cannot be read, nothing is written and each operation tries again. Additions are
// written together three seconds after the first of them, and a transaction keeps the agent alive until then:
// only a process that is killed loses what it added last. Entries that are no longer good are then dropped,
// in memory as well; those that are good are lost to nothing but the limits below, the oldest first.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

inline constexpr std::string_view kVeltoIDFindPersonCacheDomain =
    "com.velto.harbwell.veltoidauthenticationcache";
inline constexpr std::string_view kVeltoIDFindPersonCacheKey = "findPersonCache";
inline constexpr size_t kVeltoIDMaxFindPersonEntries = 100'000;
/// Of all entries together: keys, texts and data, and 16 for each of them and every other value.
inline constexpr size_t kVeltoIDMaxFindPersonCacheBytes = 60U << 20U;
inline constexpr double kVeltoIDFindPersonDefaultValidInterval = 1'209'600.0;
inline constexpr double kVeltoIDFindPersonMaxValidInterval = 31'536'000.0;

/// Whether the cache is kept in preferences or (as without this call) in memory only. Called before any other
/// operation of the cache.
void __VeltoIDDBSetFindPersonCacheUsePreferences(bool usePreferences);

/// Adds what the server found; elements that are no dictionaries or lack "matched" (the criterion's name) or
/// "value" as Strings, or are nested deeper than can be stored, are left out. An older entry of the same
/// criterion and value is replaced. True.
bool __VeltoIDDBAddFindPersonResultsToCache(const Array& results);

/// The good entries under criteria (a Dictionary from names to Arrays of Strings), in the order of the
/// criteria; none when there are none.
std::optional<Array> __VeltoIDDBCopyCachedFindPersonResults(const Dictionary& criteria);

/// Writes additions that wait for it at once. False when they could not be written.
bool __VeltoIDDBWriteFindPersonCache();

}  // namespace veltoid
