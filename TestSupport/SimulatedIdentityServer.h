// An identity server with a life of its own: accounts with certificates and signed records, and days on which
// it cannot be reached, refuses, delays, revokes or asks to be left alone. What happens follows from the seed
// alone.
#pragma once

#include <algorithm>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <vector>

#include "TestSupport/FakeIdentityServer.h"
#include "TestSupport/TestAuthority.h"
#include "Values/Base64.h"

namespace veltoid::testing_support {

/// A stretch of time, in seconds since 1970.
struct Period {
    double begin = 0;
    double end = 0;
    bool includes(double time) const { return begin <= time && time < end; }
};

class SimulatedIdentityServer {
  public:
    struct Configuration {
        unsigned seed = 1;
        double years = 1;
        double certificateLifetime = 14 * 86'400;
        bool hasBadDays = true;
    };

    /// How it answers, beside what the days bring.
    struct Behaviour {
        /// Of a request not being answered with a certificate at once.
        double pendingChance = 0.5;
        bool isPendingForEver = false;
        /// What comes with a token, and with each answer that the certificate is not there yet; absent:
        /// nothing; unset: some minutes with the token.
        std::optional<Value> delay = {};
        bool refusesCertificates = false;
        bool tellsEncDsId = true;
        bool changesEncDsId = false;
        /// How long sessions may be used again (seconds).
        double sessionValidity = 0;
    };
    void behave(const Behaviour& behaviour) {
        const std::lock_guard lock(mutex_);
        behaviour_ = behaviour;
    }

    /// Answers in the fake server's place from now on, whoever did so meanwhile.
    void serve();

    SimulatedIdentityServer(FakeIdentityServer& server, platform::Clock& clock,
                            const Configuration& configuration);

    static const TestAuthority& root();

    /// When the account's certificates were asked for.
    const std::vector<double>& requests(const std::string& account) { return accounts_[account].requests; }

    /// Sign-ins that came while the account had been asked to stay away.
    int signInsDuringEmbargo() const { return signInsDuringEmbargo_; }

    /// How many certificates were issued, refused and revoked: proof that the days were as bad as they should
    /// be.
    struct Events {
        int issued = 0;
        int refused = 0;
        int revoked = 0;
        int embargoes = 0;
        int unreachable = 0;
    };
    const Events& events() const { return events_; }

    /// Whether it told an account something that changed it, or its good or bad days began.
    bool hadNews(const Period& period) const;

    /// Whether the server could be reached and gave out all it was asked for during the whole period.
    bool wasGood(const Period& period) const;

  private:
    struct Account {
        std::vector<double> requests;
        double embargoEnd = 0;
        double revoked = 0;
        Bytes requestedKey;
        int pendingPolls = 0;
        double serial = 0;
        double recordMade = 0;
        std::string token;
        std::string encDsId;
    };

    void planBadDays(const Configuration& configuration);
    bool isWithin(const std::vector<Period>& periods) const;
    double now() const { return clock_.now(); }
    /// A number from 0 to 1.
    double chance() { return std::uniform_real_distribution<double>()(random_); }

    Value authenticate(const Dictionary& parameters);
    Value getMyInfo(const Dictionary& parameters);
    Value createCert(const Dictionary& parameters);
    Value fetchCert(const Dictionary& parameters);
    Value downloadCertComplete(const Dictionary& parameters);
    Dictionary issue(Account& account);
    void tellValidity(const Account& account, const Dictionary& parameters, Dictionary& reply) const;

    /// Held while a call is answered.
    std::mutex mutex_;
    FakeIdentityServer& server_;
    platform::Clock& clock_;
    Behaviour behaviour_;
    const Configuration configuration_;
    std::mt19937 random_;
    std::map<std::string, Account> accounts_;
    std::vector<Period> unreachable_;
    std::vector<Period> refusing_;
    int signInsDuringEmbargo_ = 0;
    Events events_;
    std::vector<double> news_;
    long lastSerial_ = 1'000;
};

}  // namespace veltoid::testing_support
