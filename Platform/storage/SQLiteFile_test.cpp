#include "Platform/storage/SQLiteFile.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <functional>
#include <random>

#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SQLiteEdit.h"
#include "TestSupport/TestLifetime.h"

namespace platform {
namespace {

namespace fs = std::filesystem;
using Outcome = SQLiteFile::Outcome;

constexpr SQLiteFile::Format kFormat = {"test.db", 0x54455354, 1,
                                        "CREATE TABLE rows (name TEXT PRIMARY KEY, value BLOB NOT NULL)"};

Outcome put(SQLiteFile& file, const std::string& name, const std::string& value) {
    return file.write([&](SQLiteTransaction& transaction) {
        transaction.prepare("REPLACE INTO rows (name, value) VALUES (?, ?)").bind(name, bytesOf(value)).run();
        return true;
    });
}

/// The value; none when there is no such row, "failed" when it cannot be read.
std::optional<std::string> get(SQLiteFile& file, const std::string& name) {
    std::string value;
    const Outcome outcome = file.read([&](SQLiteTransaction& transaction) {
        auto statement = transaction.prepare("SELECT value FROM rows WHERE name = ?");
        if (!statement.bind(name).step()) return false;
        value = textOf(statement.blob(0));
        return true;
    });
    if (outcome == Outcome::Declined) return std::nullopt;
    return outcome == Outcome::Done ? value : "failed";
}

class SQLiteFileTest : public testing::Test {
  protected:
    static void edit(const std::string& sql) { editDatabase(kFormat.name, sql); }
    static fs::path path() { return TemporaryStateDirectory::file(kFormat.name); }
    static std::string content() { return TemporaryStateDirectory::readFile(path()); }
    static void setContent(const std::string& bytes) { TemporaryStateDirectory::writeFile(path(), bytes); }

    /// Nothing is left but a file of this content.
    static void beginWith(const std::string& bytes) {
        for (const auto& old : fs::directory_iterator(stateDirectory())) fs::remove(old.path());
        setContent(bytes);
    }

    /// Files that were moved aside, without companions.
    static std::vector<fs::path> movedAside() {
        std::vector<fs::path> found;
        for (const auto& entry : fs::directory_iterator(stateDirectory())) {
            const std::string name = entry.path().filename();
            if (name.starts_with("test.db.corrupt-") && !name.ends_with("-wal") && !name.ends_with("-shm")) {
                found.push_back(entry.path());
            }
        }
        std::ranges::sort(found);
        return found;
    }

    /// A sound file with some pages and an empty log.
    static void fill() {
        SQLiteFile file(kFormat);
        for (int i = 0; i < 40; ++i)
            ASSERT_EQ(put(file, "row " + std::to_string(i), std::string(500, 'v')), Outcome::Done);
        ASSERT_TRUE(file.checkpoint());
    }

    TemporaryStateDirectory directory_;
    FakeSystemLog log_;
};

TEST_F(SQLiteFileTest, IsPrivateWhateverTheUmask) {
    umask(0);
    SQLiteFile file(kFormat);
    ASSERT_EQ(put(file, "a", "1"), Outcome::Done);
    int files = 0;
    for (const auto& entry : fs::directory_iterator(stateDirectory())) {
        EXPECT_EQ(entry.status().permissions(), fs::perms::owner_read | fs::perms::owner_write)
            << entry.path();
        ++files;
    }
    EXPECT_EQ(files, 3) << "the database, its log and its index";
    for (const fs::path& owned : {fs::path(stateDirectory()), fs::path(stateDirectory()).parent_path()}) {
        EXPECT_EQ(fs::status(owned).permissions(), fs::perms::owner_all) << owned;
    }

    fs::permissions(path(), fs::perms::all);
    fs::permissions(stateDirectory(), fs::perms::all);
    SQLiteFile again(kFormat);
    EXPECT_EQ(get(again, "a"), "1");
    EXPECT_EQ(fs::status(path()).permissions(), fs::perms::owner_read | fs::perms::owner_write);
    EXPECT_EQ(fs::status(stateDirectory()).permissions(), fs::perms::owner_all);
}

TEST_F(SQLiteFileTest, KeepsOnlyWhatATransactionCompleted) {
    SQLiteFile file(kFormat);
    ASSERT_EQ(put(file, "a", ""), Outcome::Done);
    const auto insertTwo = [&](const char* second, bool accept) {
        return file.write([&](SQLiteTransaction& transaction) {
            for (const std::string_view name : {std::string_view("b"), std::string_view(second)}) {
                transaction.prepare("INSERT INTO rows VALUES (?, ?)").bind(name, Bytes()).run();
            }
            return accept;
        });
    };
    EXPECT_EQ(insertTwo("c", false), Outcome::Declined);
    EXPECT_EQ(insertTwo("a", true), Outcome::Duplicate);
    const Outcome wrongSQL = file.write([&](SQLiteTransaction& transaction) {
        transaction.prepare("INSERT INTO rows VALUES ('b', x'')").run();
        transaction.prepare("INSERT INTO nowhere VALUES (1)").run();
        EXPECT_TRUE(transaction.failed());
        return true;
    });
    EXPECT_EQ(wrongSQL, Outcome::Failed);
    const Outcome thrown = file.write([](SQLiteTransaction& transaction) -> bool {
        transaction.prepare("INSERT INTO rows VALUES ('b', x'')").run();
        throw std::bad_alloc();
    });
    EXPECT_EQ(thrown, Outcome::Failed);

    SQLiteFile second(kFormat);
    EXPECT_EQ(get(second, "a"), "");
    EXPECT_EQ(get(second, "b"), std::nullopt);
    EXPECT_TRUE(movedAside().empty()) << "a mistake in a statement is no damage";
}

TEST_F(SQLiteFileTest, MovesADamagedFileAsideAndStartsAFreshOne) {
    fill();
    const std::string sound = content();
    ASSERT_GT(sound.size(), 5 * 4096U);
    const std::string other = "PRAGMA application_id = 7; PRAGMA user_version = 1";
    const std::pair<const char*, std::function<void()>> cases[] = {
        {"text", [] { setContent("this is no database, only some text in a file\n"); }},
        {"a cut header", [&] { setContent(sound.substr(0, 50)); }},
        {"one page", [&] { setContent(sound.substr(0, 4096)); }},
        {"a page less", [&] { setContent(sound.substr(0, sound.size() - 4096)); }},
        {"half a page less", [&] { setContent(sound.substr(0, sound.size() - 2000)); }},
        {"pages of zeros",
         [&] { setContent(sound.substr(0, 4096) + std::string(sound.size() - 4096, '\0')); }},
        {"another program's file", [&] { edit(other); }},
        {"another program's tables", [] { fs::remove(path()), edit("CREATE TABLE theirs (a)"); }},
        {"tables that were changed", [] { edit("ALTER TABLE rows RENAME TO columns"); }},
    };
    for (const auto& [name, damage] : cases) {
        SCOPED_TRACE(name);
        beginWith(sound);
        damage();
        const std::string damaged = content();
        const FakeSystemLog log;
        SQLiteFile file(kFormat);
        EXPECT_EQ(get(file, "row 39"), std::nullopt);
        EXPECT_EQ(put(file, "new", "value"), Outcome::Done);
        SQLiteFile again(kFormat);
        EXPECT_EQ(get(again, "new"), "value");

        const auto aside = movedAside();
        ASSERT_EQ(aside.size(), 1U);
        EXPECT_EQ(TemporaryStateDirectory::readFile(aside.front()), damaged);
        ASSERT_EQ(log.lines().size(), 1U);
        EXPECT_EQ(log.lines().front().priority, LogPriority::Error);
        EXPECT_TRUE(log.contains(path().string() + ":") && log.contains(aside.front().string()));
    }
}

TEST_F(SQLiteFileTest, SurvivesFlippedBytes) {
    fill();
    const std::string sound = content();
    std::minstd_rand random(4);
    for (int round = 0; round < 150; ++round) {
        std::string flipped = sound;
        // The first hundred bytes hold version numbers: there a flip may make the file one that is to be left
        // alone.
        const size_t at = 100 + random() % (sound.size() - 100);
        flipped[at] = static_cast<char>(flipped[at] ^ (1 << random() % 8));
        beginWith(flipped);
        SQLiteFile file(kFormat);
        for (int i = 0; i < 40; ++i)
            EXPECT_NE(get(file, "row " + std::to_string(i)), "failed") << "flipped at " << at;
        EXPECT_EQ(put(file, "row 7", "after"), Outcome::Done) << "flipped at " << at;
        EXPECT_EQ(get(file, "row 7"), "after") << "flipped at " << at;
    }
}

TEST_F(SQLiteFileTest, RefusesANewerFileAndLeavesItAlone) {
    fill();
    edit("PRAGMA user_version = 2");
    const std::string before = content();
    SQLiteFile file(kFormat);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(get(file, "row 1"), "failed");
        EXPECT_EQ(put(file, "row 1", "x"), Outcome::Failed);
        EXPECT_FALSE(file.checkpoint());
    }
    EXPECT_EQ(content(), before);
    EXPECT_TRUE(movedAside().empty());
    ASSERT_EQ(log_.lines().size(), 1U) << "once, not at each call";
    EXPECT_EQ(log_.lines().front().priority, LogPriority::Error);
    EXPECT_TRUE(log_.contains("newer version"));

    edit("PRAGMA user_version = 1");
    EXPECT_EQ(put(file, "row 1", "x"), Outcome::Done);
    EXPECT_EQ(log_.count("works again"), 1);
}

TEST_F(SQLiteFileTest, WaitsOutTroubleOfTheSurroundings) {
    const fs::path base = directory_.base();
    const fs::path database = path();
    const fs::path kept = base / "kept";
    const auto setHome = [](const fs::path& path) { setenv("XDG_STATE_HOME", path.c_str(), 1); };
    const auto goHome = [&] { setHome(base); };
    const auto putBack = [&] { fs::remove(database), fs::rename(kept, database); };
    rlimit before{};
    getrlimit(RLIMIT_NOFILE, &before);
    const auto allowFiles = [&](rlim_t count) {
        const rlimit limit{count, before.rlim_max};
        setrlimit(RLIMIT_NOFILE, &limit);
    };
    const std::tuple<const char*, std::function<void()>, std::function<void()>> cases[] = {
        {"a file in the place of the directory", [&] { setHome(kept); }, goHome},
        {"a directory that cannot be created", [&] { setHome("/proc/nowhere"); }, goHome},
        {"a directory in the place of the file",
         [&] { fs::rename(database, kept), fs::create_directory(database); }, putBack},
        {"a link to nothing", [&] { fs::rename(database, kept), fs::create_symlink("nowhere", database); },
         putBack},
        {"no descriptors at the start", [&] { TestLifetime::restart(), allowFiles(0); },
         [&] { allowFiles(before.rlim_cur); }},
    };
    fill();
    for (const auto& [name, spoil, restore] : cases) {
        SCOPED_TRACE(name);
        if (!fs::exists(kept)) TemporaryStateDirectory::writeFile(kept, "a file");
        const FakeSystemLog log;
        SQLiteFile file(kFormat);
        spoil();
        for (int i = 0; i < 3; ++i) {
            EXPECT_EQ(get(file, "row 1"), "failed");
            EXPECT_EQ(put(file, "row 1", "x"), Outcome::Failed);
        }
        EXPECT_EQ(log.lines().size(), 1U);
        restore();
        EXPECT_NE(get(file, "row 1"), "failed");
        EXPECT_EQ(put(file, "row 1", name), Outcome::Done);
        EXPECT_EQ(get(file, "row 2"), std::string(500, 'v'));
        EXPECT_TRUE(movedAside().empty());
        EXPECT_EQ(std::distance(fs::directory_iterator(base / "harbwell"), {}), 1)
            << "another device's folder";
    }
}

TEST_F(SQLiteFileTest, AFullDiskFailsWritesOnlyAndKeepsTheFile) {
    SQLiteFile file(kFormat);
    ASSERT_EQ(put(file, "a", "1"), Outcome::Done);
    signal(SIGXFSZ, SIG_IGN);
    rlimit before{};
    getrlimit(RLIMIT_FSIZE, &before);
    const rlimit full{65536, before.rlim_max};
    setrlimit(RLIMIT_FSIZE, &full);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(put(file, "b", std::string(1U << 20U, 'x')), Outcome::Failed);
        EXPECT_EQ(get(file, "a"), "1");
        EXPECT_EQ(get(file, "b"), std::nullopt);
    }
    setrlimit(RLIMIT_FSIZE, &before);
    EXPECT_EQ(log_.lines().size(), 1U) << "reading in between does not make it news again";
    EXPECT_EQ(put(file, "b", "2"), Outcome::Done);
    EXPECT_EQ(log_.count("writing works again"), 1);
    EXPECT_TRUE(movedAside().empty());
}

TEST_F(SQLiteFileTest, TwoProcessesMoveADamagedFileAsideOnce) {
    for (int round = 0; round < 30; ++round) {
        beginWith("not a database, and long enough to be looked at");
        // Both wait for the other end to close, so that they begin at the same moment.
        int start[2];
        ASSERT_EQ(pipe(start), 0);
        const auto putOne = [&](const char* name, const char* value) {
            char byte = 0;
            close(start[1]);
            return read(start[0], &byte, 1) == 0 &&
                   put(*new SQLiteFile(kFormat), name, value) == Outcome::Done;
        };
        {
            ChildProcess one([&] { return putOne("one", "1"); });
            ChildProcess two([&] { return putOne("two", "2"); });
            close(start[1]);
            close(start[0]);
            EXPECT_TRUE(one.succeeded() && two.succeeded());
        }
        SQLiteFile file(kFormat);
        EXPECT_EQ(get(file, "one"), "1");
        EXPECT_EQ(get(file, "two"), "2");
        EXPECT_EQ(movedAside().size(), 1U);
    }
}

}  // namespace
}  // namespace platform
