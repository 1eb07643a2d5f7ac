// Sessions with the identity server: the record that a sign-in yields, and the queue of each account.
//
// All server traffic of an account runs on the account's own serial queue, so that two calls for one account
// never overlap while different accounts proceed side by side. A session is built by the sign-in, lives with
// the engine while methods run, and is given back with __VeltoIDSessionRelease: it is cached while the server
// lets it be reused, else destroyed.
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

    bool isReusableAt(double now) const {
        return fEncDsId && fCreated != 0 && fCreated <= now && now < fCreated + fValidityDuration;
    }
};

/// The engine's handle on a session.
using Session = std::unique_ptr<VeltoIDAuthenticationSessionInfo>;

/// The account's queue, created on first use and kept. Any thread.
platform::WorkQueue copySessionQueueForAccount(const String& accountName);

/// Caches the session or has it destroyed on its queue. Any queue but the session's own; null is ignored.
void __VeltoIDSessionRelease(Session session);

}  // namespace veltoid
