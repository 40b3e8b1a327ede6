// Whether a connected host may use a plug-in.
#include "axd/AXDPlugIn.h"
#include "axd/AXDRpxClient.h"

namespace annexa {

std::optional<std::string> AXDPlugIn::allowForClient(const AXDRpxClient& client) const {
    Value restriction = client.entitlementValueForKey(keys::kAllowedPlugInsEntitlement);
    if (!restriction.isNull()) {
        if (!restriction.isDictionary()) return std::string("invalid host restriction entitlement");
        if (!match(restriction)) return std::string("the host's plug-in entitlement does not allow this plug-in");
    }
    Value required = pluginKey(keys::kHostEntitlement);
    if (!required.isNull()) {
        // A name that is no string cannot be held: the host is refused.
        const std::string* name = required.asString();
        if (!name || !client.hasEntitlement(*name))
            return corvane::log::formatText("the host does not have the \"%@\" entitlement", required);
    }
    return std::nullopt;
}

}  // namespace annexa
