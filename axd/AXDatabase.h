// The daemon's plug-in database: a cache of daemon plug-in records built on demand from the
// application registry's records, the lookups the request handlers use, registration through the
// registry, the annotations (with auto-election) and the registry's install and uninstall events.
//
// The registry (Vantry) is the source of truth; the database never enumerates bundles. A cached
// record is returned for as long as its entry lives, however its bundle changed since; entries
// leave only when the registry announces an uninstall, or all at once when an insertion finds the
// cache over its limit.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "axd/AXDAnnotationStore.h"
#include "axd/AXDPlugIn.h"
#include "axd/AXDWatchers.h"
#include "platform/dispatch/Dispatch.h"
#include "platform/vantry/Vantry.h"

namespace annexa {

// Told when plug-ins are being uninstalled, after the database dropped them; called on the
// registry's thread.
class AXDatabaseDelegate {
public:
    virtual ~AXDatabaseDelegate() = default;
    virtual void removedPlugIns(const std::vector<corvane::vantry::PlugInRecordPtr>& records) = 0;
};

inline constexpr const char* kAnnotationChangeNotification = "com.corvane.annexa.annotation-change";

// Lives on: the database queue "AXDatabase" for the cache and the annotation store; the registry
// and the delegate are used from the calling thread. The queue is entered synchronously and never
// re-entered.
class AXDatabase : private corvane::vantry::Observer {
public:
    // Opens the annotation store (`database`: the -d path, or null for its default location),
    // makes the queue and subscribes to the events of `workspace`, the registry it serves from.
    AXDatabase(const char* database, std::shared_ptr<corvane::vantry::Registry> workspace);
    virtual ~AXDatabase();
    AXDatabase(const AXDatabase&) = delete;
    AXDatabase& operator=(const AXDatabase&) = delete;

    AXDPlugInPtr plugInForProxy(const corvane::vantry::PlugInRecordPtr& record);
    // The same for many records in one visit to the database queue; null where none can be built.
    std::vector<AXDPlugInPtr> plugInsForProxies(const std::vector<corvane::vantry::PlugInRecordPtr>& records);
    AXDPlugInPtr createPlugInForProxy(const corvane::vantry::PlugInRecordPtr& record) REQUIRES(*databaseQueue_);
    void purgeCachesToLimit(int32_t limit) REQUIRES(*databaseQueue_);
    AXDPlugInPtr findPlugIn(const UUID& uuid);
    // The same for many UUIDs in one visit to the database queue, in order; the lookups stop at the
    // first UUID that names no plug-in (null there and after it), as a walk over them stops there.
    std::vector<AXDPlugInPtr> plugInsForUUIDs(const std::vector<UUID>& uuids);
    // `canonicalPath` as layout::canonicalPath gives it (requests resolve their paths once).
    AXDPlugInPtr findPlugInAtPath(const std::string& canonicalPath);
    // `findPlugIns:`: the candidates for a host's pattern dictionary (null or empty: every
    // installed plug-in), in the registry's order, each once; the registry drops plug-ins whose
    // election the query's "KSUserElection" excludes before any record is built. Called on the
    // service queue.
    std::vector<AXDPlugInPtr> findPlugIns(const Value& query);
    // The election texts a "KSUserElection" entry allows, or nothing when it filters nothing.
    static std::optional<std::set<std::string>> electionFilter(const Value& entry);
    // The text the election filter compares for a plug-in: its stored election (else 1 when its
    // auto-elect entitlement is a non-zero number, else 0), reduced to its low 8 bits.
    static std::string electionText(const Value& annotation, const Value& autoElect);
    std::string electionText(const AXDPlugIn& plugIn);

    // Null (not empty) when the application has no plug-ins or is not known; a canonical path.
    std::optional<std::vector<AXDPlugInPtr>> plugInsWithinApplication(const std::string& canonicalPath);
    Status addPlugIn(const std::string& path);
    // Whether `path` belongs to the system registry.
    bool isSystemBundle(const std::string& path);
    Status removePlugIn(const std::string& path);

    Value annotationForPlugIn(const AXDPlugIn& plugIn);
    // The same for many plug-ins in one visit to the database queue, in their order.
    std::vector<Value> annotationsForPlugIns(const std::vector<const AXDPlugIn*>& plugIns);
    // Changes the annotation in memory; saveAnnotations() writes the changes of a request at once.
    void setAnnotationForPlugIn(const Value& annotation, const AXDPlugIn& plugIn);
    // Writes the annotation file when anything changed since the last write, then tells the
    // watchers of the changes. When the write fails, every change since the last write is undone
    // (AXDAnnotationStore::saveIfChanged) and the error returned.
    Status saveAnnotations();
    void notifyAnnotationChange();
    void autoElect(const AXDPlugIn& plugIn) REQUIRES(*databaseQueue_);
    // The registry's events, on its event thread.
    void pluginsDidInstall(const std::vector<corvane::vantry::PlugInRecordPtr>& records) override;
    void pluginsWillUninstall(const std::vector<corvane::vantry::PlugInRecordPtr>& records) override;

    AXDatabaseDelegate* delegate() const { return delegate_.load(); }
    // Not owned.
    void setDelegate(AXDatabaseDelegate* delegate) { delegate_.store(delegate); }
    uint32_t cacheLimit() const { return cacheLimit_.load(); }
    // The limit that the daemon's -c text gives: a decimal number read as strtol reads it
    // (leading blanks and a sign allowed), 0 when the text has no leading digits.
    static uint32_t cacheLimitFromText(const char* text);
    void setCacheLimit(uint32_t limit) { cacheLimit_.store(limit); }
    corvane::vantry::Registry& workspace() const { return *workspace_; }
    // The clients watching changes ("watch").
    AXDWatchers& watchers() { return watchers_; }
    corvane::dispatch::Queue& databaseQueue() const RETURN_CAPABILITY(*databaseQueue_) { return *databaseQueue_; }
    // The number of cached records (read on the database queue).
    size_t cacheCount();
    // The annotation file's location.
    std::string annotationsURL();

private:

    std::atomic<AXDatabaseDelegate*> delegate_{nullptr};
    AXDWatchers watchers_;
    std::atomic<uint32_t> cacheLimit_{0};
    const std::shared_ptr<corvane::vantry::Registry> workspace_;
    const corvane::dispatch::QueuePtr databaseQueue_;
    std::unique_ptr<AXDAnnotationStore> annotations_ GUARDED_BY(*databaseQueue_);
    std::vector<Value> unsavedEvents_ GUARDED_BY(*databaseQueue_);  // annotation events, until saved
    std::unordered_map<UUID, AXDPlugInPtr, corvane::UUIDHash> cache_ GUARDED_BY(*databaseQueue_);
    // The last answer of every installed plug-in, given again while the registry's contents stay
    // and the cache is not changed (which drops it): mapping ten thousand records to their
    // plug-ins again costs a cache miss or two for each. What the mapping logs is logged again,
    // and records that built no plug-in are tried again.
    struct KeptInstalled {
        uint64_t contentVersion = 0;
        std::vector<corvane::vantry::PlugInRecordPtr> records;  // the registry's, as listed
        std::vector<AXDPlugInPtr> plugIns;
        std::vector<corvane::vantry::PlugInRecordPtr> skipped;  // passed over
        std::vector<corvane::vantry::PlugInRecordPtr> unbuilt;  // built no plug-in
    };
    std::optional<KeptInstalled> keptInstalled_ GUARDED_BY(*databaseQueue_);
    // The kept answer for `contentVersion`, or nothing when it is not current.
    std::optional<std::vector<AXDPlugInPtr>> keptInstalledPlugIns(uint64_t contentVersion);
    // The plug-in of each record (null where none can be built), from the cache or built.
    std::vector<AXDPlugInPtr> plugInsForProxiesLocked(const std::vector<corvane::vantry::PlugInRecordPtr>& records)
        REQUIRES(*databaseQueue_);
    // Last, so that it ends first: no event reaches a database being destroyed.
    corvane::vantry::Subscription subscription_;
};

}  // namespace annexa
