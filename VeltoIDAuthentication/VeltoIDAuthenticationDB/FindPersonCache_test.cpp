#include "VeltoIDAuthenticationDB/FindPersonCache.h"

#include <limits>

#include "TestSupport/DatabaseFixture.h"
#include "TestSupport/SideBySide.h"

namespace veltoid {
namespace {

constexpr std::string_view kKey = "findPersonCache";

class FindPersonCacheTest : public DatabaseTest {
  protected:
    void SetUp() override {
        DatabaseTest::SetUp();
        __VeltoIDDBSetFindPersonCacheUsePreferences(true);
    }

    static platform::Preferences cacheDomain() { return domain(kVeltoIDFindPersonCacheDomain); }

    static Dictionary stored() {
        const Dictionary contents = storedDomain(kVeltoIDFindPersonCacheDomain);
        const Dictionary* entries = contents.dictionary(kKey);
        return entries != nullptr ? *entries : Dictionary();
    }

    static void store(const Value& contents) {
        ASSERT_TRUE(cacheDomain().set(
            {{std::string(kKey), [&](platform::ValueSink& sink) { writeValue(contents, sink); }}}));
    }

    static Dictionary person(const String& value, const Value& interval = {}) {
        Dictionary person = {{"matched", "email"}, {"value", value}};
        person.set("ValidInterval", interval);
        return person;
    }

    static Dictionary dated(Dictionary person, const Value& validDate) {
        person.set("ValidDate", validDate);
        return person;
    }

    static void add(const Array& results) { EXPECT_TRUE(__VeltoIDDBAddFindPersonResultsToCache(results)); }

    static std::optional<Array> find(const Value& values) {
        return __VeltoIDDBCopyCachedFindPersonResults({{"email", values}});
    }
    static bool isFound(const String& value) { return find(Array{value}).has_value(); }
};

TEST_F(FindPersonCacheTest, AnEntryIsGoodForItsInterval) {
    using Limits = std::numeric_limits<double>;
    // How long it is found; negative: never.
    const std::tuple<const char*, Value, double> cases[] = {
        {"none", {}, 14 * kDay},
        {"a minute", number(60), 60},
        {"no time", number(0), 0},
        {"no number", "60", 14 * kDay},
        {"negative", number(-1), -1},
        {"not a number", Value::real(Limits::quiet_NaN()), -1},
        {"endless", Value::real(Limits::infinity()), 365 * kDay},
        {"nearly endless", Value::uint64(std::numeric_limits<uint64_t>::max()), 365 * kDay},
        {"endless backwards", Value::real(-Limits::infinity()), -1},
    };
    const double start = now();
    for (const auto& [what, interval, seconds] : cases) {
        SCOPED_TRACE(what);
        clock_.jumpTo(start);
        add({person("a", interval)});
        EXPECT_EQ(isFound("a"), seconds >= 0);
        clock_.jumpTo(start - 1);
        EXPECT_FALSE(isFound("a")) << "before it was stored";
        const double end = start + std::max(seconds, 0.0);
        clock_.jumpTo(end);
        EXPECT_EQ(isFound("a"), seconds >= 0);
        clock_.jumpTo(end + 1);
        EXPECT_FALSE(isFound("a"));
    }
}

TEST_F(FindPersonCacheTest, FindsWhatMatchedInTheOrderOfTheCriteria) {
    Dictionary deepPerson = person("deep");
    deepPerson.set("x", nestedArrays(70));
    const Dictionary phone = {{"matched", "phone"}, {"value", "1"}, {"FirstName", "P"}};
    add({person("a"), "text", Dictionary{{"matched", "email"}}, Dictionary{{"value", "v"}},
         Dictionary{{"matched", "email"}, {"value", number(1)}}, deepPerson, phone, person("b")});
    const auto entry = [&](const Dictionary& person) { return dated(person, date()); };

    EXPECT_EQ(__VeltoIDDBCopyCachedFindPersonResults(
                  {{"phone", Array{"1", "2"}}, {"email", Array{"b", number(1), "a", "b"}}}),
              (Array{entry(phone), entry(person("b")), entry(person("a")), entry(person("b"))}));
    EXPECT_EQ(find("a"), std::nullopt) << "not an Array";
    EXPECT_EQ(find(Array{"v", "1", "", "deep"}), std::nullopt);
    EXPECT_EQ(__VeltoIDDBCopyCachedFindPersonResults({}), std::nullopt);
    add({person("a", number(60))});
    EXPECT_EQ(find(Array{"a"}), Array{entry(person("a", number(60)))}) << "the newer one";
    flush();
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-a", "email-b", "phone-1"}));
}

TEST_F(FindPersonCacheTest, AdditionsAreWrittenTogetherWithoutWhatHasEnded) {
    add({person("short", number(60)), person("long"), person("never", number(-1))});
    EXPECT_EQ(stored(), Dictionary()) << "not yet";
    EXPECT_EQ(platform::transactions::openCount(), 1);
    clock_.advanceBy(1);
    add({person("later")});
    clock_.advanceBy(kVeltoIDDBFlushDelay - 1);
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-later", "email-long", "email-short"}));
    EXPECT_EQ(platform::transactions::openCount(), 0);
    EXPECT_EQ(stored()["email-later"], Value(dated(person("later"), date(1 - kVeltoIDDBFlushDelay))));

    clock_.advanceBy(61);
    EXPECT_FALSE(takeWritten()) << "lookups and time alone write nothing";
    add({person("now")});
    EXPECT_TRUE(__VeltoIDDBWriteFindPersonCache());
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-later", "email-long", "email-now"}));
    EXPECT_EQ(platform::transactions::openCount(), 0);
}

TEST_F(FindPersonCacheTest, FirstUseTakesWhatIsStored) {
    const Dictionary contents = {
        {"email-kept", dated(person("kept"), date(-60))},
        {"email-replaced", dated(person("replaced"), date(-60))},
        {"email-ended", dated(person("ended", number(30)), date(-60))},
        {"email-undated", person("undated")},
        {"email-misdated", dated(person("misdated"), number(0))},
        {"email-timeless", dated(person("timeless"), Value::date(std::numeric_limits<double>::quiet_NaN()))},
        {"email-text", "text"}};
    store(contents);
    Dictionary fresh = person("replaced");
    fresh.set("FirstName", "New");
    add({fresh});
    EXPECT_EQ(find(Array{"kept", "ended", "undated", "misdated", "timeless", "text"}),
              Array{contents["email-kept"]});
    EXPECT_EQ(find(Array{"replaced"}), Array{dated(fresh, date())});
    flush();
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-kept", "email-replaced"}));
    store(Dictionary());
    EXPECT_TRUE(isFound("kept")) << "read once only";
}

TEST_F(FindPersonCacheTest, WhatCannotBeReadNowIsReadLaterAndNeverOverwritten) {
    ASSERT_TRUE(platform::ChildProcess([this] {
                    store(Dictionary{{"email-stored", dated(person("stored"), date(-60))},
                                     {"email-both", dated(person("both", number(1)), date())}});
                    return true;
                }).succeeded());
    std::optional<platform::Obstacle> obstacle("preferences.db");
    add({person("both")});
    EXPECT_TRUE(isFound("both"));
    EXPECT_FALSE(isFound("stored"));
    flush();
    obstacle.reset();
    EXPECT_TRUE(isFound("stored"));
    EXPECT_EQ(find(Array{"both"}), Array{dated(person("both"), date(-kVeltoIDDBFlushDelay))})
        << "the newer one";
    add({person("added")});
    flush();
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-added", "email-both", "email-stored"}));
}

TEST_F(FindPersonCacheTest, WhatIsNoCacheIsReplaced) {
    store(Array{"x"});
    EXPECT_FALSE(isFound("x"));
    add({person("a")});
    flush();
    EXPECT_EQ(keysOf(stored()), std::set<std::string>{"email-a"});
}

TEST_F(FindPersonCacheTest, WithoutPreferencesItStaysInMemory) {
    store(Dictionary{{"email-stored", dated(person("stored"), date(-60))}});
    __VeltoIDDBSetFindPersonCacheUsePreferences(false);
    add({person("added")});
    flush();
    EXPECT_TRUE(isFound("added"));
    EXPECT_FALSE(isFound("stored"));
    EXPECT_EQ(keysOf(stored()), std::set<std::string>{"email-stored"});
}

TEST_F(FindPersonCacheTest, TheOldestGoWhenThereAreTooMany) {
    const auto named = [](size_t i) { return String(std::to_string(i)); };
    Dictionary contents;
    // The newest first, so that their order in the store does not matter.
    for (size_t i = kVeltoIDMaxFindPersonEntries; i-- > 0;) {
        const Dictionary entry = dated(person(named(i)), date(static_cast<double>(i) / 1000 - 1000));
        contents.set(String("email-" + std::to_string(i)), entry);
    }
    store(contents);
    EXPECT_TRUE(isFound(named(0)));
    add({person("1"), person("one more"), person("two more")});
    EXPECT_FALSE(isFound(named(0)));
    EXPECT_FALSE(isFound(named(2)));
    for (const String& kept : {String("1"), named(3), named(kVeltoIDMaxFindPersonEntries - 1)})
        EXPECT_TRUE(isFound(kept)) << kept.view();
    flush();
    EXPECT_EQ(stored().size(), kVeltoIDMaxFindPersonEntries);

    Dictionary large = person("large");
    large.set("x", String(std::string(kVeltoIDMaxFindPersonCacheBytes / 3, 'x')));
    for (const char* name : {"x", "y", "z"}) {
        large.set("value", name);
        add({large});
    }
    EXPECT_FALSE(isFound("x"));
    EXPECT_TRUE(isFound("y"));
    flush();
    EXPECT_EQ(keysOf(stored()), (std::set<std::string>{"email-y", "email-z"})) << "which can be stored";
}

TEST_F(FindPersonCacheTest, ManyMayUseItAtOnce) {
    platform::sideBySide(4, [](int i) {
        for (int round = 0; round < 50; ++round) {
            const String name = std::to_string(i) + "," + std::to_string(round);
            add({person(name), person("all")});
            EXPECT_TRUE(isFound(name) && isFound("all"));
            EXPECT_TRUE(round % 10 != 0 || __VeltoIDDBWriteFindPersonCache());
        }
    });
    flush();
    EXPECT_EQ(stored().size(), 4U * 50U + 1U);
}

}  // namespace
}  // namespace veltoid
