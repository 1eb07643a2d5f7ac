#include "Platform/storage/Preferences.h"

#include <exception>

#include "Platform/propertylist/PropertyList.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"
#include "Platform/storage/SQLiteFile.h"

namespace platform {

namespace {

using Outcome = SQLiteFile::Outcome;

constexpr SQLiteFile::Format kFormat = {
    "preferences.db",
    0x48575046,  // "HWPF"
    1,
    "CREATE TABLE preferences ("
    "  domain TEXT NOT NULL,"
    "  key TEXT NOT NULL,"
    "  value BLOB NOT NULL,"
    "  PRIMARY KEY (domain, key)"
    ") WITHOUT ROWID",
};

struct PreferencesFile : SQLiteFile {
    PreferencesFile() : SQLiteFile(kFormat) {}
};

SQLiteFile& file() { return Lifetime::current().state<PreferencesFile>(); }

using Work = std::function<void(SQLiteTransaction&)>;

bool write(const Work& work) {
    return file().write([&](SQLiteTransaction& transaction) { return work(transaction), true; }) ==
           Outcome::Done;
}

/// Runs one operation of the interface, out of which nothing is thrown.
template <typename Operation>
bool guarded(const std::string& domain, const char* name, Operation operation) {
    try {
        return operation();
    } catch (const std::exception& exception) {
        VELTOID_PLATFORM_LOG(Error,
                             "preferences of " + domain + ": " + name + " failed: " + exception.what());
        return false;
    }
}

}  // namespace

Preferences::ReadResult Preferences::read(std::string_view key, ValueSink& sink) const {
    auto result = ReadResult::Failed;
    guarded(domain_, "read", [&] {
        SecretBytes value;
        const Outcome outcome = file().read([&](SQLiteTransaction& transaction) {
            auto statement =
                transaction.prepare("SELECT value FROM preferences WHERE domain = ? AND key = ?");
            statement.bind(domain_, key);
            if (!statement.step()) return false;
            const Bytes stored = statement.blob(0);
            value.assign(stored.begin(), stored.end());
            return true;
        });
        if (outcome == Outcome::Failed) return false;
        // The sink is served outside the transaction: it may take its time, and may use preferences itself.
        if (outcome != Outcome::Done) {
            result = ReadResult::Absent;
            return true;
        }
        const bool readable = readBinaryPropertyList(value, sink);
        result = readable ? ReadResult::Found : ReadResult::Damaged;
        if (!readable)
            VELTOID_PLATFORM_LOG(Error, "preferences of " + domain_ + ": the value of \"" + std::string(key) +
                                            "\" is damaged");
        return true;
    });
    return result;
}

std::optional<std::vector<std::string>> Preferences::keys() const {
    std::vector<std::string> keys;
    const bool done = guarded(domain_, "keys", [&] {
        return file().read([&](SQLiteTransaction& transaction) {
            keys.clear();
            auto statement = transaction.prepare("SELECT key FROM preferences WHERE domain = ? ORDER BY key");
            statement.bind(domain_);
            while (statement.step()) keys.emplace_back(statement.text(0));
            return true;
        }) == Outcome::Done;
    });
    return done ? std::optional(std::move(keys)) : std::nullopt;
}

bool Preferences::set(const std::vector<std::pair<std::string, ValueWriter>>& values) const {
    return guarded(domain_, "set", [&] {
        std::vector<std::pair<std::string_view, SecretBytes>> rows;
        for (const auto& [key, writer] : values) {
            rows.emplace_back(key, writeBinaryPropertyList(writer));
            if (!rows.back().second.empty()) continue;
            VELTOID_PLATFORM_LOG(Error, "preferences of " + domain_ + ": the value for \"" + key +
                                            "\" has no stored form; nothing is set");
            return false;
        }
        return write([&](SQLiteTransaction& transaction) {
            for (const auto& [key, value] : rows) {
                transaction.prepare("REPLACE INTO preferences (domain, key, value) VALUES (?, ?, ?)")
                    .bind(domain_, key, value)
                    .run();
            }
        });
    });
}

bool Preferences::remove(const std::vector<std::string>& keys) const {
    return guarded(domain_, "remove", [&] {
        return write([&](SQLiteTransaction& transaction) {
            for (const auto& key : keys) {
                transaction.prepare("DELETE FROM preferences WHERE domain = ? AND key = ?")
                    .bind(domain_, key)
                    .run();
            }
        });
    });
}

bool Preferences::setAside(std::string_view key) const {
    return guarded(domain_, "setAside", [&] {
        const auto date = static_cast<int64_t>(Clock::shared().now());
        const std::string asideKey = std::string(key) + "-" + std::to_string(date);
        const std::string asideDomain = domain_ + ".damaged";
        const bool done = write([&](SQLiteTransaction& transaction) {
            transaction
                .prepare("UPDATE OR REPLACE preferences SET domain = ?, key = ? WHERE domain = ? AND key = ?")
                .bind(asideDomain, asideKey, domain_, key)
                .run();
        });
        if (done)
            VELTOID_PLATFORM_LOG(Error, "preferences of " + domain_ + ": the damaged value is kept as \"" +
                                            asideKey + "\" of " + asideDomain);
        return done;
    });
}

bool Preferences::synchronize() const {
    return guarded(domain_, "synchronize", [] { return file().checkpoint(); });
}

}  // namespace platform
