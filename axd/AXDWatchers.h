// The clients that asked to watch the registry ("watch"): each gets one event message per change,
// as it happens (docs/axd.md): plug-ins installed and uninstalled, annotation changes, holds placed
// and released.
#pragma once

#include <memory>
#include <vector>

#include "Annexa/AXUtilities.h"
#include "platform/dispatch/ThreadSafety.h"
#include "platform/rpx/Rpx.h"
#include "platform/vantry/Vantry.h"

namespace annexa {

class AXDPlugIn;

// Thread-safe: events come from the registry's event thread and the request queue; one source's
// events reach every watcher in the order they were published.
class AXDWatchers {
public:
    // A watcher that has this much of its events unread is dropped: a slow watcher never holds the
    // daemon's memory.
    static constexpr size_t kBacklogBytes = 1u << 20;

    // Watchers one process may have, and all together: each event is sent to each of them.
    static constexpr size_t kPerProcess = 8;
    static constexpr size_t kInAll = 256;

    // False when the connection's process has kPerProcess watchers already, or kInAll watch.
    bool add(const corvane::rpx::ConnectionPtr& connection);
    // Sends an event to every watcher still connected; drops the ones that fell behind.
    void publish(const Value& event);
    bool empty();

    // The summary of a plug-in in events: identifier, version, UUID and path.
    static Value summary(const AXDPlugIn& plugIn);
    static Value summary(const corvane::vantry::PlugInRecord& record);

private:
    corvane::Mutex mutex_;
    std::vector<std::weak_ptr<corvane::rpx::Connection>> watchers_ GUARDED_BY(mutex_);
};

}  // namespace annexa
