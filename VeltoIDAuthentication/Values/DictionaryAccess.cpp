#include "Values/DictionaryAccess.h"

#include <algorithm>
#include <charconv>
#include <limits>

namespace veltoid {
namespace {

const Value& valueUnder(const Dictionary* dictionary, std::string_view key) {
    return dictionary != nullptr ? (*dictionary)[key] : absentValue();
}

}  // namespace

bool getBool(const Dictionary* dictionary, std::string_view key, bool defaultValue) {
    return valueUnder(dictionary, key).asBoolean().value_or(defaultValue);
}

int32_t getInt32(const Dictionary* dictionary, std::string_view key, int32_t defaultValue) {
    return valueUnder(dictionary, key).asInt32().value_or(defaultValue);
}

long getLong(const Dictionary* dictionary, std::string_view key, long defaultValue) {
    return valueUnder(dictionary, key).asInt64().value_or(defaultValue);
}

double getDouble(const Dictionary* dictionary, std::string_view key, double defaultValue) {
    const Value& value = valueUnder(dictionary, key);
    const std::optional<double> number = value.asDouble();
    if (!number) return defaultValue;
    // An integer beyond 2^53 may have no double of its own.
    if (!value.isFloating() && value != Value::real(*number)) return defaultValue;
    return *number;
}

Value numberFromText(std::string_view text) {
    const char* const end = text.data() + text.size();
    int64_t integer = 0;
    if (const auto read = std::from_chars(text.data(), end, integer);
        read.ec == std::errc() && read.ptr == end)
        return Value::int64(integer);
    double number = std::numeric_limits<double>::infinity();
    const auto read = std::from_chars(text.data(), end, number);
    return read.ec != std::errc::invalid_argument && read.ptr == end ? Value::real(number) : Value();
}

std::optional<Dictionary> makeDictionary(std::initializer_list<std::pair<String, Value>> pairs) {
    Dictionary dictionary;
    for (const auto& [key, value] : pairs)
        if (key) dictionary.set(key, value);
    if (dictionary.empty()) return std::nullopt;
    return dictionary;
}

std::optional<Dictionary> mergeDictionaries(const std::optional<Dictionary>& base,
                                            const std::optional<Dictionary>& additions, bool replace) {
    if (!base) return additions;
    if (!additions) return base;
    Dictionary merged = *base;
    for (const auto& [key, value] : *additions)
        if (replace || !merged.contains(key.view())) merged.set(key, value);
    return merged;
}

Dictionary copyDictionarySettingValue(const std::optional<Dictionary>& dictionary, const String& key,
                                      const Value& value) {
    Dictionary copy = dictionary.value_or(Dictionary());
    if (key) copy.set(key, value);
    return copy;
}

void takeEntries(const Dictionary& from, std::span<const TakenEntry> entries, Dictionary& to) {
    for (const TakenEntry& entry : entries)
        if (const Value& value = from[entry.key]; value.kind() == entry.kind) to.set(entry.takenAs, value);
}

bool applyToArray(const Array* array, const std::function<bool(const Value&)>& function) {
    if (array == nullptr || array->empty()) return false;
    const Array held = *array;
    return std::all_of(held.begin(), held.end(), function);
}

bool applyToDictionary(const Dictionary* dictionary,
                       const std::function<bool(const String& key, const Value& value)>& function) {
    if (dictionary == nullptr || dictionary->empty()) return false;
    const Dictionary held = *dictionary;
    return std::all_of(held.begin(), held.end(),
                       [&](const Dictionary::Entry& entry) { return function(entry.key, entry.value); });
}

bool applyToSet(const Array& elements, const std::function<bool(const Value&)>& function) {
    return elements.empty() || applyToArray(&elements, function);
}

}  // namespace veltoid
