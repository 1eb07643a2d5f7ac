#include "veltoidctl/Commands.h"

#include <iostream>

#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/ClientCertificate.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {
namespace {

void printStatusOf(const std::string& account, const Json& status) {
    std::cout << account << "\n";
    printEntries(status, {{"AccountState", "  state"},
                          {"AccountRequiresUserAction", "  needs you"},
                          {"NextActionTime", "  next action"},
                          {"NextFetchAttempt", "  next fetch"},
                          {"CertificateRequestsHeldUntil", "  requests held until"},
                          {"ValidationDate", "  validated"}});
}

void printAdded(const Json& reply, const Arguments& arguments) {
    if (reply.contains("encDsId")) {
        std::cout << arguments.account << " is added and signed in as " << textOf(reply["encDsId"]) << "\n";
    } else if (arguments.withoutSigningIn) {
        std::cout << arguments.account << " is added\n";
    }
}

void printOutcome(const ClientCertificate& found, const Arguments& arguments) {
    if (found.isIssued()) {
        std::cout << "it has a certificate; see `veltoidctl certificate " << arguments.account << "`\n";
    } else if (found.isPending()) {
        std::cout << found.whyThereIsNone() << "\n";
    }
}

/// What somebody who added the account would miss; empty when nothing is.
std::string shortcoming(const Json& reply, const Arguments& arguments, const ClientCertificate& found) {
    if (!reply.contains("encDsId") && !arguments.withoutSigningIn)
        return "is stored on this device, but could not be signed in";
    if (arguments.wantsCertificate() && !found.isIssued() && !found.isPending())
        return "is signed in, but got no certificate";
    return {};
}

void printMatch(const Json& match) {
    printLine(textOf(match.value("matched", Json("match"))), match.value("value", Json("")));
    printEntries(match, {{"VeltoID", "  account"},
                         {"firstNm", "  first name"},
                         {"lastNm", "  last name"},
                         {"encDsId", "  encDsId"}});
}

}  // namespace

int ping(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = kPingCommand}), arguments, "ping",
                   [](const Json&) { std::cout << "the agent answers\n"; });
}

int add(AgentConnection& agent, const Arguments& arguments) {
    Request request{.command = kAddCommand,
                    .account = arguments.account,
                    .passwordHash = readPasswordHash(arguments.password, arguments.account)};
    if (arguments.withoutSigningIn) request.options.emplace_back("DoNotCheckPassword", true);
    if (arguments.withCertificate) request.options.emplace_back("CreateCSRAsynchronously", false);
    if (arguments.waitSeconds > 0) request.options.emplace_back("certwaitduration", arguments.waitSeconds);
    Json reply = send(agent, request);
    ClientCertificate found;
    if (arguments.wantsCertificate() && succeeded(reply)) {
        found = fetchCertificate(agent, arguments.account);
        reply["certificate"] = found.reply.value("result", Json::object());
        reply["certificateIsPending"] = found.isPending();
    }
    const int status = present(
        reply, arguments, "add",
        [&](const Json&) {
            printAdded(reply, arguments);
            printOutcome(found, arguments);
        },
        succeeded(reply) ? "" : reasonUnlessLocked("the agent could not do it"));
    const std::string missing = shortcoming(reply, arguments, found);
    if (status != kDone || missing.empty()) return status;
    if (!arguments.json)
        std::cerr << "veltoidctl: add: " << arguments.account << " " << missing
                  << "; see `veltoidctl status`\n";
    return kRefused;
}

int forget(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = kForgetCommand, .account = arguments.account}), arguments,
                   "forget", [](const Json& reply) {
                       std::cout << textOf(reply.value("VeltoID", Json(""))) << " is forgotten\n";
                   });
}

int list(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = kListCommand}), arguments, "list", [](const Json& reply) {
        const Json names = reply.value("result", Json::array());
        for (const Json& name : names) std::cout << textOf(name) << "\n";
        if (names.empty()) std::cerr << "no accounts\n";
    });
}

int info(AgentConnection& agent, const Arguments& arguments) {
    Request request{.command = kInfoCommand, .account = arguments.account};
    if (arguments.refresh) request.options.emplace_back("ForceValidation", true);
    return present(send(agent, request), arguments, "info", [](const Json& reply) {
        printEntries(reply.value("info", Json::object()), {{"VeltoID", "account"},
                                                           {"encDsId", "encDsId"},
                                                           {"FirstName", "first name"},
                                                           {"LastName", "last name"},
                                                           {"AllEmails", "e-mails"},
                                                           {"ValidatedEmail", "validated e-mails"},
                                                           {"ValidatedPhones", "validated phones"},
                                                           {"ValidationDate", "validated"},
                                                           {"SerialNumber", "certificate serial"},
                                                           {"CertificateExpiration", "certificate expires"}});
    });
}

int status(AgentConnection& agent, const Arguments& arguments) {
    Request request{.command = kStatusCommand};
    if (arguments.examine) request.options = {{"CheckNetwork", true}, {"ForceValidation", true}};
    return present(send(agent, request), arguments, "status", [](const Json& reply) {
        const Json status = reply.value("status", Json::object());
        printEntries(status, {{"pid", "agent process"},
                              {"LaunchTime", "running since"},
                              {"NextLaunchTime", "next launch"},
                              {"LastConnectAttempt", "last connect"},
                              {"LastSuccessfulConnect", "last success"},
                              {"DeviceUnlockedSinceBoot", "unlocked since boot"},
                              {"DirtyAccounts", "changed accounts"}});
        const Json accounts = status.value("AccountStatuses", Json::object());
        for (const auto& [account, entry] : accounts.items()) printStatusOf(account, entry);
        if (accounts.empty()) std::cout << "no accounts\n";
    });
}

int verify(AgentConnection& agent, const Arguments& arguments) {
    const Request request{.command = kVerifyCommand,
                          .account = arguments.account,
                          .passwordHash = readPasswordHash(arguments.password, arguments.account)};
    return present(send(agent, request), arguments, "verify", [&](const Json&) {
        std::cout << "the server accepts the password of " << arguments.account << "\n";
    });
}

int find(AgentConnection& agent, const Arguments& arguments) {
    const Request request{.command = arguments.cached ? kFindCachedCommand : kFindCommand,
                          .account = arguments.account,
                          .entries = [&](platform::ValueSink& sink) {
                              sink.key("criteria");
                              sink.beginDictionary();
                              sink.key(arguments.criterion);
                              sink.beginArray();
                              for (const std::string& value : arguments.values) sink.string(value);
                              sink.endArray();
                              sink.endDictionary();
                          }};
    return present(
        send(agent, request), arguments, "find",
        [](const Json& reply) {
            const Json matches = reply.value("result", Json::array());
            for (const Json& match : matches) printMatch(match);
            if (matches.empty()) std::cerr << "nobody was found\n";
        },
        arguments.cached ? "the agent remembers nobody like that" : "nobody could be looked for");
}

int database(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = kDatabaseCommand}), arguments, "database",
                   [](const Json& reply) { printJson(reply.value("result", Json::object())); });
}

}  // namespace veltoidctl
