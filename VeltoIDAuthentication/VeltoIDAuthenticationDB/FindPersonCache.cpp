#include "VeltoIDAuthenticationDB/FindPersonCache.h"

#include <algorithm>
#include <cmath>
#include <list>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <utility>
#include <vector>

#include "IPCHelpers/Transaction.h"
#include "Platform/propertylist/PropertyList.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Platform/storage/Preferences.h"
#include "Protocol/MessageKeys.h"
#include "Values/ValueStream.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using platform::Preferences;

constexpr std::string_view kValidDate = "ValidDate";
constexpr std::string_view kValidInterval = "ValidInterval";

Preferences domain() { return Preferences(std::string(kVeltoIDFindPersonCacheDomain)); }

String cacheKey(std::string_view criterion, std::string_view value) {
    return String::writtenBy(criterion.size() + 1 + value.size(), [&](char* out) {
        out = std::copy(criterion.begin(), criterion.end(), out);
        *out++ = '-';
        std::copy(value.begin(), value.end(), out);
    });
}

/// What every value and key counts for beyond its text or data.
constexpr size_t kObjectBytes = 16;

// Whatever stays within the limits of the cache can be written as one property list.
static_assert(kVeltoIDMaxFindPersonCacheBytes / kObjectBytes < platform::kMaxPropertyListObjects);
static_assert(kVeltoIDMaxFindPersonCacheBytes <= platform::kMaxPropertyListPayload);

/// The size that counts; none when the value is too deep to be written.
std::optional<size_t> extentOf(const Value& value, int depthLeft) {
    size_t extent = kObjectBytes + value.asText().value_or("").size() + value.asData().size();
    const auto add = [&](const Value& member) {
        const auto inner = extentOf(member, depthLeft - 1);
        extent += inner.value_or(0);
        return inner.has_value();
    };
    const Array* array = value.asArray();
    const Dictionary* dictionary = value.asDictionary();
    if ((array != nullptr || dictionary != nullptr) && depthLeft == 0) return std::nullopt;
    if (array != nullptr && !std::all_of(array->begin(), array->end(), add)) return std::nullopt;
    if (dictionary != nullptr) {
        for (const auto& [key, member] : *dictionary) {
            extent += kObjectBytes + key.view().size();
            if (!add(member)) return std::nullopt;
        }
    }
    return extent;
}

struct Entry {
    String key;
    Dictionary person;
    double validFrom;
    double validUntil;
    /// None for what cannot be written.
    std::optional<size_t> bytes;

    Entry(String cacheKey, Dictionary contents) : key(std::move(cacheKey)), person(std::move(contents)) {
        constexpr double kNever = -platform::kForever;
        validFrom = person.date(kValidDate).value_or(kNever);
        const double interval =
            person.number(kValidInterval).value_or(kVeltoIDFindPersonDefaultValidInterval);
        const bool canBeGood = std::isfinite(validFrom) && interval >= 0;
        bytes = extentOf(person, platform::kMaxPropertyListDepth - 1);
        if (bytes) *bytes += kObjectBytes + key.view().size();
        validUntil = canBeGood ? validFrom + std::min(interval, kVeltoIDFindPersonMaxValidInterval) : kNever;
    }

    /// If so, both dates are finite.
    bool isEverGood() const { return std::isfinite(validUntil); }
    bool isGoodAt(double now) const { return validFrom <= now && now <= validUntil; }
};

class FindPersonCache {
  public:
    void setUsesPreferences(bool usesPreferences) {
        const std::lock_guard lock(mutex_);
        usesPreferences_ = usesPreferences;
    }

    void add(const Array& results) {
        const std::lock_guard lock(mutex_);
        seed();
        const Value now = Value::date(platform::now());
        for (const Value& result : results) {
            if (!result.isDictionary()) continue;
            Dictionary person = *result.asDictionary();
            const String matched = person.string(message::kMatched);
            const String value = person.string(message::kMatchedValue);
            if (!matched || !value) continue;
            person.set(kValidDate, now);
            insert({cacheKey(matched.view(), value.view()), std::move(person)});
            planWrite();
        }
    }

    Array find(const Dictionary& criteria) {
        const std::lock_guard lock(mutex_);
        seed();
        const double now = platform::now();
        Array found;
        for (const auto& [criterion, wanted] : criteria) {
            const Array* values = wanted.asArray();
            if (values == nullptr) continue;
            for (const Value& value : *values) {
                const auto text = value.asText();
                const auto known =
                    text ? byKey_.find(cacheKey(criterion.view(), *text).view()) : byKey_.end();
                if (known != byKey_.end() && known->second->isGoodAt(now))
                    found.append(known->second->person);
            }
        }
        return found;
    }

    bool writeNow() {
        return writeQueue_.sync([this] { return write(); });
    }

    /// What waits to be written is written now.
    void lifetimeEnds() {
        writeQueue_.async([this] { write(); });
    }

  private:
    using Entries = std::list<Entry>;

    // The lock is held from here to planWrite.

    void seed() {
        if (isSeeded_ || !usesPreferences_) return;
        const auto stored = database::readStored(domain(), kVeltoIDFindPersonCacheKey);
        if (!stored) return;
        isSeeded_ = true;
        if (const Dictionary* people = stored->asDictionary()) seedFrom(*people);
    }

    /// What is here already has been added since and is newer than anything stored.
    void seedFrom(const Dictionary& stored) {
        Entries added;
        added.swap(entries_);
        byKey_.clear();
        bytes_ = 0;
        std::vector<Entry> sorted;
        sorted.reserve(stored.size());
        for (const auto& [key, person] : stored) {
            if (!person.isDictionary()) continue;
            Entry entry(key, *person.asDictionary());
            if (entry.isEverGood()) sorted.push_back(std::move(entry));
        }
        std::stable_sort(sorted.begin(), sorted.end(),
                         [](const Entry& a, const Entry& b) { return a.validFrom < b.validFrom; });
        for (Entry& entry : sorted) insert(std::move(entry));
        for (Entry& entry : added) insert(std::move(entry));
    }

    void insert(Entry entry) {
        if (!entry.bytes) return;
        if (const auto known = byKey_.find(entry.key.view()); known != byKey_.end()) drop(known->second);
        bytes_ += *entry.bytes;
        entries_.push_back(std::move(entry));
        byKey_.emplace(entries_.back().key.view(), std::prev(entries_.end()));
        while (entries_.size() > kVeltoIDMaxFindPersonEntries || bytes_ > kVeltoIDMaxFindPersonCacheBytes)
            drop(entries_.begin());
    }

    void drop(Entries::iterator entry) {
        bytes_ -= *entry->bytes;
        byKey_.erase(entry->key.view());
        entries_.erase(entry);
    }

    void dropEnded() {
        const double now = platform::now();
        for (auto entry = entries_.begin(); entry != entries_.end();) {
            const auto current = entry++;
            if (now > current->validUntil) drop(current);
        }
    }

    void planWrite() {
        if (pendingWrite_) return;
        pendingWrite_ = std::make_unique<Transaction>("VeltoIDFindPersonCache");
        writeQueue_.asyncAfter(database::flushDelay(), [this] { write(); });
    }

    /// On the write queue. The entries are shared, so that the lock is held only to count them.
    bool write() {
        const Transaction keepAlive("VeltoIDFindPersonCacheWrite");
        std::vector<std::pair<String, Dictionary>> kept;
        {
            const std::lock_guard lock(mutex_);
            if (!pendingWrite_) return true;
            pendingWrite_.reset();
            seed();
            dropEnded();
            if (!usesPreferences_) return true;
            if (!isSeeded_) return false;
            kept.reserve(entries_.size());
            for (const Entry& entry : entries_) kept.emplace_back(entry.key, entry.person);
        }
        return domain().set({{std::string(kVeltoIDFindPersonCacheKey), [&kept](platform::ValueSink& sink) {
                                  sink.beginDictionary();
                                  for (const auto& [key, person] : kept) {
                                      sink.key(key.view());
                                      writeValue(person, sink);
                                  }
                                  sink.endDictionary();
                              }}});
    }

    /// Writes run here one after the other, apart from the lock.
    const platform::WorkQueue writeQueue_{"VeltoIDFindPersonCacheQueue"};
    std::mutex mutex_;
    /// In the order in which they were stored.
    Entries entries_;
    /// The keys lie in the entries.
    std::unordered_map<std::string_view, Entries::iterator> byKey_;
    size_t bytes_ = 0;
    std::unique_ptr<Transaction> pendingWrite_;
    bool usesPreferences_ = false;
    bool isSeeded_ = false;
};

FindPersonCache& cache() { return platform::Lifetime::current().state<FindPersonCache>(); }

}  // namespace

void __VeltoIDDBSetFindPersonCacheUsePreferences(bool usePreferences) {
    cache().setUsesPreferences(usePreferences);
}

bool __VeltoIDDBAddFindPersonResultsToCache(const Array& results) {
    cache().add(results);
    return true;
}

std::optional<Array> __VeltoIDDBCopyCachedFindPersonResults(const Dictionary& criteria) {
    Array found = cache().find(criteria);
    if (found.empty()) return std::nullopt;
    return found;
}

bool __VeltoIDDBWriteFindPersonCache() { return cache().writeNow(); }

}  // namespace veltoid
