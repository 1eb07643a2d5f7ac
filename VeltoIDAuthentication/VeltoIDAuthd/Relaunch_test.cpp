#include "VeltoIDAuthd/Relaunch.h"

#include "Platform/bus/ServiceManager.h"
#include "TestSupport/DatabaseFixture.h"
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
    /// An account that needs attention at that time from now, or (none) never.
    void createAccount(const char* name, std::optional<double> action, const char* password = "hash") {
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(name, password ? String(password) : String(), nullptr));
        Dictionary values = {{"Dirty", Value::null()}, {"LastConnectAttempt", date(1e12)}};
        // Under an embargo nothing but its end counts.
        if (action) values.set("EarliestAllowedConnectionDate", date(*action));
        ASSERT_TRUE(__VeltoIDDBSetAccountValues(name, values, Notify::No));
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
    const platform::Semaphore started;
    const platform::Semaphore opened;
    platform::WorkQueue::main().async([started, opened] {
        started.signal();
        opened.wait();
    });
    started.wait();
    scheduleRelaunch(now() + 5);
    EXPECT_EQ(platform::transactions::openCount(), 1);
    EXPECT_EQ(manager_.take(), std::nullopt);
    opened.signal();
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
    createAccount("late", 2000);
    createAccount("early", 1000);
    createAccount("as early", 1000);
    createAccount("later", 3000);
    EXPECT_EQ(copyAccountsNeedingAction(&earliest), (Array{"late", "early", "as early", "later"}));
    EXPECT_EQ(earliest, now() + 1000);
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
