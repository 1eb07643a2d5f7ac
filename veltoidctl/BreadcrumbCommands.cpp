// The commands about breadcrumbs: small pieces of data that the identity server keeps for account and device.
#include <iostream>

#include "Platform/encoding/HexText.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/ClientCommands.h"
#include "veltoidctl/Files.h"
#include "veltoidctl/JsonBuilder.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {

namespace message = veltoid::message;

int setBreadcrumb(AgentConnection& agent, const Arguments& arguments) {
    const platform::SecretBytes data = readInput(arguments.input);
    Request request = requestWithPassword(veltoid::command::kSetBreadcrumb, arguments);
    request.entries = [&](platform::ValueSink& sink) {
        sink.key(message::kBreadcrumbKey);
        sink.string(arguments.key);
        sink.key(message::kBreadcrumb);
        sink.data(data);
    };
    return present(send(agent, request), arguments, "breadcrumb set", [&](const Json&) {
        std::cout << "the server keeps " << data.size() << " bytes under " << arguments.key << "\n";
    });
}

int getBreadcrumb(AgentConnection& agent, const Arguments& arguments) {
    const bool hasFile = arguments.output != kStandardStream;
    // A terminal gets it in a form that is fit for one.
    const bool isShown = !hasFile && (arguments.json || standardOutputIsTerminal());
    const PrivateOutput output(arguments.output, arguments.force || isShown);
    Request request = requestWithPassword(veltoid::command::kGetBreadcrumb, arguments);
    request.entries = [&](platform::ValueSink& sink) {
        sink.key(message::kBreadcrumbKey);
        sink.string(arguments.key);
    };
    const Json reply = send(agent, request);
    const veltoid::Data data = dataIn(reply, message::kBreadcrumb);
    if (data && !isShown) output.write(data.bytes());
    return present(
        reply, arguments, "breadcrumb get",
        [&](const Json&) {
            if (isShown) std::cout << platform::hexText(data.bytes()) << "\n";
        },
        "nothing is kept under " + arguments.key);
}

}  // namespace veltoidctl
