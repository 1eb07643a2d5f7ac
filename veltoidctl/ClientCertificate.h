// An account's certificate: what the agent knows of it, and the items themselves, which client and agent have
// in the same keychain.
#pragma once

#include <optional>
#include <string>

#include "Platform/crypto/Certificate.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "veltoidctl/AgentConnection.h"

namespace veltoidctl {

struct ClientCertificate {
    /// The agent's reply to the certificate request.
    Json reply = Json::object();
    /// The account's status; empty when the agent has no such account.
    Json status = Json::object();
    /// None when the account has no certificate or this user's keychain does not return it.
    std::optional<platform::Certificate> certificate = {};
    std::optional<platform::Certificate> intermediate = {};

    bool isIssued() const;
    /// A request for one is on its way.
    bool isPending() const;
    bool hasIntermediate() const;
    /// Why the agent has no certificate.
    std::string whyThereIsNone() const;
    /// For the end of a line: when the agent asks next for a pending one; empty when that is not known.
    std::string nextLook() const;
};

/// Throws Unreachable.
ClientCertificate fetchCertificate(AgentConnection& agent, const std::string& account);

/// The private key, from the keychain. Throws std::runtime_error when it is not there, or belongs to another
/// certificate.
veltoid::Key privateKeyOf(const ClientCertificate& certificate);

/// Throws std::runtime_error when it could not be read.
const platform::Certificate& needed(const std::optional<platform::Certificate>& certificate,
                                    const char* whatItIs);

}  // namespace veltoidctl
