#include "Platform/keychain/Keychain.h"

#include <algorithm>
#include <exception>
#include <functional>
#include <string>
#include <utility>

#include "Platform/crypto/Crypto.h"
#include "Platform/keychain/KernelKeyring.h"
#include "Platform/keychain/KeychainClassKeys.h"
#include "Platform/keychain/KeychainSealing.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"
#include "Platform/storage/SQLiteFile.h"

namespace platform::keychain {

namespace {

using Outcome = SQLiteFile::Outcome;

constexpr size_t kReferenceBytes = 16;

// `sequence` keeps the order of creation. Absent texts are NULL, which no unique index compares: coalesce
// makes two absent ones equal, and different from an empty text. An absent application value identifies
// nothing and stays NULL.
constexpr const char* kSchema =
    "CREATE TABLE items ("
    "  sequence INTEGER PRIMARY KEY,"
    "  id BLOB NOT NULL UNIQUE,"
    "  class INTEGER NOT NULL,"
    "  account TEXT, service TEXT, label TEXT, description TEXT, access_group TEXT,"
    "  key_class TEXT, application_value TEXT,"
    "  accessibility INTEGER NOT NULL,"
    "  sealed BLOB NOT NULL"
    ");"
    "CREATE UNIQUE INDEX passwords ON items (coalesce(account, x''), coalesce(service, x'')) WHERE class = 0;"
    "CREATE UNIQUE INDEX objects ON items (class, coalesce(key_class, x''), application_value) WHERE class "
    "<> 0;";

// Files of earlier agents have none: they get it when they are opened. It counts the items, so that one that
// was emptied by another program is told from one whose items were removed here.
constexpr const char* kIdentity =
    "CREATE TABLE IF NOT EXISTS identity AS"
    " SELECT randomblob(16) AS id, (SELECT count(*) FROM items) AS items;";

// What rowOf reads. A macro, since statements are kept under the address of their literal.
#define VELTOID_SELECT_ITEMS                                                                     \
    "SELECT sequence, id, class, account, service, label, description, access_group, key_class," \
    " application_value, accessibility FROM items WHERE "

struct KeychainFile : SQLiteFile {
    KeychainFile() : SQLiteFile({"keychain.db", 0x48574B43 /* "HWKC" */, 1, schema().c_str(), kIdentity}) {}

    static const std::string& schema() {
        static const std::string text = std::string(kSchema) + kClassKeysSchema;
        return text;
    }
};

SQLiteFile& file() { return Lifetime::current().state<KeychainFile>(); }

struct Row {
    int64_t sequence = 0;
    ItemIdentity identity;
};

using Work = std::function<void(SQLiteTransaction&)>;

/// Runs the work as a transaction that counts only when there is no Failure.
KeychainStatus perform(Outcome (SQLiteFile::*kind)(const SQLiteFile::Work&), const Work& work) {
    try {
        KeychainStatus status = kKeychainSuccess;
        const Outcome outcome = (file().*kind)([&](SQLiteTransaction& transaction) {
            status = kKeychainSuccess;
            try {
                work(transaction);
            } catch (const Failure& failure) {
                status = failure.status;
            }
            return status == kKeychainSuccess;
        });
        if (outcome == Outcome::Duplicate) return kKeychainDuplicateItem;
        return outcome == Outcome::Failed ? kKeychainNotAvailable : status;
    } catch (const std::exception& exception) {
        VELTOID_PLATFORM_LOG(Error, std::string("keychain: ") + exception.what());
        return kKeychainNotAvailable;
    }
}

KeychainStatus readItems(const Work& work) { return perform(&SQLiteFile::read, work); }

KeychainStatus changeItems(const Work& work) {
    const KeychainStatus status = perform(&SQLiteFile::write, [&](SQLiteTransaction& transaction) {
        work(transaction);
        transaction.prepare("UPDATE identity SET items = (SELECT count(*) FROM items)").run();
    });
    // Not the item's failure: it is stored, and the store logs why it could not be made durable yet.
    if (status == kKeychainSuccess) (void)file().checkpoint();
    return status;
}

bool matches(const KeychainAttributes& query, const KeychainAttributes& item) {
    const auto agrees = [&](auto text) { return !(query.*text) || query.*text == item.*text; };
    return query.itemClass == item.itemClass && std::ranges::all_of(kKeychainTexts, agrees);
}

Row rowOf(SQLiteStatement& statement) {
    const Bytes id = statement.blob(1);
    Row row;
    row.sequence = statement.integer(0);
    row.identity.id.assign(id.begin(), id.end());
    row.identity.attributes.itemClass = static_cast<KeychainItemClass>(statement.integer(2));
    int column = 3;
    for (const auto text : kKeychainTexts) row.identity.attributes.*text = statement.optionalText(column++);
    row.identity.accessibility = static_cast<Accessibility>(statement.integer(column));
    return row;
}

/// The matching items, oldest first.
std::vector<Row> find(SQLiteTransaction& transaction, const KeychainQuery& query) {
    std::vector<Row> rows;
    const auto collect = [&](SQLiteStatement& statement) {
        while (statement.step()) {
            Row row = rowOf(statement);
            if (matches(query.attributes, row.identity.attributes)) rows.push_back(std::move(row));
        }
    };
    if (!query.itemList) {
        collect(transaction.prepare(VELTOID_SELECT_ITEMS "class = ? ORDER BY sequence")
                    .bind(static_cast<int>(query.attributes.itemClass)));
        return rows;
    }
    for (const PersistentReference& reference : *query.itemList) {
        collect(transaction.prepare(VELTOID_SELECT_ITEMS "id = ?").bind(reference));
    }
    std::ranges::sort(rows, {}, &Row::sequence);
    const auto same = [](const Row& one, const Row& other) { return one.sequence == other.sequence; };
    rows.erase(std::unique(rows.begin(), rows.end(), same), rows.end());
    return rows;
}

std::vector<Row> findSome(SQLiteTransaction& transaction, const KeychainQuery& query) {
    std::vector<Row> rows = find(transaction, query);
    if (rows.empty()) throw Failure{kKeychainItemNotFound};
    return rows;
}

SecretBytes unsealRow(SQLiteTransaction& transaction, const Row& row) {
    auto statement = transaction.prepare("SELECT sealed FROM items WHERE sequence = ?");
    if (!statement.bind(row.sequence).step()) throw Failure{kKeychainNotAvailable};
    return unsealItem(transaction, row.identity, statement.blob(0));
}

void insert(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes value) {
    const SecretBytes sealed = sealItem(transaction, identity, value);
    auto statement = transaction.prepare(
        "INSERT INTO items (id, class, account, service, label, description, access_group, key_class,"
        " application_value, accessibility, sealed) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)");
    statement.bind(identity.id, static_cast<int>(identity.attributes.itemClass));
    for (const auto text : kKeychainTexts) statement.bind(identity.attributes.*text);
    statement.bind(static_cast<int>(identity.accessibility), sealed).run();
}

/// Seals anew, since the attributes are part of the seal.
void change(SQLiteTransaction& transaction, Row row, const Changes& changes) {
    SecretBytes value = unsealRow(transaction, row);
    if (changes.data) value = *changes.data;
    if (changes.accessibility) row.identity.accessibility = *changes.accessibility;
    if (changes.label) row.identity.attributes.label = changes.label;
    if (changes.accessGroup) row.identity.attributes.accessGroup = changes.accessGroup;
    const SecretBytes sealed = sealItem(transaction, row.identity, value);
    transaction
        .prepare(
            "UPDATE items SET label = ?, access_group = ?, accessibility = ?, sealed = ? WHERE sequence = ?")
        .bind(row.identity.attributes.label, row.identity.attributes.accessGroup,
              static_cast<int>(row.identity.accessibility), sealed, row.sequence)
        .run();
}

using OpenedItems = std::vector<std::pair<Row, SecretBytes>>;

/// The items that are not always accessible. One that does not unseal stays as it is.
OpenedItems openAll(SQLiteTransaction& transaction) {
    OpenedItems items;
    for (const auto itemClass :
         {KeychainItemClass::GenericPassword, KeychainItemClass::Key, KeychainItemClass::Certificate}) {
        KeychainQuery query;
        query.attributes.itemClass = itemClass;
        for (const Row& row : find(transaction, query)) {
            if (row.identity.accessibility == Accessibility::Always) continue;
            try {
                items.emplace_back(row, unsealRow(transaction, row));
            } catch (const Failure& failure) {
                if (failure.status != kKeychainItemCorrupt) throw;
            }
        }
    }
    return items;
}

/// An earlier copy of the file, together with what opened it, must not open anything of this one.
KeychainStatus replaceClassKey(const Work& replace) {
    std::string keptBefore;
    const KeychainStatus status = changeItems([&](SQLiteTransaction& transaction) {
        keptBefore = keptKeyName(transaction);
        const OpenedItems items = openAll(transaction);
        replace(transaction);
        for (const auto& [row, value] : items) {
            const SecretBytes sealed = sealItem(transaction, row.identity, value);
            transaction.prepare("UPDATE items SET sealed = ? WHERE sequence = ?")
                .bind(sealed, row.sequence)
                .run();
        }
    });
    if (status == kKeychainSuccess && !keptBefore.empty()) (void)kernel_keyring::remove(keptBefore);
    return status;
}

bool tooLong(Bytes value) {
    if (value.size() <= kMaxKeychainItemBytes) return false;
    VELTOID_PLATFORM_LOG(Error, "keychain: a value of " + std::to_string(value.size()) + " bytes is refused");
    return true;
}

}  // namespace

KeychainStatus copyMatchingReferences(const KeychainQuery& query,
                                      std::vector<PersistentReference>* references) {
    std::vector<PersistentReference> found;
    const KeychainStatus status = readItems([&](SQLiteTransaction& transaction) {
        found.clear();
        for (Row& row : findSome(transaction, query)) found.push_back(std::move(row.identity.id));
    });
    if (status == kKeychainSuccess && references != nullptr) *references = std::move(found);
    return status;
}

KeychainStatus copyMatchingData(const KeychainQuery& query, SecretBytes* data) {
    SecretBytes value;
    const KeychainStatus status = readItems([&](SQLiteTransaction& transaction) {
        value = unsealRow(transaction, findSome(transaction, query).front());
    });
    if (status == kKeychainSuccess && data != nullptr) *data = std::move(value);
    return status;
}

KeychainStatus add(const KeychainAttributes& attributes, Accessibility accessibility, Bytes data,
                   PersistentReference* reference) {
    if (tooLong(data)) return kKeychainNotAvailable;
    ItemIdentity identity{PersistentReference(kReferenceBytes), attributes, accessibility};
    fillRandom(identity.id);
    const KeychainStatus status =
        changeItems([&](SQLiteTransaction& transaction) { insert(transaction, identity, data); });
    if (status == kKeychainSuccess && reference != nullptr) *reference = std::move(identity.id);
    return status;
}

KeychainStatus update(const KeychainQuery& query, const Changes& changes) {
    if (changes.data && tooLong(*changes.data)) return kKeychainNotAvailable;
    return changeItems([&](SQLiteTransaction& transaction) {
        for (const Row& row : findSome(transaction, query)) change(transaction, row, changes);
    });
}

KeychainStatus remove(const KeychainQuery& query) {
    return changeItems([&](SQLiteTransaction& transaction) {
        for (const Row& row : findSome(transaction, query))
            transaction.prepare("DELETE FROM items WHERE sequence = ?").bind(row.sequence).run();
    });
}

std::optional<Accessibility> accessibilityOf(const KeychainQuery& query) {
    std::optional<Accessibility> accessibility;
    const KeychainStatus status = readItems([&](SQLiteTransaction& transaction) {
        accessibility = findSome(transaction, query).front().identity.accessibility;
    });
    return status == kKeychainSuccess ? accessibility : std::nullopt;
}

std::optional<std::vector<uint8_t>> identity(Reopen reopen) {
    if (reopen == Reopen::Yes) file().reopen();
    std::vector<uint8_t> found;
    const KeychainStatus status = readItems([&](SQLiteTransaction& transaction) {
        found.clear();
        auto statement =
            transaction.prepare("SELECT id FROM identity WHERE items = 0 OR EXISTS (SELECT 1 FROM items)");
        if (!statement.step()) return;
        const Bytes id = statement.blob(0);
        found.assign(id.begin(), id.end());
    });
    // What another program has left in the log would be read with a file that takes the place of this one.
    if (reopen == Reopen::Yes) (void)file().checkpoint();
    return status == kKeychainSuccess ? std::optional(std::move(found)) : std::nullopt;
}

std::optional<Protection> protection() {
    Protection result = Protection::NoPassphrase;
    const KeychainStatus status =
        readItems([&](SQLiteTransaction& transaction) { result = readProtection(transaction); });
    return status == kKeychainSuccess ? std::optional(result) : std::nullopt;
}

KeychainStatus setPassphrase(Bytes passphrase) {
    return replaceClassKey(
        [&](SQLiteTransaction& transaction) { replaceByPassphrase(transaction, passphrase); });
}

KeychainStatus removePassphrase() { return replaceClassKey(replaceByDeviceKey); }

KeychainStatus unlock(Bytes passphrase) {
    return readItems([&](SQLiteTransaction& transaction) { unlockByPassphrase(transaction, passphrase); });
}

KeychainStatus lock() {
    std::string kept;
    const KeychainStatus status =
        readItems([&](SQLiteTransaction& transaction) { kept = keptKeyName(transaction); });
    if (status != kKeychainSuccess) return status;
    return kept.empty() || kernel_keyring::remove(kept) ? kKeychainSuccess : kKeychainNotAvailable;
}

}  // namespace platform::keychain
