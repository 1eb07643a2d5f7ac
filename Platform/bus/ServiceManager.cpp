// systemd, if the agent runs as its unit. The relaunch is one transient timer, and its date is one of the
// wall clock: a suspended device and a clock that is set come out right. A transient timer starts the service
// of its own name, which is installed as another name of the agent's.
//
// systemd creates a unit but does not change it: a timer that is still there has to be stopped first. What is
// asked for becomes a job, and only the job's end tells whether it was done. One such exchange is under way
// at most; an interval that is set meanwhile is handed over after it.
#include "Platform/bus/ServiceManager.h"

#include <systemd/sd-bus.h>
#include <systemd/sd-daemon.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "Platform/bus/BusConnection.h"
#include "Platform/encoding/CalendarText.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"
#include "Platform/runtime/Transactions.h"

namespace platform {
namespace {

constexpr const char* kManagerName = "org.freedesktop.systemd1";
constexpr const char* kManagerPath = "/org/freedesktop/systemd1";
constexpr const char* kManagerInterface = "org.freedesktop.systemd1.Manager";
constexpr const char* kUnitPathPrefix = "/org/freedesktop/systemd1/unit";
constexpr const char* kUnitExists = "org.freedesktop.systemd1.UnitExists";
constexpr const char* kNoSuchUnit = "org.freedesktop.systemd1.NoSuchUnit";
constexpr const char* kJobDone = "done";

/// A date that has passed by the time the manager reads it never comes: what is nearer than this (seconds)
/// is handed over as a delay.
constexpr double kMinTimeToDate = 5;
constexpr double kMinDelay = 1;

constexpr uint64_t kMicrosecondsPerSecond = 1'000'000;
constexpr uint64_t kTimerAccuracy = 100'000;

/// Another process may create the timer at the same time. It is stopped only so many times to make room.
constexpr int kMaxStops = 3;

const Product& product() { return Lifetime::current().product(); }

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;
using MessageHandler = int (*)(sd_bus_message* message, void* context, sd_bus_error* error);

/// Of the form of systemd.time(7).
std::string calendarDate(double date) {
    const auto microseconds = static_cast<uint64_t>((date - std::floor(date)) * kMicrosecondsPerSecond);
    const std::string fraction = std::to_string(kMicrosecondsPerSecond + microseconds).substr(1);
    return calendarText(date, "%Y-%m-%d %H:%M:%S.").value_or("") + fraction + " UTC";
}

/// The manager is only spoken to: asking the bus to start one would start nothing that manages this process.
Message callTo(sd_bus* bus, const char* method) {
    sd_bus_message* call = nullptr;
    if (sd_bus_message_new_method_call(bus, &call, kManagerName, kManagerPath, kManagerInterface, method) >=
        0)
        sd_bus_message_set_auto_start(call, 0);
    return {call, sd_bus_message_unref};
}

int appendTimer(sd_bus_message* call, double date) {
    const auto append = [call](auto... schedule) {
        return sd_bus_message_append(call, "ssa(sv)a(sa(sv))", product().timerUnit, "replace", 5,  //
                                     "Description", "s", product().timerDescription,               //
                                     "AccuracyUSec", "t", kTimerAccuracy,                          //
                                     "RemainAfterElapse", "b", 0,                                  //
                                     "CollectMode", "s", "inactive-or-failed", schedule..., 0);
    };
    const double left = date - Clock::shared().now();
    if (left >= kMinTimeToDate)
        return append("TimersCalendar", "a(ss)", 1, "OnCalendar", calendarDate(date).c_str());
    const auto delay = static_cast<uint64_t>(std::max(left, kMinDelay) * kMicrosecondsPerSecond);
    return append("TimersMonotonic", "a(st)", 1, "OnActiveSec", delay);
}

bool isServiceUnit(sd_bus_message* reply) {
    const char* unit = nullptr;
    char* expected = nullptr;
    const bool same = sd_bus_message_is_method_error(reply, nullptr) <= 0 &&
                      sd_bus_message_read(reply, "o", &unit) >= 0 &&
                      sd_bus_path_encode(kUnitPathPrefix, product().serviceUnit, &expected) >= 0 &&
                      std::strcmp(unit, expected) == 0;
    std::free(expected);
    return same;
}

/// Every callback comes with this object, which lives as long as the connection.
class Systemd : public ServiceManager {
  public:
    Systemd() {
        bus::onDisconnect([this] {
            if (!job_.path.empty()) fail("the message bus is gone");
        });
    }
    ~Systemd() override { sd_bus_slot_unref(jobRemoved_); }
    Systemd(const Systemd&) = delete;
    Systemd& operator=(const Systemd&) = delete;

    uint32_t setStartInterval(uint32_t seconds) override {
        const uint32_t previous = std::exchange(interval_, seconds);
        if (!mayBeUnit() || Lifetime::current().isEnding()) return previous;
        date_ = Clock::shared().now() + seconds;
        changed_ = true;
        handedOver_ = false;
        if (!underWay_) begin();
        return previous;
    }

    void whenHandedOver(const std::function<void()>& function) override {
        if (underWay_)
            waiting_.push_back(function);
        else
            function();
    }

    void canStartAgain(const std::function<void(bool)>& answer) override {
        if (!mayBeUnit() || !handedOver_) {
            answer(false);
            return;
        }
        answers_.push_back(answer);
        if (answers_.size() == 1 && askForOwnUnit(calling<&Systemd::onAnswer>) < 0) giveAnswers(false);
    }

    void announceReady() override { sd_notify(0, "READY=1"); }
    void announceStopping() override { sd_notify(0, "STOPPING=1"); }

  private:
    /// Children of other units inherit these as well: the manager knows better.
    static bool mayBeUnit() {
        return std::getenv("INVOCATION_ID") != nullptr && std::getenv("NOTIFY_SOCKET") != nullptr;
    }

    // --- One exchange: own unit (once), create the timer, and when it is there stop it and create it again

    void begin() {
        underWay_ = true;
        stops_ = 0;
        transactions::began();
        const int result = isUnit_ ? createTimer() : askForOwnUnit(calling<&Systemd::onOwnUnit>);
        if (result < 0) fail(std::strerror(-result));
    }

    void end() {
        underWay_ = false;
        job_ = {};
        jobRemoved_ = sd_bus_slot_unref(jobRemoved_);
        transactions::ended();
        for (const auto& function : std::exchange(waiting_, {})) function();
    }

    void fail(const std::string& reason) {
        if (!std::exchange(reported_, true))
            VELTOID_PLATFORM_LOG(Error, "The service manager does not start the agent again: " + reason);
        end();
    }

    void fail(sd_bus_message* reply) {
        const sd_bus_error* error = sd_bus_message_get_error(reply);
        fail(error->message != nullptr ? error->message : error->name);
    }

    int sendWith(const Message& call, int appended, MessageHandler handle) {
        return appended < 0 ? appended : sd_bus_call_async(nullptr, nullptr, call.get(), handle, this, 0);
    }

    int askForOwnUnit(MessageHandler handle) {
        sd_bus* bus = bus::connection();
        if (bus == nullptr) return -ENOTCONN;
        const Message call = callTo(bus, "GetUnitByPID");
        constexpr uint32_t kCaller = 0;
        return sendWith(call, sd_bus_message_append(call.get(), "u", kCaller), handle);
    }

    int createTimer() {
        changed_ = false;
        const int result = watchJobs();
        const Message call = callTo(bus::connection(), "StartTransientUnit");
        return result < 0 ? result
                          : sendWith(call, appendTimer(call.get(), date_), calling<&Systemd::onCreating>);
    }

    int stopTimer() {
        const Message call = callTo(bus::connection(), "StopUnit");
        return sendWith(call, sd_bus_message_append(call.get(), "ss", product().timerUnit, "replace"),
                        calling<&Systemd::onStopping>);
    }

    /// systemd reports the end of a job to the connection that has asked for it.
    int watchJobs() {
        if (jobRemoved_ != nullptr) return 0;
        return sd_bus_match_signal_async(bus::connection(), &jobRemoved_, nullptr, kManagerPath,
                                         kManagerInterface, "JobRemoved", calling<&Systemd::onJobRemoved>,
                                         nullptr, this);
    }

    void proceed(int result) {
        if (result < 0) fail(std::strerror(-result));
    }

    // --- What the manager says

    template <void (Systemd::*handle)(sd_bus_message*)>
    static int calling(sd_bus_message* message, void* context, sd_bus_error* /*error*/) noexcept {
        (static_cast<Systemd*>(context)->*handle)(message);
        return 0;
    }

    void onOwnUnit(sd_bus_message* reply) {
        isUnit_ = isServiceUnit(reply);
        if (isUnit_)
            proceed(createTimer());
        else
            end();
    }

    void onCreating(sd_bus_message* reply) {
        if (sd_bus_message_is_method_error(reply, kUnitExists) > 0 && stops_++ < kMaxStops)
            proceed(stopTimer());
        else
            waitForJob(reply, &Systemd::created);
    }

    void onStopping(sd_bus_message* reply) {
        if (sd_bus_message_is_method_error(reply, kNoSuchUnit) > 0)
            proceed(createTimer());  // it has just elapsed
        else
            waitForJob(reply, &Systemd::stopped);
    }

    void waitForJob(sd_bus_message* reply, void (Systemd::*then)(const std::string& outcome)) {
        const char* job = nullptr;
        if (sd_bus_message_is_method_error(reply, nullptr) > 0) return fail(reply);
        if (const int result = sd_bus_message_read(reply, "o", &job); result < 0) return proceed(result);
        job_ = {job, then};
    }

    void onJobRemoved(sd_bus_message* signal) {
        uint32_t id = 0;
        const char* job = nullptr;
        const char* unit = nullptr;
        const char* outcome = nullptr;
        if (sd_bus_message_read(signal, "uoss", &id, &job, &unit, &outcome) < 0 || job != job_.path) return;
        (this->*std::exchange(job_, {}).then)(outcome);
    }

    void created(const std::string& outcome) {
        if (outcome != kJobDone) return fail("the timer's job is " + outcome);
        if (changed_) {
            stops_ = 0;
            return proceed(createTimer());
        }
        handedOver_ = true;
        end();
    }

    void stopped(const std::string& /*outcome*/) { proceed(createTimer()); }

    void onAnswer(sd_bus_message* reply) { giveAnswers(isServiceUnit(reply)); }

    void giveAnswers(bool can) {
        for (const auto& answer : std::exchange(answers_, {})) answer(can && handedOver_);
    }

    /// What is waited for, and what its end leads to.
    struct Job {
        std::string path;
        void (Systemd::*then)(const std::string& outcome) = nullptr;
    };

    uint32_t interval_ = 0;
    double date_ = 0;
    /// The interval was set after the last timer was asked for.
    bool changed_ = false;
    /// There is a timer for the interval, or no interval.
    bool handedOver_ = true;
    bool underWay_ = false;
    bool isUnit_ = false;
    bool reported_ = false;
    int stops_ = 0;
    Job job_;
    sd_bus_slot* jobRemoved_ = nullptr;
    std::vector<std::function<void()>> waiting_;
    std::vector<std::function<void(bool)>> answers_;
};

}  // namespace

ServiceManager& ServiceManager::shared() { return Lifetime::current().part<ServiceManager, Systemd>(); }

}  // namespace platform
