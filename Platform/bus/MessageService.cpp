#include "Platform/bus/MessageService.h"

#include <poll.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <map>
#include <utility>
#include <vector>

#include "Platform/bus/BusConnection.h"
#include "Platform/bus/BusMessage.h"
#include "Platform/bus/BusPeer.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"
#include "Platform/runtime/Transactions.h"

namespace platform {
namespace {

/// sd-bus counts its references without locks: a message is let go on the main thread, where the bus lives.
void releaseMessage(sd_bus_message* message) {
    const WorkQueue mainQueue = WorkQueue::main();
    if (mainQueue.isCurrent()) {
        sd_bus_message_unref(message);
    } else {
        mainQueue.async([message] { sd_bus_message_unref(message); });
    }
}

using MessageHandle = std::shared_ptr<sd_bus_message>;

/// Main thread.
void sendReply(sd_bus_message* request, const ValueWriter& writer) {
    if (sd_bus_message_get_expect_reply(request) <= 0 || Lifetime::current().isEnding()) return;
    sd_bus_message* reply = nullptr;
    int result = sd_bus_message_new_method_return(request, &reply);
    // Replies may carry what the requests of this interface carry: wiped when freed, like those.
    if (result >= 0) result = sd_bus_message_sensitive(reply);
    if (result >= 0) result = bus::appendDictionary(reply, writer);
    if (result >= 0) result = sd_bus_send(nullptr, reply, nullptr);
    sd_bus_message_unref(reply);
    if (result >= 0) return;
    bus::logFailure("replying", result);
    sd_bus_reply_method_errorf(request, SD_BUS_ERROR_LIMITS_EXCEEDED,
                               "The reply does not fit into a message.");
}

/// Giving up the names: what is left until nothing that was sent to them is unanswered.
struct Release {
    /// Requests that are not dropped yet; those that are have queued their reply on the main queue before.
    std::atomic<long> openRequests{0};
    std::atomic<bool> began{false};
    /// Main thread only.
    long namesHeld = 0;
    std::function<void()> done;

    /// Main thread.
    void look() {
        if (began && namesHeld == 0 && openRequests == 0 && done) std::exchange(done, nullptr)();
    }
};

Release& release() { return Lifetime::current().state<Release>(); }

/// Holds a transaction from its arrival on: its handler opens one of its own only when its turn has come.
class BusRequest : public IncomingMessage {
  public:
    BusRequest(sd_bus_message* message, const BusPeer& sender)
        : message_(sd_bus_message_ref(message), releaseMessage), isSenderGone_(sender.isGone()) {
        transactions::began();
        ++release().openRequests;
    }

    ~BusRequest() override {
        if (--release().openRequests == 0 && release().began)
            WorkQueue::main().async([] { release().look(); });
        transactions::ended();
    }

    BusRequest(const BusRequest&) = delete;
    BusRequest& operator=(const BusRequest&) = delete;

    std::optional<int64_t> peekInteger(std::string_view key) override {
        return bus::peekInteger(message_.get(), key);
    }
    void read(ValueSink& sink) override { bus::readDictionary(message_.get(), sink); }

    void reply(ValueWriter writer) override {
        if (std::exchange(replied_, true)) return;
        const WorkQueue mainQueue = WorkQueue::main();
        // Replies of the peer's earlier requests may still wait on the main queue: none is overtaken.
        if (mainQueue.isCurrent() && mainQueue.isEmpty()) {
            sendReply(message_.get(), writer);
        } else {
            mainQueue.async(
                [message = message_, writer = std::move(writer)] { sendReply(message.get(), writer); });
        }
    }

    bool isSenderGone() const override { return *isSenderGone_; }

  private:
    MessageHandle message_;
    const std::shared_ptr<const std::atomic<bool>> isSenderGone_;
    bool replied_ = false;
};

class BusListener;

/// The named services. Main thread only.
struct Services {
    std::vector<std::shared_ptr<BusListener>> listeners;
    bool objectAdded = false;

    void lifetimeEnds();
};

Services& services() { return Lifetime::current().state<Services>(); }

int handleSend(sd_bus_message* message, void* context, sd_bus_error* error);

const sd_bus_vtable kMessageInterfaceTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("Send", "a{sv}", SD_BUS_PARAM(request), "a{sv}", SD_BUS_PARAM(reply), handleSend,
                             SD_BUS_VTABLE_UNPRIVILEGED | SD_BUS_VTABLE_SENSITIVE),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable kNotificationInterfaceTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_SIGNAL_WITH_NAMES("Posted", "s", SD_BUS_PARAM(name), 0),
    SD_BUS_VTABLE_END,
};

/// Lives as long as the connection: the bus holds its address.
class BusListener : public Listener {
  public:
    BusListener(std::string name, std::function<void(const ListenerEvent&)> handler)
        : name_(std::move(name)), handler_(std::move(handler)) {
        bus::onDisconnect([this] { connectionLost(); });
    }

    const std::string& name() const { return name_; }
    void notify(const ListenerEvent& event) const { handler_(event); }

    bool claim() override {
        sd_bus* bus = bus::connection();
        if (bus == nullptr) return false;
        int result = addObject(bus);
        if (result >= 0 && !name_.empty()) result = requestName(bus);
        if (result == -EEXIST)
            VELTOID_PLATFORM_LOG(Error, "The service name " + name_ + " cannot be had on this bus: process " +
                                            holderOfName(bus) + " has it. This one ends.");
        else if (result < 0)
            bus::logFailure("registering a service", result);
        return result >= 0;
    }

    /// False when there is nothing to wait for.
    bool releaseName() const {
        sd_bus* bus = bus::connection();
        return bus != nullptr && !name_.empty() &&
               sd_bus_release_name_async(bus, nullptr, name_.c_str(), nameReleased, nullptr) >= 0;
    }

    /// The peers and what they were waiting for.
    void dropPeers() { peers_.clear(); }

    /// The peer of that bus name, new when this is its first message; null when it may not speak to the
    /// agent.
    BusPeer* peerFor(sd_bus_message* message) {
        const char* sender = sd_bus_message_get_sender(message);
        if (sender == nullptr) return nullptr;
        const auto known = peers_.find(sender);
        return known != peers_.end() ? known->second.get() : admit(message, sender);
    }

  private:
    struct Watch {
        BusListener* listener;
        std::string name;
    };

    static int addObject(sd_bus* bus) {
        if (std::exchange(services().objectAdded, true)) return 0;
        bus::afterReading(BusPeer::serveWaiting);
        const Product& product = Lifetime::current().product();
        const int result = sd_bus_add_object_vtable(
            bus, nullptr, product.objectPath, product.messageInterface, kMessageInterfaceTable, nullptr);
        if (result < 0) return result;
        return sd_bus_add_object_vtable(bus, nullptr, product.objectPath, product.notificationInterface,
                                        kNotificationInterfaceTable, nullptr);
    }

    /// The bus may need a moment to see that a process which had the name is gone.
    int requestName(sd_bus* bus) const {
        constexpr int kPauseMilliseconds = 20;
        int result = -EEXIST;
        for (int tries = 50; tries > 0 && result == -EEXIST; --tries) {
            result = sd_bus_request_name(bus, name_.c_str(), 0);
            if (result == -EEXIST) (void)poll(nullptr, 0, kPauseMilliseconds);
        }
        return result;
    }

    std::string holderOfName(sd_bus* bus) const {
        sd_bus_creds* credentials = nullptr;
        pid_t process = 0;
        if (sd_bus_get_name_creds(bus, name_.c_str(), SD_BUS_CREDS_PID, &credentials) >= 0)
            (void)sd_bus_creds_get_pid(credentials, &process);
        sd_bus_creds_unref(credentials);
        return std::to_string(process);
    }

    static int nameReleased(sd_bus_message* /*reply*/, void* /*context*/, sd_bus_error* /*error*/) noexcept {
        --release().namesHeld;
        // What came before this reply has been dispatched.
        release().look();
        return 0;
    }

    BusPeer* admit(sd_bus_message* message, const char* sender) {
        sd_bus_creds* credentials = nullptr;
        uid_t user = 0;
        pid_t process = 0;
        const bool known =
            sd_bus_query_sender_creds(message, SD_BUS_CREDS_EUID | SD_BUS_CREDS_PID, &credentials) >= 0 &&
            sd_bus_creds_get_euid(credentials, &user) >= 0 &&
            sd_bus_creds_get_pid(credentials, &process) >= 0;
        sd_bus_creds_unref(credentials);
        if (!known || (user != geteuid() && user != 0)) return nullptr;

        const auto peer = std::make_shared<BusPeer>(process, user);
        peers_.emplace(sender, peer);
        // Asking the bus to report the peer's end can wait until the peer has its first answer.
        WorkQueue::main().async([this, name = std::string(sender)] { watchPeer(name); });
        notify(std::shared_ptr<PeerConnection>(peer));
        return peer.get();
    }

    void watchPeer(const std::string& name) {
        const auto peer = peers_.find(name);
        if (peer == peers_.end()) return;
        peer->second->watch(bus::connection(), name, peerGone, std::make_shared<Watch>(Watch{this, name}));
    }

    static int peerGone(sd_bus_track* /*track*/, void* context) noexcept {
        const auto* watch = static_cast<const Watch*>(context);
        const auto node = watch->listener->peers_.extract(watch->name);
        if (!node) return 0;
        node.mapped()->deliver(ConnectionError::Invalid);
        // The track that calls this, and the context, belong to the peer and must outlive the call.
        WorkQueue::main().async([peer = node.mapped()] {});
        return 0;
    }

    void connectionLost() {
        for (const auto& [name, peer] : std::exchange(peers_, {}))
            peer->deliver(ConnectionError::Interrupted);
        notify(ConnectionError::Invalid);
    }

    const std::string name_;
    const std::function<void(const ListenerEvent&)> handler_;
    std::map<std::string, std::shared_ptr<BusPeer>, std::less<>> peers_;
};

void Services::lifetimeEnds() {
    for (const auto& listener : listeners) listener->dropPeers();
}

/// Messages to the connection's unique name go to the one without a name, else to the first service.
BusListener* listenerFor(sd_bus_message* message) {
    const auto& listeners = services().listeners;
    const auto called = [&](std::string_view name) {
        const auto found = std::find_if(listeners.begin(), listeners.end(),
                                        [&](const auto& listener) { return listener->name() == name; });
        return found != listeners.end() ? found->get() : nullptr;
    };
    const char* destination = sd_bus_message_get_destination(message);
    if (BusListener* named = destination != nullptr ? called(destination) : nullptr) return named;
    if (BusListener* nameless = called("")) return nameless;
    return listeners.empty() ? nullptr : listeners.front().get();
}

int handleSend(sd_bus_message* message, void* /*context*/, sd_bus_error* error) {
    try {
        BusListener* listener = listenerFor(message);
        BusPeer* peer = listener != nullptr ? listener->peerFor(message) : nullptr;
        if (peer == nullptr)
            return sd_bus_error_set(error, SD_BUS_ERROR_ACCESS_DENIED,
                                    "This service serves its own user only.");
        peer->deliver(std::make_shared<BusRequest>(message, *peer));
        return 1;
    } catch (...) {
        return sd_bus_error_set(error, SD_BUS_ERROR_NO_MEMORY, "The request could not be handled.");
    }
}

}  // namespace

std::shared_ptr<Listener> Listener::create(std::string serviceName,
                                           std::function<void(const ListenerEvent&)> handler) {
    auto listener = std::make_shared<BusListener>(std::move(serviceName), std::move(handler));
    services().listeners.push_back(listener);
    return listener;
}

namespace message_service {

void onConnectionLost(std::function<void()> handler) {
    bus::onDisconnect([handler = std::move(handler)] { WorkQueue::main().async(handler); });
}

void announceTermination() {
    const auto listeners = services().listeners;
    for (const auto& listener : listeners) listener->notify(ConnectionError::TerminationImminent);
}

void releaseNames(std::function<void()> done) {
    release().done = std::move(done);
    release().began = true;
    for (const auto& listener : services().listeners)
        if (listener->releaseName()) ++release().namesHeld;
    WorkQueue::main().async([] { release().look(); });
}

}  // namespace message_service

}  // namespace platform
