#include "Platform/ServiceManager.h"

#include <atomic>
#include <utility>

namespace platform {
namespace {

/// Without a service manager that can start it, the agent stays up and the interval is only remembered.
class NoServiceManager : public ServiceManager {
  public:
    uint32_t setStartInterval(uint32_t seconds) override { return std::exchange(interval_, seconds); }

  private:
    uint32_t interval_ = 0;
};

std::atomic<ServiceManager*> replacement{nullptr};

}  // namespace

ServiceManager& ServiceManager::shared() {
    if (ServiceManager* manager = replacement.load(std::memory_order_acquire)) return *manager;
    static auto* none = new NoServiceManager;
    return *none;
}

void ServiceManager::replaceShared(ServiceManager* manager) {
    replacement.store(manager, std::memory_order_release);
}

}  // namespace platform
