#include "axd/AXDatabase.h"

#include <unicode/uchar.h>
#include <unicode/utf8.h>

#include <unordered_set>

#include <cctype>
#include <cstdlib>

#include "platform/notify/Notify.h"

namespace annexa {

namespace log = corvane::log;
using corvane::vantry::PlugInRecordPtr;

AXDatabase::AXDatabase(const char* database, std::shared_ptr<corvane::vantry::Registry> workspace)
    : workspace_(std::move(workspace)),
      databaseQueue_(corvane::dispatch::Queue::create("AXDatabase")) {
    // Made before the queue serves anything; nothing else can see it yet.
    auto store = std::make_unique<AXDAnnotationStore>(database);
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        annotations_ = std::move(store);
    });
    subscription_ = workspace_->subscribe(*this);
}

AXDatabase::~AXDatabase() = default;

AXDPlugInPtr AXDatabase::plugInForProxy(const PlugInRecordPtr& record) {
    return plugInsForProxies({record}).front();
}

std::vector<AXDPlugInPtr> AXDatabase::plugInsForProxies(const std::vector<PlugInRecordPtr>& records) {
    databaseQueue_->assertNotCurrent();
    std::vector<AXDPlugInPtr> result;
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        result = plugInsForProxiesLocked(records);
    });
    return result;
}

std::vector<AXDPlugInPtr> AXDatabase::plugInsForProxiesLocked(const std::vector<PlugInRecordPtr>& records) {
    std::vector<AXDPlugInPtr> result;
    result.reserve(records.size());
    for (const auto& record : records) {
        auto it = cache_.find(record->uuid());
        result.push_back(it != cache_.end() ? it->second : createPlugInForProxy(record));
    }
    return result;
}

AXDPlugInPtr AXDatabase::createPlugInForProxy(const PlugInRecordPtr& record) {
    databaseQueue_->assertCurrent();
    AXDPlugInPtr plugIn = AXDPlugIn::fromRegistryRecord(record);
    if (!plugIn) return nullptr;
    // The record is stored only once built, and elected first when it asks for that.
    if (plugIn->hasEntitlement(keys::kAutoElectEntitlement)) autoElect(*plugIn);
    purgeCachesToLimit(static_cast<int32_t>(cacheLimit()));
    cache_[*plugIn->uuid()] = plugIn;
    keptInstalled_.reset();
    return plugIn;
}

void AXDatabase::purgeCachesToLimit(int32_t limit) {
    databaseQueue_->assertCurrent();
    if (cache_.size() <= static_cast<uint32_t>(limit)) return;
    log::info(logOps(), "purging cache for %d > %d", static_cast<int>(cache_.size()), limit);
    cache_.clear();
    keptInstalled_.reset();
    workspace_->dropCaches();
}

AXDPlugInPtr AXDatabase::findPlugIn(const UUID& uuid) { return plugInsForUUIDs(std::vector<UUID>{uuid}).front(); }

std::vector<AXDPlugInPtr> AXDatabase::plugInsForUUIDs(const std::vector<UUID>& uuids) {
    databaseQueue_->assertNotCurrent();
    std::vector<AXDPlugInPtr> result(uuids.size());
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        for (size_t i = 0; i < uuids.size(); ++i) {
            auto it = cache_.find(uuids[i]);
            if (it != cache_.end()) {
                result[i] = it->second;
            } else if (auto record = workspace_->plugInForUUID(uuids[i])) {
                result[i] = createPlugInForProxy(record);
            } else {
                log::info(logOps(), "Vantry cannot find plug-in with UUID:%{public}@", uuids[i]);
            }
            if (!result[i]) return;
        }
    });
    return result;
}

AXDPlugInPtr AXDatabase::findPlugInAtPath(const std::string& canonicalPath) {
    auto record = workspace_->plugInAtCanonicalPath(canonicalPath);
    if (!record) {
        log::info(logOps(), "Vantry cannot find plug-in at path:%@", canonicalPath);
        return nullptr;
    }
    return findPlugIn(record->uuid());
}

std::optional<std::vector<AXDPlugInPtr>> AXDatabase::plugInsWithinApplication(const std::string& canonicalPath) {
    auto app = workspace_->applicationAtCanonicalPath(canonicalPath);
    auto records = app ? app->plugIns() : std::vector<PlugInRecordPtr>{};
    if (records.empty()) return std::nullopt;
    std::vector<AXDPlugInPtr> result;
    for (const auto& r : records)
        if (auto p = plugInForProxy(r)) result.push_back(std::move(p));
    return result;
}

bool AXDatabase::isSystemBundle(const std::string& path) { return workspace_->isSystemBundle(path); }

Status AXDatabase::addPlugIn(const std::string& path) {
    Status registered = workspace_->registerBundle(path);
    if (registered.ok()) return {};
    // The reply's text is fixed; the registry's reason goes to the log, and beside the text.
    log::error(logOps(), "Vantry cannot register %@: %{public}@", path, registered.error().description());
    Error error = makeError(AXErrorCode::RegistryRefused, "Vantry failed to register the plug-in");
    error.cause = registered.error().description();
    return error;
}

Status AXDatabase::removePlugIn(const std::string& path) {
    Status unregistered = workspace_->unregisterBundle(path);
    if (unregistered.ok()) return {};
    log::info(logOps(), "Vantry cannot unregister %@: %{public}@", path, unregistered.error().description());
    Error error = makeError(AXErrorCode::RegistryRefused, "Vantry failed to deregister the plug-in");
    error.cause = unregistered.error().description();
    return error;
}

namespace {

// Whether the first character (UTF-8) is a Unicode letter, mark or number: "«", "—" or a no-break
// space are not, nor is a byte that begins no character.
bool beginsWithLetterMarkOrDigit(const std::string& text) {
    int32_t at = 0;
    UChar32 c = U_SENTINEL;
    U8_NEXT(reinterpret_cast<const uint8_t*>(text.data()), at, static_cast<int32_t>(std::min<size_t>(text.size(), 4)), c);
    return c >= 0 && (U_GET_GC_MASK(c) & (U_GC_L_MASK | U_GC_M_MASK | U_GC_N_MASK)) != 0;
}

// The registry's answer as the log shows it.
std::string recordsText(const std::vector<PlugInRecordPtr>& records) {
    std::string text = "(";
    for (const auto& r : records) text += (text.size() > 1 ? ", " : "") + r->description();
    return text + ")";
}

}  // namespace

std::string AXDatabase::electionText(const Value& annotation, const Value& autoElect) {
    const Value* stored = annotation.find(keys::kElection);
    int64_t election = stored ? integerValueOf(*stored) : (autoElect.isNumber() && !autoElect.isFalse() ? 1 : 0);
    return std::to_string(static_cast<uint64_t>(election) & 0xff);
}

std::string AXDatabase::electionText(const AXDPlugIn& plugIn) {
    return electionText(annotationForPlugIn(plugIn), plugIn.valueForEntitlement(keys::kAutoElectEntitlement));
}

std::optional<std::set<std::string>> AXDatabase::electionFilter(const Value& entry) {
    std::vector<Value> elements;
    if (entry.isString()) {
        elements.push_back(entry);
    } else if (const Array* list = entry.asArray()) {
        elements = *list;
    } else {
        return std::nullopt;
    }
    std::set<std::string> allowed;
    for (const Value& e : elements) {
        const std::string* text = e.asString();
        if (!text || text->empty()) return std::nullopt;
        if ((*text)[0] == '=') {
            allowed.insert(text->substr(1));
        } else if (beginsWithLetterMarkOrDigit(*text)) {
            allowed.insert(*text);
        } else {
            return std::nullopt;
        }
    }
    return allowed;
}

namespace {

// Whether a record gives no candidate; the log says why each time it is passed over.
bool skipRecord(const PlugInRecordPtr& r) {
    if (r->bundlePath().empty()) {
        log::info(logOps(), "skipping vt proxy %@ with nil bundleURL", r->description());
        return true;
    }
    if (const auto& app = r->containingApplication(); app && app->isPlaceholder()) {
        log::info(logOps(), "skipping vt proxy %@ because its app is a placeholder", r->description());
        return true;
    }
    return false;
}

void logInstalled(const std::vector<PlugInRecordPtr>& records) {
    if (logVt().enabled(log::Level::Debug))
        log::debug(logVt(), "%d installedPlugins: %@", static_cast<int>(records.size()), recordsText(records));
}

}  // namespace

std::optional<std::vector<AXDPlugInPtr>> AXDatabase::keptInstalledPlugIns(uint64_t contentVersion) {
    return databaseQueue_->syncResult([&]() -> std::optional<std::vector<AXDPlugInPtr>> {
        databaseQueue_->assertCurrent();
        if (!keptInstalled_ || keptInstalled_->contentVersion != contentVersion) return std::nullopt;
        logInstalled(keptInstalled_->records);
        for (const auto& r : keptInstalled_->skipped) (void)skipRecord(r);
        // A record that built nothing says so again; one that builds now drops the kept answer
        // (and the list with it: the loop goes over a copy).
        std::vector<PlugInRecordPtr> unbuilt = keptInstalled_->unbuilt;
        (void)plugInsForProxiesLocked(unbuilt);
        if (!keptInstalled_) return std::nullopt;
        return keptInstalled_->plugIns;
    });
}

std::vector<AXDPlugInPtr> AXDatabase::findPlugIns(const Value& query) {
    databaseQueue_->assertNotCurrent();
    std::vector<corvane::vantry::PlugInRecordPtr> records;
    const Dictionary* tests = query.asDictionary();
    bool everything = !tests || tests->empty();
    // Read before the records: should the registry change after it, the version moves on and
    // the answer kept under this one is not given again.
    uint64_t contentVersion = everything ? workspace_->contentVersion() : 0;
    if (everything) {
        if (auto kept = keptInstalledPlugIns(contentVersion)) {
            log::debug(logOps(), "VT reported %u plug-ins (kept)", static_cast<unsigned>(kept->size()));
            return std::move(*kept);
        }
        records = workspace_->installedPlugIns();
        logInstalled(records);
    } else {
        auto allowed = electionFilter(query["KSUserElection"]);
        auto filter = [&](const std::string& identifier, const Value& entitlements) {
            if (!allowed) return true;
            const std::string* replaced = entitlements[keys::kReplaceEntitlement].asString();
            std::string key = replaced ? *replaced : identifier;
            Value annotation = databaseQueue_->syncResult([&] {
                databaseQueue_->assertCurrent();
                return annotations_->annotationForIdentifier(key);
            });
            bool kept = allowed->count(electionText(annotation, entitlements[keys::kAutoElectEntitlement])) > 0;
            log::debug(logOps(), "vt filter %@ -> %d", key, static_cast<int>(kept));
            return kept;
        };
        records = workspace_->query(query, filter);
        if (logVt().enabled(log::Level::Debug))
            log::debug(logVt(), "%d plugin(s) matching %@ = %@", static_cast<int>(records.size()), query,
                       recordsText(records));
    }
    KeptInstalled made;
    made.contentVersion = contentVersion;
    if (everything) made.records = records;
    std::vector<corvane::vantry::PlugInRecordPtr> usable;
    usable.reserve(records.size());
    std::unordered_set<UUID, corvane::UUIDHash> seen;
    seen.reserve(records.size());
    for (const auto& r : records) {
        if (skipRecord(r)) {
            made.skipped.push_back(r);
            continue;
        }
        if (seen.insert(r->uuid()).second) usable.push_back(r);
    }
    size_t before = 0;
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        before = cache_.size();
        std::vector<AXDPlugInPtr> built = plugInsForProxiesLocked(usable);
        made.plugIns.reserve(built.size());
        for (size_t i = 0; i < built.size(); ++i) {
            if (built[i]) {
                made.plugIns.push_back(std::move(built[i]));
            } else {
                made.unbuilt.push_back(usable[i]);
            }
        }
        // Kept in the same visit as the mapping: any later change of the cache drops it.
        if (everything) keptInstalled_ = made;
    });
    log::debug(logOps(), "VT reported %u plug-ins (cache %u/%u)", static_cast<unsigned>(made.plugIns.size()),
               static_cast<unsigned>(before), static_cast<unsigned>(cacheCount()));
    return std::move(made.plugIns);
}

uint32_t AXDatabase::cacheLimitFromText(const char* text) {
    return static_cast<uint32_t>(std::strtol(text, nullptr, 10));
}

std::vector<Value> AXDatabase::annotationsForPlugIns(const std::vector<const AXDPlugIn*>& plugIns) {
    databaseQueue_->assertNotCurrent();
    std::vector<Value> result;
    result.reserve(plugIns.size());
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        for (const AXDPlugIn* p : plugIns) result.push_back(annotations_->annotationForPlugIn(*p));
    });
    return result;
}

Value AXDatabase::annotationForPlugIn(const AXDPlugIn& plugIn) {
    databaseQueue_->assertNotCurrent();
    return databaseQueue_->syncResult([&] {
        databaseQueue_->assertCurrent();
        return annotations_->annotationForPlugIn(plugIn);
    });
}

void AXDatabase::setAnnotationForPlugIn(const Value& annotation, const AXDPlugIn& plugIn) {
    databaseQueue_->assertNotCurrent();
    bool watched = !watchers_.empty();
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        Value before = watched ? annotations_->annotationForPlugIn(plugIn) : Value();
        annotations_->changeAnnotationForPlugIn(annotation, plugIn);
        if (!watched) return;
        Value after = annotations_->annotationForPlugIn(plugIn);
        if (before != after) {
            unsavedEvents_.push_back(corvane::dict({{"event", "annotation"}, {"plugin", AXDWatchers::summary(plugIn)},
                                                    {"old", before}, {"new", after}}));
        }
    });
}

Status AXDatabase::saveAnnotations() {
    databaseQueue_->assertNotCurrent();
    std::vector<Value> events;
    Status saved = databaseQueue_->syncResult([&] {
        databaseQueue_->assertCurrent();
        Status status = annotations_->saveIfChanged();
        // Watchers learn of a change once it is on disk; one that could not be saved was undone.
        if (status.ok()) events = std::move(unsavedEvents_);
        unsavedEvents_.clear();
        return status;
    });
    for (auto& event : events) watchers_.publish(std::move(event));
    return saved;
}

void AXDatabase::notifyAnnotationChange() { (void)corvane::notify::post(kAnnotationChangeNotification); }

void AXDatabase::autoElect(const AXDPlugIn& plugIn) {
    databaseQueue_->assertCurrent();
    Value current = annotations_->annotationForPlugIn(plugIn);
    const Value* election = current.find(keys::kElection);
    // An election already made is never overridden.
    if (election && integerValueOf(*election) != 0) return;
    // A failed save is logged and undone: the plug-in is elected again at its next build.
    (void)annotations_->setAnnotationForPlugIn(Value(dictionaryChanging(current, keys::kElection, Value(1))), plugIn);
}

void AXDatabase::pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) {
    for (const auto& r : records) {
        log::notice(logOps(), "plug-in INSTALLED:%@ %@(%@) %{public}@ %@", r->bundleIdentifier(), r->identifier(),
                    r->bundleVersion(), r->uuid().string(), r->bundlePath());
        watchers_.publish(corvane::dict({{"event", "installed"}, {"plugin", AXDWatchers::summary(*r)}}));
    }
}

void AXDatabase::pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) {
    databaseQueue_->assertNotCurrent();
    databaseQueue_->sync([&] {
        databaseQueue_->assertCurrent();
        for (const auto& r : records) {
            log::notice(logOps(), "plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", r->bundleIdentifier(),
                        r->identifier(), r->bundleVersion(), r->uuid().string(), r->bundlePath());
            cache_.erase(r->uuid());
        }
        keptInstalled_.reset();
    });
    for (const auto& r : records) {
        watchers_.publish(corvane::dict({{"event", "uninstalled"}, {"plugin", AXDWatchers::summary(*r)}}));
    }
    if (AXDatabaseDelegate* d = delegate()) d->removedPlugIns(records);
}

size_t AXDatabase::cacheCount() {
    return databaseQueue_->syncResult([&] {
        databaseQueue_->assertCurrent();
        return cache_.size();
    });
}

std::string AXDatabase::annotationsURL() {
    return databaseQueue_->syncResult([&] {
        databaseQueue_->assertCurrent();
        return annotations_->annotationsURL();
    });
}

}  // namespace annexa
