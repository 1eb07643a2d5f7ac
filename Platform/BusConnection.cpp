#include "Platform/BusConnection.h"

#include <systemd/sd-bus.h>

#include <cstdlib>
#include <cstring>
#include <vector>

#include "Platform/EventLoop.h"
#include "Platform/SystemLog.h"

namespace platform::bus {
namespace {

/// Main thread only.
struct State {
    sd_bus* bus = nullptr;
    bool tried = false;
    std::vector<std::function<void()>> disconnectHandlers;

    static State& shared() {
        static auto* state = new State;
        return *state;
    }
};

int disconnected(sd_bus_message* /*message*/, void* /*context*/, sd_bus_error* /*error*/) noexcept {
    VELTOID_PLATFORM_LOG(Error, "The message bus has ended the connection.");
    for (const auto& handler : State::shared().disconnectHandlers) handler();
    return 0;
}

/// The bus that started the agent says which one it is; by hand it is the user's.
int openBus(sd_bus** bus) {
    const char* starter = std::getenv("DBUS_STARTER_BUS_TYPE");
    return starter != nullptr && std::strcmp(starter, "system") == 0 ? sd_bus_open_system(bus)
                                                                     : sd_bus_open_user(bus);
}

int watchDisconnect(sd_bus* bus) {
    return sd_bus_match_signal_async(bus, nullptr, "org.freedesktop.DBus.Local",
                                     "/org/freedesktop/DBus/Local", "org.freedesktop.DBus.Local",
                                     "Disconnected", disconnected, nullptr, nullptr);
}

}  // namespace

void logFailure(const char* operation, int result) {
    VELTOID_PLATFORM_LOG(Error, std::string("Message bus: ") + operation + ": " + std::strerror(-result));
}

sd_bus* connection() {
    State& state = State::shared();
    if (state.tried) return state.bus;
    state.tried = true;

    sd_bus* bus = nullptr;
    int result = openBus(&bus);
    if (result >= 0) result = sd_bus_attach_event(bus, event_loop::handle(), SD_EVENT_PRIORITY_NORMAL);
    if (result >= 0) result = watchDisconnect(bus);
    if (result < 0) {
        logFailure("connecting", result);
        sd_bus_unref(bus);
        return nullptr;
    }
    state.bus = bus;
    return bus;
}

void emitPosted(const std::string& name) {
    sd_bus* bus = State::shared().bus;
    if (bus == nullptr) return;
    const int result =
        sd_bus_emit_signal(bus, kObjectPath, kNotificationInterface, "Posted", "s", name.c_str());
    if (result < 0) logFailure("posting a notification", result);
}

void flush() {
    if (sd_bus* bus = State::shared().bus) sd_bus_flush(bus);
}

void onDisconnect(std::function<void()> handler) {
    State::shared().disconnectHandlers.push_back(std::move(handler));
}

}  // namespace platform::bus
