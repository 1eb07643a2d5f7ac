#include "VeltoIDAuthenticationDB/Store.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/InstanceLock.h"
#include "Platform/runtime/Lifetime.h"
#include "Protocol/RecordKeys.h"
#include "Values/ValueStream.h"
#include "VeltoIDAuthenticationDB/Migration.h"

namespace veltoid {
namespace database {

namespace {

Store& store() { return platform::Lifetime::current().state<Store>(); }

/// Whether the stored data can be loaded or not.
template <typename Body>
void onQueue(Body body) {
    store().queue.sync([&] { body(store()); });
}

using ReadResult = platform::Preferences::ReadResult;

struct StoredValue {
    ReadResult result = ReadResult::Failed;
    /// Absent unless found.
    Value value;
};

StoredValue readPreference(const platform::Preferences& preferences, std::string_view key) {
    ValueBuilder builder;
    const ReadResult result = preferences.read(key, builder);
    return {result, result == ReadResult::Found ? builder.value() : Value()};
}

std::pair<std::string, platform::ValueWriter> preference(std::string_view key, const Value& value) {
    return {std::string(key), [value](platform::ValueSink& sink) { writeValue(value, sink); }};
}

enum class OtherEntries { Drop, Keep };

/// A stored section; none when it cannot be read now. Entries that are no dictionaries are dropped or kept.
std::optional<Dictionary> readSection(const platform::Preferences& domain, std::string_view key,
                                      OtherEntries others) {
    const auto stored = readStored(domain, key);
    if (!stored) return std::nullopt;
    Dictionary section;
    if (const Dictionary* entries = stored->asDictionary())
        for (const auto& [name, value] : *entries)
            if (others == OtherEntries::Keep || value.isDictionary()) section.set(name, value);
    return section;
}

bool isUsableVersion(const Value& version) {
    const std::optional<int64_t> number = version.asInt64();
    return number && static_cast<uint64_t>(*number) >= static_cast<uint64_t>(kVeltoIDDBVersion);
}

/// Keeps stored data of a usable version; otherwise starts the domain afresh. A damaged version says nothing
/// about the data beside it and is written again. False when the store cannot be read or written now.
bool keepOrInitialize(const platform::Preferences& domain) {
    const StoredValue version = readPreference(domain, kVeltoIDDBVersionKey);
    if (version.result == ReadResult::Failed) return false;
    if (isUsableVersion(version.value)) return true;
    const auto current = preference(kVeltoIDDBVersionKey, Value::int64(kVeltoIDDBVersion));
    if (version.result == ReadResult::Damaged) return domain.set({current});
    const Value now = Value::date(platform::now());
    const auto keys = domain.keys();
    return keys && domain.remove(*keys) &&
           domain.set({current, preference(kVeltoIDDBCreationDateKey, now)}) && domain.synchronize();
}

/// Every key of the domain with its value; none when it cannot be read now.
std::optional<Dictionary> readAll(const platform::Preferences& domain) {
    const auto keys = domain.keys();
    if (!keys) return std::nullopt;
    Dictionary all;
    for (const std::string& key : *keys) {
        const StoredValue stored = readPreference(domain, key);
        if (stored.result == ReadResult::Failed) return std::nullopt;
        all.set(String(key), stored.value);
    }
    return all;
}

Error unreadable() {
    return makeError(
        identity_error::kUnspecified,
        {"The stored accounts cannot be read now.",
         "Nothing is known about the accounts, and nothing is lost.",
         "The log says what is in the way of the agent's preferences. Try again when it is gone."},
        {}, "__VeltoIDDBIsReadable", __FILE_NAME__, __LINE__);
}

/// The name of a section in the domain.
std::string_view keyOf(Dictionary Store::*section) {
    if (section == &Store::accounts) return kVeltoIDDBAccountsKey;
    return section == &Store::certificates ? kVeltoIDDBCertificatesKey : kVeltoIDDBMetaInfoKey;
}

}  // namespace

std::optional<Value> readStored(const platform::Preferences& domain, std::string_view key) {
    const StoredValue stored = readPreference(domain, key);
    if (stored.result == ReadResult::Failed) return std::nullopt;
    if (stored.result == ReadResult::Damaged && !domain.setAside(key)) return std::nullopt;
    return stored.value;
}

double flushDelay() { return platform::Lifetime::current().isEnding() ? 0 : kVeltoIDDBFlushDelay; }

Store& loadedStore() {
    Store& current = store();
    if (!current.isReady_.load(std::memory_order_acquire)) {
        current.queue.sync([&] {
            if (current.isReady_.load(std::memory_order_relaxed)) return;
            const bool isLoaded = current.load();
            current.isReady_.store(isLoaded, std::memory_order_release);
            // Who waits for that need not wait any longer.
            if (std::exchange(current.hasFailed_, !isLoaded) && isLoaded && current.changeSemaphore_)
                current.changeSemaphore_->signal();
        });
    }
    return current;
}

bool change(Dictionary& dictionary, const String& key, const Value& value) {
    if (value.isAbsent() || value.isNull()) return dictionary.remove(key.view());
    if (dictionary[key.view()] == value) return false;
    dictionary.set(key, value);
    return true;
}

Array keysOf(const Dictionary& section) {
    Array keys;
    for (const auto& [key, value] : section) keys.append(key);
    return keys;
}

const Dictionary* Store::find(const Dictionary& section, const String& key) {
    return key ? section.dictionary(key.view()) : nullptr;
}

std::string Store::domain() const {
    return domainName_ ? domainName_.text() : std::string(kVeltoIDDBDefaultDomain);
}

platform::Preferences Store::preferences() const { return platform::Preferences(domain()); }

platform::Preferences Store::keychainDomain() const { return platform::Preferences(domain() + ".keychain"); }

bool Store::load() {
    if (!usePreferences_) return true;
    if (!platform::instance_lock::mayRead()) return false;
    const platform::Preferences domain = preferences();
    if (!keepOrInitialize(domain)) return false;
    const auto storedAccounts = readSection(domain, kVeltoIDDBAccountsKey, OtherEntries::Drop);
    const auto storedCertificates = readSection(domain, kVeltoIDDBCertificatesKey, OtherEntries::Drop);
    const auto storedMetaInfo = readSection(domain, kVeltoIDDBMetaInfoKey, OtherEntries::Keep);
    const StoredValue storedVersions = readPreference(domain, kVeltoIDDBAccessorVersionsKey);
    if (!storedAccounts || !storedCertificates || !storedMetaInfo ||
        storedVersions.result == ReadResult::Failed)
        return false;

    accounts = *storedAccounts;
    certificates = *storedCertificates;
    metaInfo = *storedMetaInfo;
    loaded_ = true;
    const Array* stored = storedVersions.value.asArray();
    Array versions = stored != nullptr ? *stored : Array();
    const MigrationOutcome migrated = migrate(accounts, metaInfo, versions);
    const Value own = Value::real(kVeltoIDDBAccessorVersion);
    const bool isNew = std::find(versions.begin(), versions.end(), own) == versions.end();
    if (isNew) versions.append(own);
    if (isNew || migrated.versionsCut) {
        domain.set({preference(kVeltoIDDBAccessorVersionsKey, versions)});
        domain.synchronize();
    }
    if (isNew || migrated.sectionsChanged)
        writeSections({&Store::accounts, &Store::certificates, &Store::metaInfo});
    return true;
}

bool Store::set(Dictionary Store::*section, const String& key, const Dictionary& entry, Notify notify) {
    Dictionary changed = this->*section;
    changed.set(key, entry);
    return replace({{section, std::move(changed)}}, notify);
}

bool Store::remove(Dictionary Store::*section, const String& key) {
    Dictionary changed = this->*section;
    return key && changed.remove(key.view()) && replace({{section, std::move(changed)}}, Notify::Yes);
}

bool Store::replace(std::vector<Change> changes, Notify notify) {
    if (!isLoaded()) return false;
    std::vector<Dictionary Store::*> sections;
    sections.reserve(changes.size());
    for (Change& each : changes) sections.push_back(each.section);
    const auto exchange = [&] {
        for (Change& each : changes) std::swap(this->*each.section, each.changed);
    };
    exchange();
    if (!writeSections(sections)) {
        exchange();
        return false;
    }
    if (notify == Notify::Yes && changeSemaphore_) changeSemaphore_->signal();
    return true;
}

bool Store::writeSections(const std::vector<Dictionary Store::*>& sections) {
    if (!usePreferences_) return true;
    if (!loaded_) return false;
    const platform::Preferences domain = preferences();
    std::vector<std::pair<std::string, platform::ValueWriter>> values;
    // The file may have been taken away: its successor would be taken for one of another layout.
    const bool isWhole = readPreference(domain, kVeltoIDDBVersionKey).result != ReadResult::Absent;
    const std::vector<Dictionary Store::*> all = {&Store::accounts, &Store::certificates, &Store::metaInfo};
    if (!isWhole) values.push_back(preference(kVeltoIDDBVersionKey, Value::int64(kVeltoIDDBVersion)));
    for (Dictionary Store::*section : isWhole ? sections : all)
        values.push_back(preference(keyOf(section), this->*section));
    if (!domain.set(values)) return false;
    planFlush();
    return true;
}

void Store::planFlush() {
    if (pendingFlush_) return;
    pendingFlush_ = std::make_unique<Transaction>("VeltoIDDBFlush");
    queue.asyncAfter(flushDelay(), [this] { synchronize(); });
}

void Store::lifetimeEnds() {
    queue.async([this] {
        if (pendingFlush_) synchronize();
    });
}

/// A flush that fails is logged by the preference store; the data survives the process all the same.
void Store::synchronize() {
    const Transaction keepAlive("VeltoIDDBSynchronize");
    preferences().synchronize();
    pendingFlush_.reset();
}

}  // namespace database

using database::Store;

void __VeltoIDDBSetPreferencesDomainName(const String& name) {
    database::onQueue([&](Store& store) { store.domainName_ = name; });
}

void __VeltoIDDBSetUsePreferences(bool usePreferences) {
    database::onQueue([&](Store& store) {
        if (store.usePreferences_)
            store.writeSections({&Store::accounts, &Store::certificates, &Store::metaInfo});
        store.usePreferences_ = usePreferences;
    });
}

void __VeltoIDDBSetChangeSemaphore(const platform::Semaphore& semaphore) {
    database::onQueue([&](Store& store) { store.changeSemaphore_ = semaphore; });
}

bool __VeltoIDDBSynchronize() {
    database::onQueue([](Store& store) {
        if (store.usePreferences_) store.synchronize();
    });
    return true;
}

bool __VeltoIDDBIsReadable(ErrorOut error) {
    const bool isLoaded = database::perform([](const Store& store) { return store.isLoaded(); });
    return isLoaded || failWith(error, database::unreadable());
}

bool __VeltoIDDBCopyAllContents(std::optional<Dictionary>* contents, ErrorOut error) {
    const auto all = database::perform([](Store& store) -> std::optional<Dictionary> {
        if (!store.usePreferences_)
            return Dictionary{{kVeltoIDDBAccountsKey, store.accounts},
                              {kVeltoIDDBUnstoredCertificatesKey, store.certificates},
                              {kVeltoIDDBMetaInfoKey, store.metaInfo}};
        if (!store.isLoaded()) return std::nullopt;
        auto stored = database::readAll(store.preferences());
        if (!stored || stored->contains(kVeltoIDDBVersionKey) || !store.writeSections({})) return stored;
        return database::readAll(store.preferences());
    });
    if (!all) return failWith(error, database::unreadable());
    fill(contents, all);
    return true;
}

}  // namespace veltoid
