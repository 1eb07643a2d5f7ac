#include "Platform/OptionalLibrary.h"

#include "Platform/CurlLibrary.h"

namespace platform {

bool isHTTPSClientAvailable() { return CurlLibrary::shared() != nullptr; }

}  // namespace platform
