#include "Platform/bus/BusConnection.h"

#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <systemd/sd-bus.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <list>
#include <utility>
#include <vector>

#include "Platform/runtime/EventLoop.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::bus {
namespace {

/// Messages that are read in one go: an iteration of the event loop for each would cost a third of a ping.
constexpr int kMaxReadAtOnce = 64;

/// Main thread only.
struct State {
    sd_bus* bus = nullptr;
    bool tried = false;
    bool ended = false;
    std::function<bool()> serve;
    std::vector<std::function<void()>> disconnectHandlers;
    /// The library keeps pointers to them, so they must not move.
    std::list<std::function<void()>> postedHandlers;
    sd_event_source* arrival = nullptr;
    sd_event_source* timeout = nullptr;
    sd_event_source* more = nullptr;

    void lifetimeEnds() {
        ended = tried = true;
        for (sd_event_source** source : {&arrival, &timeout, &more})
            *source = sd_event_source_disable_unref(*source);
        bus = sd_bus_close_unref(bus);
    }
};

State& shared() { return Lifetime::current().state<State>(); }

void connectionEnded() {
    State& state = shared();
    if (std::exchange(state.ended, true)) return;
    VELTOID_PLATFORM_LOG(Error, "The message bus has ended the connection.");
    for (const auto& handler : state.disconnectHandlers) handler();
}

int disconnected(sd_bus_message* /*message*/, void* /*context*/, sd_bus_error* /*error*/) noexcept {
    connectionEnded();
    return 0;
}

int posted(sd_bus_message* /*message*/, void* context, sd_bus_error* /*error*/) noexcept {
    (*static_cast<std::function<void()>*>(context))();
    return 0;
}

void enable(sd_event_source* source, int whether) {
    if (source == nullptr) return;
    if (const int result = sd_event_source_set_enabled(source, whether); result < 0)
        logFailure("watching", result);
}

/// Sends what waits to be sent, and reads and dispatches what has come.
void process(State& state) {
    int result = state.ended ? 0 : 1;
    for (int left = kMaxReadAtOnce; left > 0 && result > 0; --left)
        result = sd_bus_process(state.bus, nullptr);
    if (result < 0) {
        if (!state.ended) logFailure("reading", result);
        sd_bus_close(state.bus);
        connectionEnded();
    }
    if (state.ended)
        for (sd_event_source* source : {state.arrival, state.timeout}) enable(source, SD_EVENT_OFF);
    enable(state.more, state.serve && state.serve() ? SD_EVENT_ON : SD_EVENT_OFF);
}

/// The callback of all event sources; their further arguments are not used.
template <typename... Details>
int isReady(sd_event_source* /*source*/, Details... /*details*/) noexcept {
    process(shared());
    return 0;
}

/// What the connection waits for, before each wait.
int prepareWait(sd_event_source* /*source*/, void* context) noexcept {
    const State& state = *static_cast<State*>(context);
    if (state.ended) return 0;
    if (const int events = sd_bus_get_events(state.bus); events >= 0)
        sd_event_source_set_io_events(state.arrival, static_cast<uint32_t>(events));
    uint64_t until = 0;
    const bool hasTimeout = sd_bus_get_timeout(state.bus, &until) > 0;
    if (hasTimeout) sd_event_source_set_time(state.timeout, until);
    enable(state.timeout, hasTimeout ? SD_EVENT_ONESHOT : SD_EVENT_OFF);
    return 0;
}

/// Instead of sd_bus_attach_event, which goes through the event loop for each message.
int watch(State& state) {
    sd_event* loop = event_loop::handle();
    int result = sd_event_add_io(loop, &state.arrival, sd_bus_get_fd(state.bus), 0, isReady, &state);
    if (result >= 0) result = sd_event_add_time(loop, &state.timeout, CLOCK_MONOTONIC, 0, 0, isReady, &state);
    if (result >= 0) result = sd_event_source_set_enabled(state.timeout, SD_EVENT_OFF);
    if (result >= 0) result = sd_event_add_defer(loop, &state.more, isReady, &state);
    // While it is on it is always ready; with the lowest priority it does not starve the others.
    if (result >= 0) result = sd_event_source_set_priority(state.more, SD_EVENT_PRIORITY_IDLE);
    if (result >= 0) result = sd_event_source_set_prepare(state.arrival, prepareWait);
    return result;
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
    State& state = shared();
    if (state.tried) return state.bus;
    state.tried = true;

    int result = openBus(&state.bus);
    if (result >= 0) result = watchDisconnect(state.bus);
    if (result >= 0) result = watch(state);
    if (result < 0) {
        logFailure("connecting", result);
        state.bus = sd_bus_unref(state.bus);
    }
    return state.bus;
}

void afterReading(std::function<bool()> serve) { shared().serve = std::move(serve); }

size_t unreadBytes() {
    sd_bus* bus = shared().bus;
    int bytes = 0;
    if (bus == nullptr || ioctl(sd_bus_get_fd(bus), SIOCOUTQ, &bytes) < 0) return 0;
    return static_cast<size_t>(bytes);
}

void serveSoon() { enable(shared().more, SD_EVENT_ON); }

void emitPosted(const std::string& name) {
    sd_bus* bus = shared().bus;
    if (bus == nullptr) return;
    const Product& product = Lifetime::current().product();
    const int result = sd_bus_emit_signal(bus, product.objectPath, product.notificationInterface, "Posted",
                                          "s", name.c_str());
    if (result < 0) logFailure("posting a notification", result);
}

void onPosted(const std::string& name, std::function<void()> handler) {
    sd_bus* bus = connection();
    if (bus == nullptr) return;
    const Product& product = Lifetime::current().product();
    const std::string rule = "type='signal',path='" + std::string(product.objectPath) + "',interface='" +
                             product.notificationInterface + "',member='Posted',arg0='" + name + "'";
    void* kept = &shared().postedHandlers.emplace_back(std::move(handler));
    const int result = sd_bus_add_match_async(bus, nullptr, rule.c_str(), posted, posted, kept);
    if (result < 0) logFailure("listening", result);
}

void flush() {
    if (sd_bus* bus = shared().bus) sd_bus_flush(bus);
}

void onDisconnect(std::function<void()> handler) {
    shared().disconnectHandlers.push_back(std::move(handler));
}

}  // namespace platform::bus
