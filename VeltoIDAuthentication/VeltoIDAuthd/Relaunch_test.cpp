#include "VeltoIDAuthd/Relaunch.h"

#include "Platform/bus/ServiceManager.h"
#include "TestSupport/DatabaseFixture.h"
#include "TestSupport/Journal.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

class FakeServiceManager : public platform::ServiceManager {
  public:
    uint32_t setStartInterval(uint32_t seconds) override {
        handed_ = seconds;
        return 0;
    }
    std::optional<uint32_t> take() { return std::exchange(handed_, {}); }

  private:
    std::optional<uint32_t> handed_;
    const platform::InTestLifetime<platform::ServiceManager> inLifetime_{*this};
};

class RelaunchTest : public DatabaseTest {
  protected:
    /// An account that needs attention at that time from now.
    void createAccount(const char* name, double action, const String& password = "hash") {
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(name, password, nullptr));
        // Under an embargo nothing but its end counts.
        ASSERT_TRUE(__VeltoIDDBSetAccountValues(
            name, {{"Dirty", kGone}, {"LastConnectAttempt", date(1e12)}, {kEmbargo, date(action)}},
            Notify::No));
    }

    FakeServiceManager manager_;
};

TEST_F(RelaunchTest, TheServiceManagerIsAskedForTheEarliestUnlessForced) {
    constexpr uint32_t kMost = 4'294'967'295;
    // One after the other, at the same time.
    const struct {
        const char* what;
        /// Seconds from now.
        std::optional<double> date;
        bool force;
        std::optional<uint32_t> handed;
        std::optional<double> next;
    } cases[] = {
        {"no particular time", {}, false, kMost, 1e10},
        {"earlier", 100, false, 100, 100},
        {"later", 200, false, {}, 100},
        {"no particular time is later", {}, false, {}, 100},
        {"the same", 100, false, 100, 100},
        {"later, forced", 200, true, 200, 200},
        {"in the past", -1, false, {}, {}},
        {"the first one again", 500, false, 500, 500},
        {"in the past, forced", -1, true, {}, {}},
        {"now", 0, true, 0, 0},
        {"fractions are dropped", 59.9, true, 59, 59.9},
        {"the longest", 4'294'967'295.0, true, kMost, 4'294'967'295.0},
        {"almost the longest", 4'294'967'294.5, true, kMost - 1, 4'294'967'294.5},
        {"more than the longest", 5e9, true, kMost, 5e9},
        {"not positive is no particular time", -now(), true, kMost, 1e10},
    };
    EXPECT_EQ(nextLaunchDate(), std::nullopt);
    for (const auto& [what, date, force, handed, next] : cases) {
        SCOPED_TRACE(what);
        scheduleRelaunch(date ? std::optional(now() + *date) : std::nullopt,
                         force ? RelaunchDate::Replaces : RelaunchDate::OnlyIfEarlier);
        clock_.settle();
        EXPECT_EQ(manager_.take(), handed);
        EXPECT_EQ(nextLaunchDate(), next ? std::optional(now() + *next) : std::nullopt);
        EXPECT_EQ(platform::transactions::openCount(), 0);
    }
}

TEST_F(RelaunchTest, ATransactionIsOpenUntilTheServiceManagerIsAsked) {
    const platform::Gate gate(platform::WorkQueue::main());
    scheduleRelaunch(now() + 5);
    EXPECT_EQ(platform::transactions::openCount(), 1);
    EXPECT_EQ(manager_.take(), std::nullopt);
    gate.open();
    clock_.settle();
    EXPECT_EQ(platform::transactions::openCount(), 0);
    EXPECT_EQ(manager_.take(), 5U);
}

TEST_F(RelaunchTest, AccountsThatNeedAnActionAndWhen) {
    std::optional<double> earliest = 1;
    EXPECT_TRUE(copyAccountsNeedingAction(&earliest).empty());
    EXPECT_EQ(earliest, std::nullopt);
    createAccount("no password", 5, nullptr);
    EXPECT_TRUE(copyAccountsNeedingAction(nullptr).empty());
    for (const auto& [name, action] :
         {std::pair("late", 2000), {"early", 1000}, {"as early", 1000}, {"later", 3000}})
        createAccount(name, action);
    EXPECT_EQ(copyAccountsNeedingAction(&earliest), (Array{"late", "early", "as early", "later"}));
    EXPECT_EQ(earliest, now() + 1000);
}

TEST_F(RelaunchTest, WhatTheServerAskedForHidesNothingNearerAndOutlivesTheAgent) {
    const auto begin = [this] {
        platform::TestLifetime::restart();
        __VeltoIDDBSetUsePreferences(true);
        restoreRequestedLaunch();
        clock_.settle();
    };
    begin();
    const double requested = now() + 20 * kDay;
    scheduleRelaunch(now() + kDay);
    scheduleRequestedLaunch(requested);
    clock_.settle();
    EXPECT_EQ(manager_.take(), kDay);
    EXPECT_EQ(nextLaunchDate(), requested) << "told until it has come";
    __VeltoIDDBSynchronize();
    begin();
    EXPECT_EQ(nextLaunchDate(), requested);
    scheduleRelaunch(now() + 30 * kDay);
    clock_.settle();
    EXPECT_EQ(manager_.take(), 20 * kDay);
    clock_.advanceBy(21 * kDay);
    EXPECT_EQ(nextLaunchDate(), now() + 9 * kDay);
}

TEST_F(RelaunchTest, TheEarliestActionIsWhenTheAgentComesBack) {
    scheduleRelaunch(now() + 10);
    computeRelaunchFromAccounts();
    clock_.settle();
    EXPECT_EQ(manager_.take(), 10U) << "without accounts what was asked for stays";
    createAccount("a", 1000);
    createAccount("b", 500);
    EXPECT_EQ(platform::transactions::openCount(), 1);
    computeRelaunchFromAccounts();
    clock_.settle();
    EXPECT_EQ(manager_.take(), 500U) << "even though it is later";
    EXPECT_EQ(platform::transactions::openCount(), 0) << "the database is made durable";
}

}  // namespace
}  // namespace veltoid
