// Stands in for the HTTPS client in tests: answers and failures are settable, requests are recorded.
#pragma once

#include <algorithm>
#include <atomic>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Platform/net/HTTPSession.h"
#include "Platform/runtime/Clock.h"
#include "TestSupport/TestLifetime.h"

namespace platform {

/// What becomes of one exchange.
struct FakeHTTPAnswer {
    int status = 200;
    std::string body = {};
    /// How the exchange ends; with `status` 0 not even a header came.
    std::optional<HTTPError> error = {};
    /// The body is delivered in pieces of at most this size.
    size_t pieceBytes = SIZE_MAX;
    /// Comes first; turned down, it ends the exchange with an error.
    std::optional<ProtectionSpace> challenge = {};
    /// Bytes sent and expected, as they are reported before the header.
    std::vector<std::pair<uint64_t, uint64_t>> progress = {};
    /// Seconds on the Clock before anything comes; kForever: never.
    double delaySeconds = 0;
};

/// While it exists, every HTTPSession is a fake one. All operations may be called from any thread.
class FakeHTTPTransport : private HTTPSessionFactory {
  public:
    using Responder = std::function<FakeHTTPAnswer(const HTTPRequest&)>;

    /// Answers are given in this order; when none is left the responder is asked.
    void enqueue(FakeHTTPAnswer answer) {
        const std::lock_guard lock(state_->mutex);
        state_->answers.push_back(std::move(answer));
    }
    void respondWith(Responder responder) {
        const std::lock_guard lock(state_->mutex);
        state_->responder = std::move(responder);
    }
    /// Whether sessions can be created.
    void setAvailable(bool isAvailable) { state_->isAvailable = isAvailable; }

    std::vector<HTTPRequest> requests() const {
        const std::lock_guard lock(state_->mutex);
        return state_->requests;
    }
    int sessionsCreated() const { return state_->created; }
    int sessionsCancelled() const { return state_->cancelled; }

    static constexpr int64_t kChallengeRefused = 42;

  private:
    struct State {
        std::mutex mutex;
        std::deque<FakeHTTPAnswer> answers;
        Responder responder = [](const HTTPRequest&) { return FakeHTTPAnswer(); };
        std::vector<HTTPRequest> requests;
        std::atomic<bool> isAvailable = true;
        std::atomic<int> created = 0;
        std::atomic<int> cancelled = 0;

        FakeHTTPAnswer answerTo(const HTTPRequest& request) {
            Responder respond;
            {
                const std::lock_guard lock(mutex);
                requests.push_back(request);
                if (!answers.empty()) {
                    FakeHTTPAnswer answer = std::move(answers.front());
                    answers.pop_front();
                    return answer;
                }
                respond = responder;
            }
            return respond(request);
        }
    };

    class Session : public HTTPSession, public std::enable_shared_from_this<Session> {
      public:
        Session(std::shared_ptr<State> state, std::shared_ptr<HTTPSessionEvents> events,
                std::optional<WorkQueue> eventQueue)
            : state_(std::move(state)),
              queue_(eventQueue ? *std::move(eventQueue) : WorkQueue("fake http")),
              events_(std::move(events)) {}

        void start(HTTPRequest request) override {
            const auto answer = std::make_shared<FakeHTTPAnswer>(state_->answerTo(request));
            if (answer->delaySeconds == kForever) return;
            queue_.asyncAfter(answer->delaySeconds,
                              [self = shared_from_this(), answer] { self->answerWith(*answer); });
        }

        void invalidateAndCancel() override {
            std::shared_ptr<HTTPSessionEvents> released;
            const std::lock_guard lock(mutex_);
            if (events_) ++state_->cancelled;
            released.swap(events_);
        }

      private:
        template <typename Event>
        void deliver(Event event) {
            std::unique_lock lock(mutex_);
            const std::shared_ptr<HTTPSessionEvents> events = events_;
            lock.unlock();
            if (events) event(*events);
        }

        void answerWith(const FakeHTTPAnswer& answer) {
            auto accepted = ChallengeAnswer::PerformDefaultHandling;
            if (answer.challenge)
                deliver([&](HTTPSessionEvents& events) { accepted = events.challenge(*answer.challenge); });
            if (accepted == ChallengeAnswer::PerformDefaultHandling) {
                deliverResponse(answer);
                complete(answer.error);
            } else {
                complete(HTTPError{kChallengeRefused, "the challenge was turned down"});
            }
        }

        void deliverResponse(const FakeHTTPAnswer& answer) {
            for (const auto& step : answer.progress)
                deliver([&](HTTPSessionEvents& events) { events.uploadProgress(step.first, step.second); });
            if (answer.status != 0)
                deliver([&](HTTPSessionEvents& events) { events.responseHeader(answer.status); });
            for (size_t start = 0; start < answer.body.size(); start += answer.pieceBytes) {
                const size_t size = std::min(answer.pieceBytes, answer.body.size() - start);
                const Bytes piece = bytesOf(answer.body).subspan(start, size);
                deliver([=](HTTPSessionEvents& events) { events.bodyBytes(piece); });
            }
        }

        void complete(const std::optional<HTTPError>& error) {
            deliver([&](HTTPSessionEvents& events) { events.completed(error); });
            const std::lock_guard lock(mutex_);
            events_ = nullptr;
        }

        const std::shared_ptr<State> state_;
        const WorkQueue queue_;
        std::mutex mutex_;
        std::shared_ptr<HTTPSessionEvents> events_;
    };

    std::shared_ptr<HTTPSession> create(std::shared_ptr<HTTPSessionEvents> events,
                                        std::optional<WorkQueue> eventQueue) override {
        ++state_->created;
        if (!state_->isAvailable) return nullptr;
        return std::make_shared<Session>(state_, std::move(events), std::move(eventQueue));
    }

    const std::shared_ptr<State> state_ = std::make_shared<State>();
    const InTestLifetime<HTTPSessionFactory> inLifetime_{*this};
};

}  // namespace platform
