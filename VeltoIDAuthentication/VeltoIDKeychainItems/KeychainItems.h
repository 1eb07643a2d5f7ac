// What passwords, keys and certificates in the keychain have in common: the queue on which every operation on
// them runs, and the substitute in memory.
//
// KeychainDispatchQueue never calls back into the database. Without the system keychain, passwords and keys
// live in in-memory tables under random 16-byte references and are gone at exit.
#pragma once

#include <functional>
#include <utility>
#include <vector>

#include "Platform/keychain/Keychain.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Values/Digest.h"
#include "Values/Value.h"

namespace veltoid {

/// Access group of keys and certificates.
inline constexpr const char* kKeychainAccessGroup =
    "com.velto.harbwell.veltoidauthentication.keychainaccessgroup";

/// Whether items go to the keychain (the default) or into memory. Any thread.
void setUseSystemKeychain(bool use);
bool usesSystemKeychain();

/// The queue of all keychain operations.
platform::WorkQueue keychainQueue();

enum class ItemState {
    Readable,
    /// There is no such item, or it is damaged.
    Gone,
    /// It may be had later: the keychain is locked, or cannot be read now.
    Unreadable,
};

/// The state of the item of that class and reference; gone without reference. Says nothing about whether the
/// keychain is the one that the reference is from (VeltoIDAuthenticationDB/KeychainIdentity.h does).
ItemState keychainItemState(platform::KeychainItemClass itemClass, const Data& reference);

/// For the rooms' own sources: their callers use the operations of the other headers.
namespace keychain_items {

/// The item of that class and reference.
platform::KeychainQuery queryForReference(platform::KeychainItemClass itemClass, const Data& reference);

/// The item list of the query that names one item, as a log line shows it.
std::string describeItemQuery(std::string_view itemClass, const Data& reference);

/// The reference of the first item that matches; null, with the status, when there is none.
Data copyReference(const platform::KeychainAttributes& attributes,
                   platform::KeychainStatus* status = nullptr);

/// An item that is to be in the keychain.
struct WantedItem {
    /// By this an item is found that is there already.
    platform::KeychainAttributes identity;
    /// What that one is changed to; a new one has this data too.
    platform::keychain::Changes changes;
    /// Of a new item.
    platform::KeychainAttributes attributes;
    platform::Accessibility accessibility;
};

/// What is about to be done, as a log line may tell it: to the item of that reference, after this status.
enum class Step { Update, Replace, Add };
using TellStep = std::function<void(Step step, const Data& reference, platform::KeychainStatus status)>;

/// Changes the item in place, replaces one that cannot be changed for good, or adds it; an item that only
/// cannot be changed for the moment stays. Hands out the reference on success. On the keychain queue only.
platform::KeychainStatus addOrUpdate(const WantedItem& item, Data* reference, const TellStep& tell);

/// The references of all items that match; none when there are none. Runs on the keychain queue.
std::optional<Array> copyReferences(const platform::KeychainAttributes& attributes);

/// The attributes of all items of the class, or of those with the label.
platform::KeychainAttributes itemsOf(platform::KeychainItemClass itemClass,
                                     std::optional<std::string> label = {});

/// Runs `find`, which returns a reference, on the keychain queue, and hands the reference out. False when it
/// is null.
template <typename Find>
bool handOut(Data* reference, Find find) {
    return keychainQueue().sync([&] {
        const Data found = find();
        if (found && reference != nullptr) *reference = found;
        return static_cast<bool>(found);
    });
}

/// Items kept in memory instead, by reference. On the keychain queue only.
template <typename Item>
class MemoryTable {
  public:
    Data add(const Item& item) {
        items_.emplace_back(uuidBytes(platform::randomUUID()), item);
        return items_.back().first;
    }
    /// True and the item, when there is one.
    bool copy(const Data& reference, Item* out) const {
        for (const auto& [known, item] : items_) {
            if (known != reference) continue;
            if (out != nullptr) *out = item;
            return true;
        }
        return false;
    }
    bool remove(const Data& reference) {
        return std::erase_if(items_, [&](const auto& item) { return item.first == reference; }) > 0;
    }
    const std::vector<std::pair<Data, Item>>& items() const { return items_; }

    /// All references; none when there are none. Any queue.
    std::optional<Array> references() const {
        return keychainQueue().sync([&]() -> std::optional<Array> {
            Array references;
            for (const auto& [reference, item] : items_) references.append(reference);
            return references.empty() ? std::nullopt : std::optional(references);
        });
    }

  private:
    std::vector<std::pair<Data, Item>> items_;
};

/// The table of this lifetime.
template <typename Item>
MemoryTable<Item>& memoryItems() {
    return platform::Lifetime::current().state<MemoryTable<Item>>();
}

}  // namespace keychain_items
}  // namespace veltoid
