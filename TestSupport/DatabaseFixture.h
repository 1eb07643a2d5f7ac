// What tests of the account database, and of everything above it, stand on: a state directory of their own,
// simulated time, the log, the preference store behind the database's back, and at the end the proof that it
// holds what memory holds.
#pragma once

#include <gtest/gtest.h>

#include <ostream>
#include <set>
#include <string>
#include <vector>

#include "Logging/Describe.h"
#include "Platform/runtime/Transactions.h"
#include "Platform/storage/Preferences.h"
#include "Protocol/RecordKeys.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SimulatedClock.h"
#include "TestSupport/TemporaryStateDirectory.h"
#include "Values/ValueStream.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {

// What a failed comparison prints.
inline void PrintTo(const Value& value, std::ostream* stream) { *stream << describeValue(value); }
inline void PrintTo(const Dictionary& value, std::ostream* stream) { *stream << describeValue(value); }
inline void PrintTo(const Array& value, std::ostream* stream) { *stream << describeValue(value); }
inline void PrintTo(const String& value, std::ostream* stream) { *stream << describeValue(value); }
inline void PrintTo(const Error& value, std::ostream* stream) { *stream << describeValue(value); }

inline Value flag(bool value) { return Value::boolean(value); }
inline Value number(int64_t value) { return Value::int64(value); }

inline const Value kOn = flag(true);
inline const Value kOff = flag(false);
/// Removes a value where one is set.
inline const Value kGone = Value::null();
inline constexpr double kDay = 86'400;

// Keys of records.
inline constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";
inline constexpr const char* kData = "VeltoIDAccountValidationRecordData";
inline constexpr const char* kNextCheck = "VeltoIDAccountValidationRecordNextCheckDateKey";
inline constexpr const char* kAsOf = "VeltoIDAccountValidationRecordValidAsOfKey";
inline constexpr const char* kDuration = "VeltoIDAccountValidationRecordSuggestedValidIntervalKey";
inline constexpr const char* kEmbargo = "EarliestAllowedConnectionDate";
inline constexpr const char* kToken = "CertificateToken";
inline constexpr const char* kFetchDate = "NextCertificateFetchDate";
// Keys of certificate entries.
inline constexpr const char* kKeyReference = "CertificatePrivateKeyReference";
inline constexpr const char* kCertificateReference = "CertificateReference";
inline constexpr const char* kValidated = "LastSuccessfulValidation";
inline constexpr const char* kAttempt = "LastValidationAttempt";
inline constexpr const char* kRenewal = "NextRenewalAttempt";

/// An array within an array and so on.
inline Value nestedArrays(int depth) {
    Value value = Array();
    for (; depth > 0; --depth) value = Array{value};
    return value;
}

/// The keys of a dictionary.
inline std::set<std::string> keysOf(const Dictionary& dictionary) {
    std::set<std::string> keys;
    for (const auto& [key, value] : dictionary) keys.insert(key.text());
    return keys;
}

class DatabaseTest : public testing::Test {
  protected:
    void SetUp() override {
        __VeltoIDDBSetUsePreferences(true);
        __VeltoIDDBSetChangeSemaphore(changes_);
    }

    void TearDown() override {
        flush();
        EXPECT_EQ(platform::transactions::openCount(), 0);
        if (isComparedWithDisk_) compareWithDisk();
        // What still waits ends while all of the test is there.
        platform::TestLifetime::restart();
    }

    static void compareWithDisk() {
        const Dictionary stored = storedDomain();
        const auto section = [&](std::string_view key) {
            const Dictionary* entries = stored.dictionary(key);
            return entries != nullptr ? *entries : Dictionary();
        };
        database::perform([&](const database::Store& store) {
            EXPECT_EQ(section(kVeltoIDDBAccountsKey), store.accounts);
            EXPECT_EQ(section(kVeltoIDDBCertificatesKey), store.certificates);
            EXPECT_EQ(section(kVeltoIDDBMetaInfoKey), store.metaInfo);
        });
    }

    /// For tests whose memory holds what the preference store is not to hold.
    void doNotCompareWithDisk() { isComparedWithDisk_ = false; }

    double now() const { return clock_.now(); }
    Value date(double offset = 0) const { return Value::date(now() + offset); }

    /// Lets planned flushes run. Three seconds pass.
    void flush() { clock_.advanceBy(kVeltoIDDBFlushDelay); }

    /// Whether anything was handed to the preference store since the last flush; flushes it.
    bool takeWritten() {
        clock_.settle();
        const bool written = platform::transactions::openCount() > 0;
        flush();
        return written;
    }

    /// How often the change semaphore was signalled since the last call.
    int takeSignals() {
        int signals = 0;
        while (changes_.wait(0)) ++signals;
        return signals;
    }

    /// What one changing operation did beyond memory: "", "written" or "written, signalled".
    template <typename Operation>
    std::string effectsOf(Operation operation) {
        database::loadedStore();
        (void)takeWritten();
        (void)takeSignals();
        operationDate_ = now();
        operation();
        const int signals = takeSignals();
        std::string effects = takeWritten() ? "written" : "";
        for (int i = 0; i < signals; ++i) effects += ", signalled";
        return effects;
    }

    /// When the last operation was done whose effects were asked for.
    Value operationDate() const { return Value::date(operationDate_); }

    // The preference store behind the database's back.
    static platform::Preferences domain(std::string_view name = kVeltoIDDBDefaultDomain) {
        return platform::Preferences(std::string(name));
    }
    static void storeDomain(const Dictionary& contents) {
        std::vector<std::pair<std::string, platform::ValueWriter>> values;
        for (const auto& [key, value] : contents)
            values.emplace_back(key.text(),
                                [value = value](platform::ValueSink& sink) { writeValue(value, sink); });
        ASSERT_TRUE(domain().set(values));
    }
    static Dictionary storedDomain(std::string_view name = kVeltoIDDBDefaultDomain) {
        Dictionary contents;
        const auto keys = domain(name).keys();
        for (const std::string& key : keys.value()) {
            ValueBuilder builder;
            domain(name).read(key, builder);
            contents.set(String(key), builder.value());
        }
        return contents;
    }

    platform::TemporaryStateDirectory directory_;
    platform::SimulatedClock clock_;
    platform::FakeSystemLog log_;
    const platform::Semaphore changes_;

  private:
    bool isComparedWithDisk_ = true;
    double operationDate_ = 0;
};

}  // namespace veltoid
