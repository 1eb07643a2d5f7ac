// The command-line client of the account agent.
#include <sys/resource.h>

#include <iostream>
#include <stdexcept>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/runtime/Lifetime.h"
#include "Protocol/Product.h"
#include "veltoidctl/ClientCommandLine.h"

namespace veltoidctl {
namespace {

/// Passwords and keys pass through this process: none of them ends in a core file, or stays in memory that
/// was given back.
void keepSecrets() {
    const rlimit none{0, 0};
    setrlimit(RLIMIT_CORE, &none);
    if (!platform::openssl::prepare()) throw std::runtime_error("OpenSSL is in use already");
}

int run(int argc, char** argv) {
    const auto parsed = parseCommandLine(argc, argv);
    if (const int* status = std::get_if<int>(&parsed)) return *status;
    const auto& invocation = std::get<Invocation>(parsed);
    AgentConnection agent(invocation.service, invocation.timeout + invocation.arguments.waitSeconds);
    return invocation.command(agent, invocation.arguments);
}

}  // namespace
}  // namespace veltoidctl

int main(int argc, char** argv) {
    const platform::Lifetime lifetime(veltoid::kProduct);
    try {
        veltoidctl::keepSecrets();
        return veltoidctl::run(argc, argv);
    } catch (const veltoidctl::Unreachable& error) {
        std::cerr << "veltoidctl: " << error.what() << "\n";
        return veltoidctl::kAgentUnreachable;
    } catch (const std::exception& error) {
        std::cerr << "veltoidctl: " << error.what() << "\n";
        return veltoidctl::kRefused;
    }
}
