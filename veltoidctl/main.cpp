// The command-line client of the account agent.
#include <sys/resource.h>

#include <CLI/CLI.hpp>
#include <functional>
#include <iostream>

#include "veltoidctl/Commands.h"

namespace veltoidctl {
namespace {

constexpr const char* kDefaultService = "com.velto.harbwell.veltoid.authentication";
/// Longer than the agent waits for a server in one request.
constexpr double kDefaultTimeout = 30;

using Command = int (*)(AgentConnection&, const Arguments&);

CLI::App* addCommand(CLI::App& application, const char* name, const char* purpose, Command command,
                     Command& chosen) {
    CLI::App* sub = application.add_subcommand(name, purpose);
    sub->callback([command, &chosen] { chosen = command; });
    return sub;
}

void takesAccount(CLI::App* command, Arguments& arguments, bool required = true) {
    auto* option = command->add_option("NAME", arguments.account, "the account's name");
    if (required) option->required();
}

void takesPassword(CLI::App* command, Arguments& arguments) {
    auto* plain = command->add_flag_callback(
        "--password-stdin", [&] { arguments.password = PasswordSource::StandardInput; },
        "read the password from standard input instead of asking for it");
    command
        ->add_flag_callback(
            "--hashed-password-stdin", [&] { arguments.password = PasswordSource::HashedStandardInput; },
            "read the password's hash from standard input and pass it on as it is")
        ->excludes(plain);
}

int run(int argc, char** argv) {
    Arguments arguments;
    Command chosen = nullptr;
    std::string service = kDefaultService;
    double timeout = kDefaultTimeout;

    CLI::App application("Manages the Velto ID accounts of this device.", "veltoidctl");
    application.require_subcommand(1);
    application.fallthrough();
    application.add_flag("--json", arguments.json, "print the agent's whole reply as JSON");
    application.add_option("--service", service, "the agent's name on the bus")->capture_default_str();
    application.add_option("--timeout", timeout, "seconds to wait for the agent")
        ->capture_default_str()
        ->check(CLI::Range(0.1, 3'600.0));

    addCommand(application, "ping", "see whether the agent answers", ping, chosen);
    CLI::App* addAccount =
        addCommand(application, "add", "add an account, or give it a new password", add, chosen);
    takesAccount(addAccount, arguments);
    takesPassword(addAccount, arguments);
    addAccount->add_flag("--no-sign-in", arguments.withoutSigningIn, "store it without asking the server");
    takesAccount(addCommand(application, "forget", "take an account off this device", forget, chosen),
                 arguments);
    addCommand(application, "list", "list the accounts", list, chosen);
    CLI::App* showInfo = addCommand(application, "info", "show who an account is", info, chosen);
    takesAccount(showInfo, arguments, false);
    showInfo->add_flag("--refresh", arguments.refresh, "ask the server even if the information is fresh");
    addCommand(application, "status", "show the accounts' states and what happens next", status, chosen);
    CLI::App* verifyPassword =
        addCommand(application, "verify", "check a password with the server", verify, chosen);
    takesAccount(verifyPassword, arguments);
    takesPassword(verifyPassword, arguments);
    addCommand(application, "database", "dump the account database", database, chosen);

    try {
        application.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        // Prints the help that was asked for, or what is wrong.
        return application.exit(error) == 0 ? kDone : kWrongUse;
    }
    AgentConnection agent(service, timeout);
    return chosen(agent, arguments);
}

}  // namespace
}  // namespace veltoidctl

int main(int argc, char** argv) {
    // Passwords pass through this process: none of them ends in a core file.
    const rlimit none{0, 0};
    setrlimit(RLIMIT_CORE, &none);
    try {
        return veltoidctl::run(argc, argv);
    } catch (const veltoidctl::Unreachable& error) {
        std::cerr << "veltoidctl: " << error.what() << "\n";
        return veltoidctl::kAgentUnreachable;
    } catch (const std::exception& error) {
        std::cerr << "veltoidctl: " << error.what() << "\n";
        return veltoidctl::kRefused;
    }
}
