#include "veltoidctl/ClientCertificate.h"

#include <stdexcept>

#include "Values/LowerCase.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/JsonBuilder.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {
namespace {

constexpr int kUnknownAccountCode = -1;

Json entryOf(const Json& dictionary, const std::string& section, const std::string& key) {
    return dictionary.value(section, Json::object()).value(key, Json::object());
}

std::optional<platform::Certificate> certificateFromKeychain(const veltoid::Data& reference) {
    std::optional<platform::Certificate> certificate;
    veltoid::copyCertificateFromKeychainGivenPersistentRef(reference, &certificate);
    return certificate;
}

/// An agent without keychain hands out the certificate itself.
std::optional<platform::Certificate> certificateOf(const Json& information) {
    if (const veltoid::Data der = dataIn(information, "CertificateData"))
        return platform::readCertificate(der.bytes());
    return certificateFromKeychain(dataIn(information, "CertificateReference"));
}

}  // namespace

bool ClientCertificate::isIssued() const {
    return succeeded(reply) && entryOf(reply, "result", "CertStatus") == "CERT_ISSUED";
}

bool ClientCertificate::isPending() const { return record.contains("CertificateToken"); }

std::string ClientCertificate::whyThereIsNone() const {
    if (isPending()) return "the certificate is still pending" + nextLook();
    if (reply.contains("error") && reply["error"].value("Code", 0) == kUnknownAccountCode)
        return "there is no such account on this device, or it was never signed in";
    return "the account has no certificate";
}

std::string ClientCertificate::nextLook() const {
    return record.contains("NextCertificateFetchDate")
               ? "; the agent asks again at " + textOf(record["NextCertificateFetchDate"])
               : std::string();
}

ClientCertificate fetchCertificate(AgentConnection& agent, const std::string& account) {
    ClientCertificate found;
    found.reply = send(agent, {.command = kCertificateCommand, .account = account});
    const Json information = found.reply.value("result", Json::object());
    const Json database =
        send(agent, {.command = kDatabaseCommand, .account = account}).value("result", Json::object());
    found.record = entryOf(database, "Accounts", veltoid::lowerCased(account).text());
    found.entry = entryOf(database, "AuthCertificates", information.value("encDsId", ""));
    found.certificate = certificateOf(information);
    found.intermediate = certificateFromKeychain(dataIn(found.entry, kIntermediateReference));
    return found;
}

veltoid::Key privateKeyOf(const ClientCertificate& certificate) {
    const veltoid::Data reference =
        dataIn(certificate.reply.value("result", Json::object()), "CertificatePrivateKeyReference");
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
