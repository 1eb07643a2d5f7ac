#include "VeltoIDAuthenticationDB/Migration.h"

#include <algorithm>
#include <vector>

#include "Platform/encoding/UTF8.h"
#include "Protocol/RecordKeys.h"
#include "Values/Digest.h"
#include "Values/LowerCase.h"
#include "VeltoIDAuthenticationDB/AccountUUIDs.h"

namespace veltoid::database {
namespace {

// Agents up to these accessor versions left something behind.
constexpr double kLastWithCertificatesInRecords = 478;
constexpr double kLastWithVersionsInMetaInfo = 481;
constexpr double kLastWithoutUserUUID = 508;
constexpr double kLastWithCertificateLists = 617;

/// Changes every record of the accounts by `change(name, record)`.
template <typename Change>
void changeEveryRecord(Dictionary& accounts, Change change) {
    const Dictionary before = accounts;
    for (const auto& [name, value] : before) {
        Dictionary record = *value.asDictionary();
        change(name, record);
        accounts.set(name, record);
    }
}

/// Numbers in descending order, before everything else.
bool descendingNumbers(const Value& a, const Value& b) {
    const std::optional<double> x = a.asDouble();
    const std::optional<double> y = b.asDouble();
    if (x && y) return *x > *y;
    return x.has_value() && !y.has_value();
}

/// Gives the device its identifier, and every account the one derived from it. False when the device has one.
bool addUserUUID(Dictionary& accounts, Dictionary& metaInfo) {
    if (metaInfo.contains(kVeltoIDMetaUserUUIDKey)) return false;
    metaInfo.set(kVeltoIDMetaUserUUIDKey, randomUUIDText());
    changeEveryRecord(accounts, [&metaInfo](const String& name, Dictionary& record) {
        deriveAccountUUIDs(name, record, metaInfo);
    });
    return true;
}

/// Agents whose locale did not know a letter kept its case: nobody could ask for the account any more. False
/// when there is none.
bool lowerCaseNames(Dictionary& accounts) {
    bool changed = false;
    const Dictionary before = accounts;
    for (const auto& [name, value] : before) {
        const String lower = lowerCased(name);
        if (platform::isASCII(name.view()) || lower == name || accounts.contains(lower.view())) continue;
        Dictionary record = *value.asDictionary();
        record.set(kVeltoIDAccountNameKey, lower);
        accounts.set(lower, record);
        changed = accounts.remove(name.view());
    }
    return changed;
}

}  // namespace

MigrationOutcome migrate(Dictionary& accounts, Dictionary& metaInfo, Array& versions) {
    std::vector<Value> sorted(versions.begin(), versions.end());
    std::stable_sort(sorted.begin(), sorted.end(), descendingNumbers);

    MigrationOutcome outcome;
    for (size_t i = 0; i < sorted.size(); ++i) {
        const double version = sorted[i].asDouble().value_or(0);
        if (!(version > 0)) continue;
        if (version <= kLastWithCertificatesInRecords) {
            changeEveryRecord(accounts, [](const String&, Dictionary& record) {
                record.set(kVeltoIDDirtyKey, Value::boolean(true));
                record.remove(kVeltoIDAccountOldCertificateKey);
                record.remove(kVeltoIDAccountOldPrivateKeyKey);
            });
            sorted.resize(i + 1);
            versions = Array();
            for (const Value& kept : sorted) versions.append(kept);
            outcome.versionsCut = true;
        } else if (version <= kLastWithVersionsInMetaInfo) {
            metaInfo.remove(kVeltoIDDBAccessorVersionsKey);
        } else if (version <= kLastWithoutUserUUID) {
            outcome.sectionsChanged = addUserUUID(accounts, metaInfo) || outcome.sectionsChanged;
        } else if (version <= kLastWithCertificateLists) {
            changeEveryRecord(accounts, [](const String&, Dictionary& record) {
                record.remove(kVeltoIDAccountOldCertificatesKey);
            });
        }
    }
    outcome.sectionsChanged = lowerCaseNames(accounts) || outcome.sectionsChanged;
    return outcome;
}

}  // namespace veltoid::database
