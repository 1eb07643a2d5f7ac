#include "Platform/storage/Preferences.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <thread>

#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/RecordingSink.h"
#include "TestSupport/SQLiteEdit.h"

namespace platform {
namespace {

ValueWriter text(std::string value) {
    return [value = std::move(value)](ValueSink& sink) { sink.string(value); };
}

/// The value as text, "absent" or "failed".
std::string value(const Preferences& preferences, std::string_view key) {
    RecordingSink sink;
    const auto result = preferences.read(key, sink);
    if (result == Preferences::ReadResult::Found) return sink.text();
    EXPECT_EQ(sink.text(), "") << "a value that was not found reached the sink";
    return result == Preferences::ReadResult::Absent ? "absent" : "failed";
}

class PreferencesTest : public testing::Test {
  protected:
    TemporaryStateDirectory directory_;
    FakeSystemLog log_;
    const Preferences domain_{"com.example.one"};
    const Preferences other_{"com.example.two"};
};

TEST_F(PreferencesTest, AnotherProcessReadsWhatWasSet) {
    const auto setAll = [&] {
        const auto record = [](ValueSink& sink) {
            sink.beginDictionary(), sink.key("Dirty"), sink.boolean(true), sink.key("Date"), sink.date(1.5e9);
            sink.key("List"), sink.beginArray(), sink.real(727.8), sink.endArray(), sink.endDictionary();
        };
        return domain_.set({{"b", record}, {"a", text("first")}, {"Schlüssel", text("ß")}}) &&
               other_.set({{"a", text("other")}}) &&
               domain_.set({{"a", text("second")}, {"gone", text("x")}}) && domain_.set({}) &&
               domain_.remove({"gone", "never there"});
    };
    ASSERT_TRUE(ChildProcess(setAll).succeeded());
    EXPECT_EQ(value(domain_, "a"), "\"second\"");
    EXPECT_EQ(value(domain_, "b"),
              "{ k\"Dirty\" true k\"Date\" d41d65a0bc0000000 k\"List\" [ r4086be6666666666 ] }");
    EXPECT_EQ(value(domain_, "Schlüssel"), "\"ß\"");
    EXPECT_EQ(value(domain_, "gone"), "absent");
    EXPECT_EQ(value(domain_, "A"), "absent");
    EXPECT_EQ(value(other_, "a"), "\"other\"");
    EXPECT_EQ(domain_.keys(), (std::vector<std::string>{"Schlüssel", "a", "b"}));
    EXPECT_EQ(Preferences("com.example").keys(), std::vector<std::string>());
    EXPECT_TRUE(log_.lines().empty());
}

TEST_F(PreferencesTest, SetsAllOrNothing) {
    ASSERT_TRUE(domain_.set({{"a", text("before")}}));
    const std::pair<const char*, ValueWriter> cases[] = {
        {"a descriptor", [](ValueSink& sink) { sink.fileDescriptor(0); }},
        {"nothing", [](ValueSink&) {}},
        {"a writer that throws", [](ValueSink&) { throw std::runtime_error("broken"); }},
    };
    for (const auto& [name, writer] : cases) {
        const FakeSystemLog log;
        EXPECT_FALSE(domain_.set({{"a", text("after")}, {"bad", writer}, {"c", text("after")}})) << name;
        EXPECT_EQ(value(domain_, "a"), "\"before\"") << name;
        EXPECT_EQ(value(domain_, "c"), "absent") << name;
        EXPECT_EQ(log.count("com.example.one"), 1) << name;
    }
}

TEST_F(PreferencesTest, ADamagedValueIsToldApartAndHarmsNoOther) {
    ASSERT_TRUE(domain_.set({{"bad", text("confidential")}, {"good", text("fine")}}));
    for (const std::string damaged :
         {"substr(value, 1, length(value) - 1)", "x''", "12", "'text'", "zeroblob(64)"}) {
        editDatabase("preferences.db", "UPDATE preferences SET value = " + damaged + " WHERE key = 'bad'");
        const FakeSystemLog log;
        RecordingSink sink;
        EXPECT_EQ(domain_.read("bad", sink), Preferences::ReadResult::Damaged) << damaged;
        EXPECT_EQ(value(domain_, "good"), "\"fine\"") << damaged;
        EXPECT_TRUE(log.contains("\"bad\" is damaged")) << damaged;
        EXPECT_FALSE(log.contains("confidential")) << damaged;
    }
    EXPECT_TRUE(domain_.setAside("bad"));
    EXPECT_EQ(domain_.keys(), std::vector<std::string>{"good"});
    EXPECT_EQ(Preferences("com.example.one.damaged").keys()->size(), 1U);
    EXPECT_TRUE(domain_.set({{"bad", text("new")}}));
    EXPECT_EQ(value(domain_, "bad"), "\"new\"");
}

TEST_F(PreferencesTest, ASinkThatThrowsDoesNotMakeTheValueAbsent) {
    class Throwing : public RecordingSink {
        void string(std::string_view) override { throw std::runtime_error("full"); }
    } sink;
    ASSERT_TRUE(domain_.set({{"a", text("1")}}));
    EXPECT_EQ(domain_.read("a", sink), Preferences::ReadResult::Failed);
    EXPECT_EQ(value(domain_, "a"), "\"1\"");
}

TEST_F(PreferencesTest, SynchronizedValuesAreInTheFileItself) {
    ASSERT_TRUE(ChildProcess([&] {
                    return domain_.set({{"a", text("1")}}) && domain_.synchronize();
                }).succeeded());
    // Without the log, as if it had never reached the disk.
    std::filesystem::remove(TemporaryStateDirectory::file("preferences.db-wal"));
    EXPECT_EQ(value(domain_, "a"), "\"1\"");
}

TEST_F(PreferencesTest, FailsPolitelyWithoutAPlaceToStore) {
    setenv("XDG_STATE_HOME", "/proc/nowhere", 1);
    for (int i = 0; i < 2; ++i) {
        EXPECT_FALSE(domain_.set({{"a", text("1")}}));
        EXPECT_EQ(value(domain_, "a"), "failed");
        EXPECT_EQ(domain_.keys(), std::nullopt);
        EXPECT_FALSE(domain_.remove({"a"}));
        EXPECT_FALSE(domain_.synchronize());
    }
    EXPECT_EQ(log_.lines().size(), 1U);
    setenv("XDG_STATE_HOME", directory_.base().c_str(), 1);
    EXPECT_TRUE(domain_.set({{"a", text("1")}}));
    EXPECT_TRUE(domain_.synchronize());
}

TEST_F(PreferencesTest, ProcessesAndThreadsWriteTogether) {
    constexpr int kKeys = 50;
    const auto setMany = [&](const std::string& prefix) {
        for (int i = 0; i < kKeys; ++i) {
            if (!domain_.set({{prefix + std::to_string(i), text(prefix)}})) return false;
        }
        return domain_.synchronize();
    };
    ChildProcess child([&] {
        std::thread second([&] { EXPECT_TRUE(setMany("c")); });
        const bool done = setMany("b");
        second.join();
        return done;
    });
    EXPECT_TRUE(setMany("a"));
    EXPECT_TRUE(child.succeeded());
    EXPECT_EQ(domain_.keys()->size(), 3U * kKeys);
    EXPECT_EQ(value(domain_, "c49"), "\"c\"");
}

TEST(StateDirectory, IsWhereTheEnvironmentSays) {
    const TemporaryStateDirectory directory;
    const std::string base = directory.base().string();
    using Text = std::optional<std::string>;
    const std::tuple<const char*, Text, Text, std::string> cases[] = {
        {"state home", base + "/s", base + "/h", base + "/s/harbwell/"},
        {"several missing components", base + "/a/b/c", std::nullopt, base + "/a/b/c/harbwell/"},
        {"home", std::nullopt, base + "/h", base + "/h/.local/state/harbwell/"},
        {"a relative state home", "relative", base + "/h", base + "/h/.local/state/harbwell/"},
        {"an empty state home", "", base + "/h", base + "/h/.local/state/harbwell/"},
        {"nowhere", "/proc/nowhere", base, ""},
    };
    const auto setOrUnset = [](const char* name, const Text& to) {
        to ? setenv(name, to->c_str(), 1) : unsetenv(name);
    };
    for (const auto& [name, state, home, expected] : cases) {
        setOrUnset("XDG_STATE_HOME", state);
        setOrUnset("HOME", home);
        const std::string found = stateDirectory();
        const std::string machine = found.substr(found.rfind('/') + 1);
        EXPECT_EQ(found.substr(0, found.size() - machine.size()), expected) << name;
        if (found.empty()) continue;
        EXPECT_TRUE(machine == "no-machine-id" || machine.size() == 32) << machine;
        EXPECT_EQ(stateDirectory(), found) << "not the same once it exists";
        for (std::filesystem::path made = found; made != base; made = made.parent_path()) {
            EXPECT_EQ(std::filesystem::status(made).permissions(), std::filesystem::perms::owner_all) << made;
        }
    }
}

}  // namespace
}  // namespace platform
