// A client's connection to one of the services, and the turns of clients: one event of each client at a time,
// so that a client that sends much delays only itself. Main thread, except that events are handled on the
// target queue.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <deque>
#include <functional>
#include <memory>
#include <string>

#include "Platform/bus/PeerConnection.h"
#include "Platform/runtime/WorkQueue.h"

struct sd_bus;
struct sd_bus_track;

namespace platform {

class BusPeer : public PeerConnection, public std::enable_shared_from_this<BusPeer> {
  public:
    BusPeer(pid_t processID, uid_t userID) : processID_(processID), userID_(userID) {}
    ~BusPeer() override;
    BusPeer(const BusPeer&) = delete;
    BusPeer& operator=(const BusPeer&) = delete;

    pid_t processID() const override { return processID_; }
    uid_t userID() const override { return userID_; }
    void setTargetQueue(WorkQueue queue) override { queue_ = std::move(queue); }
    void setEventHandler(std::function<void(const PeerEvent&)> handler) override;
    void setAnsweredAtOnce(std::function<bool(IncomingMessage&)> test) override;
    void resume() override;

    /// Has the event handled when its turn has come, after those that were delivered before.
    void deliver(PeerEvent event);

    /// Set when the peer's connection has ended. Any thread.
    std::shared_ptr<const std::atomic<bool>> isGone() const { return isGone_; }

    /// Handles events of the peers that have some; true when others are left that may be handled now.
    static bool serveWaiting();

    /// Calls `gone`, possibly more than once, when the bus says that the name has left it. The context is
    /// kept as long as this peer.
    void watch(sd_bus* bus, const std::string& name, int (*gone)(sd_bus_track*, void*),
               std::shared_ptr<void> context);

  private:
    struct Turns;
    static Turns& turns();

    void handleOldest();
    bool sendsAhead() const;

    const pid_t processID_;
    const uid_t userID_;
    WorkQueue queue_ = WorkQueue::main();
    std::shared_ptr<std::function<void(const PeerEvent&)>> handler_;
    std::function<bool(IncomingMessage&)> answeredAtOnce_;
    std::deque<PeerEvent> waiting_;
    bool resumed_ = false;
    const std::shared_ptr<std::atomic<bool>> isGone_ = std::make_shared<std::atomic<bool>>(false);
    std::shared_ptr<void> watchContext_;
    sd_bus_track* track_ = nullptr;
};

}  // namespace platform
