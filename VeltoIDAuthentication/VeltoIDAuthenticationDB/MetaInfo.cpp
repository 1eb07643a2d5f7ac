#include "VeltoIDAuthenticationDB/MetaInfo.h"

#include <algorithm>
#include <cmath>
#include <limits>

#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using database::Store;

const Dictionary& defaults() {
    static const auto* values = new Dictionary{
        {kVeltoIDDBServerURLKey, kVeltoIDDefaultServerURL},
        {kVeltoIDMetaPreExpirationIntervalKey, Value::real(kVeltoIDDefaultPreExpirationInterval)},
    };
    return *values;
}

Value numberOf(const Value& value) { return value.isString() ? numberFromText(*value.asText()) : value; }

bool fits(const Value& value, std::optional<Value::Kind> requiredKind) {
    return !value.isAbsent() && (!requiredKind || value.kind() == *requiredKind);
}

}  // namespace

Value __VeltoIDDBCopyMetaInfoValue(const String& section, const Dictionary& options, const String& key,
                                   std::optional<Value::Kind> requiredKind) {
    if (!key) return {};
    if (const Value& given = options[key.view()]; fits(given, requiredKind)) return given;
    return database::perform([&](const Store& store) {
        for (const Dictionary* level : {Store::find(store.metaInfo, section), &store.metaInfo, &defaults()})
            if (level != nullptr)
                if (const Value& value = (*level)[key.view()]; fits(value, requiredKind)) return value;
        return Value();
    });
}

bool __VeltoIDDBSetMetaInfoValue(const String& section, const String& key, const Value& value) {
    if (!key) return false;
    return database::perform([&](Store& store) {
        const Dictionary* stored = section ? Store::find(store.metaInfo, section) : &store.metaInfo;
        Dictionary changed = stored != nullptr ? *stored : Dictionary();
        if (!database::change(changed, key, value)) return true;
        return section ? store.set(&Store::metaInfo, section, changed, Notify::No)
                       : store.replace({{&Store::metaInfo, std::move(changed)}}, Notify::No);
    });
}

int64_t __VeltoIDDBIncrementMetaInfoCounter(const String& section, const Dictionary& options,
                                            const String& key, int64_t delta) {
    if (!key) return 0;
    const Value current = __VeltoIDDBCopyMetaInfoValue(section, options, key, Value::Kind::Number);
    const auto sum = static_cast<int64_t>(static_cast<uint64_t>(current.asInt64().value_or(0)) +
                                          static_cast<uint64_t>(delta));
    const bool isForNobody = section && database::perform([&](const Store& store) {
                                 return Store::find(store.accounts, section) == nullptr;
                             });
    if (!isForNobody) __VeltoIDDBSetMetaInfoValue(section, key, Value::int64(sum));
    return sum;
}

void __VeltoIDDBForgetUnknownNames() {
    database::perform([](Store& store) {
        if (!store.isLoaded()) return;
        Dictionary kept = store.metaInfo;
        for (const auto& [name, value] : store.metaInfo) {
            const Dictionary* section = value.asDictionary();
            if (section == nullptr || Store::find(store.accounts, name) != nullptr) continue;
            if (std::all_of(section->begin(), section->end(),
                            [](const auto& entry) { return entry.key.view().ends_with("Count"); }))
                kept.remove(name.view());
        }
        if (kept.size() != store.metaInfo.size())
            store.replace({{&Store::metaInfo, std::move(kept)}}, Notify::No);
    });
}

double metaInterval(const String& section, const Dictionary& options, std::string_view key,
                    double defaultValue, UnreadableInterval unreadable) {
    const bool isZero = unreadable == UnreadableInterval::Zero;
    Value stored = __VeltoIDDBCopyMetaInfoValue(section, options, key);
    if (!isZero && !fits(numberOf(stored), Value::Kind::Number))
        stored = __VeltoIDDBCopyMetaInfoValue(section, options, key, Value::Kind::Number);
    if (stored.isAbsent()) return defaultValue;
    const double seconds = numberOf(stored).asDouble().value_or(std::numeric_limits<double>::quiet_NaN());
    if (std::isfinite(seconds)) return seconds;
    return isZero ? 0 : defaultValue;
}

std::optional<Dictionary> __VeltoIDDBCopyMetaInformation(const String& section, const Dictionary& options) {
    Dictionary information;
    for (const std::string_view key : kVeltoIDReportableMetaInformation)
        information.set(key, __VeltoIDDBCopyMetaInfoValue(section, options, key));
    if (information.empty()) return std::nullopt;
    return information;
}

}  // namespace veltoid
