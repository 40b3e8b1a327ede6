// Registry: the public face of the stores, the system registry and the user's read as one.
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>

#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Store.h"

namespace corvane::vantry {

namespace {

// Whether this process may write the database at `path` (or create it in its directory).
bool mayWrite(const std::string& path) {
    std::string directory = path.substr(0, path.rfind('/'));
    if (::access(path.c_str(), F_OK) == 0) return ::access(path.c_str(), W_OK) == 0 && ::access(directory.c_str(), W_OK) == 0;
    std::string parent = directory;
    while (!parent.empty() && ::access(parent.c_str(), F_OK) != 0) parent = parent.substr(0, parent.rfind('/'));
    return ::access(parent.empty() ? "/" : parent.c_str(), W_OK) == 0;
}

template <typename T>
void appendSortedByPath(std::vector<T>& into, std::vector<T> more) {
    into.insert(into.end(), std::make_move_iterator(more.begin()), std::make_move_iterator(more.end()));
    std::stable_sort(into.begin(), into.end(), [](const T& a, const T& b) { return a->bundlePath() < b->bundlePath(); });
}

}  // namespace

Registry::Registry(std::shared_ptr<Store> user, std::shared_ptr<Store> system)
    : user_(std::move(user)), system_(std::move(system)) {}
Registry::~Registry() = default;

std::string Registry::defaultPath() { return layout::userStateDir() + "/vantry/registry.db"; }
std::string Registry::systemPath() { return layout::stateDir() + "/vantry/registry.db"; }

Result<std::unique_ptr<Registry>> Registry::open(const std::string& path) {
    auto store = Store::open(path);
    if (!store) return store.error();
    return std::unique_ptr<Registry>(new Registry(*store, nullptr));
}

Result<std::unique_ptr<Registry>> Registry::openSystem() {
    std::string path = systemPath();
    bool writable = mayWrite(path);
    if (!writable && ::access(path.c_str(), F_OK) != 0)
        return refusal("there is no system registry at " + path + " (as root: vantry --system sync)");
    auto store = Store::open(path, StoreOptions{.readOnly = !writable, .shared = true});
    if (!store) return store.error();
    return std::unique_ptr<Registry>(new Registry(nullptr, *store));
}

Result<std::unique_ptr<Registry>> Registry::openDefault() {
    auto user = Store::open(defaultPath());
    if (!user) return user.error();
    std::shared_ptr<Store> system;
    std::string systemDb = systemPath();
    bool writable = mayWrite(systemDb);
    if (writable || ::access(systemDb.c_str(), F_OK) == 0) {
        auto opened = Store::open(systemDb, StoreOptions{.readOnly = !writable, .shared = true});
        if (!opened) return opened.error();
        system = *opened;
    }
    return std::unique_ptr<Registry>(new Registry(*user, system));
}

const std::string& Registry::path() const { return user_ ? user_->path() : system_->path(); }

std::vector<Store*> Registry::stores() const {
    std::vector<Store*> out;
    if (system_) out.push_back(system_.get());
    if (user_) out.push_back(user_.get());
    return out;
}

bool Registry::isSystemBundle(const std::string& path) {
    if (!user_) return true;
    std::string canonical = layout::canonicalPath(path).value_or(path);
    std::string applications = layout::systemApplicationsDir();
    if (layout::isBeneath(canonical, layout::canonicalPath(applications).value_or(applications))) return true;
    return system_ && (system_->holdsBundle(canonical) || system_->holdsBundle(path));
}

Result<Store*> Registry::writerFor(const std::string& path) {
    if (!isSystemBundle(path)) return user_.get();
    if (!system_ || system_->options().readOnly)
        return refusal(path + " belongs to the system registry (" + systemPath() +
                       "), which only its owner writes: the package system keeps it in step (as root: "
                       "vantry --system sync)");
    return system_.get();
}

PlugInRecordPtr Registry::plugInForUUID(const UUID& uuid) {
    for (Store* store : stores())
        if (auto found = store->plugInForUUID(uuid)) return found;
    return nullptr;
}

PlugInRecordPtr Registry::plugInForPath(const std::string& bundlePath) {
    return plugInAtCanonicalPath(layout::canonicalPath(bundlePath).value_or(bundlePath));
}

ApplicationRecordPtr Registry::applicationForPath(const std::string& bundlePath) {
    return applicationAtCanonicalPath(layout::canonicalPath(bundlePath).value_or(bundlePath));
}

PlugInRecordPtr Registry::plugInAtCanonicalPath(const std::string& canonicalPath) {
    for (Store* store : stores()) {
        auto found = store->selectPlugIns("WHERE path = ?", {canonicalPath});
        if (!found.empty()) return found.front();
    }
    return nullptr;
}

ApplicationRecordPtr Registry::applicationAtCanonicalPath(const std::string& canonicalPath) {
    for (Store* store : stores())
        if (auto found = store->applicationForPath(canonicalPath)) return found;
    return nullptr;
}

std::vector<PlugInRecordPtr> Registry::installedPlugIns() {
    std::vector<PlugInRecordPtr> out;
    for (Store* store : stores()) appendSortedByPath(out, store->selectPlugIns("ORDER BY path", {}));
    return out;
}

std::vector<ApplicationRecordPtr> Registry::installedApplications() {
    std::vector<ApplicationRecordPtr> out;
    for (Store* store : stores()) appendSortedByPath(out, store->installedApplications());
    return out;
}

std::vector<PlugInRecordPtr> Registry::query(const Value& pattern,
                                             const std::function<bool(const std::string&, const Value&)>& filter) {
    // The system's plug-ins first, then the user's: each store answers in path order.
    std::vector<PlugInRecordPtr> out;
    for (Store* store : stores()) {
        auto some = store->query(pattern, filter);
        out.insert(out.end(), std::make_move_iterator(some.begin()), std::make_move_iterator(some.end()));
    }
    return out;
}

Status Registry::registerBundle(const std::string& path, bool placeholder) {
    auto writer = writerFor(path);
    if (!writer) return writer.error();
    return (*writer)->registerBundle(path, placeholder);
}

Status Registry::unregisterBundle(const std::string& path) {
    auto writer = writerFor(path);
    if (!writer) return writer.error();
    return (*writer)->unregisterBundle(path);
}

Result<SyncReport> Registry::sync(const std::string& directory) {
    std::string canonical = layout::canonicalPath(directory).value_or(directory);
    auto writer = writerFor(canonical);
    if (!writer) return writer.error();
    return (*writer)->sync(canonical);
}

std::vector<std::string> Registry::registeredPaths() {
    std::vector<std::string> out;
    for (Store* store : stores()) {
        auto some = store->registeredPaths();
        out.insert(out.end(), some.begin(), some.end());
    }
    return out;
}

Status Registry::checkBundle(const std::string& path) { return vantry::checkBundle(path); }

Subscription Registry::subscribe(Observer& observer) {
    Subscription all;
    bool first = true;
    for (Store* store : stores()) {
        if (first) {
            all = store->subscribe(observer);
            first = false;
        } else {
            all.join(store->subscribe(observer));
        }
    }
    return all;
}

void Registry::dropCaches() {
    for (Store* store : stores()) store->dropCaches();
}

uint64_t Registry::contentVersion() {
    uint64_t sum = 0;
    for (Store* store : stores()) sum += store->contentVersion();
    return sum;
}

Result<std::vector<std::string>> Registry::rebuild(const std::string& path) {
    auto list = plist::readWholeFile(path + ".paths");
    std::string aside = path + ".damaged-" + std::to_string(Date::now().wholeSeconds());
    for (const char* suffix : {"", "-wal", "-shm", "-journal"}) {
        std::string from = path + suffix;
        if (::rename(from.c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT)
            return Error::posix(errno, from);
    }
    auto fresh = path == systemPath() ? openSystem() : open(path);
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
