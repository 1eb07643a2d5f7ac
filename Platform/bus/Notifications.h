// System-wide notifications: a name without payload for all that listen (D-Bus signal Posted(s name) of
// the product's notification interface on its object).
#pragma once

#include <string>

namespace platform {

/// Any thread; delivered later, in order. Nothing happens while there is no bus.
class Notifications {
  public:
    virtual ~Notifications() = default;
    static Notifications& shared();

    virtual void post(std::string name) = 0;
};

}  // namespace platform
