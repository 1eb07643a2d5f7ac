// What is known of an item of the keychain, and the outcomes of operations on it.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace platform {

/// Opaque name of an item for as long as it exists.
using PersistentReference = std::vector<uint8_t>;

/// Outcome of a keychain operation. Values other than these three are failures of the store itself.
using KeychainStatus = int32_t;
inline constexpr KeychainStatus kKeychainSuccess = 0;
inline constexpr KeychainStatus kKeychainDuplicateItem = -25299;
inline constexpr KeychainStatus kKeychainItemNotFound = -25300;
/// The store cannot be opened, read or written.
inline constexpr KeychainStatus kKeychainNotAvailable = -25291;
/// The item does not unseal: damaged or tampered with.
inline constexpr KeychainStatus kKeychainItemCorrupt = -26275;
/// The class key is not available until the device is unlocked.
inline constexpr KeychainStatus kKeychainLocked = -25308;
/// Not the passphrase.
inline constexpr KeychainStatus kKeychainWrongPassphrase = -25293;

/// The values of these two are stored: they do not change.
enum class KeychainItemClass : int { GenericPassword = 0, Key = 1, Certificate = 2 };
enum class Accessibility : int { Always = 0, AfterFirstUnlock = 1, AfterFirstUnlockThisDeviceOnly = 2 };

/// Longer values are refused: nothing that belongs into a keychain comes near.
inline constexpr size_t kMaxKeychainItemBytes = size_t{16} << 20U;

/// The attributes of an item. In a query an absent one matches everything.
struct KeychainAttributes {
    KeychainItemClass itemClass = KeychainItemClass::GenericPassword;
    std::optional<std::string> account;
    std::optional<std::string> service;
    std::optional<std::string> label;
    std::optional<std::string> description;
    std::optional<std::string> accessGroup;
    /// "private" or "public", for keys.
    std::optional<std::string> keyClass;
    /// What makes keys and certificates equal (a digest of the public part); unique within class and key
    /// class.
    std::optional<std::string> applicationValue;
};

/// All of an item's texts, in the order in which they are stored and sealed.
inline constexpr std::array kKeychainTexts = {
    &KeychainAttributes::account,         &KeychainAttributes::service,     &KeychainAttributes::label,
    &KeychainAttributes::description,     &KeychainAttributes::accessGroup, &KeychainAttributes::keyClass,
    &KeychainAttributes::applicationValue};

namespace keychain {

/// Whether items other than the always accessible ones can be had only after the passphrase was given.
enum class Protection { NoPassphrase, Locked, Unlocked };

}  // namespace keychain

}  // namespace platform
