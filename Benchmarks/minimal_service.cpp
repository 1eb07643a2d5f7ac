// The least that a service on this bus can be, to measure the agent against: sd-bus on sd-event, the agent's
// object, interface and method, and one answer to everything. Usage: minimal_service NAME
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Protocol/Names.h"

namespace {

int handleSend(sd_bus_message* message, void* /*context*/, sd_bus_error* /*error*/) {
    return sd_bus_reply_method_return(message, "a{sv}", 1, "success", "b", 1);
}

const sd_bus_vtable kInterfaceTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Send", "a{sv}", "a{sv}", handleSend, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

void require(int result, const char* what) {
    if (result >= 0) return;
    (void)std::fprintf(stderr, "minimal_service: %s: %s\n", what, std::strerror(-result));
    std::_Exit(EXIT_FAILURE);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) return EXIT_FAILURE;
    sd_event* loop = nullptr;
    sd_bus* bus = nullptr;
    require(sd_event_default(&loop), "event loop");
    require(sd_bus_open_user(&bus), "bus");
    // Without its bus it has nothing to do.
    require(sd_bus_set_exit_on_disconnect(bus, 1), "bus");
    require(sd_bus_add_object_vtable(bus, nullptr, veltoid::kVeltoIDObjectPath,
                                     veltoid::kVeltoIDMessageInterface, kInterfaceTable, nullptr),
            "object");
    require(sd_bus_request_name(bus, argv[1], 0), "name");
    require(sd_bus_attach_event(bus, loop, SD_EVENT_PRIORITY_NORMAL), "attaching");
    return sd_event_loop(loop);
}
