// Attributes of keychain items, as tests name them.
#pragma once

#include <optional>
#include <string>
#include <utility>

#include "Platform/keychain/KeychainItem.h"

namespace platform {

/// What a password is stored under.
inline KeychainAttributes password(std::optional<std::string> account,
                                   std::optional<std::string> service = "service") {
    return {KeychainItemClass::GenericPassword, std::move(account), std::move(service), {}, {}, {}, {}, {}};
}

/// What a key or a certificate is stored under.
inline KeychainAttributes object(KeychainItemClass itemClass, std::optional<std::string> keyClass,
                                 std::optional<std::string> value) {
    return {itemClass, {}, {}, {}, {}, {}, std::move(keyClass), std::move(value)};
}

}  // namespace platform
