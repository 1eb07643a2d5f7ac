// Every state of an account with every kind of server, for more than a day of simulated time in which the
// agent comes and goes: how often it is started and asks, that it goes on trying, and that the account is
// usable soon after the trouble ends.
#include "TestSupport/AgentLife.h"
#include "TestSupport/SimulatedIdentityServer.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"

namespace veltoid {
namespace {

using testing_support::AgentLife;
using testing_support::mostWithin;
using testing_support::SimulatedIdentityServer;
using Behaviour = SimulatedIdentityServer::Behaviour;

constexpr double kHour = 3'600;
/// The first minute with an account, and the pass after it.
constexpr double kFirstWhile = 75;
constexpr double kTrouble = 30 * kHour;
/// The longest that an account which its user waits for stays unusable once nothing is in its way, with the
/// agent's start.
constexpr double kMaxRepair = kHour + 60;
/// An account that is due is looked at in the next pass.
constexpr double kTolerance = 10;

constexpr size_t kMaxStartsFirstHour = 15;
constexpr size_t kMaxCallsFirstHour = 40;
constexpr size_t kMaxStartsPerHour = 6;
constexpr size_t kMaxCallsPerHour = 12;

/// The most of each that any cell has seen.
struct Figures {
    size_t startsFirstHour = 0, callsFirstHour = 0, callsFirstWhile = 0, starts = 0, calls = 0,
           startsLate = 0;
    double repair = 0;
};
Figures figures;

/// One account, one server, one agent.
class Cell : public ServerTest {
  public:
    void TestBody() override {}
    void begin() {
        SetUp();
        trust(SimulatedIdentityServer::root());
        life_.onLook = [this] { look(); };
    }
    void end() {
        // What is under way comes to its end.
        live(120);
        doNotCompareWithDisk();
        TearDown();
    }

    // What an account is.
    void add() {
        life_.ask([] {
            (void)(addOnlyAccount(kName, kPassword, {}, {wakeAccountCheck, [] { return false; }}, nullptr));
        });
    }
    void create(const String& encDsId) {
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, kPassword, encDsId));
    }
    void issue() {
        add();
        live(3 * kHour);
        ASSERT_TRUE(__VeltoIDDBHasValidCertificate(kName));
    }
    void set(const Dictionary& values) { setValues(values); }
    void setInCertificate(const Dictionary& values) {
        for (const auto& [key, value] : values)
            __VeltoIDDBSetCertificateValue(record().string("encDsId"), key, value, Notify::No);
    }
    static String encDsId() { return std::string("d-") + kName; }

    // What happens to the server, and to the device.
    FakeIdentityServer& server() { return server_; }
    SimulatedIdentityServer& simulation() { return simulation_; }
    void every(const platform::FakeHTTPAnswer& answer) {
        for (const char* method :
             {"authenticate", "getMyInfo", "createCert", "fetchCert", "downloadCertComplete"})
            server_.set(method, answer);
    }
    void everyFault(int64_t code) {
        for (const char* method :
             {"authenticate", "getMyInfo", "createCert", "fetchCert", "downloadCertComplete"})
            server_.fault(method, code);
    }
    void trust(const testing_support::TestAuthority& authority) const {
        setenv("XDG_CONFIG_HOME", directory_.base().c_str(), 1);
        std::filesystem::create_directories(authorityFile().parent_path());
        std::ofstream(authorityFile()) << testing_support::pemOf(authority.certificate());
    }
    void trustNobody() const { std::filesystem::remove(authorityFile()); }
    void intervals(const Value& value) const {
        for (const char* key :
             {"DefaultRelaunchInterval", "AccountValidationInterval", "CertificateValidationInterval",
              "CertificateRenewalInterval", "PreExpirationInterval", "AccountPresumedValidInterval",
              "VeltoIDMetaInfoValidationRecordRenewalAttemptInterval"})
            __VeltoIDDBSetMetaInfoValue(nullptr, key, value);
    }
    void heal() {
        simulation_.behave({.pendingChance = 0});
        simulation_.serve();
        trust(SimulatedIdentityServer::root());
        intervals(kGone);
    }

    void ask(const std::function<void()>& command) { life_.ask(command); }
    void live(double seconds) { life_.liveUntil(now() + seconds); }
    double date() const { return now(); }

    /// From here on everything counts.
    void beginCount() {
        begin_ = now();
        (void)server_.take();
    }
    void expectFewStartsAndCalls(size_t maxCallsFirstWhile) {
        if (embargoEnd_ > 0) {
            EXPECT_TRUE(calls_.empty() || calls_.front() >= embargoEnd_);
            begin_ = embargoEnd_;
        }
        const double end = now();
        const double kFirst = 30;
        const auto most = [&](const std::vector<double>& dates, double length, double from, double until,
                              size_t limit, size_t& figure, const char* what) {
            const size_t found = mostWithin(dates, length, from, until);
            EXPECT_LE(found, limit) << what << describeWithin(dates, from);
            figure = std::max(figure, found);
        };
        most(life_.starts(), kHour, begin_, begin_ + kFirst, kMaxStartsFirstHour, figures.startsFirstHour,
             "starts first");
        most(calls_, kHour, begin_, begin_ + kFirst, kMaxCallsFirstHour, figures.callsFirstHour,
             "calls first");
        most(calls_, kFirstWhile, begin_, begin_ + kFirst, maxCallsFirstWhile, figures.callsFirstWhile,
             "first while");
        most(life_.starts(), kHour, begin_ + kHour, end, kMaxStartsPerHour, figures.starts, "starts");
        most(calls_, kHour, begin_ + kHour, end, kMaxCallsPerHour, figures.calls, "calls");
        most(life_.starts(), 10 * kHour, end - 10 * kHour, end, 12, figures.startsLate, "starts late");
    }
    void expectUsableSoon() {
        const double healed = now();
        // What the server has refused needs its user.
        if (!hasPassword()) add();
        while (!__VeltoIDDBHasValidCertificate(kName) && now() < std::max(healed, embargoEnd_) + kMaxRepair)
            live(30);
        EXPECT_TRUE(__VeltoIDDBHasValidCertificate(kName)) << describeValue(record());
        figures.repair = std::max(figures.repair, now() - std::max(healed, embargoEnd_));
    }
    double embargoEnd_ = 0;

  private:
    std::filesystem::path authorityFile() const {
        return directory_.base() / kVeltoIDFolder / kVeltoIDIdentityAuthorityFile;
    }
    std::string describeWithin(const std::vector<double>& dates, double from) const {
        std::string text = ":";
        for (const double each : dates)
            if (each >= from && each < from + 3 * kHour)
                text += " " + std::to_string(std::lround(each - begin_));
        return text;
    }
    /// What the status says of the next action is about to happen, or the agent will be there.
    void look() {
        for (const auto& call : server_.take()) {
            calls_.push_back(now());
            if (std::getenv("VELTOID_TRACE") != nullptr)
                std::printf("%.0f %s\n", now() - begin_, call.method.c_str());
        }
        const auto next = copyNextActionDateForAccount(kName);
        if (!next) return;
        // The first pass may be yet to come.
        const double since = life_.isRunning()
                                 ? std::max(*next, life_.starts().back() + kVeltoIDFirstAccountCheckDelay)
                                 : *next;
        EXPECT_GE(since, now() - kTolerance) << "the next action is overdue";
        if (life_.isRunning()) return;
        EXPECT_LE(life_.alarm().value_or(1e12), std::max(*next, now()) + 1) << "the agent comes too late";
    }

    AgentLife life_{clock_};
    SimulatedIdentityServer simulation_{server_, clock_, {.hasBadDays = false}};
    double begin_ = 0;
    std::vector<double> calls_;
};

struct Server {
    const char* what;
    void (*makes)(Cell& cell);
    /// A token without a delay is asked with every half minute at first, each time with a sign-in.
    size_t maxCallsFirstWhile = 8;
};
const platform::FakeHTTPAnswer kRubbish{200,
                                        "<html><body>Please log in to the hotel's network</body></html>"};
const Server kServers[] = {
    {"up", [](Cell& /*cell*/) {}},
    {"up, sessions", [](Cell& cell) { cell.simulation().behave({.sessionValidity = 600}); }},
    {"503", [](Cell& cell) { cell.every({503}); }},
    {"no answer",
     [](Cell& cell) {
         cell.every({0, {}, platform::HTTPError{7, "cannot connect"}});
     }},
    {"wrong password", [](Cell& cell) { cell.server().fault("authenticate", -20101); }},
    {"disabled", [](Cell& cell) { cell.server().fault("authenticate", -20209); }},
    {"no certificates", [](Cell& cell) { cell.simulation().behave({.refusesCertificates = true}); }},
    {"no certificates, sessions",
     [](Cell& cell) { cell.simulation().behave({.refusesCertificates = true, .sessionValidity = 600}); }},
    {"faults", [](Cell& cell) { cell.everyFault(-5); }},
    {"faults but sign-in",
     [](Cell& cell) {
         for (const char* method : {"getMyInfo", "createCert", "fetchCert"}) cell.server().fault(method, -5);
     }},
    {"rubbish", [](Cell& cell) { cell.every(kRubbish); }},
    {"rubbish but sign-in",
     [](Cell& cell) {
         for (const char* method : {"getMyInfo", "createCert", "fetchCert"})
             cell.server().set(method, kRubbish);
     }},
    {"no encDsId", [](Cell& cell) { cell.simulation().behave({.tellsEncDsId = false}); }},
    {"another encDsId each time",
     [](Cell& cell) { cell.simulation().behave({.pendingChance = 0, .changesEncDsId = true}); }},
    {
        "pending, delay 0",
        [](Cell& cell) {
            cell.simulation().behave(
                {.pendingChance = 1, .isPendingForEver = true, .delay = Value::int32(0)});
        },
    },
    {
        "pending, no delay",
        [](Cell& cell) {
            cell.simulation().behave({.pendingChance = 1, .isPendingForEver = true, .delay = Value()});
        },
    },
    {"pending, delay -1, sessions",
     [](Cell& cell) {
         cell.simulation().behave({.pendingChance = 1,
                                   .isPendingForEver = true,
                                   .delay = Value::int32(-1),
                                   .sessionValidity = 600});
     }},
    {"no authority",
     [](Cell& cell) {
         cell.simulation().behave({.pendingChance = 0});
         cell.trustNobody();
     }},
    {"another authority",
     [](Cell& cell) {
         cell.simulation().behave({.pendingChance = 0});
         cell.trust(testing_support::TestAuthority("Other"));
     }},
    {"intervals 0", [](Cell& cell) { cell.intervals(Value::int64(0)); }},
    {"intervals negative", [](Cell& cell) { cell.intervals(Value::int64(-100)); }},
    {"intervals huge", [](Cell& cell) { cell.intervals(Value::real(1e300)); }},
    {"intervals text", [](Cell& cell) { cell.intervals(Value("soon")); }},
};

struct State {
    const char* what;
    /// Before the server turns to what it is, and after.
    void (*prepare)(Cell& cell);
    void (*make)(Cell& cell);
};
void nothing(Cell& /*cell*/) {}
const State kStates[] = {
    {"Added", nothing, [](Cell& cell) { cell.add(); }},
    {"NoEncDsId", nothing, [](Cell& cell) { cell.create(nullptr); }},
    {"NoCertificate", nothing, [](Cell& cell) { cell.create(Cell::encDsId()); }},
    {"Pending",
     [](Cell& cell) {
         cell.simulation().behave({.pendingChance = 1, .isPendingForEver = true});
         cell.add();
         cell.live(3 * kHour);
         cell.heal();
     },
     nothing},
    {"Good", [](Cell& cell) { cell.issue(); }, nothing},
    {"RenewalDue", [](Cell& cell) { cell.issue(); },
     [](Cell& cell) {
         cell.setInCertificate({{kRenewal, Value::date(cell.date() - 1)}});
     }},
    {"Expired", [](Cell& cell) { cell.issue(); },
     [](Cell& cell) {
         cell.setInCertificate({{"Expires", Value::date(cell.date() - 1)}});
     }},
    {"Revoked", [](Cell& cell) { cell.issue(); },
     [](Cell& cell) {
         cell.setInCertificate({{"CertStatus", "CERTIFICATE_INVALID"}});
     }},
    {"RecordDue", [](Cell& cell) { cell.issue(); },
     [](Cell& cell) {
         cell.set({{kNextCheck, Value::date(cell.date() - 1)}});
     }},
    {"Forced", [](Cell& cell) { cell.issue(); },
     [](Cell& cell) {
         cell.set({{"ForceValidation", kOn}});
     }},
    {"Embargo", nothing,
     [](Cell& cell) {
         cell.create(Cell::encDsId());
         cell.embargoEnd_ = cell.date() + 2 * kHour;
         cell.set({{kEmbargo, Value::date(cell.embargoEnd_)}});
     }},
};

/// All of them where VELTOID_YEARS asks for a long test, or the one that VELTOID_SERVER names; else every
/// third, a different one for each state.
bool isChosen(const State& state, const Server& server) {
    if (const char* only = std::getenv("VELTOID_SERVER")) return std::string(server.what) == only;
#ifdef VELTOID_SANITIZED
    constexpr long kEvery = 8;
#else
    constexpr long kEvery = 3;
#endif
    return std::getenv("VELTOID_YEARS") != nullptr || (&server - kServers + (&state - kStates)) % kEvery == 0;
}

class SimulatedMatrix : public testing::TestWithParam<const State*> {};

TEST_P(SimulatedMatrix, FewStartsAndCallsAndUsableSoonAfter) {
    for (const Server& server : kServers) {
        if (!isChosen(*GetParam(), server)) continue;
        SCOPED_TRACE(server.what);
        Cell cell;
        cell.begin();
        GetParam()->prepare(cell);
        server.makes(cell);
        cell.beginCount();
        cell.ask([&] { GetParam()->make(cell); });
        cell.live(kTrouble);
        cell.expectFewStartsAndCalls(server.maxCallsFirstWhile);
        cell.heal();
        cell.expectUsableSoon();
        cell.end();
    }
    std::printf(
        "first hour: %zu starts, %zu calls, %zu of them in %.0f s; later: %zu starts, %zu calls; last ten "
        "hours: "
        "%zu starts; usable after %.0f s\n",
        figures.startsFirstHour, figures.callsFirstHour, figures.callsFirstWhile, kFirstWhile, figures.starts,
        figures.calls, figures.startsLate, figures.repair);
}

INSTANTIATE_TEST_SUITE_P(States, SimulatedMatrix, testing::ValuesIn([] {
                             std::vector<const State*> states;
                             for (const State& each : kStates) states.push_back(&each);
                             return states;
                         }()),
                         [](const auto& info) { return info.param->what; });

}  // namespace
}  // namespace veltoid
