// System-wide notifications: a name, no payload, for whoever listens (D-Bus signal Posted(s name) of
// interface com.velto.harbwell.veltoid.Notifications on the agent's object).
#pragma once

#include <string>

namespace platform {

/// Any thread; delivered later, in order. Nothing happens while there is no bus.
class Notifications {
  public:
    virtual ~Notifications() = default;
    static Notifications& shared();
    /// Tests only: posts go to `notifications` (kept alive by the caller) until it is replaced by null.
    static void replaceShared(Notifications* notifications);

    virtual void post(std::string name) = 0;
};

}  // namespace platform
