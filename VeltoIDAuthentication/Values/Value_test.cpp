#include "Values/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <map>
#include <random>

#include "Platform/propertylist/PropertyList.h"
#include "Values/DateText.h"
#include "Values/DictionaryAccess.h"
#include "Values/LowerCase.h"
#include "Values/ValueStream.h"

namespace veltoid {
namespace {

TEST(Value, NumbersAreReadExactlyOrNotAtAll) {
    constexpr int64_t kMax = std::numeric_limits<int64_t>::max();
    // As 64 bits, as 32 bits, and as 64 bits without sign.
    using std::optional;
    const std::tuple<Value, optional<int64_t>, optional<int32_t>, optional<uint64_t>> cases[] = {
        {Value::int32(-7), -7, -7, std::nullopt},
        {Value::int64(5'000'000'000), 5'000'000'000, std::nullopt, 5'000'000'000U},
        {Value::uint64(~uint64_t{0}), std::nullopt, std::nullopt, ~uint64_t{0}},
        {Value::real(3.0), 3, 3, 3U},
        {Value::real(3.5), std::nullopt, std::nullopt, std::nullopt},
        {Value::real(9223372036854775808.0), std::nullopt, std::nullopt, std::nullopt},
        {Value::real(std::nan("")), std::nullopt, std::nullopt, std::nullopt},
        {Value::singleReal(-2.0F), -2, -2, std::nullopt},
        {Value::int64(kMax), kMax, std::nullopt, static_cast<uint64_t>(kMax)},
        {Value("5"), std::nullopt, std::nullopt, std::nullopt},
        {Value::boolean(true), std::nullopt, std::nullopt, std::nullopt},
    };
    for (const auto& [number, asInt64, asInt32, asUInt64] : cases) {
        EXPECT_EQ(number.asInt64(), asInt64);
        EXPECT_EQ(number.asInt32(), asInt32);
        EXPECT_EQ(number.asUInt64(), asUInt64);
    }
}

TEST(Value, EqualityGoesByContentAndNumbersByTheirValue) {
    EXPECT_EQ(Value::int32(3), Value::real(3.0));
    EXPECT_EQ(Value::uint64(3), Value::int64(3));
    EXPECT_NE(Value::uint64(~uint64_t{0}), Value::int64(-1));
    EXPECT_NE(Value::int64((int64_t{1} << 53) + 1), Value::real(9007199254740992.0));
    EXPECT_NE(Value::boolean(true), Value::int32(1));
    EXPECT_NE(Value::null(), Value());
    EXPECT_NE(Value("1"), Value::int32(1));
    EXPECT_NE(Value::date(1), Value::real(1));
    const Dictionary a{{"x", Value::int32(1)}, {"y", "z"}};
    const Dictionary b{{"y", "z"}, {"x", Value::int64(1)}};
    EXPECT_EQ(Value(a), Value(b)) << "the order of entries does not matter";
    EXPECT_NE(Value(Array{"a", "b"}), Value(Array{"b", "a"})) << "the order of elements does";
}

TEST(Value, ChangingACopyLeavesTheOriginalAlone) {
    Dictionary record{{"name", "jane"}, {"inner", Dictionary{{"k", Value::int32(1)}}}};
    const Dictionary snapshot = record;
    const Value held = record;
    Dictionary inner = *record.dictionary("inner");
    inner.set("k", Value::int32(2));
    record.set("inner", inner);
    record.remove("name");
    EXPECT_EQ(snapshot.dictionary("inner")->number("k"), 1);
    EXPECT_EQ(held.asDictionary()->string("name"), "jane");
    EXPECT_EQ(record.dictionary("inner")->number("k"), 2);
    Array list{"a"};
    const Array before = list;
    list.append("b");
    EXPECT_EQ(before.size(), 1U);
}

TEST(Value, SelfAssignmentAndMovesKeepTheContent) {
    Value value = Dictionary{{"k", "v"}};
    const Value& alias = value;
    value = alias;
    value = (*value.asDictionary())["k"];
    EXPECT_EQ(value, Value("v"));
    Value moved = std::move(value);
    EXPECT_EQ(moved, Value("v"));
}

TEST(Dictionary, BehavesLikeAMapThatKeepsItsOrder) {
    std::mt19937 random(7);
    Dictionary dictionary;
    std::map<std::string, int> model;
    std::vector<std::string> order;
    for (int step = 0; step < 5'000; ++step) {
        const std::string key = "key" + std::to_string(random() % 200);
        if (random() % 3 == 0) {
            EXPECT_EQ(dictionary.remove(key), model.erase(key) == 1);
            std::erase(order, key);
        } else {
            if (!model.contains(key)) order.push_back(key);
            model[key] = step;
            dictionary.set(String(key), Value::int32(step));
        }
        ASSERT_EQ(dictionary.size(), model.size());
    }
    std::vector<std::string> found;
    for (const auto& [key, value] : dictionary) {
        found.push_back(key.text());
        EXPECT_EQ(value.asInt32(), model[key.text()]);
    }
    EXPECT_EQ(found, order);
}

TEST(Dictionary, ReadsOfTheWrongTypeAreAbsent) {
    const Dictionary d{{"number", Value::real(3.5)}, {"text", "t"}, {"yes", Value::boolean(true)}};
    EXPECT_FALSE(d.string("number"));
    EXPECT_FALSE(d.number("yes"));
    EXPECT_FALSE(d.boolean("text"));
    EXPECT_EQ(d.dictionary("text"), nullptr);
    EXPECT_TRUE(d["missing"].isAbsent());
    EXPECT_EQ(getInt32(&d, "number", 9), 9);
    EXPECT_EQ(getDouble(&d, "number", 9), 3.5);
    EXPECT_EQ(getBool(&d, "text", true), true);
    EXPECT_EQ(getLong(nullptr, "number", -1), -1);
    const Dictionary big{{"n", Value::int64((int64_t{1} << 53) + 1)}};
    EXPECT_EQ(getDouble(&big, "n", -1), -1) << "no double is exactly that number";
}

TEST(DictionaryAccess, MergesAndBuildsWithWhatIsPresent) {
    const Dictionary base{{"a", "1"}, {"b", "2"}};
    const Dictionary more{{"b", "3"}, {"c", "4"}};
    EXPECT_EQ(mergeDictionaries(base, more, true), (Dictionary{{"a", "1"}, {"b", "3"}, {"c", "4"}}));
    EXPECT_EQ(mergeDictionaries(base, more, false), (Dictionary{{"a", "1"}, {"b", "2"}, {"c", "4"}}));
    EXPECT_EQ(mergeDictionaries(std::nullopt, more, true), more);
    EXPECT_EQ(mergeDictionaries(base, std::nullopt, true), base);
    EXPECT_EQ(makeDictionary({{"a", Value()}, {nullptr, "x"}}), std::nullopt);
    EXPECT_EQ(makeDictionary({{"a", Value()}, {"b", "x"}}), (Dictionary{{"b", "x"}}));
    EXPECT_EQ(copyDictionarySettingValue(base, "a", Value()), base);
}

TEST(DictionaryAccess, IterationStopsEarlyAndIsFalseForNothing) {
    const Array three{"a", "b", "c"};
    int visited = 0;
    EXPECT_FALSE(applyToArray(&three, [&](const Value& v) { return ++visited, v != Value("b"); }));
    EXPECT_EQ(visited, 2);
    const Array empty;
    EXPECT_FALSE(applyToArray(&empty, [](const Value&) { return true; }));
    EXPECT_TRUE(applyToSet(empty, [](const Value&) { return false; }));
    EXPECT_FALSE(applyToDictionary(nullptr, [](const String&, const Value&) { return true; }));
}

TEST(ValueStream, EveryStoredKindComesBackFromItsStoredForm) {
    const std::array<uint8_t, 3> bytes{0, 255, 7};
    const Value value = Dictionary{
        {"text", "Zoë"},
        {"int", Value::int64(-5)},
        {"big", Value::uint64(~uint64_t{0})},
        {"real", Value::real(0.1)},
        {"yes", Value::boolean(false)},
        {"date", Value::date(1234.5)},
        {"data", Data(bytes)},
        {"list", Array{"a", Value::null(), Array{}, Dictionary{}}},
    };
    const auto stored =
        platform::writeBinaryPropertyList([&](platform::ValueSink& sink) { writeValue(value, sink); });
    ValueBuilder builder;
    ASSERT_TRUE(platform::readBinaryPropertyList(stored, builder));
    EXPECT_EQ(builder.value(), value);
}

TEST(ValueBuilder, LeavesOutWhatIsNotFinite) {
    constexpr double kEndless = std::numeric_limits<double>::infinity();
    const Value value = Dictionary{{"nan", Value::real(std::nan(""))},
                                   {"date", Value::date(std::nan(""))},
                                   {"single", Value::singleReal(std::numeric_limits<float>::infinity())},
                                   {"list", Array{Value::date(-kEndless), "a", Value::real(kEndless)}}};
    ValueBuilder builder;
    writeValue(value, builder);
    EXPECT_EQ(builder.value(), Value(Dictionary{{"list", Array{"a"}}}));
}

TEST(DateText, FormsOfOneInstantAgreeAndOthersAreRefused) {
    const double instant = 1'394'039'040;  // 2014-03-05 17:04:00 UTC
    const std::pair<const char*, double> cases[] = {
        {"2014-03-05T17:04:00Z", instant},      {"2014-03-05T18:04:00+0100", instant},
        {"2014-03-05 09:04:00 -0800", instant}, {"2014-03-05T22:49:00+0545", instant},
        {"1969-12-31T23:59:59Z", -1.0},         {"2000-02-29T00:00:00Z", 951'782'400.0},
    };
    for (const auto& [text, expected] : cases) EXPECT_EQ(dateFromValue(String(text)), expected) << text;
    for (const char* text :
         {"2014-03-05T17:04:00", "2014-03-05", "", "2014-13-05T17:04:00Z", "2015-02-29T00:00:00Z",
          "99999999999999999999-01-01T00:00:00Z", "2014-03-05T17:04:00+99999"})
        EXPECT_EQ(dateFromValue(String(text)), std::nullopt) << text;
    EXPECT_EQ(dateFromValue(Value::date(5)), 5);
    EXPECT_EQ(dateFromValue(Value::int32(5)), std::nullopt);
    EXPECT_EQ(dateFromValue(std::string(129, '1')), std::nullopt);
}

TEST(LowerCase, GoesByUnicodeWhateverTheLocaleAndKeepsBytesThatAreNoText) {
    EXPECT_EQ(lowerCased("ÄNNE.İÉÑ@ПРИМЕР.ΟΔΟΣ"), "änne.iéñ@пример.οδοσ");
    EXPECT_EQ(lowerCased("Straße@ǄÅ"), "straße@ǆå");
    EXPECT_EQ(lowerCased("Jane.ROE@Example.COM"), "jane.roe@example.com");
    EXPECT_EQ(lowerCased("A\xff\x00Z"), "a\xff");
    EXPECT_FALSE(lowerCased(nullptr));
}

}  // namespace
}  // namespace veltoid
