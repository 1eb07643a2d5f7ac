#include "Platform/crypto/OpenSSLLibrary.h"

#include <gtest/gtest.h>
#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <memory>

#include "Platform/crypto/KeyPair.h"

namespace platform {
namespace {

constexpr uint8_t kMask = 0x5A;
constexpr size_t kNeedleBytes = 32;

/// A piece of a secret number, masked, so that a search through the own memory does not find itself.
using Needle = std::vector<uint8_t>;

/// Byte by byte, so that no vector register keeps the piece: its content may be saved on the stack.
Needle masked(const SecretBytes& number, bool reversed) {
    Needle needle;
    const volatile uint8_t* bytes = number.data();
    for (size_t i = kNeedleBytes; needle.size() < kNeedleBytes; ++i)
        needle.push_back(bytes[reversed ? number.size() - 1 - i : i] ^ kMask);
    return needle;
}

/// Pieces of the key's exponent and primes, as encodings have them and as the library computes with them.
std::vector<Needle> piecesOf(const SecretBytes& pkcs8) {
    const unsigned char* end = pkcs8.data();
    const std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> key(
        d2i_AutoPrivateKey(nullptr, &end, static_cast<long>(pkcs8.size())), EVP_PKEY_free);
    std::vector<Needle> needles;
    for (const char* name : {OSSL_PKEY_PARAM_RSA_D, OSSL_PKEY_PARAM_RSA_FACTOR1, OSSL_PKEY_PARAM_RSA_FACTOR2,
                             OSSL_PKEY_PARAM_RSA_EXPONENT1, OSSL_PKEY_PARAM_RSA_COEFFICIENT1}) {
        BIGNUM* number = nullptr;
        EXPECT_EQ(EVP_PKEY_get_bn_param(key.get(), name, &number), 1);
        SecretBytes bytes(static_cast<size_t>(BN_num_bytes(number)));
        BN_bn2bin(number, bytes.data());
        needles.push_back(masked(bytes, false));
        needles.push_back(masked(bytes, true));
        BN_clear_free(number);
    }
    return needles;
}

bool isAt(const uint8_t* memory, const Needle& needle) {
    for (size_t i = 0; i < needle.size(); ++i)
        if ((memory[i] ^ kMask) != needle[i]) return false;
    return true;
}

size_t countIn(Bytes memory, const Needle& needle) {
    size_t count = 0;
    while (memory.size() >= needle.size()) {
        const void* found = std::memchr(memory.data(), needle[0] ^ kMask, memory.size() - needle.size() + 1);
        if (found == nullptr) break;
        const auto* start = static_cast<const uint8_t*>(found);
        count += isAt(start, needle) ? 1 : 0;
        memory = memory.subspan(static_cast<size_t>(start - memory.data()) + 1);
    }
    return count;
}

/// How often one of the pieces is found in what this process can write to.
size_t countInMemory(const std::vector<Needle>& needles) {
    const std::unique_ptr<FILE, decltype(&std::fclose)> maps(std::fopen("/proc/self/maps", "r"), std::fclose);
    size_t count = 0;
    char line[4096];
    while (std::fgets(line, sizeof line, maps.get()) != nullptr) {
        uintptr_t start = 0;
        uintptr_t end = 0;
        char access[5] = {};
        if (std::sscanf(line, "%" SCNxPTR "-%" SCNxPTR " %4s", &start, &end, access) != 3 ||
            std::string_view(access).substr(0, 2) != "rw")
            continue;
        for (const Needle& needle : needles)
            count += countIn({reinterpret_cast<const uint8_t*>(start), end - start}, needle);
    }
    return count;
}

TEST(OpenSSLLibrary, LeavesNothingInMemoryOfAKeyThatIsGone) {
#ifdef VELTOID_SANITIZED
    GTEST_SKIP() << "sanitizers keep most of the address space for themselves";
#endif
    ASSERT_TRUE(openssl::prepare());
    std::vector<Needle> needles;
    {
        const auto pair = generateRSAKeyPair(2048);
        ASSERT_TRUE(pair);
        const SubjectAttribute subject[] = {{SubjectAttribute::Type::CommonName, "jane"}};
        EXPECT_TRUE(createCertificationRequest(pair->privateKey, subject));
        EXPECT_TRUE(publicKeyOf(pair->privateKey));
        needles = piecesOf(pair->privateKey);
        EXPECT_GE(countInMemory(needles), needles.size() / 2) << "the key itself is found";
    }
    EXPECT_EQ(countInMemory(needles), 0U);
}

}  // namespace
}  // namespace platform
