#include "Platform/storage/SQLiteFile.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <exception>

#include "Platform/encoding/CalendarText.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/LazyLibrary.h"
#include "Platform/runtime/StateDirectory.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {

namespace {

constinit const LazyLibrary library("libsqlite3.so.0");
VELTOID_LAZY_FUNCTIONS(library, sqlite3_bind_blob64, sqlite3_bind_int64, sqlite3_bind_null,
                       sqlite3_bind_text64, sqlite3_busy_timeout, sqlite3_clear_bindings, sqlite3_close,
                       sqlite3_column_blob, sqlite3_column_bytes, sqlite3_column_int64, sqlite3_column_text,
                       sqlite3_column_type, sqlite3_db_config, sqlite3_errstr, sqlite3_exec,
                       sqlite3_file_control, sqlite3_finalize, sqlite3_get_autocommit, sqlite3_open,
                       sqlite3_open_v2, sqlite3_prepare_v2, sqlite3_prepare_v3, sqlite3_reset, sqlite3_step,
                       sqlite3_system_errno, sqlite3_wal_checkpoint_v2);

constexpr int kBusyTimeoutMilliseconds = 5000;
/// Two attempts to be sure of damage, one with the fresh file, and one if another process has replaced the
/// file meanwhile.
constexpr int kMaxAttempts = 4;
/// Pages in the write-ahead log before it is worked off (400 KiB): reading a long one would slow the next
/// start.
constexpr const char* kConfiguration =
    "PRAGMA cell_size_check = ON;"
    "PRAGMA secure_delete = ON;"
    "PRAGMA temp_store = MEMORY;"
    "PRAGMA synchronous = NORMAL;"
    "PRAGMA wal_autocheckpoint = 100;";
constexpr std::array<const char*, 3> kFileSuffixes = {"", "-wal", "-shm"};

enum class Kind { Fine, Duplicate, Damaged, Unusable };

/// The one place where the library's codes get a meaning.
Kind kindOf(int code) {
    switch (code & 0xFF) {
        case SQLITE_OK:
        case SQLITE_ROW:
        case SQLITE_DONE:
            return Kind::Fine;
        case SQLITE_CONSTRAINT:
            return code == SQLITE_CONSTRAINT_UNIQUE || code == SQLITE_CONSTRAINT_PRIMARYKEY ? Kind::Duplicate
                                                                                            : Kind::Unusable;
        case SQLITE_NOTADB:
        case SQLITE_CORRUPT:
            return Kind::Damaged;
        // Permission, full disk, I/O errors, locks, memory: none of them says anything about the content.
        default:
            return Kind::Unusable;
    }
}

bool exists(const std::string& path) {
    struct stat information {};
    return lstat(path.c_str(), &information) == 0;
}

/// `path`.corrupt-YYYYMMDD-HHMMSS, with a counter when that is taken.
std::string nameAside(const std::string& path) {
    const std::string base =
        path + ".corrupt-" + calendarText(Clock::shared().now(), "%Y%m%d-%H%M%S").value_or("-");
    std::string name = base;
    const auto taken = [&] {
        return std::ranges::any_of(kFileSuffixes, [&](const char* suffix) { return exists(name + suffix); });
    };
    for (int counter = 2; taken(); ++counter) name = base + '-' + std::to_string(counter);
    return name;
}

/// All `sql` texts of a schema in a fixed order; none when they cannot be read.
std::optional<std::string> schemaText(sqlite3* database) {
    constexpr const char* kQuery = "SELECT sql FROM sqlite_schema WHERE sql IS NOT NULL ORDER BY name";
    std::string text;
    sqlite3_stmt* statement = nullptr;
    int code = sqlite3_prepare_v2(database, kQuery, -1, &statement, nullptr);
    if (code == SQLITE_OK) code = sqlite3_step(statement);
    for (; code == SQLITE_ROW; code = sqlite3_step(statement)) {
        text.append(reinterpret_cast<const char*>(sqlite3_column_text(statement, 0))).append(";");
    }
    sqlite3_finalize(statement);
    return code == SQLITE_DONE ? std::optional(text) : std::nullopt;
}

}  // namespace

// Statement

SQLiteStatement::~SQLiteStatement() {
    if (statement_ == nullptr) return;
    // A failed step is already recorded; reset only repeats its code.
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
}

void SQLiteStatement::check(int code) {
    if (kindOf(code) != Kind::Fine) file_.fail(code);
}

template <typename Bind, typename... Value>
void SQLiteStatement::bindWith(const Bind& bind, Value... value) {
    if (statement_ != nullptr) check(bind(statement_, ++bound_, value...));
}

void SQLiteStatement::bindNext(int64_t value) { bindWith(sqlite3_bind_int64, value); }
void SQLiteStatement::bindNull() { bindWith(sqlite3_bind_null); }

// A null pointer would bind NULL instead of an empty value.

void SQLiteStatement::bindNext(std::string_view value) {
    const char* const text = value.data() == nullptr ? "" : value.data();
    bindWith(sqlite3_bind_text64, text, value.size(), SQLITE_STATIC, uint8_t{SQLITE_UTF8});
}

void SQLiteStatement::bindNext(Bytes value) {
    const void* const bytes = value.empty() ? "" : static_cast<const void*>(value.data());
    bindWith(sqlite3_bind_blob64, bytes, value.size(), SQLITE_STATIC);
}

bool SQLiteStatement::step() {
    if (statement_ == nullptr || file_.error_ != SQLITE_OK) return false;
    const int code = sqlite3_step(statement_);
    check(code);
    return code == SQLITE_ROW;
}

int64_t SQLiteStatement::integer(int column) { return sqlite3_column_int64(statement_, column); }

std::string_view SQLiteStatement::text(int column) {
    const auto* const text = reinterpret_cast<const char*>(sqlite3_column_text(statement_, column));
    return {text, static_cast<size_t>(sqlite3_column_bytes(statement_, column))};
}

std::optional<std::string> SQLiteStatement::optionalText(int column) {
    if (sqlite3_column_type(statement_, column) == SQLITE_NULL) return std::nullopt;
    return std::string(text(column));
}

Bytes SQLiteStatement::blob(int column) {
    const auto* const bytes = static_cast<const uint8_t*>(sqlite3_column_blob(statement_, column));
    return {bytes, static_cast<size_t>(sqlite3_column_bytes(statement_, column))};
}

SQLiteStatement SQLiteTransaction::prepare(const char* sql) { return {file_, file_.statementFor(sql)}; }
bool SQLiteTransaction::failed() const { return file_.error_ != SQLITE_OK; }
const std::string& SQLiteTransaction::directory() const { return file_.directory_; }

// Transactions

SQLiteFile::~SQLiteFile() { close(); }

SQLiteFile::Outcome SQLiteFile::read(const Work& work) {
    return guarded(Reading, [&] { return run("BEGIN", work); });
}

SQLiteFile::Outcome SQLiteFile::write(const Work& work) {
    return guarded(Writing, [&] { return run("BEGIN IMMEDIATE", work); });
}

template <typename Operation>
SQLiteFile::Outcome SQLiteFile::guarded(Activity activity, Operation operation) {
    const std::lock_guard lock(mutex_);
    Outcome outcome = Outcome::Failed;
    try {
        outcome = operation();
    } catch (const std::exception& exception) {
        // Out of memory, in practice. A transaction that it left open ends with the connection.
        close();
        error_ = SQLITE_OK;
        fail(SQLITE_NOMEM, exception.what());
    }
    outcome == Outcome::Failed ? reportTrouble(activity) : reportSuccess(activity);
    return outcome;
}

SQLiteFile::Outcome SQLiteFile::run(const char* begin, const Work& work) {
    bool damageSeen = false;
    for (int attempt = 0; attempt < kMaxAttempts; ++attempt) {
        const State state = prepareFile();
        if (state == State::Failed) return Outcome::Failed;
        if (state == State::Ready) {
            const Outcome outcome = transact(begin, work);
            // Another process has moved the file aside, and the changes with it: they are made again.
            if (hasMoved()) {
                close();
                continue;
            }
            if (outcome != Outcome::Failed || kindOf(error_) != Kind::Damaged) return outcome;
        }
        if (damageSeen && !moveAside()) return Outcome::Failed;
        damageSeen = !damageSeen;
        close();
    }
    return Outcome::Failed;
}

SQLiteFile::Outcome SQLiteFile::transact(const char* begin, const Work& work) {
    error_ = SQLITE_OK;
    if (!execute(begin)) return Outcome::Failed;
    SQLiteTransaction transaction(*this);
    const bool accepted = work(transaction);
    if (error_ == SQLITE_OK && accepted && execute("COMMIT")) return Outcome::Done;
    if (sqlite3_get_autocommit(database_) == 0)
        sqlite3_exec(database_, "ROLLBACK", nullptr, nullptr, nullptr);
    if (error_ == SQLITE_OK) return Outcome::Declined;
    return kindOf(error_) == Kind::Duplicate ? Outcome::Duplicate : Outcome::Failed;
}

bool SQLiteFile::checkpoint() {
    return guarded(Synchronising, [this] {
               // An empty transaction first: it opens the file and deals with a damaged or replaced one.
               const Outcome outcome = run("BEGIN", [](SQLiteTransaction& transaction) {
                   transaction.prepare("SELECT 1 FROM sqlite_schema").run();
                   return true;
               });
               if (outcome != Outcome::Done) return outcome;
               int code = sqlite3_wal_checkpoint_v2(database_, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr,
                                                    nullptr);
               // Another process is at it, or still reads the log: what this one wrote is in the log until
               // the main file has it durably, so that a durable log is as good.
               if (code == SQLITE_BUSY) code = syncLog();
               if (code == SQLITE_OK) return Outcome::Done;
               fail(code);
               return Outcome::Failed;
           }) == Outcome::Done;
}

void SQLiteFile::reopen() {
    const std::lock_guard lock(mutex_);
    close();
}

int SQLiteFile::syncLog() {
    sqlite3_file* log = nullptr;
    const int code =
        sqlite3_file_control(database_, nullptr, SQLITE_FCNTL_JOURNAL_POINTER, static_cast<void*>(&log));
    if (code != SQLITE_OK) return code;
    return log == nullptr || log->pMethods == nullptr ? SQLITE_BUSY
                                                      : log->pMethods->xSync(log, SQLITE_SYNC_NORMAL);
}

// Opening

SQLiteFile::State SQLiteFile::prepareFile() {
    error_ = SQLITE_OK;
    if (database_ != nullptr && !hasMoved()) return State::Ready;
    close();
    const State state = open();
    if (state == State::Failed) close();
    return state;
}

SQLiteFile::State SQLiteFile::open() {
    directory_ = stateDirectory();
    if (directory_.empty()) {
        fail(SQLITE_CANTOPEN, std::string("the state directory cannot be used: ") + std::strerror(errno));
        return State::Failed;
    }
    // Until the main file and its log are both open: otherwise another process could move them aside in
    // between, and the old file would be read and written with the new one's log.
    const FileDescriptor lock = lockDirectory(directory_);
    if (!createWhenMissing()) return State::Failed;
    constexpr int kFlags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE;
    const int code = sqlite3_open_v2(path().c_str(), &database_, kFlags, nullptr);
    if (code != SQLITE_OK) {
        fail(code);
        return State::Failed;
    }
    configure();
    const State state = checkFormat();
    return kindOf(error_) == Kind::Damaged ? State::Damaged : state;
}

/// The library would create the file with the mode of the process's umask.
bool SQLiteFile::createWhenMissing() {
    const FileDescriptor created(
        ::open(path().c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, S_IRUSR | S_IWUSR));
    if (created.isOpen()) {
        (void)syncDirectory(directory_);
        return true;
    }
    struct stat information {};
    if (errno == EEXIST && stat(path().c_str(), &information) == 0) {
        if ((information.st_mode & (S_IRWXG | S_IRWXO)) == 0) return true;
        if (chmod(path().c_str(), S_IRUSR | S_IWUSR) == 0) return true;
    }
    fail(SQLITE_CANTOPEN, std::string("cannot be created: ") + std::strerror(errno));
    return false;
}

void SQLiteFile::configure() {
    sqlite3_busy_timeout(database_, kBusyTimeoutMilliseconds);
    // The content is not trusted: it cannot make the library call functions, and nothing here edits its
    // internals.
    sqlite3_db_config(database_, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);
    sqlite3_db_config(database_, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
    // Closing changes nothing on disk: the file may be one that is to be moved aside, or left alone.
    sqlite3_db_config(database_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
    execute(kConfiguration);
}

SQLiteFile::State SQLiteFile::checkFormat() {
    int64_t version = queryInteger("PRAGMA user_version");
    if (error_ == SQLITE_OK && version == 0 && queryInteger("SELECT count(*) FROM sqlite_schema") == 0) {
        if (layOut() != State::Ready) return State::Failed;
        version = queryInteger("PRAGMA user_version");
    }
    const int64_t application = queryInteger("PRAGMA application_id");
    if (error_ != SQLITE_OK) return State::Failed;
    if (application != format_.applicationID || version <= 0 || version < format_.version) {
        fail(SQLITE_NOTADB, "is not one of this program's files");
        return State::Damaged;
    }
    if (version > format_.version) {
        fail(SQLITE_CANTOPEN, "was written by a newer version (layout " + std::to_string(version) +
                                  ", this one reads " + std::to_string(format_.version) +
                                  "); it is left alone");
        return State::Failed;
    }
    if (endsWithinPage()) {
        fail(SQLITE_CORRUPT, "ends within a page");
        return State::Damaged;
    }
    return execute("PRAGMA journal_mode = WAL") && execute(format_.additions) ? State::Ready : State::Failed;
}

/// The library would read the missing part as zeros. With something in the log it may be a page that a crash
/// cut short; then the log has it whole.
bool SQLiteFile::endsWithinPage() {
    struct stat file {};
    struct stat log {};
    const int64_t page = queryInteger("PRAGMA page_size");
    const bool logged = stat((path() + "-wal").c_str(), &log) == 0 && log.st_size > 0;
    return !logged && page > 0 && stat(path().c_str(), &file) == 0 && file.st_size % page != 0;
}

SQLiteFile::State SQLiteFile::layOut() {
    execute("PRAGMA journal_mode = WAL");
    execute("BEGIN IMMEDIATE");
    // Where directories cannot be locked, another process may have been faster.
    if (queryInteger("PRAGMA user_version") == 0) {
        execute(format_.schema);
        execute(("PRAGMA application_id = " + std::to_string(format_.applicationID)).c_str());
        execute(("PRAGMA user_version = " + std::to_string(format_.version)).c_str());
    }
    execute(format_.additions);
    if (error_ == SQLITE_OK && execute("COMMIT")) {
        // Out of the log at once: another file that takes this one's place would be read with it.
        sqlite3_wal_checkpoint_v2(database_, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
        return State::Ready;
    }
    sqlite3_exec(database_, "ROLLBACK", nullptr, nullptr, nullptr);
    return State::Failed;
}

/// In doubt they are: a file is given up only for what was seen.
bool SQLiteFile::schemaIsOurs() {
    sqlite3* fresh = nullptr;
    std::optional<std::string> expected;
    if (sqlite3_open(":memory:", &fresh) == SQLITE_OK &&
        sqlite3_exec(fresh, format_.schema, nullptr, nullptr, nullptr) == SQLITE_OK &&
        sqlite3_exec(fresh, format_.additions, nullptr, nullptr, nullptr) == SQLITE_OK) {
        expected = schemaText(fresh);
    }
    sqlite3_close(fresh);
    const auto found = schemaText(database_);
    return !expected || !found || *expected == *found;
}

bool SQLiteFile::hasMoved() {
    int moved = 0;
    return database_ == nullptr ||
           (sqlite3_file_control(database_, nullptr, SQLITE_FCNTL_HAS_MOVED, &moved) == SQLITE_OK &&
            moved != 0);
}

bool SQLiteFile::moveAside() {
    const FileDescriptor lock = lockDirectory(directory_);
    // Another process may have been faster: then the name already leads to its fresh file.
    if (hasMoved()) return true;
    const std::string aside = nameAside(path());
    for (const char* suffix : kFileSuffixes) {
        if (rename((path() + suffix).c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT) {
            errorText_ += std::string(" (damaged, but cannot be moved aside: ") + std::strerror(errno) + ')';
            close();
            return false;
        }
    }
    (void)syncDirectory(directory_);
    VELTOID_PLATFORM_LOG(
        Error, path() + ": damaged (" + errorText_ + "); moved to " + aside + " and a new one is started");
    return true;
}

void SQLiteFile::close() {
    for (const auto& [sql, statement] : statements_) sqlite3_finalize(statement);
    statements_.clear();
    sqlite3_close(database_);
    database_ = nullptr;
}

// Statements and errors

bool SQLiteFile::execute(const char* sql) {
    if (error_ != SQLITE_OK) return false;
    const int code = sqlite3_exec(database_, sql, nullptr, nullptr, nullptr);
    if (code != SQLITE_OK) fail(code);
    return code == SQLITE_OK;
}

int64_t SQLiteFile::queryInteger(const char* sql) {
    SQLiteStatement statement(*this, statementFor(sql));
    return statement.step() ? statement.integer(0) : 0;
}

sqlite3_stmt* SQLiteFile::statementFor(const char* sql) {
    if (error_ != SQLITE_OK) return nullptr;
    if (const auto known = statements_.find(sql); known != statements_.end()) return known->second;
    sqlite3_stmt* statement = nullptr;
    const int code = sqlite3_prepare_v3(database_, sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr);
    if (code == SQLITE_OK) {
        statements_.emplace(sql, statement);
        return statement;
    }
    // Sound SQL that does not fit the tables: then they are not the ones that were laid out.
    const bool damaged = (code & 0xFF) == SQLITE_ERROR && !schemaIsOurs();
    fail(damaged ? SQLITE_CORRUPT : code, damaged ? "its tables are not as they were laid out" : "");
    return nullptr;
}

void SQLiteFile::fail(int code, const std::string& what) {
    if (error_ != SQLITE_OK) return;
    error_ = code;
    errorText_ = what.empty() ? sqlite3_errstr(code) : what;
    if (!what.empty() || database_ == nullptr) return;
    const int reason = sqlite3_system_errno(database_);
    if (kindOf(code) == Kind::Unusable && reason != 0)
        errorText_ += std::string(": ") + std::strerror(reason);
}

void SQLiteFile::reportTrouble(Activity activity) {
    // Logged already, by this activity or by another one with the same trouble.
    const bool known = std::ranges::find(trouble_, errorText_) != trouble_.end();
    trouble_[activity] = errorText_;
    if (known) return;
    VELTOID_PLATFORM_LOG(Error, (directory_.empty() ? format_.name : path()) + ": " + errorText_);
}

void SQLiteFile::reportSuccess(Activity activity) {
    if (trouble_[activity].empty()) return;
    std::fill_n(trouble_.begin(), activity + 1, std::string());
    constexpr std::array<const char*, kActivities> kNames = {"reading", "writing", "synchronising"};
    VELTOID_PLATFORM_LOG(Notice, path() + ": " + kNames[activity] + " works again");
}

}  // namespace platform
