#include "VeltoIDKeychainItems/KeychainItems.h"

#include <atomic>

#include "Logging/Describe.h"

namespace veltoid {

namespace {

struct State {
    std::atomic<bool> useKeychain{true};
    const platform::WorkQueue queue{"KeychainDispatchQueue"};
};

State& state() { return platform::Lifetime::current().state<State>(); }

/// Whether what failed with that status may be had later: no reason to replace an item.
bool mayPass(platform::KeychainStatus status) {
    return status == platform::kKeychainLocked || status == platform::kKeychainNotAvailable;
}

}  // namespace

void setUseSystemKeychain(bool use) { state().useKeychain = use; }
bool usesSystemKeychain() { return state().useKeychain; }

platform::WorkQueue keychainQueue() { return state().queue; }

ItemState keychainItemState(platform::KeychainItemClass itemClass, const Data& reference) {
    if (!reference) return ItemState::Gone;
    return keychainQueue().sync([&] {
        const auto status = platform::keychain::copyMatchingData(
            keychain_items::queryForReference(itemClass, reference), nullptr);
        if (status == platform::kKeychainSuccess) return ItemState::Readable;
        return mayPass(status) ? ItemState::Unreadable : ItemState::Gone;
    });
}

namespace keychain_items {

platform::KeychainAttributes itemsOf(platform::KeychainItemClass itemClass,
                                     std::optional<std::string> label) {
    platform::KeychainAttributes attributes;
    attributes.itemClass = itemClass;
    attributes.label = std::move(label);
    return attributes;
}

platform::KeychainQuery queryForReference(platform::KeychainItemClass itemClass, const Data& reference) {
    const auto bytes = reference.bytes();
    return {itemsOf(itemClass), {{platform::PersistentReference(bytes.begin(), bytes.end())}}};
}

std::string describeItemQuery(std::string_view itemClass, const Data& reference) {
    return describeValue(Dictionary{{"class", itemClass}, {"itemList", Array{reference}}});
}

Data copyReference(const platform::KeychainAttributes& attributes, platform::KeychainStatus* status) {
    std::vector<platform::PersistentReference> found;
    const auto result = platform::keychain::copyMatchingReferences({attributes, {}}, &found);
    if (status != nullptr) *status = result;
    return result == platform::kKeychainSuccess ? Data(found.front()) : Data();
}

platform::KeychainStatus addOrUpdate(const WantedItem& item, Data* reference, const TellStep& tell) {
    platform::KeychainStatus status = platform::kKeychainSuccess;
    if (const Data found = copyReference(item.identity, &status)) {
        tell(Step::Update, found, status);
        status = platform::keychain::update(queryForReference(item.identity.itemClass, found), item.changes);
        if (status == platform::kKeychainSuccess) *reference = found;
        if (status == platform::kKeychainSuccess || mayPass(status)) return status;
        tell(Step::Replace, found, status);
        platform::keychain::remove({item.identity, {}});
    } else if (status != platform::kKeychainItemNotFound) {
        return status;
    }
    tell(Step::Add, {}, status);
    platform::PersistentReference added;
    const auto add = [&] {
        return platform::keychain::add(item.attributes, item.accessibility, *item.changes.data, &added);
    };
    status = add();
    // A duplicate that the search did not find makes room once.
    if (status == platform::kKeychainDuplicateItem &&
        platform::keychain::remove({item.identity, {}}) == platform::kKeychainSuccess)
        status = add();
    if (status == platform::kKeychainSuccess) *reference = Data(added);
    return status;
}

std::optional<Array> copyReferences(const platform::KeychainAttributes& attributes) {
    return keychainQueue().sync([&]() -> std::optional<Array> {
        std::vector<platform::PersistentReference> found;
        if (!usesSystemKeychain() || platform::keychain::copyMatchingReferences({attributes, {}}, &found) !=
                                         platform::kKeychainSuccess)
            return std::nullopt;
        Array references;
        for (const auto& reference : found) references.append(Data(reference));
        return references;
    });
}

}  // namespace keychain_items
}  // namespace veltoid
