#include "Platform/OptionalLibrary.h"

#include "Platform/CurlExchange.h"

namespace platform {

bool isHTTPSClientAvailable() { return CurlExchange::isLibraryAvailable(); }

}  // namespace platform
