// The plug-in's side and the host's side of a running plug-in (docs/spawnd.md).
//
// A plug-in executable that spawnd launched serves its hosts with AXPlugInRuntime::run: each host
// connection is an rpx connection, and every message on it goes to the handler, which replies to
// the messages that want a reply. The runtime tells spawnd when the plug-in serves no host (so an
// idle instance can be ended) and carries its busy assertions. A host reaches a plug-in that axd
// got ready for it with connectToPlugIn.
//
// Thread-safe: the handler runs on the queue "com.corvane.annexa.plugin", one message at a time.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "Annexa/AXUtilities.h"
#include "platform/rpx/Rpx.h"

namespace annexa {

class AXPlugInRuntime {
public:
    using Handler = std::function<void(const corvane::rpx::ConnectionPtr& host, const corvane::rpx::Event& message)>;

    // Serves host connections until spawnd ends the control connection; 0 then. EINVAL at once
    // when this process was not launched by spawnd, EALREADY when run is already serving.
    static int run(Handler handler);
    // A busy assertion with a reason; the instance counts as busy until every assertion is ended
    // (or it exits). 0 when not running under spawnd.
    static uint64_t beginBusy(const std::string& reason);
    static void endBusy(uint64_t assertion);
};

// Connects to an instance of the plug-in `bundleIdentifier`, which axd must have got ready for this
// process ("ready"): spawnd launches it when it is not running. The connection is resumed, its
// events (messages from the plug-in, then "connection invalid") going to `events` on `queue`. The
// error carries spawnd's reason: an errno value and a text.
Result<corvane::rpx::ConnectionPtr> connectToPlugIn(const std::string& bundleIdentifier,
                                                    corvane::dispatch::QueuePtr queue,
                                                    std::function<void(const corvane::rpx::Event&)> events);

}  // namespace annexa
