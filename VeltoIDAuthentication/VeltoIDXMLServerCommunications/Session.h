// Sessions with the identity server: the record that a sign-in yields, and the queue of each account.
//
// All server traffic of an account runs on the account's own serial queue, so that two calls for one account
// never overlap while different accounts proceed side by side. A session is built by the sign-in and lives
// with the engine while methods run. When its owner lets go of it, it is cached while the server lets it be
// reused, else destroyed.
#pragma once

#include <memory>

#include "Platform/runtime/WorkQueue.h"
#include "Values/Value.h"

namespace veltoid {

/// Members belong to the session's queue; the record is destroyed there only.
struct VeltoIDAuthenticationSessionInfo {
    String fAccountName;
    String fPasswordHash;
    String fServerURL;
    /// Null until the server has given one.
    String fSessionID;
    /// When the record was built, before the server was called (seconds since 1970).
    double fCreated = 0;
    /// How long after that the server lets the session be reused, in seconds; never negative.
    double fValidityDuration = 0;
    /// A session without one is never cached.
    String fEncDsId;
    platform::WorkQueue fDispatchQueue;

    /// The session is not to be used again: it is destroyed when its owner lets go of it.
    void spoil() {
        fSessionID = nullptr;
        fCreated = 0;
        fValidityDuration = 0;
    }

    bool isReusableAt(double now) const {
        return fEncDsId && fCreated != 0 && fCreated <= now && now < fCreated + fValidityDuration;
    }
};

/// Caches the session, oldest first, or has it destroyed on its queue. Called by Session's destructor alone:
/// on any queue but the session's own.
void __VeltoIDSessionRelease(VeltoIDAuthenticationSessionInfo* session);

struct SessionReleaser {
    void operator()(VeltoIDAuthenticationSessionInfo* session) const { __VeltoIDSessionRelease(session); }
};

/// The engine's handle on a session. It must not end on the session's own queue.
using Session = std::unique_ptr<VeltoIDAuthenticationSessionInfo, SessionReleaser>;

/// A session that no operation uses: cached, or still signing in. Its end does not put it into the cache.
using IdleSession = std::unique_ptr<VeltoIDAuthenticationSessionInfo>;

/// The account's queue, created on first use and kept. Any thread.
platform::WorkQueue copySessionQueueForAccount(const String& accountName);

/// Takes the first cached session of exactly this account, password and server that is still valid; null when
/// there is none. Any thread.
IdleSession takeCachedSession(const String& accountName, const String& passwordHash, const String& serverURL);

}  // namespace veltoid
