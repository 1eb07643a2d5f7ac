#include "veltoidctl/AgentRequest.h"

#include "Platform/keychain/Keychain.h"
#include "Protocol/MessageKeys.h"

namespace veltoidctl {

namespace message = veltoid::message;

Request requestWithPassword(int64_t command, const Arguments& arguments) {
    return {.command = command,
            .account = arguments.account,
            .passwordHash = readPasswordHash(arguments.password, arguments.account)};
}

Json send(AgentConnection& agent, const Request& request) {
    return agent.send([&](platform::ValueSink& sink) {
        sink.beginDictionary();
        sink.key(message::kCommand);
        sink.integer(request.command);
        if (!request.account.empty()) {
            sink.key(message::kAccount);
            sink.string(request.account);
        }
        if (!request.passwordHash.empty()) {
            sink.key(message::kHashedPassword);
            sink.string(request.passwordHash);
        }
        if (request.entries) request.entries(sink);
        sink.key(message::kOptions);
        sink.beginDictionary();
        for (const auto& [option, value] : request.options) {
            sink.key(option);
            if (const bool* flag = std::get_if<bool>(&value)) {
                sink.boolean(*flag);
            } else {
                sink.real(std::get<double>(value));
            }
        }
        sink.endDictionary();
        sink.endDictionary();
    });
}

bool succeeded(const Json& reply) { return reply.value(message::kSuccess, false); }

std::string reasonUnlessLocked(const std::string& reason) {
    return platform::keychain::protection() == platform::keychain::Protection::Locked
               ? "the keychain is locked; `veltoidctl keychain unlock` comes first"
               : reason;
}

}  // namespace veltoidctl
