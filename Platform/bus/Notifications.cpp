#include "Platform/bus/Notifications.h"

#include "Platform/bus/BusConnection.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {
namespace {

class BusNotifications : public Notifications {
  public:
    void post(std::string name) override {
        WorkQueue::main().async([name = std::move(name)] { bus::emitPosted(name); });
    }
};

}  // namespace

Notifications& Notifications::shared() { return Lifetime::current().part<Notifications, BusNotifications>(); }

}  // namespace platform
