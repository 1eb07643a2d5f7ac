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
        return keychain_items::mayPass(status) ? ItemState::Unreadable : ItemState::Gone;
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
