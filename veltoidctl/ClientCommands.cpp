#include "veltoidctl/ClientCommands.h"

#include <iostream>

#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/ClientCertificate.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {

namespace command = veltoid::command;
namespace message = veltoid::message;
namespace option = veltoid::option;

namespace {

void printStatusOf(const std::string& account, const Json& status) {
    std::cout << account << "\n";
    printEntries(status, {{message::kAccountState, "  state"},
                          {message::kRequiresUserAction, "  needs you"},
                          {message::kNextActionTime, "  next action"},
                          {message::kNextFetchAttempt, "  next fetch"},
                          {veltoid::kVeltoIDAccountCertificateRequestsHeldUntilKey, "  requests held until"},
                          {veltoid::kVeltoIDAccountLastValidationDateKey, "  validated"}});
}

void printAdded(const Json& reply, const Arguments& arguments) {
    if (reply.contains(message::kEncDsId)) {
        std::cout << arguments.account << " is added and signed in as " << textOf(reply[message::kEncDsId])
                  << "\n";
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

/// What is missing from the account that was added; empty when nothing is.
std::string shortcoming(const Json& reply, const Arguments& arguments, const ClientCertificate& found) {
    if (!reply.contains(message::kEncDsId) && !arguments.withoutSigningIn)
        return "is stored on this device, but could not be signed in";
    if (arguments.wantsCertificate() && !found.isIssued() && !found.isPending())
        return "is signed in, but got no certificate";
    return {};
}

void printMatch(const Json& match) {
    printLine(textOf(match.value(message::kMatched, Json("match"))),
              match.value(message::kMatchedValue, Json("")));
    printEntries(match, {{veltoid::kVeltoIDAccountNameKey, "  account"},
                         {message::kPersonFirstName, "  first name"},
                         {message::kPersonLastName, "  last name"},
                         {veltoid::kVeltoIDAccountDSIDKey, "  encDsId"}});
}

}  // namespace

int ping(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = command::kPing}), arguments, "ping",
                   [](const Json&) { std::cout << "the agent answers\n"; });
}

int add(AgentConnection& agent, const Arguments& arguments) {
    Request request = requestWithPassword(command::kAdd, arguments);
    if (arguments.withoutSigningIn) request.options.emplace_back(option::kDoNotCheckPassword, true);
    if (arguments.withCertificate) request.options.emplace_back(option::kCreateRequestAsynchronously, false);
    if (arguments.waitSeconds > 0)
        request.options.emplace_back(option::kCertificateWait, arguments.waitSeconds);
    Json reply = send(agent, request);
    ClientCertificate found;
    if (arguments.wantsCertificate() && succeeded(reply)) {
        found = fetchCertificate(agent, arguments.account);
        reply["certificate"] = found.reply.value(message::kResult, Json::object());
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
    return present(send(agent, {.command = command::kForget, .account = arguments.account}), arguments,
                   "forget", [](const Json& reply) {
                       std::cout << textOf(reply.value(message::kAccount, Json(""))) << " is forgotten\n";
                   });
}

int list(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = command::kList}), arguments, "list", [](const Json& reply) {
        const Json names = reply.value(message::kResult, Json::array());
        for (const Json& name : names) std::cout << textOf(name) << "\n";
        if (names.empty()) std::cerr << "no accounts\n";
    });
}

int info(AgentConnection& agent, const Arguments& arguments) {
    Request request{.command = command::kInfo, .account = arguments.account};
    if (arguments.refresh) request.options.emplace_back(option::kForceValidation, true);
    return present(send(agent, request), arguments, "info", [](const Json& reply) {
        printEntries(reply.value(message::kInfo, Json::object()),
                     {{veltoid::kVeltoIDAccountNameKey, "account"},
                      {veltoid::kVeltoIDAccountDSIDKey, "encDsId"},
                      {veltoid::kVeltoIDAccountFirstNameKey, "first name"},
                      {veltoid::kVeltoIDAccountLastNameKey, "last name"},
                      {message::kAllEmails, "e-mails"},
                      {veltoid::kVeltoIDAccountValidatedEmailKey, "validated e-mails"},
                      {veltoid::kVeltoIDAccountValidatedPhonesKey, "validated phones"},
                      {veltoid::kVeltoIDAccountLastValidationDateKey, "validated"},
                      {veltoid::kVeltoIDCertificateSerialNumberKey, "certificate serial"},
                      {message::kCertificateExpiration, "certificate expires"}});
    });
}

int status(AgentConnection& agent, const Arguments& arguments) {
    Request request{.command = command::kStatus};
    if (arguments.examine)
        request.options = {{option::kCheckNetwork, true}, {option::kForceValidation, true}};
    return present(send(agent, request), arguments, "status", [](const Json& reply) {
        const Json status = reply.value(message::kStatus, Json::object());
        printEntries(status, {{message::kProcessID, "agent process"},
                              {message::kLaunchTime, "running since"},
                              {message::kNextLaunchTime, "next launch"},
                              {veltoid::kVeltoIDMetaLastConnectAttemptKey, "last connect"},
                              {veltoid::kVeltoIDMetaLastSuccessfulConnectKey, "last success"},
                              {message::kUnlockedSinceBoot, "unlocked since boot"},
                              {message::kKeychainTrouble, "keychain"},
                              {message::kDirtyAccounts, "changed accounts"}});
        const Json accounts = status.value(message::kAccountStatuses, Json::object());
        for (const auto& [account, entry] : accounts.items()) printStatusOf(account, entry);
        if (accounts.empty()) std::cout << "no accounts\n";
    });
}

int verify(AgentConnection& agent, const Arguments& arguments) {
    const Request request = requestWithPassword(command::kVerify, arguments);
    return present(send(agent, request), arguments, "verify", [&](const Json&) {
        std::cout << "the server accepts the password of " << arguments.account << "\n";
    });
}

int find(AgentConnection& agent, const Arguments& arguments) {
    const Request request{.command = arguments.cached ? command::kFindCached : command::kFind,
                          .account = arguments.account,
                          .entries = [&](platform::ValueSink& sink) {
                              sink.key(message::kCriteria);
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
            const Json matches = reply.value(message::kResult, Json::array());
            for (const Json& match : matches) printMatch(match);
            if (matches.empty()) std::cerr << "nobody was found\n";
        },
        arguments.cached ? "the agent remembers nobody like that" : "nobody could be looked for");
}

int database(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {.command = command::kDatabase}), arguments, "database",
                   [](const Json& reply) { printJson(reply.value(message::kResult, Json::object())); });
}

}  // namespace veltoidctl
