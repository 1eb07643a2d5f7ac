#include "VeltoIDXMLServerCommunications/Session.h"

#include <algorithm>
#include <mutex>
#include <utility>
#include <vector>

#include "Platform/runtime/Clock.h"

namespace veltoid {
namespace {

/// Guarded by its mutex; never destroyed.
struct QueueTable {
    std::mutex mutex;
    std::vector<std::pair<String, platform::WorkQueue>> queues;

    static QueueTable& shared() {
        static auto* table = new QueueTable;
        return *table;
    }
};

platform::WorkQueue globalQueue() {
    static const auto* queue = new platform::WorkQueue("sVeltoIDAuthenticationSessionGlobalQueue");
    return *queue;
}

/// On the global queue only.
std::vector<IdleSession>& cachedSessions() {
    static auto* sessions = new std::vector<IdleSession>;
    return *sessions;
}

/// Has the session destroyed on its own queue.
void destroy(IdleSession session) {
    const platform::WorkQueue queue = session->fDispatchQueue;
    queue.async([released = std::shared_ptr<VeltoIDAuthenticationSessionInfo>(std::move(session))] {});
}

/// Keeps the session; those whose time has passed go.
void cache(IdleSession session) {
    globalQueue().sync([&] {
        auto& sessions = cachedSessions();
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
    QueueTable& table = QueueTable::shared();
    const std::lock_guard lock(table.mutex);
    const auto known = std::find_if(table.queues.begin(), table.queues.end(),
                                    [&](const auto& entry) { return entry.first == accountName; });
    if (known != table.queues.end()) return known->second;
    return table.queues.emplace_back(accountName, platform::WorkQueue("queue.session.")).second;
}

IdleSession takeCachedSession(const String& accountName, const String& passwordHash,
                              const String& serverURL) {
    if (!accountName || !passwordHash || !serverURL) return nullptr;
    return globalQueue().sync([&]() -> IdleSession {
        auto& sessions = cachedSessions();
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
    queue.sync([&] {
        IdleSession idle(session);
        if (idle->isReusableAt(platform::now())) {
            cache(std::move(idle));
        } else {
            destroy(std::move(idle));
        }
    });
}

}  // namespace veltoid
