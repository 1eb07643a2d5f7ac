#include "VeltoIDXMLServerCommunications/Session.h"

#include <algorithm>
#include <mutex>
#include <utility>
#include <vector>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "VeltoIDXMLServerCommunications/SessionCache.h"

namespace veltoid {
namespace {

struct Sessions {
    std::mutex mutex;
    /// Guarded by the mutex.
    std::vector<std::pair<String, platform::WorkQueue>> queues;

    const platform::WorkQueue globalQueue{"sVeltoIDAuthenticationSessionGlobalQueue"};
    /// On the global queue only.
    std::vector<Session> cached;
};

Sessions& state() { return platform::Lifetime::current().state<Sessions>(); }

platform::WorkQueue globalQueue() { return state().globalQueue; }

/// On the global queue only.
std::vector<Session>& cachedSessions() { return state().cached; }

}  // namespace

platform::WorkQueue copySessionQueueForAccount(const String& accountName) {
    Sessions& table = state();
    const std::lock_guard lock(table.mutex);
    const auto known = std::find_if(table.queues.begin(), table.queues.end(),
                                    [&](const auto& entry) { return entry.first == accountName; });
    if (known != table.queues.end()) return known->second;
    return table.queues.emplace_back(accountName, platform::WorkQueue("queue.session.")).second;
}

void __VeltoIDSessionRelease(Session session) {
    if (!session) return;
    const platform::WorkQueue queue = session->fDispatchQueue;
    queue.sync([&] {
        if (session->isReusableAt(platform::Clock::shared().now())) {
            cacheSession(std::move(session));
        } else {
            destroySession(std::move(session));
        }
    });
}

Session takeCachedSession(const String& accountName, const String& passwordHash, const String& serverURL) {
    if (!accountName || !passwordHash || !serverURL) return nullptr;
    return globalQueue().sync([&]() -> Session {
        auto& sessions = cachedSessions();
        const double now = platform::Clock::shared().now();
        const auto match = std::find_if(sessions.begin(), sessions.end(), [&](const Session& session) {
            return session->fAccountName == accountName && session->fPasswordHash == passwordHash &&
                   session->fServerURL == serverURL && session->isReusableAt(now);
        });
        if (match == sessions.end()) return nullptr;
        Session taken = std::move(*match);
        sessions.erase(match);
        return taken;
    });
}

void cacheSession(Session session) {
    globalQueue().sync([&] {
        auto& sessions = cachedSessions();
        const double now = platform::Clock::shared().now();
        const auto expired =
            std::stable_partition(sessions.begin(), sessions.end(),
                                  [&](const Session& cached) { return cached->isReusableAt(now); });
        std::for_each(expired, sessions.end(), [](Session& cached) { destroySession(std::move(cached)); });
        sessions.erase(expired, sessions.end());
        sessions.push_back(std::move(session));
    });
}

void destroySession(Session session) {
    const platform::WorkQueue queue = session->fDispatchQueue;
    queue.async([released = std::shared_ptr<VeltoIDAuthenticationSessionInfo>(std::move(session))] {});
}

}  // namespace veltoid
