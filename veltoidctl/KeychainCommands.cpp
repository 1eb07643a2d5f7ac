// The passphrase goes no further than this process, which opens the keychain by itself; the agent is told
// afterwards.
#include <iostream>

#include "Platform/keychain/Keychain.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/Names.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/ClientCommands.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {
namespace {

using platform::keychain::Protection;

constexpr const char* kQuestion = "Passphrase of the keychain: ";

const char* nameOf(Protection protection) {
    if (protection == Protection::NoPassphrase) return "no passphrase";
    return protection == Protection::Locked ? "locked" : "unlocked";
}

std::string reasonFor(platform::KeychainStatus status) {
    if (status == platform::kKeychainWrongPassphrase) return "that is not the passphrase";
    return reasonUnlessLocked("the keychain or the kernel's keyring is not available");
}

int presentOutcome(platform::KeychainStatus status, const Arguments& arguments, const std::string& what,
                   const char* done) {
    const Json reply{{veltoid::message::kSuccess, status == platform::kKeychainSuccess}};
    return present(
        reply, arguments, what, [done](const Json&) { std::cout << done << "\n"; }, reasonFor(status));
}

/// A running agent may wait for this, and one that is not running has work now.
void tellAgent(AgentConnection& agent) {
    agent.post(veltoid::kVeltoIDUnlockedNotification);
    send(agent, {.command = veltoid::command::kPing});
}

}  // namespace

int keychainStatus(AgentConnection& /*agent*/, const Arguments& arguments) {
    const auto protection = platform::keychain::protection();
    Json reply{{veltoid::message::kSuccess, protection.has_value()}};
    if (protection) reply["protection"] = nameOf(*protection);
    return present(
        reply, arguments, "keychain status",
        [](const Json& shown) { std::cout << textOf(shown["protection"]) << "\n"; },
        "the keychain cannot be read");
}

int setPassphrase(AgentConnection& /*agent*/, const Arguments& arguments) {
    const auto passphrase = readNewPassword(arguments.password, "the keychain");
    return presentOutcome(
        platform::keychain::setPassphrase(platform::bytesOf(passphrase)), arguments,
        "keychain set-passphrase",
        "the keychain has this passphrase, and is unlocked until the device is switched off");
}

int removePassphrase(AgentConnection& /*agent*/, const Arguments& arguments) {
    return presentOutcome(platform::keychain::removePassphrase(), arguments, "keychain remove-passphrase",
                          "the keychain has no passphrase");
}

int unlockKeychain(AgentConnection& agent, const Arguments& arguments) {
    if (platform::keychain::protection() == Protection::NoPassphrase)
        return presentOutcome(platform::kKeychainSuccess, arguments, "keychain unlock",
                              "the keychain has no passphrase");
    const auto passphrase = readPassword(arguments.password, kQuestion);
    const auto status = platform::keychain::unlock(platform::bytesOf(passphrase));
    const int outcome = presentOutcome(status, arguments, "keychain unlock", "the keychain is unlocked");
    if (outcome == kDone) tellAgent(agent);
    return outcome;
}

int lockKeychain(AgentConnection& /*agent*/, const Arguments& arguments) {
    if (platform::keychain::protection() == Protection::NoPassphrase) {
        const Json refusal{{veltoid::message::kSuccess, false}};
        return present(refusal, arguments, "keychain lock", {}, "the keychain has no passphrase");
    }
    return presentOutcome(platform::keychain::lock(), arguments, "keychain lock", "the keychain is locked");
}

}  // namespace veltoidctl
