#include "veltoidctl/ClientCommandLine.h"

#include <CLI/CLI.hpp>
#include <functional>

#include "veltoidctl/Files.h"

namespace veltoidctl {
namespace {

using Command = decltype(Invocation::command);
/// Looks at all that was given; throws what CLI11 throws when it does not go together.
using Check = std::function<void()>;

/// Lays out the commands; what is parsed goes to the invocation.
class Commands {
  public:
    Commands(CLI::App& application, Invocation& invocation)
        : application_(&application), invocation_(invocation), arguments_(invocation.arguments) {
        addAccountCommands();
        addFind();
        addCertificate();
        addBreadcrumb();
        addKeychain();
        addAgentCommands();
    }

  private:
    void addAccountCommands() {
        CLI::App* added =
            add(application_, "add", "add an account, or give it a new password", veltoidctl::add);
        takesAccount(added);
        takesPassword(added);
        auto* withoutSigningIn = added->add_flag("--no-sign-in", arguments_.withoutSigningIn,
                                                 "store it without asking the server");
        auto* atOnce =
            added->add_flag("--certificate", arguments_.withCertificate, "ask for its certificate at once")
                ->excludes(withoutSigningIn);
        added->add_option("--wait", arguments_.waitSeconds, "wait so many seconds until the agent has got it")
            ->check(CLI::Range(0.0, 3'600.0))
            ->excludes(withoutSigningIn)
            ->excludes(atOnce);

        takesAccount(add(application_, "forget", "take an account off this device", forget));
        add(application_, "list", "list the accounts", list);

        CLI::App* shown = add(application_, "info", "show who an account is", info);
        takesAccount(shown)->required(false);
        shown->add_flag("--refresh", arguments_.refresh, "ask the server even if the information is fresh");

        CLI::App* verified = add(application_, "verify", "check a password with the server", verify);
        takesAccount(verified);
        takesPassword(verified);
    }

    void addFind() {
        CLI::App* found = add(application_, "find", "find people", find);
        found->add_option("CRITERION", arguments_.criterion, "what they are found by, such as email or phone")
            ->required();
        found->add_option("VALUE", arguments_.values, "addresses, numbers or names")->required();
        found->add_flag("--cached", arguments_.cached, "look only at what the agent remembers");
        found->add_option("--account", arguments_.account, "the account that asks; else the first one");
    }

    void addCertificate() {
        CLI::App* group = add(application_, "certificate", "show an account's certificate", certificate);
        CLI::Option* name = takesAccount(group)->required(false);
        takesForm(group);
        group->callback([this, group, name] {
            if (!group->get_subcommands().empty()) return;
            if (name->count() == 0) throw CLI::RequiredError("NAME");
            invocation_.command = certificate;
        });

        CLI::App* shown = add(group, "show", "the same", certificate);
        shown->excludes(name);
        takesAccount(shown);
        takesForm(shown);

        addExport(group)->excludes(name);
    }

    CLI::App* addExport(CLI::App* group) {
        CLI::App* exported =
            add(group, "export", "write key, certificate and intermediate certificate to one file",
                exportCertificate, [this] {
                    if (arguments_.json && arguments_.output == kStandardStream)
                        throw CLI::ValidationError("--json", "standard output has room for one of the two");
                });
        takesAccount(exported);
        auto* kinds = exported->add_option_group("form");
        kinds->require_option(1);
        CLI::Option* pem = kinds->add_option("--pem", arguments_.output, "as PEM; - is standard output");
        CLI::Option* pkcs12 =
            kinds->add_option("--pkcs12", arguments_.output, "as PKCS#12; - is standard output")
                ->each([this](const std::string&) { arguments_.pkcs12 = true; });
        for (CLI::Option* kind : {pem, pkcs12}) kind->type_name("FILE");
        takesForce(exported);
        CLI::Option* fromInput = takesPlainPassword(exported)->needs(pkcs12);
        exported->add_flag("--no-password", arguments_.withoutPassword, "protect it with an empty password")
            ->needs(pkcs12)
            ->excludes(fromInput);
        return exported;
    }

    void addBreadcrumb() {
        CLI::App* group =
            application_->add_subcommand("breadcrumb", "data that the server keeps for a device");
        group->require_subcommand(1);
        CLI::App* got = add(group, "get", "fetch it", getBreadcrumb);
        takesAccountAndKey(got);
        takesOutput(got);
        CLI::App* set = add(group, "set", "store it", setBreadcrumb, [this] {
            if (arguments_.input == kStandardStream && arguments_.password != PasswordSource::Prompt)
                throw CLI::ValidationError("--input", "password and data cannot both be standard input");
        });
        takesAccountAndKey(set);
        set->add_option("--input", arguments_.input, "the file to store; else standard input")
            ->type_name("FILE");
    }

    void addKeychain() {
        CLI::App* group = application_->add_subcommand(
            "keychain", "the passphrase of the accounts' secrets on this device");
        group->require_subcommand(1);
        add(group, "status", "show whether there is a passphrase, and whether it was given", keychainStatus);
        takesPlainPassword(add(group, "set-passphrase",
                               "protect the secrets by a passphrase, or by another one", setPassphrase));
        add(group, "remove-passphrase", "protect them by the device alone again", removePassphrase);
        takesPlainPassword(add(group, "unlock", "give the passphrase, for until the device is switched off",
                               unlockKeychain));
        add(group, "lock", "have it given again before the agent can use the secrets", lockKeychain);
    }

    void addAgentCommands() {
        add(application_, "status", "show the accounts' states and what happens next", status)
            ->add_flag("--check", arguments_.examine, "examine them anew, certificates and server included");
        add(application_, "database", "dump the account database", database);
        add(application_, "ping", "see whether the agent answers", ping);
    }

    CLI::App* add(CLI::App* parent, const char* name, const char* purpose, Command command,
                  const Check& check = {}) {
        CLI::App* added = parent->add_subcommand(name, purpose);
        added->callback([this, command, check] {
            if (check) check();
            invocation_.command = command;
        });
        return added;
    }

    CLI::Option* takesAccount(CLI::App* command) {
        return command->add_option("NAME", arguments_.account, "the account's name")->required();
    }

    void takesAccountAndKey(CLI::App* command) {
        takesAccount(command);
        command->add_option("KEY", arguments_.key, "the breadcrumb's name")->required();
        takesPassword(command);
    }

    CLI::Option* takesPlainPassword(CLI::App* command) {
        return command->add_flag_callback(
            "--password-stdin", [this] { arguments_.password = PasswordSource::StandardInput; },
            "read the password from standard input instead of asking for it");
    }

    void takesPassword(CLI::App* command) {
        CLI::Option* plain = takesPlainPassword(command);
        command
            ->add_flag_callback(
                "--hashed-password-stdin",
                [this] { arguments_.password = PasswordSource::HashedStandardInput; },
                "read the password's hash from standard input and pass it on as it is")
            ->excludes(plain);
    }

    void takesForce(CLI::App* command) {
        command->add_flag("--force", arguments_.force, "replace the file, or write to a terminal");
    }

    CLI::Option* takesOutput(CLI::App* command) {
        takesForce(command);
        return command->add_option("--output", arguments_.output, "the file to write; else standard output")
            ->type_name("FILE");
    }

    void takesForm(CLI::App* command) {
        CLI::Option* pem = command->add_flag("--pem", arguments_.pem, "print the certificate itself");
        CLI::Option* chain =
            command->add_flag("--chain", arguments_.chain, "and the intermediate certificate after it");
        CLI::Option* record = command->add_flag("--validation-record", arguments_.validationRecord,
                                                "write the signed record of validated items instead");
        record->excludes(pem)->excludes(chain);
        takesOutput(command)->needs(record);
    }

    CLI::App* application_;
    Invocation& invocation_;
    Arguments& arguments_;
};

}  // namespace

std::variant<Invocation, int> parseCommandLine(int argc, char** argv) {
    Invocation invocation;
    CLI::App application("Manages the Velto ID accounts of this device.", "veltoidctl");
    application.require_subcommand(1);
    application.fallthrough();
    application.add_flag("--json", invocation.arguments.json, "print the agent's whole reply as JSON");
    application.add_option("--service", invocation.service, "the agent's name on the bus")
        ->capture_default_str();
    application.add_option("--timeout", invocation.timeout, "seconds to wait for the agent")
        ->capture_default_str()
        ->check(CLI::Range(0.1, 3'600.0));
    const Commands commands(application, invocation);
    try {
        application.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        return application.exit(error) == 0 ? kDone : kWrongUse;
    }
    return invocation;
}

}  // namespace veltoidctl
