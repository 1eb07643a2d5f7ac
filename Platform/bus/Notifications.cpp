#include "Platform/bus/Notifications.h"

#include <atomic>

#include "Platform/bus/BusConnection.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {
namespace {

class BusNotifications : public Notifications {
  public:
    void post(std::string name) override {
        WorkQueue::main().async([name = std::move(name)] { bus::emitPosted(name); });
    }
};

std::atomic<Notifications*> replacement{nullptr};

}  // namespace

Notifications& Notifications::shared() {
    if (Notifications* notifications = replacement.load(std::memory_order_acquire)) return *notifications;
    static auto* real = new BusNotifications;
    return *real;
}

void Notifications::replaceShared(Notifications* notifications) {
    replacement.store(notifications, std::memory_order_release);
}

}  // namespace platform
