#include "VeltoIDXMLServerCommunications/Session.h"

#include <algorithm>
#include <mutex>
#include <utility>
#include <vector>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"

namespace veltoid {
namespace {

struct Sessions {
    std::mutex mutex;
    /// Guarded by the mutex.
    std::vector<std::pair<String, platform::WorkQueue>> queues;

    const platform::WorkQueue globalQueue{"sVeltoIDAuthenticationSessionGlobalQueue"};
    /// On the global queue only.
    std::vector<IdleSession> cached;
};

Sessions& state() { return platform::Lifetime::current().state<Sessions>(); }

/// Has the session destroyed on its own queue.
void destroy(IdleSession session) {
    const platform::WorkQueue queue = session->fDispatchQueue;
    queue.async([released = std::shared_ptr<VeltoIDAuthenticationSessionInfo>(std::move(session))] {});
}

/// Keeps the session; those whose time has passed go.
void cache(IdleSession session) {
    state().globalQueue.sync([&] {
        auto& sessions = state().cached;
        const double now = platform::now();
        const auto expired =
            std::stable_partition(sessions.begin(), sessions.end(),
                                  [&](const IdleSession& cached) { return cached->isReusableAt(now); });
        std::for_each(expired, sessions.end(), [](IdleSession& cached) { destroy(std::move(cached)); });
        sessions.erase(expired, sessions.end());
        sessions.push_back(std::move(session));
    });
}

}  // namespace

platform::WorkQueue copySessionQueueForAccount(const String& accountName) {
    Sessions& table = state();
    const std::lock_guard lock(table.mutex);
    const auto known = std::find_if(table.queues.begin(), table.queues.end(),
                                    [&](const auto& entry) { return entry.first == accountName; });
    if (known != table.queues.end()) return known->second;
    return table.queues.emplace_back(accountName, platform::WorkQueue("queue.session.")).second;
}

IdleSession takeCachedSession(const String& accountName, const String& passwordHash,
                              const String& serverURL) {
    if (!accountName || !passwordHash || !serverURL) return nullptr;
    return state().globalQueue.sync([&]() -> IdleSession {
        auto& sessions = state().cached;
        const double now = platform::now();
        const auto match = std::find_if(sessions.begin(), sessions.end(), [&](const IdleSession& session) {
            return session->fAccountName == accountName && session->fPasswordHash == passwordHash &&
                   session->fServerURL == serverURL && session->isReusableAt(now);
        });
        if (match == sessions.end()) return nullptr;
        IdleSession taken = std::move(*match);
        sessions.erase(match);
        return taken;
    });
}

void __VeltoIDSessionRelease(VeltoIDAuthenticationSessionInfo* session) {
    const platform::WorkQueue queue = session->fDispatchQueue;
    queue.sync([&] { (session->isReusableAt(platform::now()) ? cache : destroy)(IdleSession(session)); });
}

}  // namespace veltoid
