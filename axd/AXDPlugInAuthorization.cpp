// Whether a connected host may use a plug-in.
#include "axd/AXDPlugIn.h"
#include "axd/AXDRpxClient.h"
#include "platform/bundle/Bundle.h"
#include "platform/pcx/Pcx.h"

namespace annexa {

std::optional<std::string> AXDPlugIn::allowForClient(const AXDRpxClient& client) const {
    return allowForHost([&client](const std::string& key) { return client.entitlementValueForKey(key); });
}

std::optional<std::string> AXDPlugIn::allowForHost(const std::function<Value(const std::string&)>& entitlement) const {
    static const std::string kRestriction(keys::kAllowedPlugInsEntitlement);  // made once, not per plug-in
    Value restriction = entitlement(kRestriction);
    if (!restriction.isNull()) {
        if (!restriction.isDictionary()) return std::string("invalid host restriction entitlement");
        if (!match(restriction)) return std::string("the host's plug-in entitlement does not allow this plug-in");
    }
    const Value& required = walkFacts().hostEntitlement;
    if (!required.isNull()) {
        // A name that is no string cannot be held: the host is refused. The text shows the name's
        // own characters (a value of another type in its notation).
        const std::string* name = required.asString();
        if (!name || !entitlementGranted(entitlement(*name)))
            return corvane::log::formatText("the host does not have the \"%@\" entitlement", required);
    }
    return std::nullopt;
}

std::set<std::string> AXDPlugIn::allowedPCXServices() const {
    std::set<std::string> services;
    auto container = containingUrl();
    if (!container) return services;
    auto bundle = corvane::bundle::Bundle::openPath(*container);
    if (!bundle) {
        corvane::log::info(logOps(), "failed to create bundle for %@", url());
        return services;
    }
    bundle->flush();
    auto records = corvane::pcx::consentInformationForBundle(*container);
    if (!records) {
        corvane::log::info(logOps(), "PCXAccessCopyInformationForBundle failed for %@", bundle->description());
        return services;
    }
    for (const Value& record : *records) {
        const std::string* service = record[corvane::pcx::kServiceKey].asString();
        if (service && record[corvane::pcx::kGrantedKey].isTrue()) services.insert(*service);
    }
    return services;
}

}  // namespace annexa
