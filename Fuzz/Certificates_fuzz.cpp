// Bytes of certificates, signed records and keys, as a server or a keychain item may hold them; the first
// byte chooses the reader. What is accepted must be the same when it is read again from what was made of it.
#include <cstdlib>

#include "Certificates/CertificateRequest.h"
#include "Certificates/ValidationRecord.h"
#include "Platform/crypto/KeyPair.h"
#include "Platform/crypto/SignedMessage.h"
#include "Values/Base64.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace {

using platform::Bytes;
using veltoid::Data;
using veltoid::Key;
using veltoid::String;

void require(bool condition) {
    if (!condition) std::abort();
}

void readCertificate(Bytes der) {
    const auto certificate = platform::readCertificate(der);
    if (!certificate) return;
    require(certificate->der == std::vector<uint8_t>(der.begin(), der.end()));
    const String pem =
        veltoid::base64Encode(Data(der), "-----BEGIN CERTIFICATE-----\n", "\n-----END CERTIFICATE-----\n");
    require(veltoid::certificateFromPEM(pem) == certificate);
}

void readCertificateText(Bytes text) {
    const auto certificate = veltoid::certificateFromPEM(String(platform::textOf(text)));
    if (certificate) readCertificate(certificate->der);
}

void readRecord(Bytes message) {
    const auto content = platform::verifySignedMessage(message);
    const Data payload = veltoid::verifyValidationRecord(Data(message));
    require(content.has_value() == static_cast<bool>(payload) && (!content || Data(*content) == payload));
    if (payload) (void)veltoid::parseValidationRecordPayload(payload);
}

void readPrivateKey(Bytes pkcs8) {
    const Key key = Key::privateKey(pkcs8);
    if (!key) return;
    require(key.encoded == Data(pkcs8) && platform::isPublicKey(key.publicPart.bytes()));
    require(Key::privateKey(key.encoded.bytes()) == key);
    // Whether it can sign or not: an item may hold a key of any kind.
    const platform::SubjectAttribute subject[] = {
        {platform::SubjectAttribute::Type::CommonName, "jane.roe@example.com"}};
    (void)platform::createCertificationRequest(pkcs8, subject);
}

void readPublicKey(Bytes publicKeyInfo) {
    const Key key = Key::publicKey(publicKeyInfo);
    require(static_cast<bool>(key) == platform::isPublicKey(publicKeyInfo));
    if (key) (void)key.description();
}

constexpr void (*kReaders[])(Bytes) = {readCertificate, readCertificateText, readRecord, readPrivateKey,
                                       readPublicKey};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
    if (size == 0) return 0;
    kReaders[*bytes % std::size(kReaders)]({bytes + 1, size - 1});
    return 0;
}
