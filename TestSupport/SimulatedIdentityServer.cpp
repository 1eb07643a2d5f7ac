#include "TestSupport/SimulatedIdentityServer.h"

#include <algorithm>
#include <cmath>
#include <ctime>

namespace veltoid::testing_support {

namespace {

constexpr double kDay = 86'400;

std::string generalizedTime(double seconds) {
    const auto whole = static_cast<time_t>(seconds);
    std::tm fields{};
    gmtime_r(&whole, &fields);
    char text[32];
    std::strftime(text, sizeof text, "%Y%m%d%H%M%SZ", &fields);
    return text;
}

std::string serialText(double serial) {
    char text[32];
    std::snprintf(text, sizeof text, "%lX", static_cast<long>(serial));
    return text;
}

const TestAuthority& intermediate() {
    static const TestAuthority authority("Intermediate", &SimulatedIdentityServer::root());
    return authority;
}

}  // namespace

/// Making keys takes long: one authority for all servers of a process.
const TestAuthority& SimulatedIdentityServer::root() {
    static const TestAuthority authority("Root");
    return authority;
}

SimulatedIdentityServer::SimulatedIdentityServer(FakeIdentityServer& server, platform::Clock& clock,
                                                 const Configuration& configuration)
    : server_(server), clock_(clock), configuration_(configuration), random_(configuration.seed) {
    if (configuration.hasBadDays) planBadDays(configuration);
    serve();
}

void SimulatedIdentityServer::serve() {
    const auto answer = [&](const char* method, Value (SimulatedIdentityServer::*reply)(const Dictionary&)) {
        server_.answerWith(method, [this, reply](const Dictionary& parameters) -> Value {
            const std::lock_guard lock(mutex_);
            if (isWithin(unreachable_)) {
                ++events_.unreachable;
                return FakeIdentityServer::noAnswer();
            }
            return (this->*reply)(parameters);
        });
    };
    answer("authenticate", &SimulatedIdentityServer::authenticate);
    answer("getMyInfo", &SimulatedIdentityServer::getMyInfo);
    answer("createCert", &SimulatedIdentityServer::createCert);
    answer("fetchCert", &SimulatedIdentityServer::fetchCert);
    answer("downloadCertComplete", &SimulatedIdentityServer::downloadCertComplete);
}

void SimulatedIdentityServer::planBadDays(const Configuration& configuration) {
    const double end = now() + configuration.years * 365 * kDay;
    for (auto* periods : {&unreachable_, &refusing_})
        for (double begin = now() + 5 * kDay; begin < end;
             begin = periods->back().end + (1 + 15 * chance()) * kDay)
            // From minutes to weeks.
            periods->push_back({begin, begin + 300 * std::pow(6'000, chance())});
}

bool SimulatedIdentityServer::isWithin(const std::vector<Period>& periods) const {
    return std::any_of(periods.begin(), periods.end(),
                       [&](const Period& each) { return each.includes(now()); });
}

bool SimulatedIdentityServer::hadNews(const Period& period) const {
    for (const auto* periods : {&unreachable_, &refusing_})
        for (const Period& bad : *periods)
            if (period.includes(bad.begin) || period.includes(bad.end)) return true;
    const auto next = std::lower_bound(news_.begin(), news_.end(), period.begin);
    return next != news_.end() && *next < period.end;
}

bool SimulatedIdentityServer::wasGood(const Period& period) const {
    for (const auto* periods : {&unreachable_, &refusing_})
        for (const Period& bad : *periods)
            if (bad.begin < period.end && period.begin < bad.end) return false;
    return std::none_of(accounts_.begin(), accounts_.end(),
                        [&](const auto& account) { return period.begin < account.second.embargoEnd; });
}

Value SimulatedIdentityServer::authenticate(const Dictionary& parameters) {
    const std::string name = parameters.string("veltoConnect").text();
    Account& account = accounts_[name];
    if (now() < account.embargoEnd) ++signInsDuringEmbargo_;
    if (account.encDsId.empty() || behaviour_.changesEncDsId)
        account.encDsId = "d-" + name + (behaviour_.changesEncDsId ? std::to_string(random_()) : "");
    Dictionary reply = {{"dsSession", name}, {"Version", Value::int32(101)}};
    if (behaviour_.tellsEncDsId) reply.set("encDsId", account.encDsId);
    if (behaviour_.sessionValidity > 0)
        reply.set("dsSessionValidityDuration", Value::real(behaviour_.sessionValidity));
    if (configuration_.hasBadDays && chance() < 0.02) {
        account.embargoEnd = now() + 6 * 3'600;
        reply.set("DoNotConnectForX", Value::int32(6 * 3'600));
        ++events_.embargoes;
        news_.push_back(now());
    }
    return reply;
}

Value SimulatedIdentityServer::getMyInfo(const Dictionary& parameters) {
    if (isWithin(refusing_)) return FakeIdentityServer::faultOf(-5);
    const std::string name = parameters.string("dsSession").text();
    Account& account = accounts_[name];
    if (configuration_.hasBadDays && account.serial > 0 && chance() < 0.02) {
        account.serial = 0;
        account.revoked = now();
        ++events_.revoked;
        news_.push_back(now());
    }
    Dictionary reply = {{"encDsId", account.encDsId}, {"ValidatedEmail", Array{name}}};
    // Another case, or an alias.
    if (configuration_.hasBadDays && chance() < 0.2)
        reply.set("VeltoID", (chance() < 0.5 ? "ALIAS" : "Account") + name.substr(7));
    tellValidity(account, parameters, reply);
    const std::string identifier = "record of " + std::to_string(account.recordMade);
    if (account.recordMade == 0 || parameters.string("ClientVIDVRecordIdentifier") != identifier) {
        account.recordMade = now();
        const Data record(root().sign("<plist><dict><key>ValidAsOf</key><string>" + [&] {
            std::string text = generalizedTime(now());
            return text.substr(0, 4) + "-" + text.substr(4, 2) + "-" + text.substr(6, 2) + "T" +
                   text.substr(8, 2) + ":" + text.substr(10, 2) + ":" + text.substr(12, 2) + "Z";
        }() + "</string><key>SuggestValidDuration</key><integer>2592000</integer></dict></plist>"));
        reply.set("VIDVRecord", base64Encode(record));
        reply.set("VIDVRecordIdentifier", "record of " + std::to_string(account.recordMade));
    }
    return reply;
}

void SimulatedIdentityServer::tellValidity(const Account& account, const Dictionary& parameters,
                                           Dictionary& reply) const {
    if (const String serial = parameters.string("CertificateSerialNumber"))
        reply.set("CertificateIsValid", Value::boolean(serial == serialText(account.serial)));
}

Dictionary SimulatedIdentityServer::issue(Account& account) {
    account.serial = static_cast<double>(++lastSerial_);
    ++events_.issued;
    news_.push_back(now());
    const double expires = now() + configuration_.certificateLifetime;
    const Bytes certificate =
        intermediate().issue(account.requestedKey, {.notBefore = generalizedTime(now()),
                                                    .notAfter = generalizedTime(expires),
                                                    .serialNumber = lastSerial_});
    Dictionary issued = {{"Certificate", pemOf(certificate)},
                         {"IntermediateCert", pemOf(intermediate().certificate())},
                         {"CertStatus", "CERT_ISSUED"},
                         {"SerialNumber", serialText(account.serial)}};
    if (!configuration_.hasBadDays || chance() < 0.8) issued.set("Expires", Value::date(expires));
    return issued;
}

Value SimulatedIdentityServer::createCert(const Dictionary& parameters) {
    Account& account = accounts_[parameters.string("dsSession").text()];
    account.requests.push_back(now());
    account.requestedKey = readRequest(parameters.string("CSR").text()).publicKey;
    if (isWithin(refusing_) || behaviour_.refusesCertificates) {
        ++events_.refused;
        return Dictionary{{"dsCert", Dictionary{{"CertStatus", "FAILED"}}}};
    }
    if (chance() >= behaviour_.pendingChance) return Dictionary{{"dsCert", issue(account)}};
    news_.push_back(now());
    account.pendingPolls = static_cast<int>(4 * chance());
    account.token = "token " + std::to_string(random_());
    return Dictionary{
        {"CertificateToken", account.token},
        {"Delay", behaviour_.delay.value_or(Value::int32(static_cast<int>(10 + 600 * chance())))}};
}

Value SimulatedIdentityServer::fetchCert(const Dictionary& parameters) {
    Account& account = accounts_[parameters.string("dsSession").text()];
    if (parameters.string("CertificateToken") != account.token) return FakeIdentityServer::faultOf(-9);
    if (behaviour_.isPendingForEver)
        return Dictionary{{"dsCert", Dictionary{{"CertStatus", "SIGNIN_PENDING"}}},
                          {"Delay", behaviour_.delay.value_or(Value())}};
    if (behaviour_.refusesCertificates) return Dictionary{{"dsCert", Dictionary{{"CertStatus", "FAILED"}}}};
    if (behaviour_.pendingChance > 0 && account.pendingPolls-- > 0) return FakeIdentityServer::faultOf(-4164);
    return Dictionary{{"dsCert", issue(account)}};
}

/// Forgets the token.
Value SimulatedIdentityServer::downloadCertComplete(const Dictionary& parameters) {
    accounts_[parameters.string("dsSession").text()].token.clear();
    return Dictionary{{"done", "yes"}};
}

}  // namespace veltoid::testing_support
