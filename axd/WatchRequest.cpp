// "watch", a request of our own: the connection stays subscribed to the registry's changes.
#include "axd/AXDServer.h"
#include "axd/Transaction.h"

namespace annexa {

void Transaction::watchRegistry() {
    // The reply says the connection is subscribed; events follow on it until it ends.
    auto conn = connection();
    if (conn && !server().watchers().add(conn)) {
        return failMessage(AXErrorCode::InvalidRequest,
                           corvane::log::formatText("too many watchers (%u a process, %u in all)",
                                                    static_cast<unsigned>(AXDWatchers::kPerProcess),
                                                    static_cast<unsigned>(AXDWatchers::kInAll)));
    }
    done();
}

}  // namespace annexa
