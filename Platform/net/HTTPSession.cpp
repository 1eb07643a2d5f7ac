#include "Platform/net/HTTPSession.h"

#include <atomic>
#include <mutex>

#include "Platform/net/CurlExchange.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/Transactions.h"

namespace platform {
namespace {

/// Runs its exchange on a queue of its own, which is the delivery thread, and hands the events on: to the
/// event queue when there is one, and no longer once the session was cancelled.
class CurlSession : public HTTPSession,
                    private HTTPSessionEvents,
                    public std::enable_shared_from_this<CurlSession> {
  public:
    CurlSession(std::shared_ptr<HTTPSessionEvents> events, std::optional<WorkQueue> eventQueue)
        : eventQueue_(std::move(eventQueue)), events_(std::move(events)) {}

    void start(HTTPRequest request) override {
        {
            const std::lock_guard lock(mutex_);
            if (started_ || cancelled_) return;
            started_ = true;
        }
        // In flight until its last event has been delivered.
        transactions::began();
        const auto shared = std::make_shared<const HTTPRequest>(std::move(request));
        queue_.async([self = shared_from_this(), shared] { self->run(*shared); });
    }

    void invalidateAndCancel() override {
        // Released after the lock: the receiver may hold the last reference to this session.
        std::shared_ptr<HTTPSessionEvents> released;
        const std::lock_guard lock(mutex_);
        cancelled_ = true;
        released.swap(events_);
        if (exchange_ != nullptr) exchange_->wakeUp();
    }

  private:
    void run(const HTTPRequest& request) {
        const auto exchange = CurlExchange::create(request, *this);
        setExchange(exchange.get());
        const std::optional<HTTPError> error = exchange->run(cancelled_);
        setExchange(nullptr);
        completed(error);
        if (eventQueue_)
            eventQueue_->async(transactions::ended);
        else
            transactions::ended();
    }

    void setExchange(CurlExchange* exchange) {
        const std::lock_guard lock(mutex_);
        exchange_ = exchange;
    }

    /// Null once the session was cancelled or is complete.
    std::shared_ptr<HTTPSessionEvents> receiver() {
        const std::lock_guard lock(mutex_);
        return events_;
    }

    template <typename Handle>
    void deliver(Handle handle) {
        const auto deliverNow = [self = shared_from_this(), handle = std::move(handle)] {
            if (const auto events = self->receiver()) handle(*events);
        };
        if (eventQueue_) {
            eventQueue_->async(deliverNow);
        } else {
            deliverNow();
        }
    }

    // What the exchange reports, on the delivery thread.

    ChallengeAnswer challenge(const ProtectionSpace& space) override {
        const auto ask = [&] {
            const auto events = receiver();
            return events ? events->challenge(space) : ChallengeAnswer::Cancel;
        };
        return eventQueue_ ? eventQueue_->sync(ask) : ask();
    }

    void responseHeader(int statusCode) override {
        deliver([=](HTTPSessionEvents& events) { events.responseHeader(statusCode); });
    }

    void bodyBytes(Bytes bytes) override {
        if (!eventQueue_) {
            if (const auto events = receiver()) events->bodyBytes(bytes);
            return;
        }
        deliver([copy = SecretBytes(bytes.begin(), bytes.end())](HTTPSessionEvents& events) {
            events.bodyBytes(copy);
        });
    }

    void uploadProgress(uint64_t sent, uint64_t expected) override {
        deliver([=](HTTPSessionEvents& events) { events.uploadProgress(sent, expected); });
    }

    void completed(const std::optional<HTTPError>& error) override {
        deliver([self = shared_from_this(), error](HTTPSessionEvents& events) {
            events.completed(error);
            // The receiver usually owns this session: let go of it.
            self->invalidateAndCancel();
        });
    }

    const WorkQueue queue_{"http"};
    const std::optional<WorkQueue> eventQueue_;
    std::atomic<bool> cancelled_ = false;

    std::mutex mutex_;
    // Guarded by the mutex.
    bool started_ = false;
    std::shared_ptr<HTTPSessionEvents> events_;
    CurlExchange* exchange_ = nullptr;
};

class CurlSessionFactory : public HTTPSessionFactory {
  public:
    std::shared_ptr<HTTPSession> create(std::shared_ptr<HTTPSessionEvents> events,
                                        std::optional<WorkQueue> eventQueue) override {
        if (!isHTTPSClientAvailable()) return nullptr;
        return std::make_shared<CurlSession>(std::move(events), std::move(eventQueue));
    }
};

}  // namespace

std::shared_ptr<HTTPSession> HTTPSession::create(std::shared_ptr<HTTPSessionEvents> events,
                                                 std::optional<WorkQueue> eventQueue) {
    return Lifetime::current().part<HTTPSessionFactory, CurlSessionFactory>().create(std::move(events),
                                                                                     std::move(eventQueue));
}

bool isHTTPSClientAvailable() { return CurlExchange::isLibraryAvailable(); }

}  // namespace platform
