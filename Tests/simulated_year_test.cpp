// The agent's account check through years of an identity server's good and bad days, in simulated time:
// everything but the connection and the clock is real. VELTOID_YEARS says how many (default 0.2;
// sanitizers pass less).
#include <cstdlib>

#include "TestSupport/AgentLife.h"
#include "TestSupport/CertificateFixture.h"
#include "TestSupport/SimulatedIdentityServer.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"

namespace veltoid {
namespace {

using testing_support::Period;
using testing_support::SimulatedIdentityServer;

constexpr double kHour = 3'600;
constexpr double kDay = 24 * kHour;
/// Between two looks at the agent from outside.
constexpr double kLook = 4 * kHour;
/// In good times an account is usable after this: what its user waits for is tried within an hour, and the
/// server may let a certificate wait for three quarters of one.
constexpr double kMaxRepair = 2 * kHour;
/// For each account, in an hour without news; in the first hour of something that fails.
constexpr size_t kMaxStarts = 6;
constexpr size_t kMaxCalls = 12;
constexpr size_t kMaxStartsFirstHour = 15;
constexpr size_t kMaxCallsFirstHour = 40;
/// Of so many hours one may be such a first one, or have news.
constexpr size_t kShareOfFirstHours = 10;
constexpr double kIntervalAfterAnswer = 4 * kHour;

/// How many of the dates begin an hour with more than `most` of them.
size_t fullHours(const std::vector<double>& dates, size_t most) {
    size_t full = 0;
    for (size_t i = 0; i + most < dates.size(); ++i) full += dates[i + most] < dates[i] + kHour ? 1 : 0;
    return full;
}

double yearsToPass() {
    const char* text = std::getenv("VELTOID_YEARS");  // NOLINT(concurrency-mt-unsafe): no other thread yet
#ifdef VELTOID_SANITIZED
    constexpr double kDefault = 0.05;
#else
    constexpr double kDefault = 0.2;
#endif
    return text != nullptr ? std::strtod(text, nullptr) : kDefault;
}

/// Drives the agent through the time and looks at it at every pass, and every few hours between them.
class SimulatedYear : public CertificateTest {
  protected:
    void SetUp() override {
        CertificateTest::SetUp();
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
    void TearDown() override {
        doNotCompareWithDisk();
        for (const std::string& name : names_) __VeltoIDForgetVeltoID(name, {});
        EXPECT_EQ(keys() + certificates(), 0U) << "years leave no item behind";
        CertificateTest::TearDown();
    }

    void live(const SimulatedIdentityServer::Configuration& configuration, int accounts) {
        SimulatedIdentityServer server(server_, clock_, configuration);
        trust(server.root());
        for (int i = 0; i < accounts; ++i) {
            names_.push_back("account" + std::to_string(i) + "@velto.example");
            ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(names_.back(), kPassword, nullptr));
        }
        agent_.onPass = [this] { atPass(); };
        agent_.onLook = [this] { calls_.resize(calls_.size() + server_.take().size(), now()); };
        agent_.ask([] {});
        const double begin = now();
        const double end = begin + configuration.years * 365 * kDay;
        while (now() < end && !HasFailure()) {
            agent_.liveUntil(now() + kLook);
            expectTimelyRelaunch();
            if (now() > begin + 2 * kDay) expectCertificates(server);
        }
        EXPECT_EQ(server.signInsDuringEmbargo(), 0);
        const auto most = [&](std::vector<double> dates) {
            // Not those within an hour of news.
            std::erase_if(dates, [&](double date) { return server.hadNews({date - kHour, date + kHour}); });
            return testing_support::mostWithin(dates, kHour, begin + kHour, end) / names_.size();
        };
        EXPECT_LE(most(agent_.starts()), kMaxStartsFirstHour);
        EXPECT_LE(most(calls_), kMaxCallsFirstHour);
        const auto expectFewFullHours = [](const std::vector<double>& dates, size_t most) {
            EXPECT_LE(fullHours(dates, most), kMaxCallsFirstHour + dates.size() / kShareOfFirstHours);
        };
        expectFewFullHours(agent_.starts(), kMaxStarts * names_.size());
        expectFewFullHours(calls_, kMaxCalls * names_.size());
        std::printf("%zu starts, at most %zu of them and %zu calls an hour; ", agent_.starts().size(),
                    most(agent_.starts()), most(calls_));
        for (const std::string& name : names_) expectSpacing(server.requests(name));
        const auto& events = server.events();
        std::printf(
            "%d passes, %d certificates, %d refusals, %d revocations, %d embargoes, %d calls without answer, "
            "%d records tried again\n",
            passes_, events.issued, events.refused, events.revoked, events.embargoes, events.unreachable,
            retries_);
        EXPECT_LT(passes_, configuration.years * 365 * 24 * accounts) << "less than one an hour";
    }

  private:
    /// On the account check's queue.
    void atPass() {
        ++passes_;
        EXPECT_TRUE(!lastPass_ || now() - *lastPass_ >= 5) << "passes keep their distance";
        lastPass_ = now();
        for (const std::string& name : names_) expectGrowingRetries(name);
    }

    /// A validation record that cannot be had is tried after 180 s, and then half as long again each time, up
    /// to a random cap between one and two days. When the server answers, but not with one, that goes on from
    /// four hours.
    void expectGrowingRetries(const std::string& name) {
        const double before = retryIntervals_[name];
        const double interval =
            __VeltoIDDBCopyAccountValue(name, kVeltoIDAccountValidationRecordNextCheckIntervalKey)
                .asDouble()
                .value_or(0);
        EXPECT_TRUE(interval == before || interval == 0 || interval == 1.5 * std::max(before, 180.0) ||
                    interval == kIntervalAfterAnswer ||
                    (interval >= kDay && interval <= 2 * kDay && 1.5 * before >= interval))
            << interval << " after " << before;
        if (interval != before && interval > 0) ++retries_;
        retryIntervals_[name] = interval;
    }

    /// Were the agent ended now, it would be back in time.
    void expectTimelyRelaunch() {
        std::optional<double> earliest;
        const Array accounts = copyAccountsNeedingAction(&earliest);
        const auto next = agent_.alarm();
        if (accounts.empty() || !earliest || agent_.isRunning()) return;
        EXPECT_TRUE(next && *next <= std::max(*earliest, now()) + 1)
            << (next ? *next - now() : -1) << " instead of " << *earliest - now();
    }

    void expectCertificates(const SimulatedIdentityServer& server) {
        const Period before = {now() - kMaxRepair, now()};
        if (!server.wasGood(before) || server.hadNews(before)) return;
        for (const std::string& name : names_)
            EXPECT_TRUE(__VeltoIDDBHasValidCertificate(name))
                << name << " at " << now() << describeEntry(name);
    }

    static std::string describeEntry(const std::string& name) {
        AccountRecord record;
        CertificateEntry entry;
        __VeltoIDDBCopyVeltoIDAccount(name, &record);
        __VeltoIDDBCopyCertificateInfo(record.encDsId(), &entry);
        Dictionary ofRecord = record.values();
        Dictionary ofEntry = entry.values();
        ofEntry.remove(kVeltoIDCertificateCertificateKey);
        ofEntry.remove(kVeltoIDCertificateIntermediateCertificateKey);
        ofRecord.remove(kVeltoIDAccountValidationRecordDataKey);
        return describeValue(ofRecord) + describeValue(ofEntry);
    }

    static void expectSpacing(const std::vector<double>& requests) {
        for (size_t i = 3; i < requests.size(); ++i)
            EXPECT_GE(requests[i] - requests[i - 3], kHour) << "three requests in an hour";
    }

    testing_support::AgentLife agent_{clock_};
    std::vector<double> calls_;
    std::vector<std::string> names_;
    std::optional<double> lastPass_;
    int passes_ = 0;
    std::map<std::string, double> retryIntervals_;
    int retries_ = 0;
};

TEST_F(SimulatedYear, OneAccountKeepsItsCertificate) { live({.seed = 1, .years = yearsToPass()}, 1); }

TEST_F(SimulatedYear, TwoAccountsKeepTheirs) {
    live({.seed = 2, .years = yearsToPass(), .certificateLifetime = 90 * kDay}, 2);
}

TEST_F(SimulatedYear, WithoutBadDaysHardlyAnythingHappens) {
    live({.seed = 3, .years = yearsToPass() / 2, .hasBadDays = false}, 1);
}

}  // namespace
}  // namespace veltoid
