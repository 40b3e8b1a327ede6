#include "axd/AXDWatchers.h"

#include <algorithm>

#include "axd/AXDPlugIn.h"

namespace annexa {

namespace log = corvane::log;

bool AXDWatchers::add(const corvane::rpx::ConnectionPtr& connection) {
    corvane::MutexLock lock(mutex_);
    size_t ofProcess = 0;
    auto end = std::remove_if(watchers_.begin(), watchers_.end(), [&](const auto& weak) {
        auto watcher = weak.lock();
        if (!watcher || !watcher->isValid()) return true;
        if (watcher->pid() == connection->pid()) ++ofProcess;
        return false;
    });
    watchers_.erase(end, watchers_.end());
    if (ofProcess >= kPerProcess || watchers_.size() >= kInAll) return false;
    watchers_.push_back(connection);
    return true;
}

bool AXDWatchers::empty() {
    corvane::MutexLock lock(mutex_);
    return watchers_.empty();
}

void AXDWatchers::publish(const Value& event) {
    // Sending may run a connection's event handlers on this thread (the daemon delivers inline),
    // and those may publish in turn: nothing is sent under the lock.
    std::vector<corvane::rpx::ConnectionPtr> live;
    {
        corvane::MutexLock lock(mutex_);
        auto end = std::remove_if(watchers_.begin(), watchers_.end(), [&](const auto& weak) {
            auto connection = weak.lock();
            if (!connection || !connection->isValid()) return true;
            live.push_back(std::move(connection));
            return false;
        });
        watchers_.erase(end, watchers_.end());
    }
    for (const auto& connection : live) {
        if (connection->queuedOutgoingBytes() > kBacklogBytes) {
            log::notice(logOps(), "dropping watcher pid %d: it does not read its events", connection->pid());
            connection->cancel();
        } else {
            connection->send(event);
        }
    }
}

Value AXDWatchers::summary(const AXDPlugIn& plugIn) {
    // From the registry's record when there is one, so that every event names a plug-in alike.
    if (auto record = plugIn.vtproxy()) return summary(*record);
    return corvane::dict({{"identifier", plugIn.identifier() ? Value(*plugIn.identifier()) : Value()},
                          {"version", plugIn.version()},
                          {"uuid", plugIn.uuid() ? Value(*plugIn.uuid()) : Value()},
                          {"path", plugIn.path()}});
}

Value AXDWatchers::summary(const corvane::vantry::PlugInRecord& record) {
    return corvane::dict({{"identifier", record.identifier()},
                          {"version", record.bundleVersion()},
                          {"uuid", record.uuid()},
                          {"path", record.bundlePath()}});
}

}  // namespace annexa
