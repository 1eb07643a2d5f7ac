// One SQLite file of the state directory, as the stores of Platform use it. Internal to Platform.
//
// A transaction finds the file opened, checked and, when it is new, laid out. What happens to a bad
// file is decided here, once for all stores: a damaged one is moved aside with its companions (never deleted)
// and a fresh one begun; one that a newer version wrote is refused and left alone; anything that may pass
// (permission, full disk, an I/O error, another process holding it) fails the operation, keeps the file, and
// is tried again by the next call.
#pragma once

#include <array>
#include <concepts>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

#include "Platform/runtime/SecureMemory.h"

struct sqlite3;
struct sqlite3_stmt;

namespace platform {

class SQLiteFile;

/// One use of a statement: its parameters are bound, then it is stepped. After an error it gives no more
/// rows, and the transaction fails as a whole, so that nothing has to be checked in between. Bound memory
/// must outlive the use.
class SQLiteStatement {
  public:
    SQLiteStatement(SQLiteFile& file, sqlite3_stmt* statement) : file_(file), statement_(statement) {}
    ~SQLiteStatement();
    SQLiteStatement(const SQLiteStatement&) = delete;
    SQLiteStatement& operator=(const SQLiteStatement&) = delete;

    /// Binds the next parameters, in order: integers, texts (an absent one is NULL) and bytes.
    template <typename... Values>
    SQLiteStatement& bind(const Values&... values) {
        (bindNext(values), ...);
        return *this;
    }

    /// True: there is a row.
    bool step();
    void run() {
        while (step()) {
        }
    }

    /// Columns of the row, counted from 0; views live until the next step.
    int64_t integer(int column);
    std::string_view text(int column);
    std::optional<std::string> optionalText(int column);
    Bytes blob(int column);

  private:
    void bindNext(int64_t value);
    void bindNext(std::string_view value);
    void bindNext(Bytes value);
    /// A template, so that no other text becomes an optional one.
    void bindNext(const std::same_as<std::optional<std::string>> auto& value) {
        value ? bindNext(std::string_view(*value)) : bindNull();
    }
    void bindNull();
    template <typename Bind, typename... Value>
    void bindWith(const Bind& bind, Value... value);
    void check(int code);

    SQLiteFile& file_;
    sqlite3_stmt* statement_;
    int bound_ = 0;
};

/// What a transaction's work may do. The SQL is a literal: statements are kept prepared under its address.
class SQLiteTransaction {
  public:
    explicit SQLiteTransaction(SQLiteFile& file) : file_(file) {}
    SQLiteStatement prepare(const char* sql);
    /// True when a statement has failed: what was read so far is not to be trusted.
    bool failed() const;
    /// Where the file is.
    const std::string& directory() const;

  private:
    SQLiteFile& file_;
};

/// All operations may be called from any thread; one mutex guards all state, and holds while work runs. None
/// throws.
class SQLiteFile {
  public:
    struct Format {
        const char* name;
        int32_t applicationID;
        int32_t version;
        /// The statements that lay out an empty file.
        const char* schema;
        /// Those that add what earlier files of the version lack; without effect where it is there already.
        const char* additions = "";
    };

    enum class Outcome {
        Done,
        Declined,   ///< The work returned false: rolled back.
        Duplicate,  ///< A unique index refused: rolled back.
        Failed,     ///< Rolled back; logged when the reason is another one than last time.
    };

    /// May run more than once (when the file turned out to be replaced or damaged): it begins by resetting
    /// its results.
    using Work = std::function<bool(SQLiteTransaction&)>;

    explicit SQLiteFile(const Format& format) : format_(format) {}
    ~SQLiteFile();

    Outcome read(const Work& work);

    /// What was done survives the end of the process at once, and a power cut after checkpoint().
    Outcome write(const Work& work);

    /// Makes everything done so far durable on disk.
    bool checkpoint();

    /// The next transaction opens the file anew: one that was written over in place would not be noticed.
    void reopen();

  private:
    friend class SQLiteStatement;
    friend class SQLiteTransaction;

    enum class State { Ready, Damaged, Failed };
    /// In this order: who can write can read, and who can synchronise can do both.
    enum Activity : size_t { Reading, Writing, Synchronising, kActivities };

    template <typename Operation>
    Outcome guarded(Activity activity, Operation operation);
    Outcome run(const char* begin, const Work& work);
    Outcome transact(const char* begin, const Work& work);

    int syncLog();

    State prepareFile();
    State open();
    bool createWhenMissing();
    void configure();
    State checkFormat();
    bool endsWithinPage();
    State layOut();
    bool schemaIsOurs();
    bool hasMoved();
    bool moveAside();
    void close();

    bool execute(const char* sql);
    int64_t queryInteger(const char* sql);
    sqlite3_stmt* statementFor(const char* sql);

    /// Keeps the first error of a transaction.
    void fail(int code, const std::string& what = {});
    void reportTrouble(Activity activity);
    void reportSuccess(Activity activity);
    std::string path() const { return directory_ + '/' + format_.name; }

    std::mutex mutex_;
    const Format format_;
    std::string directory_;
    sqlite3* database_ = nullptr;
    std::unordered_map<const char*, sqlite3_stmt*> statements_;
    int error_ = 0;
    std::string errorText_;
    /// The trouble that each activity is known to have; empty when it works.
    std::array<std::string, kActivities> trouble_;
};

}  // namespace platform
