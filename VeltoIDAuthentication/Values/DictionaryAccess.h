// Typed reads with defaults, dictionary builders and iteration with early stop.
#pragma once

#include <functional>

#include "Values/Value.h"

namespace veltoid {

/// Each takes the dictionary by pointer; null means absent.
bool getBool(const Dictionary* dictionary, std::string_view key, bool defaultValue);

// The default when the value is absent, no Number, or not exactly representable.
int32_t getInt32(const Dictionary* dictionary, std::string_view key, int32_t defaultValue);
long getLong(const Dictionary* dictionary, std::string_view key, long defaultValue);
double getDouble(const Dictionary* dictionary, std::string_view key, double defaultValue);

/// The Number that the whole text writes in decimal, finite or not; absent when it writes none.
Value numberFromText(std::string_view text);

/// The pairs whose key and value are both present, in the order given; none when no pair is complete.
std::optional<Dictionary> makeDictionary(std::initializer_list<std::pair<String, Value>> pairs);

/// `base` with every entry of `additions`, which replace existing ones only with `replace`. An absent side
/// yields the other one.
std::optional<Dictionary> mergeDictionaries(const std::optional<Dictionary>& base,
                                            const std::optional<Dictionary>& additions, bool replace);

/// A copy of `dictionary` (or a new one) with key set to value when both are given.
Dictionary copyDictionarySettingValue(const std::optional<Dictionary>& dictionary, const String& key,
                                      const Value& value);

/// What one dictionary takes over from another: an entry of that kind, under another key where one is given.
struct TakenEntry {
    std::string_view key;
    Value::Kind kind;
    std::string_view takenAs = key;
};
void takeEntries(const Dictionary& from, std::span<const TakenEntry> entries, Dictionary& to);

// False for an absent or empty collection, false as soon as the function returns false, true otherwise.
bool applyToArray(const Array* array, const std::function<bool(const Value&)>& function);
bool applyToDictionary(const Dictionary* dictionary,
                       const std::function<bool(const String& key, const Value& value)>& function);

/// The elements of a set, each once. True for an empty set; otherwise as applyToArray. The elements are held
/// for the duration.
bool applyToSet(const Array& elements, const std::function<bool(const Value&)>& function);

}  // namespace veltoid
