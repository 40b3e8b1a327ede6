// Getting a plug-in ready for a host: the activation overlay registered with the service manager,
// and whether any process of the plug-in is busy.
#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "Annexa/AXBundle.h"
#include "Annexa/AXMessage.h"
#include "axd/AXDPlugIn.h"
#include "axd/AXDRpxClient.h"
#include "platform/pcx/Pcx.h"
#include "platform/rpx/Rpx.h"
#include "platform/sdk/Sdk.h"
#include "platform/spawn/Protocol.h"
#include "platform/spawn/Spawn.h"

namespace annexa {

namespace log = corvane::log;

namespace {

std::string uuidText(const AXDPlugIn& plugIn) { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); }
std::string identifierText(const AXDPlugIn& plugIn) { return plugIn.identifier().value_or(""); }
// A version is a string in the bundle; the log shows it as written, not quoted.
std::string versionText(const AXDPlugIn& plugIn) {
    Value version = plugIn.version();
    const std::string* text = version.asString();
    return text ? *text : version.description();
}

}  // namespace

std::string AXDPlugIn::sandboxProfile() const {
    const Value pointValue = pluginKey(keys::kPointIdentifier);
    const std::string* point = pointValue.asString();
    bool networkGranted = attribute("RequestsOpenAccess").isTrue() &&
                          allowedPCXServices().count(corvane::pcx::kKeyboardNetworkService);
    return corvane::sdk::sandboxProfileFor(point ? *point : std::string(), networkGranted).profile;
}

Status AXDPlugIn::enableForClient(const AXDRpxClient& client) const {
    const std::string identifier = identifierText(*this);
    const std::string uuid = uuidText(*this);
    const std::string version = versionText(*this);
    // The environment: the daemon's AXTEST_SDK, then the plug-in's own variables, then, last, those
    // that name its container, which the plug-in cannot replace (spawnd sets them again from the
    // container it opens itself).
    Dictionary environment;
    if (const char* sdk = std::getenv("AXTEST_SDK")) environment["AXTEST_SDK"] = Value(sdk);
    Dictionary service;
    Value raw = infoKey("RPXService");
    if (raw.isDictionary()) {
        log::debug(logVt(), "raw RPXService=%@", raw);
        service = *raw.asDictionary();
    } else {
        log::info(logOps(), "no RPXService for plug-in; database returned %@", raw);
    }
    if (const Dictionary* own = service["EnvironmentVariables"].asDictionary()) {
        for (const auto& [name, value] : *own)
            if (!corvane::spawn::isReservedVariable(name)) environment[name] = value;
    }
    service.erase(corvane::spawn::protocol::kDataContainer);
    service.erase(corvane::spawn::protocol::kMemoryLimit);
    auto record = vtproxy();
    if (record && record->dataContainerPath()) {
        const std::string& container = *record->dataContainerPath();
        environment["HOME"] = Value(container);
        environment["KFFIXED_USER_HOME"] = Value(container);
        environment["TMPDIR"] = Value(container + "/tmp");
        service[corvane::spawn::protocol::kDataContainer] = Value(container.substr(container.rfind('/') + 1));
    } else {
        log::debug(logOps(), "no data container for plug-in %@(%@) %{public}@ at %@", identifier, version, uuid, path());
    }
    // The extension point's memory for its sandboxes (MiB in its SDK definition).
    if (auto mib = pluginKey(corvane::sdk::kSandboxMemoryLimit).uint64Value(); mib && *mib > 0)
        service[corvane::spawn::protocol::kMemoryLimit] = Value(std::min<uint64_t>(*mib, uint64_t{1} << 16) << 20);
    std::string profile = sandboxProfile();
    service["EnvironmentVariables"] = Value(std::move(environment));
    service["_SandboxProfile"] = Value(profile);
    service["_OmitSandboxParameters"] = Value(true);
    log::info(logOps(), "assigning plug-in %@(%@) %{public}@ to %s sandbox", identifier, version, uuid, profile);

    Value overlay = corvane::dict({{"RPXService", convertValueToMessage(Value(std::move(service)))},
                                   {"KFBundlePackageType", "RPX!"}});
    log::notice(logOps(), "allowing host %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", client.pid(), client.path(),
             identifier, version, uuid, url());
    auto bundle = AXBundle::initWithURL(url());
    auto executable = bundle ? bundle->executablePath() : std::nullopt;
    if (!executable) {
        log::error(logOps(), "failed to obtain execPath for plug-in %@(%{public}@) bundle=%@", description(), uuid,
                   bundle ? bundle->description() : std::string("(null)"));
        return makeErrorWithFormat(AXErrorCode::InvalidRequest, "cannot obtain executable path for plug-in %@(%@)",
                                   identifier, uuid);
    }
    log::debug(logOps(), "activation overlay=%@", overlay);
    std::string reason;
    int result = corvane::spawn::addExternalService(client.pid(), *executable, overlay, &reason);
    if (result != 0) {
        log::error(logOps(), "spawnd error %d trying to allow %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", result,
                   client.pid(), client.path(), identifier, version, uuid, path());
        if (result == EPERM) {
            log::error(logOps(), "spawnd refused: this axd's signature lacks the %{public}s entitlement",
                       corvane::spawn::kDomainExtensionProxyEntitlement);
        } else if (result == EHOSTUNREACH) {
            log::error(logOps(), "spawnd cannot be reached on %{public}s: %{public}s", corvane::spawn::kEndpoint,
                       corvane::rpx::unreachableText(corvane::spawn::kEndpoint, "spawnd.socket"));
        }
        Error error = makeErrorWithFormat(AXErrorCode::InvalidRequest, "unable to enable plug-in %@(%@)", identifier, uuid);
        error.cause = reason;
        return error;
    }
    return {};
}

std::optional<Value> AXDPlugIn::checkBusy() const {
    Value bundleIdentifier = infoKey("KFBundleIdentifier");
    const std::string* text = bundleIdentifier.asString();
    auto instances = corvane::spawn::busyExtensionInstances({text ? *text : std::string()});
    if (!instances) return std::nullopt;
    for (const Value& instance : *instances) {
        const Value* busy = instance.find(corvane::spawn::kBundleIdentifierKey);
        if (busy) return corvane::dict({{corvane::spawn::kBundleIdentifierKey, *busy}});
        log::error(logOps(), "vigild reported incomplete bundle for plug-in %@/%{public}@", identifierText(*this),
                   uuidText(*this));
    }
    return std::nullopt;
}

}  // namespace annexa
