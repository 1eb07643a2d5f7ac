// The directory in which this user's state on this machine is kept: $XDG_STATE_HOME/FOLDER/<machine-id>, by
// default below ~/.local/state; the product names the folder.
#pragma once

#include <string>

#include "Platform/runtime/FileDescriptor.h"

namespace platform {

/// The directory of this user's state on this machine, created with mode 0700 when missing; empty, with errno
/// set, when it cannot be had now.
std::string stateDirectory();

/// Makes the directory's entries durable; false with errno set.
bool syncDirectory(const std::string& directory);

/// Holds a directory for this process until the result's end: creating and replacing files in it is for one
/// at a time. Where the file system has no such locks the holder goes on without.
[[nodiscard]] FileDescriptor lockDirectory(const std::string& directory);

}  // namespace platform
