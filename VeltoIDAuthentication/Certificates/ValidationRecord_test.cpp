#include "Certificates/ValidationRecord.h"

#include <gtest/gtest.h>

#include <random>

#include "Platform/propertylist/PropertyList.h"
#include "TestSupport/TestAuthority.h"
#include "Values/ValueStream.h"

namespace veltoid {
namespace {

using testing_support::TestAuthority;

constexpr std::string_view kPayload =
    R"(<?xml version="1.0"?><plist version="1.0"><dict><key>ValidAsOf</key><date>2014-03-05T17:04:00Z</date></dict></plist>)";

Data dataOf(std::string_view text) { return Data(platform::bytesOf(text)); }

TEST(ValidationRecord, YieldsItsContentWhenTheSignatureVerifies) {
    const TestAuthority authority;
    for (const std::string& content : {std::string(kPayload), std::string("a\nb\r\n\0c", 7), std::string()})
        EXPECT_EQ(verifyValidationRecord(Data(authority.sign(content))), dataOf(content));

    const auto whole = authority.sign(kPayload);
    const testing_support::Bytes cut(whole.begin(), whole.end() - 1);
    auto longer = authority.sign(kPayload);
    longer.push_back(0);
    for (const auto& record :
         {cut, longer, authority.sign(kPayload, TestAuthority::Content::Detached), authority.certificate(),
          testing_support::Bytes{}, testing_support::Bytes(5U << 20U, 0x30)})
        EXPECT_FALSE(verifyValidationRecord(Data(record)));
    EXPECT_FALSE(verifyValidationRecord({}));
}

TEST(ValidationRecord, IsRefusedWithAnyByteOfContentOrSignatureChanged) {
    const TestAuthority authority;
    const auto record = authority.sign(kPayload);
    const std::string_view text(reinterpret_cast<const char*>(record.data()), record.size());
    const size_t content = text.find(kPayload);
    ASSERT_NE(content, std::string_view::npos);
    std::mt19937 random(4711);  // NOLINT(cert-msc32-c,cert-msc51-cpp): the same positions each time
    for (int i = 0; i < 500; ++i) {
        // An ECDSA signature is the last thing in the message and has more than 60 bytes.
        const size_t position =
            i % 2 == 0 ? content + random() % kPayload.size() : record.size() - 1 - random() % 60;
        auto damaged = record;
        damaged[position] = static_cast<uint8_t>(damaged[position] ^ (1 + random() % 255));
        EXPECT_FALSE(verifyValidationRecord(Data(damaged))) << position;
    }
    for (size_t i = 0; i < record.size(); ++i) {
        auto damaged = record;
        damaged[i] ^= 0x80;
        const Data read = verifyValidationRecord(Data(damaged));
        EXPECT_TRUE(!read || read == dataOf(kPayload)) << "never another content: " << i;
    }
}

TEST(ValidationRecordPayload, IsADictionaryInEitherForm) {
    const Dictionary payload = {{"ValidAsOf", Value::date(1'394'039'040)}};
    EXPECT_EQ(parseValidationRecordPayload(dataOf(kPayload)), payload);
    const auto binary =
        platform::writeBinaryPropertyList([&](platform::ValueSink& sink) { writeValue(payload, sink); });
    EXPECT_EQ(parseValidationRecordPayload(Data(binary)), payload);

    const auto array =
        platform::writeBinaryPropertyList([](platform::ValueSink& sink) { writeValue(Array{"a"}, sink); });
    std::string deep = "<plist>";
    for (int i = 0; i < 100; ++i) deep += "<array>";
    for (int i = 0; i < 100; ++i) deep += "</array>";
    for (const Data& none : {Data(array), dataOf("<plist><array/></plist>"), dataOf("hello"), dataOf(""),
                             Data(), dataOf(deep + "</plist>")})
        EXPECT_FALSE(parseValidationRecordPayload(none));
}

}  // namespace
}  // namespace veltoid
