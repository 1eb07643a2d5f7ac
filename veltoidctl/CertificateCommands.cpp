// The commands about an account's client certificate.
#include <iostream>
#include <stdexcept>

#include "Platform/encoding/CalendarText.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/RecordKeys.h"
#include "veltoidctl/AgentRequest.h"
#include "veltoidctl/CertificateExport.h"
#include "veltoidctl/ClientCertificate.h"
#include "veltoidctl/ClientCommands.h"
#include "veltoidctl/Files.h"
#include "veltoidctl/JsonBuilder.h"
#include "veltoidctl/Printing.h"

namespace veltoidctl {

namespace message = veltoid::message;

namespace {

constexpr const char* kSubject = "Subject";
constexpr const char* kIssuer = "Issuer";
constexpr const char* kValidFrom = "ValidFrom";

constexpr const char* kCertificate = "certificate";
constexpr const char* kIntermediate = "intermediate certificate";

/// What is shown: the certificate's own words where it can be read, else the agent's.
Json describe(const ClientCertificate& found) {
    Json shown = found.reply[message::kResult];
    if (found.certificate) {
        shown[kSubject] = found.certificate->subject;
        shown[kIssuer] = found.certificate->issuer;
        shown[veltoid::kVeltoIDCertificateSerialNumberKey] = found.certificate->serialNumber;
        if (const auto start = platform::calendarText(found.certificate->notBefore, platform::kISO8601))
            shown[kValidFrom] = *start;
        if (const auto end = platform::calendarText(found.certificate->notAfter, platform::kISO8601))
            shown[veltoid::kVeltoIDCertificateExpirationDateKey] = *end;
    }
    shown.erase(std::string(veltoid::kVeltoIDCertificateIntermediateCertificateReferenceKey));
    return shown;
}

void printDescription(const ClientCertificate& found) {
    printEntries(describe(found), {{kSubject, "certificate of"},
                                   {veltoid::kVeltoIDCertificateStatusKey, "status"},
                                   {veltoid::kVeltoIDCertificateExpirationDateKey, "valid until"},
                                   {veltoid::kVeltoIDCertificateSerialNumberKey, "serial"},
                                   {kIssuer, "issuer"},
                                   {veltoid::kVeltoIDCertificateNextRenewalAttemptDateKey, "next renewal"}});
    if (found.isPending()) printLine("new certificate", "pending" + found.nextLook());
    if (!found.certificate)
        std::cerr << "veltoidctl: the certificate itself cannot be read from this user's keychain\n";
}

std::string pemFor(const ClientCertificate& found, const Arguments& arguments) {
    std::string text = pemOf(needed(found.certificate, kCertificate));
    if (arguments.chain) text += pemOf(needed(found.intermediate, kIntermediate));
    return text;
}

int writeValidationRecord(AgentConnection& agent, const Arguments& arguments) {
    const bool isPartOfReply = arguments.json && arguments.output == kStandardStream;
    const PrivateOutput output(arguments.output, arguments.force || isPartOfReply);
    const Json reply = send(agent, {.command = veltoid::command::kCertificate,
                                    .account = arguments.account,
                                    .entries = [](platform::ValueSink& sink) {
                                        sink.key(message::kCertificateType);
                                        sink.string(message::kValidationRecordType);
                                    }});
    const veltoid::Data record = dataIn(reply.value(message::kResult, Json::object()),
                                        veltoid::kVeltoIDAccountValidationRecordDataKey);
    if (succeeded(reply) && !record) throw std::runtime_error("the account has no validation record");
    if (record && !isPartOfReply) output.write(record.bytes());
    return present(
        reply, arguments, "certificate", [](const Json&) {}, "there is no such account on this device");
}

Identity identityOf(const ClientCertificate& found) {
    Identity identity{privateKeyOf(found), *found.certificate, {}};
    if (found.hasIntermediate()) identity.intermediate = needed(found.intermediate, kIntermediate);
    return identity;
}

platform::SecretBytes encode(const Identity& identity, const Arguments& arguments) {
    if (!arguments.pkcs12) return pemOf(identity);
    const platform::SecretText password = arguments.withoutPassword
                                              ? platform::SecretText()
                                              : readNewPassword(arguments.password, arguments.output);
    return pkcs12Of(identity, password, arguments.account);
}

}  // namespace

int certificate(AgentConnection& agent, const Arguments& arguments) {
    if (arguments.validationRecord) return writeValidationRecord(agent, arguments);
    const ClientCertificate found = fetchCertificate(agent, arguments.account);
    Json shown = found.reply;
    std::string pem;
    if (succeeded(shown)) {
        shown["certificate"] = describe(found);
        if (arguments.pem || arguments.chain) shown["certificate"]["PEM"] = pem = pemFor(found, arguments);
    }
    return present(
        shown, arguments, "certificate",
        [&](const Json&) {
            if (pem.empty()) printDescription(found);
            std::cout << pem;
        },
        found.whyThereIsNone());
}

int exportCertificate(AgentConnection& agent, const Arguments& arguments) {
    const PrivateOutput output(arguments.output, arguments.force);
    const ClientCertificate found = fetchCertificate(agent, arguments.account);
    if (!succeeded(found.reply))
        return present(found.reply, arguments, "certificate export", {}, found.whyThereIsNone());
    const platform::Certificate& certificate = needed(found.certificate, kCertificate);
    output.write(encode(identityOf(found), arguments));
    const Json shown = {
        {message::kSuccess, true}, {"file", arguments.output}, {"certificate", describe(found)}};
    return present(shown, arguments, "certificate export", [&](const Json&) {
        if (arguments.output != kStandardStream)
            std::cerr << "key and certificate of " << textOf(certificate.summary) << " are in "
                      << arguments.output << "\n";
    });
}

}  // namespace veltoidctl
