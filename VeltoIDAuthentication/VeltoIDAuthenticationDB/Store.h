// The account database: account records, certificate entries and meta information, loaded once from a
// preference domain, written back section by section and flushed lazily.
//
// Everything here belongs to one serial queue, VeltoIDDBQueue: public operations run their bodies on it
// synchronously and never call each other from there. Bodies may call the keychain, which never calls back.
//
// Changes reach the preference store at once and survive the process; making them durable on disk is put off
// for three seconds, so that a burst of changes costs one flush, and a transaction keeps the agent alive
// until it has run.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <vector>

#include "IPCHelpers/Transaction.h"
#include "Platform/runtime/WorkQueue.h"
#include "Platform/storage/Preferences.h"
#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/Notify.h"

namespace veltoid {

/// Layout of the stored data; smaller ones are not kept.
inline constexpr int64_t kVeltoIDDBVersion = 100;
/// Version of this agent as an accessor of the database.
inline constexpr double kVeltoIDDBAccessorVersion = 727.8;
inline constexpr double kVeltoIDDBFlushDelay = 3.0;

/// Uses the preference domain `name` instead of the default one. Called before any other database operation.
void __VeltoIDDBSetPreferencesDomainName(const String& name);

/// Whether the database is kept in preferences or in memory only. When it was kept so far, it is written
/// first. Changing this after the first access does not load again.
void __VeltoIDDBSetUsePreferences(bool usePreferences);

/// The semaphore that changing operations signal when asked to.
void __VeltoIDDBSetChangeSemaphore(const platform::Semaphore& semaphore);

/// Makes all changes durable on disk. True.
bool __VeltoIDDBSynchronize();

/// Tries to load what is stored, unless that was done. False, with the error that says so, while it cannot be
/// read: whoever would answer from the empty database says that instead.
bool __VeltoIDDBIsReadable(ErrorOut error = nullptr);

/// Every key of the preference domain with its value; without preferences the sections under "Accounts",
/// "Certificates" and "MetaInfo". False, with the same error, while they cannot be read.
bool __VeltoIDDBCopyAllContents(std::optional<Dictionary>* contents, ErrorOut error = nullptr);

/// For the rooms of the database; their callers use the operations above and those of the other headers.
namespace database {

/// All members belong to the database queue.
class Store {
  public:
    Dictionary accounts;
    Dictionary certificates;
    Dictionary metaInfo;

    // Of KeychainIdentity.cpp: whether the keychain's identity is stored (any thread), and whether it was the
    // right one last time.
    std::atomic<bool> keychainIsKnown{false};
    bool keychainWasOurs = true;

    /// Where the keychain's identity is remembered: beside the database, as it is nothing for clients.
    platform::Preferences keychainDomain() const;

    /// The record or entry under a key of a section; null when there is none or it is not a Dictionary.
    static const Dictionary* find(const Dictionary& section, const String& key);

    /// Whether the stored data could be loaded, or none is kept. Otherwise the sections are empty and cannot
    /// be changed: what could not be read is never overwritten.
    bool isLoaded() const { return !usePreferences_ || loaded_; }

    /// A section and what takes its place.
    struct Change {
        Dictionary Store::*section;
        Dictionary changed;
    };

    /// Replaces sections by changed ones, hands them to the preference store in one step, plans the flush,
    /// and signals the change semaphore if asked. False, with the sections as they were, when they cannot be
    /// stored.
    bool replace(std::vector<Change> changes, Notify notify);

    /// The same with one entry of the section set.
    bool set(Dictionary Store::*section, const String& key, const Dictionary& entry, Notify notify);

    /// The same with one entry removed, with signal; false also when there is none.
    bool remove(Dictionary Store::*section, const String& key);

    /// What waits to be flushed is flushed now.
    void lifetimeEnds();

    const platform::WorkQueue queue{"VeltoIDDBQueue"};

  private:
    friend void veltoid::__VeltoIDDBSetPreferencesDomainName(const String& name);
    friend void veltoid::__VeltoIDDBSetUsePreferences(bool usePreferences);
    friend void veltoid::__VeltoIDDBSetChangeSemaphore(const platform::Semaphore& semaphore);
    friend bool veltoid::__VeltoIDDBSynchronize();
    friend bool veltoid::__VeltoIDDBCopyAllContents(std::optional<Dictionary>* contents, ErrorOut error);
    friend Store& loadedStore();

    std::string domain() const;
    platform::Preferences preferences() const;
    bool load();
    bool writeSections(const std::vector<Dictionary Store::*>& sections);
    void planFlush();
    void synchronize();

    std::atomic<bool> isReady_{false};
    bool usePreferences_ = false;
    bool loaded_ = false;
    /// The last attempt to load.
    bool hasFailed_ = false;
    String domainName_;
    std::unique_ptr<Transaction> pendingFlush_;
    std::optional<platform::Semaphore> changeSemaphore_;
};

/// Sets one value, an absent or Null one removing it; false when that changes nothing.
bool change(Dictionary& dictionary, const String& key, const Value& value);

Array keysOf(const Dictionary& section);

/// The stored value; absent when there is none, or a damaged one, which is kept aside so that nothing that is
/// written later takes its place. None when it cannot be read now.
std::optional<Value> readStored(const platform::Preferences& domain, std::string_view key);

/// How long what has changed waits for more to be written with it; not at all when the lifetime ends.
double flushDelay();

/// The store, loaded. The first caller loads it before its body is queued; others wait for that. While the
/// preference store cannot be read, the sections are empty and nothing is written, and each call tries to
/// load again.
Store& loadedStore();

/// Runs `body(store)` on the database queue and returns its result.
template <typename Body>
auto perform(Body&& body) {
    Store& store = loadedStore();
    return store.queue.sync([&] { return body(store); });
}

}  // namespace database
}  // namespace veltoid
