// The names under which this system is known outside its process: on the message bus, to the service manager,
// in the file system and in the kernel's keyring. Packaging/ spells those that its files need once more.
#pragma once

namespace veltoid {

// Message bus.
inline constexpr const char* kVeltoIDAuthenticationServiceName = "com.velto.harbwell.veltoid.authentication";
inline constexpr const char* kVeltoIDPasswordCheckServiceName = "com.velto.harbwell.veltoid.checkpassword";
inline constexpr const char* kVeltoIDObjectPath = "/com/velto/harbwell/veltoid";
inline constexpr const char* kVeltoIDMessageInterface = "com.velto.harbwell.veltoid.MessageService";
inline constexpr const char* kVeltoIDNotificationInterface = "com.velto.harbwell.veltoid.Notifications";

// Notifications, posted on the object.
inline constexpr const char* kVeltoIDAccountAddedOrRemovedNotification =
    "HWVeltoIDAccountConfigurationAddedOrRemovedNotification";
inline constexpr const char* kVeltoIDAccountChangeNotification =
    "HWVeltoIDAccountConfigurationChangeNotification";
/// Posted by the program that has unlocked the keychain.
inline constexpr const char* kVeltoIDUnlockedNotification = "com.velto.harbwell.veltoid.keychain.unlocked";

// systemd.
inline constexpr const char* kVeltoIDServiceUnit = "veltoidauthd.service";
/// The transient timer that starts the agent again; it starts the service of its own name.
inline constexpr const char* kVeltoIDRelaunchTimerUnit = "veltoidauthd-relaunch.timer";
inline constexpr const char* kVeltoIDRelaunchTimerDescription = "Starts the Velto ID account agent again";

// Files: the folder's name below $XDG_STATE_HOME, $XDG_CONFIG_HOME and /etc.
inline constexpr const char* kVeltoIDFolder = "harbwell";
inline constexpr const char* kVeltoIDIdentityAuthorityFile = "identity-authority.pem";

/// Begins the names of the keys that the kernel keeps while a keychain is unlocked.
inline constexpr const char* kVeltoIDKeyringPrefix = "veltoid keychain ";

}  // namespace veltoid
