// The numbers of the binary property-list layout, which its writer and its reader share. Internal to this
// folder.
#pragma once

#include <cstdint>
#include <string_view>

namespace platform::propertylist {

inline constexpr std::string_view kHeader = "bplist00";
inline constexpr size_t kTrailerBytes = 32;
inline constexpr size_t kUUIDBytes = 16;
/// The binary form counts from 2001-01-01 00:00:00 UTC.
inline constexpr double kReferenceDate = 978307200.0;
/// A count of this or more does not fit into the marker and follows it as an integer.
inline constexpr uint64_t kCountFollows = 0x0F;

enum Marker : uint8_t {
    kNull = 0x00,
    kFalse = 0x08,
    kTrue = 0x09,
    kUUID = 0x0E,
    kInteger = 0x10,
    kFloat = 0x22,
    kDouble = 0x23,
    kDate = 0x33,
    kData = 0x40,
    kASCII = 0x50,
    kUTF16 = 0x60,
    kArray = 0xA0,
    kDictionary = 0xD0,
};

}  // namespace platform::propertylist
