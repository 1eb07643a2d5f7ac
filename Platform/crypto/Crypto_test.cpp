#include "Platform/crypto/Crypto.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

namespace platform {
namespace {

SecretBytes bytesFromHex(std::string_view text) {
    SecretBytes bytes;
    for (size_t i = 0; i + 1 < text.size(); i += 2) {
        bytes.push_back(static_cast<uint8_t>(std::stoi(std::string(text.substr(i, 2)), nullptr, 16)));
    }
    return bytes;
}

TEST(Crypto, DigestsAreThePublishedOnes) {
    const std::pair<std::string, std::string_view> cases[] = {
        {"", "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"},
        {"abc", "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
        {std::string(1000000, 'a'), "cdc76e5c9914fb9281a1c7e284d73e67f1809a48a497200e046d39ccc7112cd0"},
    };
    for (const auto& [text, digest] : cases)
        EXPECT_TRUE(std::ranges::equal(sha256(bytesOf(text)), bytesFromHex(digest))) << text.size();
}

TEST(Crypto, RandomBytesFillTheWholeSpan) {
    // More than the kernel gives in one piece when a signal arrives.
    std::vector<uint8_t> bytes(1U << 20U);
    fillRandom(bytes);
    const std::span<const uint8_t> all(bytes);
    for (size_t at = 0; at < all.size(); at += 64) {
        const auto part = all.subspan(at, 64);
        ASSERT_FALSE(std::ranges::all_of(part, [](uint8_t byte) { return byte == 0; })) << at;
    }
}

TEST(Crypto, UUIDsAreRandomOnesInCanonicalText) {
    const UUIDBytes sample = {0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77,
                              0x88, 0x99, 0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF};
    EXPECT_EQ(canonicalUUIDText(sample), "00112233-4455-6677-8899-AABBCCDDEEFF");
    for (int i = 0; i < 64; ++i) {
        const std::string text = canonicalUUIDText(randomUUID());
        EXPECT_EQ(text[14], '4') << text;
        EXPECT_NE(std::string_view("89AB").find(text[19]), std::string_view::npos) << text;
    }
    EXPECT_NE(randomUUID(), randomUUID());
}

TEST(Crypto, UnsealsAPublishedSampleOfTheCipher) {
    // Nonce, ciphertext and tag of the GCM test case with an all-zero 256-bit key and one all-zero block.
    const auto sealed = bytesFromHex(
        "000000000000000000000000"
        "cea7403d4d606b6e074ec5d3baf39d18"
        "d0d1c8a799996bf0265b98b5d48ab919");
    const auto plain = unseal(SecretBytes(kSealingKeyBytes), {}, sealed);
    ASSERT_TRUE(plain);
    EXPECT_EQ(*plain, SecretBytes(16));
}

TEST(Crypto, UnsealsOnlyWhatWasSealedTogether) {
    SecretBytes key(kSealingKeyBytes);
    fillRandom(key);
    for (const size_t size : {size_t{0}, size_t{1}, size_t{16}, size_t{1000}}) {
        const SecretBytes plain(size, 0x5A);
        const SecretBytes sealed = seal(key, bytesOf("context"), plain);
        ASSERT_EQ(unseal(key, bytesOf("context"), sealed), plain);
        EXPECT_NE(seal(key, bytesOf("context"), plain), sealed) << "a nonce was used twice";

        EXPECT_FALSE(unseal(key, bytesOf("Context"), sealed));
        EXPECT_FALSE(unseal(key, {}, sealed));
        EXPECT_FALSE(unseal(Bytes(key).first(16), bytesOf("context"), sealed));
        SecretBytes otherKey = key;
        otherKey.back() ^= 1U;
        EXPECT_FALSE(unseal(otherKey, bytesOf("context"), sealed));
        for (size_t at = 0; at < sealed.size(); ++at) {
            SecretBytes flipped = sealed;
            flipped[at] ^= 0x80U;
            EXPECT_FALSE(unseal(key, bytesOf("context"), flipped)) << "flipped at " << at;
            EXPECT_FALSE(unseal(key, bytesOf("context"), Bytes(sealed).first(at))) << "cut at " << at;
        }
    }
}

}  // namespace
}  // namespace platform
