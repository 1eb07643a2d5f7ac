// System-wide notifications that the engine posts.
#pragma once

namespace veltoid {

inline constexpr const char* kVeltoIDAccountAddedOrRemovedNotification =
    "HWVeltoIDAccountConfigurationAddedOrRemovedNotification";
inline constexpr const char* kVeltoIDAccountChangeNotification =
    "HWVeltoIDAccountConfigurationChangeNotification";

}  // namespace veltoid
