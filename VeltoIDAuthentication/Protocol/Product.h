// This product's names, as the platform takes them.
#pragma once

#include "Platform/runtime/ProductNames.h"
#include "Protocol/Names.h"

namespace veltoid {

inline constexpr platform::Product kProduct = {
    .folder = kVeltoIDFolder,
    .authorityFile = kVeltoIDIdentityAuthorityFile,
    .objectPath = kVeltoIDObjectPath,
    .messageInterface = kVeltoIDMessageInterface,
    .notificationInterface = kVeltoIDNotificationInterface,
    .unlockedNotification = kVeltoIDUnlockedNotification,
    .serviceUnit = kVeltoIDServiceUnit,
    .timerUnit = kVeltoIDRelaunchTimerUnit,
    .timerDescription = kVeltoIDRelaunchTimerDescription,
    .keyringPrefix = kVeltoIDKeyringPrefix,
};

}  // namespace veltoid
