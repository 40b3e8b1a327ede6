// Registry: the public face of the store.
#include <cerrno>
#include <cstdio>

#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Store.h"

namespace corvane::vantry {

Registry::Registry(std::shared_ptr<Store> store) : store_(std::move(store)) {}
Registry::~Registry() = default;

std::string Registry::defaultPath() { return layout::stateDir() + "/vantry/registry.db"; }

Result<std::unique_ptr<Registry>> Registry::open(const std::string& path) {
    auto store = Store::open(path);
    if (!store) return store.error();
    return std::unique_ptr<Registry>(new Registry(*store));
}

const std::string& Registry::path() const { return store_->path(); }

PlugInRecordPtr Registry::plugInForUUID(const UUID& uuid) { return store_->plugInForUUID(uuid); }

PlugInRecordPtr Registry::plugInForPath(const std::string& bundlePath) {
    return plugInAtCanonicalPath(layout::canonicalPath(bundlePath).value_or(bundlePath));
}

ApplicationRecordPtr Registry::applicationForPath(const std::string& bundlePath) {
    return applicationAtCanonicalPath(layout::canonicalPath(bundlePath).value_or(bundlePath));
}

PlugInRecordPtr Registry::plugInAtCanonicalPath(const std::string& canonicalPath) {
    auto found = store_->selectPlugIns("WHERE path = ?", {canonicalPath});
    return found.empty() ? nullptr : found.front();
}

ApplicationRecordPtr Registry::applicationAtCanonicalPath(const std::string& canonicalPath) {
    return store_->applicationForPath(canonicalPath);
}

std::vector<PlugInRecordPtr> Registry::installedPlugIns() { return store_->selectPlugIns("ORDER BY path", {}); }

std::vector<PlugInRecordPtr> Registry::query(const Value& pattern,
                                             const std::function<bool(const std::string&, const Value&)>& filter) {
    return store_->query(pattern, filter);
}

Status Registry::registerBundle(const std::string& path, bool placeholder) {
    return store_->registerBundle(path, placeholder);
}

Status Registry::unregisterBundle(const std::string& path) { return store_->unregisterBundle(path); }

std::vector<std::string> Registry::registeredPaths() { return store_->registeredPaths(); }

std::vector<ApplicationRecordPtr> Registry::installedApplications() { return store_->installedApplications(); }

Status Registry::checkBundle(const std::string& path) { return vantry::checkBundle(path); }

Subscription Registry::subscribe(Observer& observer) { return store_->subscribe(observer); }

void Registry::dropCaches() { store_->dropCaches(); }

uint64_t Registry::contentVersion() { return store_->contentVersion(); }

Result<std::vector<std::string>> Registry::rebuild(const std::string& path) {
    auto list = plist::readWholeFile(path + ".paths");
    std::string aside = path + ".damaged-" + std::to_string(Date::now().wholeSeconds());
    for (const char* suffix : {"", "-wal", "-shm"}) {
        std::string from = path + suffix;
        if (::rename(from.c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT)
            return Error::posix(errno, from);
    }
    auto fresh = open(path);
    if (!fresh) return fresh.error();
    std::vector<std::string> failed;
    if (list) {
        size_t start = 0;
        while (start < list->size()) {
            size_t end = list->find('\n', start);
            std::string p = list->substr(start, end == std::string::npos ? std::string::npos : end - start);
            start = end == std::string::npos ? list->size() : end + 1;
            if (p.empty()) continue;
            if (!(*fresh)->registerBundle(p).ok()) failed.push_back(p);
        }
    }
    return failed;
}

}  // namespace corvane::vantry
