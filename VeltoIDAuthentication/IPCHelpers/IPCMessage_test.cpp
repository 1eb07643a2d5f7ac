#include "IPCHelpers/IPCMessage.h"

#include <gtest/gtest.h>

#include <array>
#include <limits>
#include <vector>

#include "IPCHelpers/Transaction.h"
#include "TestSupport/FakeSystemLog.h"
#include "Values/SecurityObject.h"
#include "Values/ValueStream.h"

namespace veltoid {
namespace {

constexpr std::array<uint8_t, 16> kUUID = {1, 2, 3};
const Data kBytes(std::vector<uint8_t>{0x01, 0xAB, 0x00});

MessageValue array(std::vector<MessageValue> elements) { return {MessageArray(std::move(elements))}; }

MessageValue dictionary(std::initializer_list<std::pair<const char*, MessageValue>> entries) {
    MessageDictionary message;
    for (const auto& [key, value] : entries) message.set(key, value);
    return {message};
}

TEST(MessageValueTest, EveryKindIsConvertedBothWays) {
    const std::pair<const char*, Value> cases[] = {
        {"null", Value::null()},
        {"true", Value::boolean(true)},
        {"false", Value::boolean(false)},
        {"-5", Value::int64(-5)},
        {"5", Value::integer(5, NumberKind::Int8)},
        {"18446744073709551615U", Value::uint64(std::numeric_limits<uint64_t>::max())},
        {"7U", Value::uint64(7)},
        {"ipc object:1.5 ", Value::real(1.5)},
        {"ipc object:0.5 ", Value::singleReal(0.5F)},
        {"ipc object:2 ", Value::real(2)},
        {"\"\"", ""},
        {"\"t\"ä\"", "t\"ä"},
        {"01ab00", kBytes},
        {"", Data(std::vector<uint8_t>{})},
        {"2014/03/05 17:04:00 ", Value::date(1'394'039'040.75)},
        {"UUID:", Value::uuid(kUUID)},
        {"[]", Array()},
        {"[\"a\"[1]]", Array{"a", Array{Value::int64(1)}}},
        {"{0 }", Dictionary()},
        {"{2 success=true, status=3, }",
         Dictionary{{"success", Value::boolean(true)}, {"status", Value::int64(3)}}},
    };
    for (const auto& [description, value] : cases) {
        SCOPED_TRACE(description);
        const MessageValue message = messageFromValue(value);
        EXPECT_EQ(describe(message), description);
        const Value back = valueFromMessage(message);
        EXPECT_EQ(back, value);
        EXPECT_EQ(back.isFloating(), value.isFloating());

        // And over the platform's event form.
        MessageValueBuilder builder;
        writeMessageValue(message, builder);
        EXPECT_EQ(describe(builder.take()), description);
        ValueBuilder values;
        writeMessageValue(message, values);
        EXPECT_EQ(values.value(), value);
    }
}

TEST(MessageValueTest, WhatHasNoOtherFormIsLeftOut) {
    const Value unsupported[] = {Value(), Value::url("https://x.example"), Error{"d", 1, {}},
                                 Value::object({UnknownDescription{}})};
    for (const Value& value : unsupported) {
        EXPECT_EQ(describe(messageFromValue(value)), "(NULL element)");
        EXPECT_EQ(describe(messageFromValue(Array{"a", value, "b"})), "[\"a\"\"b\"]");
        EXPECT_EQ(describe(messageFromValue(Dictionary{{"a", value}, {"b", "c"}})), "{1 b=\"c\", }");
    }
    for (const MessageValue& message : std::vector<MessageValue>{{},
                                                                 {MessageError{"e"}},
                                                                 {MessageConnection()},
                                                                 {MessageFileDescriptor()},
                                                                 {MessageSharedMemory()},
                                                                 {MessageOther{"o"}}}) {
        EXPECT_TRUE(valueFromMessage(message).isAbsent());
        EXPECT_EQ(valueFromMessage(array({message, {String("a")}})), Value(Array{"a"}));
        EXPECT_EQ(valueFromMessage(dictionary({{"x", message}})), Value(Dictionary()));
        ValueBuilder written;
        writeMessageValue(message, written);
        EXPECT_TRUE(written.value().isNull());
    }
}

TEST(MessageValueTest, DescriptionsOfWhatOnlyMessagesHold) {
    const std::pair<MessageValue, const char*> cases[] = {
        {{}, "(NULL element)"},
        {{MessageError{"it is gone"}}, "(Error \"it is gone\")"},
        {{MessageConnection()}, "(Connection)"},
        {{MessageFileDescriptor()}, "FD:"},
        {{MessageSharedMemory()}, "SharedMemory:"},
        {{MessageOther{"a thing"}}, "ipc object:a thing "},
        {{MessageDate{0}}, ""},
        {{MessageDate{-1}}, ""},
        {{MessageDate{std::numeric_limits<double>::quiet_NaN()}}, ""},
        {{MessageDate{1}}, "1970/01/01 00:00:01 "},
        {{MessageDate{253'402'300'800}}, "10000/01/01 00:00:00 "},
        {dictionary({{"e", {}}, {"d", {MessageConnection()}}}), "{2 e=(NULL element), d=(Connection), }"},
        {array({{MessageNull()}, {}}), "[null(NULL element)]"},
    };
    for (const auto& [message, description] : cases) EXPECT_EQ(describe(message), description);
    // Beyond any calendar: no text, or some year, but no harm.
    for (const double seconds : {1e300, std::numeric_limits<double>::infinity()})
        (void)describe({MessageDate{seconds}});
}

TEST(MessageValueTest, EventsThatEndEarlyGiveNoValue) {
    MessageValueBuilder builder;
    builder.beginDictionary();
    builder.key("a");
    builder.integer(1);
    EXPECT_EQ(describe(builder.take()), "(NULL element)");
    builder.endDictionary();
    EXPECT_EQ(describe(builder.take()), "{1 a=1, }");
}

class IPCMessageTest : public testing::Test {
  protected:
    platform::FakeSystemLog log_;
    IPCMessage message_;
};

TEST_F(IPCMessageTest, EntriesAreReadAsTheKindThatIsExpected) {
    message_.setValue("number", Value::int64(5));
    message_.setValue("text", "before");
    message_.setValue("text", "t");
    message_.setValue("text", {});
    message_.setValue("text", Value::url("https://x.example"));
    message_.setValue(nullptr, "x");
    EXPECT_EQ(describe(*message_.message()), "{2 number=5, text=\"t\", }");
    EXPECT_EQ(message_.copyValue("number"), Value::int64(5));
    EXPECT_EQ(message_.copyValue("number", Value::Kind::Number), Value::int64(5));
    EXPECT_TRUE(message_.copyValue("number", Value::Kind::String).isAbsent());
    EXPECT_TRUE(message_.copyValue("nothing").isAbsent());
    message_.setValue("text", Value::null());
    EXPECT_TRUE(message_.copyValue("text").isNull());
}

TEST_F(IPCMessageTest, AccountNamesAreInLowerCase) {
    const std::pair<Value, String> cases[] = {{"Jane.Roe@Velto.Example", "jane.roe@velto.example"},
                                              {"jane.roe@velto.example", "jane.roe@velto.example"},
                                              {"Z", "z"},
                                              {"ÄNNE@Straße.example", "änne@straße.example"},
                                              {"Ä@é.example", "ä@é.example"},
                                              {"[@`{", "[@`{"},
                                              {"", ""},
                                              {Value::int64(5), nullptr},
                                              {Value::null(), nullptr}};
    for (const auto& [given, name] : cases) {
        message_.setValue("VeltoID", given);
        EXPECT_EQ(message_.copyAccountName("VeltoID"), name) << name.view();
    }
    EXPECT_EQ(message_.copyAccountName("nothing"), String());
}

TEST_F(IPCMessageTest, MadeOfKeysAndValues) {
    const String keys[] = {"a", "b", "a", "left over"};
    const MessageValue values[] = {{int64_t{1}}, {true}, {int64_t{2}}};
    EXPECT_EQ(describe(*IPCMessage(keys, values).message()), "{2 a=2, b=true, }");
    EXPECT_EQ(describe(*IPCMessage().message()), "{0 }");
}

TEST_F(IPCMessageTest, ErrorsTravelAsDictionaries) {
    Error error{kIdentityErrorDomain, -101, {{"k", "v"}}};
    error.userInfo.set(kErrorUnderlyingErrorKey, Error{kXMLErrorDomain, -20101, {}});
    message_.setError(error);
    EXPECT_EQ(message_.copyError(), error);
    EXPECT_FALSE(message_.isError());

    const Error none{kIdentityErrorDomain, -11, {}};
    EXPECT_EQ(IPCMessage().copyError(), none);
    for (const Value& damaged : {Value("text"), Value(Dictionary{{"Domain", "d"}}), Value::null()}) {
        message_.setValue("error", damaged);
        EXPECT_EQ(message_.copyError(), none);
    }
    const IPCMessage lost(std::make_shared<MessageValue>(MessageValue{MessageError{"interrupted"}}));
    EXPECT_TRUE(lost.isError());
    EXPECT_EQ(lost.copyError(),
              (Error{kIdentityErrorDomain, -11, {{kErrorDescriptionKey, "\"interrupted\""}}}));
    EXPECT_TRUE(lost.copyValue("error").isAbsent());
}

TEST_F(IPCMessageTest, AWrapperOfNothingIsAnEmptyMessage) {
    IPCMessage nothing{MessageObject()};
    const auto lines = log_.lines();
    ASSERT_FALSE(lines.empty());
    EXPECT_NE(lines.back().text.find("IPCMessage() passed a NULL message."), std::string::npos);
    EXPECT_EQ(lines.back().priority, platform::LogPriority::Alert);
    nothing.setValue("a", "b");
    EXPECT_EQ(nothing.message(), nullptr);
    EXPECT_TRUE(nothing.copyValue("a").isAbsent());
    EXPECT_FALSE(nothing.isError());
    EXPECT_EQ(nothing.copyError().code, -11);
    IPCMessage text(std::make_shared<MessageValue>(MessageValue{String("no dictionary")}));
    text.setValue("a", "b");
    EXPECT_TRUE(text.copyValue("a").isAbsent());
}

TEST(TransactionTest, IsOpenUntilItIsClosed) {
    using platform::transactions::openCount;
    EXPECT_EQ(openCount(), 0);
    {
        Transaction named("work");
        const Transaction other;
        EXPECT_EQ(named.name() + other.name(), "work-");
        EXPECT_EQ(openCount(), 2);
        named.close();
        named.close();
        EXPECT_EQ(openCount(), 1);
    }
    EXPECT_EQ(openCount(), 0);
}

}  // namespace
}  // namespace veltoid
