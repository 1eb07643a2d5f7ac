// The names by which the product that runs on this platform is known to the system. The process defines them
// and gives them to the lifetime (Lifetime.h).
#pragma once

namespace platform {

struct Product {
    /// The folder below $XDG_STATE_HOME, $XDG_CONFIG_HOME and /etc.
    const char* folder = "";
    /// The file in the configuration folder that holds the trusted authorities.
    const char* authorityFile = "";

    // Message bus: the one object, its interfaces, and what is posted on it when the keychain was unlocked.
    const char* objectPath = "";
    const char* messageInterface = "";
    const char* notificationInterface = "";
    const char* unlockedNotification = "";

    // Service manager: the unit that the process is, and the transient timer that starts it again.
    const char* serviceUnit = "";
    const char* timerUnit = "";
    const char* timerDescription = "";

    /// Begins the names of the keys that the kernel keeps.
    const char* keyringPrefix = "";
};

}  // namespace platform
