// The HTTPS client library is loaded when it is first needed and may be missing.
#pragma once

namespace platform {

/// Whether the library (libcurl.so.4) can be loaded. The first call, here or through HTTPSession, loads it
/// for good and takes some milliseconds; later ones only read the outcome. Any thread.
bool isHTTPSClientAvailable();

}  // namespace platform
