// Signed-in sessions that may be used again, oldest first, on a serial queue of their own.
#pragma once

#include "VeltoIDXMLServerCommunications/Session.h"

namespace veltoid {

/// Takes the first session of exactly this account, password and server that is still valid; null when there
/// is none.
Session takeCachedSession(const String& accountName, const String& passwordHash, const String& serverURL);

/// Keeps the session; those whose time has passed go.
void cacheSession(Session session);

/// Has the session destroyed on its own queue.
void destroySession(Session session);

}  // namespace veltoid
