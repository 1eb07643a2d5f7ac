#include "veltoidctl/Commands.h"

#include <functional>
#include <iomanip>
#include <iostream>

namespace veltoidctl {
namespace {

// Commands of the agent's service.
constexpr int64_t kPing = 0x1;
constexpr int64_t kAdd = 0x120;
constexpr int64_t kInfo = 0x130;
constexpr int64_t kList = 0x150;
constexpr int64_t kForget = 0x160;
constexpr int64_t kVerify = 0x180;
constexpr int64_t kDatabase = 0x500;
constexpr int64_t kStatus = 0x510;

constexpr int kLabelWidth = 22;

struct RequestParts {
    int64_t command = 0;
    std::string account;
    /// Empty: the request carries none.
    platform::SecretText passwordHash;
    std::vector<std::string> trueOptions;
};

Json send(AgentConnection& agent, const RequestParts& parts) {
    return agent.send([&](platform::ValueSink& sink) {
        sink.beginDictionary();
        sink.key("command");
        sink.integer(parts.command);
        if (!parts.account.empty()) {
            sink.key("VeltoID");
            sink.string(parts.account);
        }
        if (!parts.passwordHash.empty()) {
            sink.key("hashedpassword");
            sink.string(parts.passwordHash);
        }
        sink.key("options");
        sink.beginDictionary();
        for (const std::string& option : parts.trueOptions) {
            sink.key(option);
            sink.boolean(true);
        }
        sink.endDictionary();
        sink.endDictionary();
    });
}

bool succeeded(const Json& reply) { return reply.value("success", false); }

std::string textOf(const Json& value) {
    if (value.is_string()) return value.get<std::string>();
    if (value.is_boolean()) return value.get<bool>() ? "yes" : "no";
    if (!value.is_array()) return value.dump();
    std::string joined;
    for (const Json& element : value) joined += (joined.empty() ? "" : ", ") + textOf(element);
    return joined.empty() ? "none" : joined;
}

void printLine(const std::string& label, const Json& value) {
    std::cout << std::left << std::setw(kLabelWidth) << label + ":" << textOf(value) << "\n";
}

/// Prints the entries that the reply has, in the given order, under readable labels.
void printEntries(const Json& dictionary,
                  std::initializer_list<std::pair<const char*, const char*>> entries) {
    for (const auto& [key, label] : entries)
        if (dictionary.contains(key)) printLine(label, dictionary[key]);
}

/// The most telling text of an error, its own or that of the one underneath.
std::string reasonOf(const Json& error) {
    const Json information = error.value("UserInfo", Json::object());
    for (const char* key : {"HWLocalizedFailureReason", "HWLocalizedDescription"})
        if (information.contains(key)) return textOf(information[key]);
    if (information.contains("HWUnderlyingError")) return reasonOf(information["HWUnderlyingError"]);
    switch (error.value("Code", 0)) {
        case -103:
            return "the server has asked not to be contacted for a while";
        case -107:
        case -108:
            return "there is no such account on this device";
        default:
            return "the agent could not do it";
    }
}

void printRefusal(const Json& reply, const std::string& what) {
    std::cerr << "veltoidctl: " << what << ": ";
    if (!reply.contains("error")) {
        std::cerr << "refused\n";
        return;
    }
    const Json& error = reply["error"];
    std::cerr << reasonOf(error) << " (" << error.value("Domain", "?") << " " << error.value("Code", 0)
              << ")\n";
}

/// Prints the reply as JSON, the refusal, or what `print` makes of it.
int present(const Json& reply, const Arguments& arguments, const std::string& what,
            const std::function<void(const Json&)>& print) {
    if (arguments.json) {
        std::cout << reply.dump(2, ' ', false, Json::error_handler_t::replace) << "\n";
    } else if (succeeded(reply)) {
        print(reply);
    }
    if (succeeded(reply)) return kDone;
    if (!arguments.json) printRefusal(reply, what);
    return kRefused;
}

void printStatusOf(const std::string& account, const Json& status) {
    std::cout << account << "\n";
    printEntries(status, {{"AccountState", "  state"},
                          {"AccountRequiresUserAction", "  needs you"},
                          {"NextActionTime", "  next action"},
                          {"NextFetchAttempt", "  next fetch"},
                          {"ValidationDate", "  validated"}});
}

}  // namespace

int ping(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {kPing, {}, {}, {}}), arguments, "ping",
                   [](const Json&) { std::cout << "the agent answers\n"; });
}

int add(AgentConnection& agent, const Arguments& arguments) {
    RequestParts parts{kAdd, arguments.account, readPasswordHash(arguments.password, arguments.account), {}};
    if (arguments.withoutSigningIn) parts.trueOptions.emplace_back("DoNotCheckPassword");
    const Json reply = send(agent, parts);
    const int status = present(reply, arguments, "add", [&](const Json& added) {
        if (added.contains("encDsId")) {
            std::cout << arguments.account << " is added and signed in as " << textOf(added["encDsId"])
                      << "\n";
        } else if (arguments.withoutSigningIn) {
            std::cout << arguments.account << " is added\n";
        }
    });
    if (status != kDone || reply.contains("encDsId") || arguments.withoutSigningIn) return status;
    if (!arguments.json)
        std::cerr << "veltoidctl: add: " << arguments.account
                  << " is stored on this device, but could not be signed in; see `veltoidctl status`\n";
    return kRefused;
}

int forget(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {kForget, arguments.account, {}, {}}), arguments, "forget",
                   [](const Json& reply) {
                       std::cout << textOf(reply.value("VeltoID", Json(""))) << " is forgotten\n";
                   });
}

int list(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {kList, {}, {}, {}}), arguments, "list", [](const Json& reply) {
        const Json names = reply.value("result", Json::array());
        for (const Json& name : names) std::cout << textOf(name) << "\n";
        if (names.empty()) std::cerr << "no accounts\n";
    });
}

int info(AgentConnection& agent, const Arguments& arguments) {
    RequestParts parts{kInfo, arguments.account, {}, {}};
    if (arguments.refresh) parts.trueOptions.emplace_back("ForceValidation");
    return present(send(agent, parts), arguments, "info", [](const Json& reply) {
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
    return present(send(agent, {kStatus, {}, {}, {}}), arguments, "status", [](const Json& reply) {
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
    const RequestParts parts{
        kVerify, arguments.account, readPasswordHash(arguments.password, arguments.account), {}};
    return present(send(agent, parts), arguments, "verify", [&](const Json&) {
        std::cout << "the server accepts the password of " << arguments.account << "\n";
    });
}

int database(AgentConnection& agent, const Arguments& arguments) {
    return present(send(agent, {kDatabase, {}, {}, {}}), arguments, "database", [](const Json& reply) {
        std::cout << reply.value("result", Json::object()).dump(2, ' ', false, Json::error_handler_t::replace)
                  << "\n";
    });
}

}  // namespace veltoidctl
