#include "Platform/bus/BusPeer.h"

#include <systemd/sd-bus.h>

#include <utility>

#include "Platform/bus/BusConnection.h"
#include "Platform/runtime/Lifetime.h"

namespace platform {
namespace {

/// Events that are handled before the bus is read again. These are fewer than are read at once, since only
/// reading shows which clients have requests.
constexpr int kMaxServedAtOnce = 32;

/// So many events of a peer wait here for their turn. While there are more, each one that comes sends the
/// oldest to the peer's own queue, out of turn.
constexpr size_t kMaxWaiting = 16'384;

/// A peer that has more events than this waiting sends ahead of its replies. It rests while more than
/// kMaxUnread bytes of what the agent has sent are still unread by the bus, since replies to other peers
/// would have to stand in line behind its own. The kernel counts 768 bytes for a small reply. With twice the
/// limit other peers wait half as long again; with half of it a peer that is alone is slowed down by half.
constexpr size_t kSendingAhead = 8;
constexpr size_t kMaxUnread = 12 << 10;
constexpr double kRestSeconds = 0.0003;

}  // namespace

/// The peers that have events waiting, each in one of the two. Main thread only.
struct BusPeer::Turns {
    std::deque<std::shared_ptr<BusPeer>> peers;
    std::deque<std::shared_ptr<BusPeer>> resting;

    /// What waits for its turn is not handled any more.
    void lifetimeEnds() {
        for (auto& each : {&peers, &resting})
            for (const auto& peer : *each) peer->waiting_.clear();
        peers.clear();
        resting.clear();
    }

    void rest(std::shared_ptr<BusPeer> peer) {
        if (resting.empty()) {
            WorkQueue::main().asyncAfter(kRestSeconds, [this] {
                for (auto& rested : std::exchange(resting, {})) peers.push_back(std::move(rested));
                bus::serveSoon();
            });
        }
        resting.push_back(std::move(peer));
    }
};

BusPeer::Turns& BusPeer::turns() { return Lifetime::current().state<Turns>(); }

bool BusPeer::serveWaiting() {
    Turns& current = turns();
    for (int left = kMaxServedAtOnce; left > 0 && !current.peers.empty(); --left) {
        std::shared_ptr<BusPeer> peer = std::move(current.peers.front());
        current.peers.pop_front();
        if (peer->sendsAhead() && bus::unreadBytes() > kMaxUnread) {
            current.rest(std::move(peer));
            continue;
        }
        peer->handleOldest();
        if (!peer->waiting_.empty()) current.peers.push_back(std::move(peer));
    }
    return !current.peers.empty();
}

BusPeer::~BusPeer() { sd_bus_track_unref(track_); }

void BusPeer::setEventHandler(std::function<void(const PeerEvent&)> handler) {
    handler_ = std::make_shared<std::function<void(const PeerEvent&)>>(std::move(handler));
}

void BusPeer::setAnsweredAtOnce(std::function<bool(IncomingMessage&)> test) {
    answeredAtOnce_ = std::move(test);
}

void BusPeer::resume() {
    if (std::exchange(resumed_, true) || waiting_.empty()) return;
    turns().peers.push_back(shared_from_this());
    bus::serveSoon();
}

void BusPeer::deliver(PeerEvent event) {
    if (std::holds_alternative<ConnectionError>(event)) *isGone_ = true;
    waiting_.push_back(std::move(event));
    if (!resumed_) return;
    if (waiting_.size() == 1) turns().peers.push_back(shared_from_this());
    if (waiting_.size() > kMaxWaiting) handleOldest();
}

void BusPeer::watch(sd_bus* bus, const std::string& name, sd_bus_track_handler_t gone,
                    std::shared_ptr<void> context) {
    watchContext_ = std::move(context);
    if (sd_bus_track_new(bus, &track_, gone, watchContext_.get()) >= 0)
        sd_bus_track_add_name(track_, name.c_str());
}

bool BusPeer::sendsAhead() const { return waiting_.size() > kSendingAhead; }

void BusPeer::handleOldest() {
    const PeerEvent event = std::move(waiting_.front());
    waiting_.pop_front();
    if (!handler_) return;
    const auto* message = std::get_if<std::shared_ptr<IncomingMessage>>(&event);
    const bool atOnce = message != nullptr && answeredAtOnce_ && answeredAtOnce_(**message);
    const WorkQueue::Task task = [handler = handler_, event] { (*handler)(event); };
    if (!atOnce || !queue_.tryRunNow(task)) queue_.async(task);
}

}  // namespace platform
