// "watch", a request of our own: the connection stays subscribed to the registry's changes.
#include "axd/AXDServer.h"
#include "axd/Transaction.h"

namespace annexa {

void Transaction::watchRegistry() {
    // The reply says the connection is subscribed; events follow on it until it ends.
    if (auto conn = connection()) server().watchers().add(conn);
    done();
}

}  // namespace annexa
