#include "Values/Base64.h"

#include <gtest/gtest.h>

#include <random>

#include "Values/Digest.h"
#include "Values/PEM.h"

namespace veltoid {
namespace {

Data dataOf(std::string_view text) { return Data(platform::bytesOf(text)); }

Data randomData(std::mt19937& random, size_t size) {
    std::vector<uint8_t> bytes(size);
    for (uint8_t& byte : bytes) byte = static_cast<uint8_t>(random());
    return Data(bytes);
}

TEST(Base64, LinesEndAfterEveryFullLine) {
    const std::string line48(64, 'A');
    EXPECT_EQ(base64Encode(Data(std::vector<uint8_t>(48))), line48 + "\n");
    EXPECT_EQ(base64Encode(Data(std::vector<uint8_t>(49))), line48 + "\nAA==");
    EXPECT_EQ(base64Encode(dataOf("AB"), "<", ">"), "<QUI=>");
    EXPECT_EQ(base64Encode(dataOf(""), "<", ">"), "<>");
    EXPECT_EQ(base64Encode(dataOf("ABCDEF"), {}, {}, 4), "QUJD\nREVG\n");
    EXPECT_EQ(base64Encode(dataOf("ABCDEF"), {}, {}, 0), "QUJDREVG");
    EXPECT_FALSE(base64Encode(Data()));
}

TEST(Base64, DecodingSkipsWhatIsNoSymbolAndStopsAtATag) {
    const std::pair<const char*, const char*> cases[] = {
        {"QUJD", "ABC"},   {"QUI=", "AB"},       {"QQ==", "A"},
        {"QUJD\n", "ABC"}, {"QUJD<QUJD", "ABC"}, {"Q U\tJ\r\nD", "ABC"},
        {"QUJDQ", "ABC"},  {"\xffQUJD", "ABC"},  {"QUI=QUJD", "ABABC"},
    };
    for (const auto& [text, expected] : cases) EXPECT_EQ(base64Decode(text), dataOf(expected)) << text;
    EXPECT_EQ(base64Decode("QQ=\n="), dataOf("A")) << "padding counts across white space";
    EXPECT_FALSE(base64Decode(""));
    EXPECT_FALSE(base64Decode(nullptr));
}

TEST(Base64, XMLRPCFormHasLinesOf64AndNoneAfterTheLast) {
    const auto encode = [](size_t size, bool lines) {
        return xmlrpcBase64Encode(std::vector<uint8_t>(size), lines).text();
    };
    const std::string full(64, 'A');
    EXPECT_EQ(encode(0, true), "");
    EXPECT_EQ(encode(48, true), full);
    EXPECT_EQ(encode(49, true), full + "\r\nAA==");
    EXPECT_EQ(encode(96, true), full + "\r\n" + full);
    EXPECT_EQ(encode(49, false), full + "AA==");
    EXPECT_EQ(xmlrpcBase64Decode("QUJD\n"), dataOf("ABC"));
    EXPECT_EQ(xmlrpcBase64Decode("QUI"), dataOf("AB"));
    EXPECT_EQ(xmlrpcBase64Decode("QQ"), dataOf("A"));
    EXPECT_EQ(xmlrpcBase64Decode("Q"), dataOf(""));
    EXPECT_EQ(xmlrpcBase64Decode("\n").size(), 0U);
}

TEST(Base64, WhatWasEncodedDecodesToItselfAtEveryLength) {
    std::mt19937 random(1);
    for (size_t size = 1; size < 300; ++size) {
        const Data data = randomData(random, size);
        ASSERT_EQ(base64Decode(base64Encode(data)), data) << size;
        ASSERT_EQ(base64Decode(base64Encode(data, {}, {}, 0)), data) << size;
        ASSERT_EQ(xmlrpcBase64Decode(xmlrpcBase64Encode(data.bytes(), true).view()), data) << size;
    }
}

TEST(PEM, BodyStandsBetweenTheLines) {
    const std::pair<const char*, const char*> cases[] = {
        {"-----BEGIN CERTIFICATE-----\nQUJD\n-----END CERTIFICATE-----\n", "ABC"},
        {"text before\n----begin x-----\nQUJD\n-----end x-----", "ABC"},
        {"QUJD", "ABC"},
        {"-----BEGIN A-----\nQUJD", "ABC"},
        {"QUJD-----END A-----", "ABC"},
    };
    for (const auto& [text, expected] : cases) EXPECT_EQ(pemBodyToData(text), dataOf(expected)) << text;
    for (const char* text :
         {"", "-----BEGIN A----------END A-----", "-----END A-----\n-----BEGIN A-----", "----BEGIN"})
        EXPECT_FALSE(pemBodyToData(text)) << text;
}

TEST(Digest, IsTheKnownOneForTextsOfEveryKind) {
    EXPECT_EQ(base64Encode(sha256OfString("abc"), {}, {}, 0), "ungWv48Bz+pBQUDeXa4iI7ADYaOWF3qctBD/YfIAFa0=");
    const std::string umlauts = std::string(70, 'a') + "ü" + std::string(70, 'b');
    EXPECT_EQ(sha256OfString(umlauts), Data(platform::sha256(platform::bytesOf(umlauts))));
    EXPECT_FALSE(sha256OfString(nullptr));
    EXPECT_EQ(randomUUIDText().view().size(), 36U);
    EXPECT_NE(randomUUIDText(), randomUUIDText());
}

}  // namespace
}  // namespace veltoid
