#include "veltoidctl/ClientCertificate.h"

#include <stdexcept>

#include "Protocol/AccountState.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/LowerCase.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/JsonBuilder.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {

namespace command = veltoid::command;
namespace message = veltoid::message;

namespace {

constexpr int kUnknownAccountCode = -1;

/// An empty object when there is none.
Json objectIn(const Json& dictionary, std::string_view key) { return dictionary.value(key, Json::object()); }

std::optional<platform::Certificate> certificateFromKeychain(const veltoid::Data& reference) {
    std::optional<platform::Certificate> certificate;
    veltoid::copyCertificateFromKeychainGivenPersistentRef(reference, &certificate);
    return certificate;
}

/// An agent without keychain hands out the certificate itself.
std::optional<platform::Certificate> certificateOf(const Json& information) {
    if (const veltoid::Data der = dataIn(information, message::kCertificateData))
        return platform::readCertificate(der.bytes());
    return certificateFromKeychain(
        dataIn(information, veltoid::kVeltoIDCertificateCertificatePersistentReferenceKey));
}

}  // namespace

bool ClientCertificate::isIssued() const {
    return succeeded(reply) &&
           objectIn(reply, message::kResult).value(veltoid::kVeltoIDCertificateStatusKey, "") ==
               veltoid::kVeltoIDCertificateStatusIssued;
}

bool ClientCertificate::isPending() const {
    return status.value(message::kAccountState, "") == nameOf(veltoid::AccountState::CertificatePending);
}

bool ClientCertificate::hasIntermediate() const {
    return objectIn(reply, message::kResult)
        .contains(veltoid::kVeltoIDCertificateIntermediateCertificateReferenceKey);
}

std::string ClientCertificate::whyThereIsNone() const {
    if (isPending()) return "the certificate is still pending" + nextLook();
    if (objectIn(reply, message::kError).value(message::kErrorCode, 0) == kUnknownAccountCode)
        return "there is no such account on this device, or it was never signed in";
    return "the account has no certificate";
}

std::string ClientCertificate::nextLook() const {
    return status.contains(message::kNextFetchAttempt)
               ? "; the agent asks again at " + textOf(status[message::kNextFetchAttempt])
               : std::string();
}

ClientCertificate fetchCertificate(AgentConnection& agent, const std::string& account) {
    ClientCertificate found;
    found.reply = send(agent, {.command = command::kCertificate,
                               .account = account,
                               .options = {{veltoid::option::kCertificateDetails, true}}});
    const Json information = objectIn(found.reply, message::kResult);
    const Json agentStatus = objectIn(send(agent, {.command = command::kStatus}), message::kStatus);
    found.status =
        objectIn(objectIn(agentStatus, message::kAccountStatuses), veltoid::lowerCased(account).view());
    found.certificate = certificateOf(information);
    found.intermediate = certificateFromKeychain(
        dataIn(information, veltoid::kVeltoIDCertificateIntermediateCertificateReferenceKey));
    return found;
}

veltoid::Key privateKeyOf(const ClientCertificate& certificate) {
    const veltoid::Data reference = dataIn(objectIn(certificate.reply, message::kResult),
                                           veltoid::kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
    veltoid::Key key;
    if (!veltoid::copyKeyFromKeychainGivenPersistentRef(reference, &key) || !key.isPrivate)
        throw std::runtime_error(reasonUnlessLocked("the private key is not in this user's keychain"));
    if (key.publicPart != veltoid::Data(certificate.certificate->publicKey))
        throw std::runtime_error("the private key in the keychain is not the certificate's");
    return key;
}

const platform::Certificate& needed(const std::optional<platform::Certificate>& certificate,
                                    const char* whatItIs) {
    if (!certificate)
        throw std::runtime_error(std::string("the ") + whatItIs + " is not in this user's keychain");
    return *certificate;
}

}  // namespace veltoidctl
