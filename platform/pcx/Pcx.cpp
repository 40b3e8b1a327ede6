#include "platform/pcx/Pcx.h"

#include <cerrno>

#include "platform/bundle/Bundle.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"

namespace corvane::pcx {

namespace {

const log::Handle& pcxLog() {
    static const log::Handle h("com.corvane.pcx", "consent");
    return h;
}

// The store as a dictionary; a store not made yet is an empty one.
Result<Value> readStore() {
    auto store = plist::readFile(storePath());
    if (!store) {
        if (store.error().domain == kFileErrorDomain && store.error().code == kFileNoSuchFile) return Value(Dictionary{});
        return store.error();
    }
    if (!store->isDictionary()) return Error::posix(EINVAL, storePath() + ": not a dictionary of applications");
    return store;
}

std::vector<Record> recordsOf(const Value& application) {
    std::vector<Record> records;
    if (const Dictionary* services = application.asDictionary()) {
        for (const auto& [service, granted] : *services) {
            records.push_back({service, granted.isTrue()});
        }
    }
    return records;
}

// Whether the process on the other side of `connection` runs the executable of the bundle at
// `bundlePath`: an application may read its own records.
bool runsBundle(const rpx::Connection& connection, const std::string& bundlePath) {
    auto bundle = bundle::Bundle::openPath(bundlePath);
    auto executable = bundle ? bundle->property(bundle::kPropertyExecutablePath) : std::nullopt;
    auto own = layout::canonicalPath(connection.peer().executablePath);
    return executable && own && layout::canonicalPath(*executable) == own;
}

Value answer(const rpx::Connection& connection, const Value& request) {
    const std::string* path = request["bundle"].asString();
    if (!path) return dict({{"error", "the request names no \"bundle\" path"}});
    auto signer = codesign::Handle::fromAuditToken(connection.peer().auditToken);
    bool manager = signer && signer->valueForEntitlement(kManagerEntitlement).isTrue();
    if (!manager && !runsBundle(connection, *path)) {
        log::notice(pcxLog(), "refused consent information for %@ to pid %d without the %{public}s entitlement",
                    *path, connection.pid(), kManagerEntitlement);
        return dict({{"error", log::formatText("not entitled to read the consent records of %@", *path)}});
    }
    auto records = recordsForBundle(*path);
    if (!records) return dict({{"error", records.error().description()}});
    Array list;
    for (const Record& record : *records) {
        list.push_back(dict({{kServiceKey, record.service}, {kGrantedKey, record.granted}}));
    }
    return dict({{"records", Value(std::move(list))}});
}

}  // namespace

std::string storePath() { return layout::userDataDir() + "/pcx/consent.plist"; }

Result<std::string> bundleIdentifierAt(const std::string& bundlePath) {
    // What is wrong, said as it is: no Info.plist, one that cannot be read (a FIFO, too large, no
    // permission), one that does not parse, or one without identifier.
    auto info = bundle::readPropertyListOfBundle(bundlePath + "/Info.plist");
    if (!info) return Error(kPosixErrorDomain, ENOENT, bundlePath + " is no bundle: " + info.error().description());
    const std::string* identifier = (*info)["KFBundleIdentifier"].asString();
    if (!identifier || identifier->empty()) {
        return Error(kPosixErrorDomain, ENOENT, bundlePath + "/Info.plist has no KFBundleIdentifier");
    }
    return *identifier;
}

Result<std::vector<Record>> recordsForBundle(const std::string& bundlePath) {
    auto identifier = bundleIdentifierAt(bundlePath);
    if (!identifier) return identifier.error();
    auto store = readStore();
    if (!store) return store.error();
    return recordsOf((*store)[*identifier]);
}

Result<Value> allRecords() { return readStore(); }

Status setConsent(const std::string& bundlePath, const std::string& service, bool granted) {
    if (service.empty()) return Error::posix(EINVAL, "empty service identifier");
    auto identifier = bundleIdentifierAt(bundlePath);
    if (!identifier) return identifier.error();
    auto store = readStore();
    if (!store) return store.error();
    Dictionary applications = *store->asDictionary();
    Dictionary services;
    if (const Dictionary* known = applications[*identifier].asDictionary()) services = *known;
    services[service] = Value(granted);
    applications[*identifier] = Value(std::move(services));
    if (auto made = layout::makeDirectories(layout::userDataDir() + "/pcx", 0700); !made.ok()) return made;
    return plist::writeXMLFile(storePath(), Value(std::move(applications)), 0600);
}

std::optional<Array> consentInformationForBundle(const std::string& bundlePath) {
    auto connection = rpx::Connection::connect(kEndpoint, dispatch::Queue::create("com.corvane.pcx.client"));
    connection->setEventHandler([](const rpx::Event&) {});
    connection->resume();
    rpx::Reply reply = connection->sendWithReplySync(dict({{"bundle", bundlePath}}));
    connection->cancel();
    const Array* records = reply.ok() ? reply.value["records"].asArray() : nullptr;
    if (!records) return std::nullopt;
    return *records;
}

Result<std::unique_ptr<Service>> Service::start(dispatch::QueuePtr queue) {
    auto listener = rpx::serveRequests(kEndpoint, std::move(queue), answer);
    if (!listener) return listener.error();
    return std::unique_ptr<Service>(new Service(*listener));
}

Service::~Service() { listener_->cancel(); }

}  // namespace corvane::pcx
