// What certificates cost, ours or by bare OpenSSL, one of the two in a process: the agent's way makes OpenSSL
// wipe what it frees, which the other must not pay for.
//
//     Certificates_bench request ours|bare SEED...      prints "SEED MICROSECONDS": a certification request
//     with
//                                                       a new key, or the generation of just that key
//     Certificates_bench verify ours|bare RUNS FILE     prints "verify MICROSECONDS" for each run: a
//     validation
//                                                       record verified and read, or verified alone
//
// How long a key takes is a matter of luck. Random numbers that follow from the seed give both sides the
// same.
#define OPENSSL_SUPPRESS_DEPRECATED  // a random source of one's own would have to be a provider

#include <openssl/bio.h>
#include <openssl/cms.h>
#include <openssl/evp.h>
#include <openssl/rand.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "Certificates/CertificateRequest.h"
#include "Certificates/ValidationRecord.h"
#include "Platform/crypto/OpenSSLLibrary.h"

namespace {

using namespace veltoid;

constexpr int kVerifications = 500;

uint64_t randomState = 1;

int fillFromSeed(unsigned char* bytes, int size) {
    for (int i = 0; i < size; ++i) {
        randomState = randomState * 6'364'136'223'846'793'005U + 1'442'695'040'888'963'407U;
        bytes[i] = static_cast<unsigned char>(randomState >> 56U);
    }
    return 1;
}

int isSeeded() { return 1; }

void useSeededRandomNumbers() {
    static RAND_METHOD method{nullptr, fillFromSeed, nullptr, nullptr, fillFromSeed, isSeeded};
    if (RAND_set_rand_method(&method) != 1) std::abort();
}

void require(bool condition) {
    if (!condition) std::abort();
}

void requestOurs() {
    require(createKeyPairAndCertificateRequest("jane.roe@example.com", nullptr, nullptr, nullptr) == 0);
}

void requestBare() {
    EVP_PKEY* key = EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", kVeltoIDKeyBits);
    require(key != nullptr);
    EVP_PKEY_free(key);
}

void verifyOurs(const Data& record) {
    const auto payload = parseValidationRecordPayload(verifyValidationRecord(record));
    require(payload && payload->date("ValidAsOf"));
}

void verifyBare(const Data& record) {
    const unsigned char* end = record.bytes().data();
    CMS_ContentInfo* message = d2i_CMS_ContentInfo(nullptr, &end, static_cast<long>(record.size()));
    BIO* content = BIO_new(BIO_s_mem());
    require(CMS_verify(message, nullptr, nullptr, nullptr, content, CMS_NO_SIGNER_CERT_VERIFY | CMS_BINARY) ==
            1);
    BIO_free(content);
    CMS_ContentInfo_free(message);
}

/// Processor time: all of this is computation on one thread.
template <typename Work>
double microsecondsOf(const Work& work) {
    const std::clock_t start = std::clock();
    work();
    return static_cast<double>(std::clock() - start) * 1e6 / CLOCKS_PER_SEC;
}

Data contentsOf(const char* path) {
    std::ifstream stream(path, std::ios::binary);
    const std::string text{std::istreambuf_iterator<char>(stream), {}};
    return Data(platform::bytesOf(text));
}

void measureRequests(void (*make)(), const std::vector<std::string>& seeds) {
    useSeededRandomNumbers();
    make();  // whatever is loaded and set up at first
    for (const std::string& seed : seeds) {
        randomState = std::stoull(seed);
        std::printf("%s %.1f\n", seed.c_str(), microsecondsOf(make));
    }
}

void measureVerifications(void (*verify)(const Data&), const std::vector<std::string>& arguments) {
    const Data record = contentsOf(arguments.at(1).c_str());
    verify(record);
    for (int runs = std::stoi(arguments.at(0)); runs > 0; --runs) {
        const double all = microsecondsOf([&] {
            for (int i = 0; i < kVerifications; ++i) verify(record);
        });
        std::printf("verify %.3f\n", all / kVerifications);
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 4) return EXIT_FAILURE;
    const bool isOurs = std::string_view(argv[2]) == "ours";
    if (isOurs) require(platform::openssl::prepare());
    const std::vector<std::string> rest(argv + 3, argv + argc);
    if (std::string_view(argv[1]) == "request")
        measureRequests(isOurs ? requestOurs : requestBare, rest);
    else
        measureVerifications(isOurs ? verifyOurs : verifyBare, rest);
}
