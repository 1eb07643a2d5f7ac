#include "Platform/net/OptionalLibrary.h"

#include "Platform/net/CurlExchange.h"

namespace platform {

bool isHTTPSClientAvailable() { return CurlExchange::isLibraryAvailable(); }

}  // namespace platform
