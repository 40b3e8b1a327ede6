// Vantry: the application registry (docs/registry.md).
//
// One SQLite database (WAL mode) under the platform root holds every registered application and
// plug-in; every process that uses the registry opens it: the daemon, installers, the vantry tool.
// Registering scans a bundle on disk once: an application with every plug-in under its PlugIns/,
// or a stand-alone plug-in. Reading a record never touches the bundle again.
//
// Install and uninstall events reach observers in every process, in order and each once, through a
// journal table and an inotify wake-up; an observer gets only events after it was added.
//
// Records are immutable snapshots shared by reference. Thread-safe: a Registry may be used from
// any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::vantry {

class ApplicationRecord;
class PlugInRecord;
using ApplicationRecordPtr = std::shared_ptr<const ApplicationRecord>;
using PlugInRecordPtr = std::shared_ptr<const PlugInRecord>;

enum class Scope { Attributes, PlugIn, InfoPlist };

// Immutable.
class PlugInRecord {
public:
    UUID uuid() const { return uuid_; }
    const std::string& bundlePath() const { return bundlePath_; }
    // "KSExtensionIdentifier" of the plug-in dictionary when it is a string, else
    // "KFBundleIdentifier".
    const std::string& identifier() const { return identifier_; }
    const std::string& bundleIdentifier() const { return bundleIdentifier_; }
    const std::string& originalIdentifier() const { return originalIdentifier_; }
    const std::string& bundleVersion() const { return bundleVersion_; }
    // The plug-in dictionary merged with its extension point's SDK and in canonical form.
    const Value& pluginDictionary() const { return plugin_; }
    // The Info.plist merged with its extension point's SDK.
    const Value& infoDictionary() const { return info_; }
    // Verified entitlements of the executable; an empty dictionary when there are none.
    const Value& entitlements() const { return entitlements_; }
    Date registrationDate() const { return registered_; }
    bool onSystemVolume() const { return system_; }
    const ApplicationRecordPtr& containingApplication() const { return application_; }
    const std::optional<std::string>& dataContainerPath() const { return container_; }
    const std::optional<std::string>& localizedName() const { return localizedName_; }
    const std::optional<std::string>& localizedShortName() const { return localizedShortName_; }
    // The value of a key in the attributes, the plug-in dictionary, or the whole Info.plist.
    Value lookup(Scope scope, std::string_view key) const;

    // All of the record as one dictionary.
    Value serialize() const;
    // Where a stored form is kept: a row of the plug-ins table, whose columns hold the UUID, path
    // and identifier and name the application, or a journal entry, which must stand alone.
    enum class StoredIn { Table, Journal };
    // As the database keeps it: serialize() without what is there twice or follows from the rest.
    // The Info.plist leaves out its plug-in dictionary when that is the record's own (as it is
    // unless the extension point's SDK or the canonical form changed it), and a mark says to put
    // it back. The bundle identifier, version and original identifier are left out when they are
    // what reading derives from the rest; the data container always is (each reader's follows
    // from the identifier). A row also leaves out what its columns hold.
    Value storedForm(StoredIn where) const;
    // What a table row keeps beside its stored form.
    struct Columns {
        std::string_view uuid, path, identifier;
    };
    // Reads either form, or serialize()'s (a form without a data container leaves it to the
    // reader to name).
    static PlugInRecordPtr deserialize(const Value& v, ApplicationRecordPtr application, const Columns& columns = {});
    std::string description() const;

private:
    // deserialize(), the record still to be completed by its reader.
    static std::shared_ptr<PlugInRecord> read(const Value& v, ApplicationRecordPtr application, const Columns& columns);

    friend class Store;
    friend PlugInRecordPtr makeRecord(const struct ScannedPlugIn& s, const ApplicationRecordPtr& app);
    UUID uuid_;
    std::string bundlePath_, identifier_, bundleIdentifier_, originalIdentifier_, bundleVersion_;
    Value plugin_, info_, entitlements_;
    Date registered_;
    bool system_ = false;
    ApplicationRecordPtr application_;
    std::optional<std::string> container_, localizedName_, localizedShortName_;
};

// Immutable.
class ApplicationRecord {
public:
    const std::string& bundlePath() const { return bundlePath_; }
    const std::string& identifier() const { return identifier_; }
    const std::optional<std::string>& localizedName() const { return localizedName_; }
    bool isPlaceholder() const { return placeholder_; }
    // <bundle>/Receipt when it existed at registration.
    const std::optional<std::string>& receiptPath() const { return receipt_; }
    // The application's plug-ins, ordered by bundle path. Filled by the registry's lookups.
    std::vector<PlugInRecordPtr> plugIns() const;

    Value serialize() const;
    std::string description() const;

private:
    friend class Store;
    friend class PlugInRecord;
    std::string bundlePath_, identifier_;
    std::optional<std::string> localizedName_, receipt_;
    bool placeholder_ = false;
    std::function<std::vector<PlugInRecordPtr>()> plugIns_;
};

// Told of installs and uninstalls, on the registry's event thread ("vantry.events"), one event at a
// time and in order.
class Observer {
public:
    virtual ~Observer() = default;
    virtual void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) = 0;
    virtual void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) = 0;
};

class Store;

// An observer's subscription to a registry's events; destroying it (or cancel()) unsubscribes.
// Once cancel() has returned, the observer is not called again and no call to it is still running
// (called from inside the observer itself, it only stops later calls).
class [[nodiscard]] Subscription {
public:
    Subscription() = default;
    Subscription(Subscription&& other) noexcept;
    Subscription& operator=(Subscription&& other) noexcept;
    Subscription(const Subscription&) = delete;
    Subscription& operator=(const Subscription&) = delete;
    ~Subscription();

    void cancel();

    // One subscription that ends `more` together with this one.
    void join(Subscription&& more);

private:
    friend class Store;
    Subscription(std::weak_ptr<Store> store, uint64_t id);
    std::weak_ptr<Store> store_;
    uint64_t id_ = 0;
    std::unique_ptr<Subscription> next_;
};

// What bringing a registry in step with a directory did, by bundle path.
struct SyncReport {
    std::vector<std::string> registered, updated, unregistered;
    // Bundles that could not be registered, with the reason; a registration they had is gone.
    std::vector<std::pair<std::string, std::string>> refused;
};

// Two registries are read as one: the system registry, which holds what packages install in the
// system applications directory and which only its owner (root) writes, and the user's own,
// which holds everything else the user registers. A bundle path is in one of them, never both.
class Registry {
public:
    // The user's registry and the system registry, read as one (the layout's places). The system
    // registry is read only unless this process may write it; it is left out while it does not
    // exist.
    static Result<std::unique_ptr<Registry>> openDefault();
    // The system registry alone: to be written (created when missing) when this process may, else
    // read only.
    static Result<std::unique_ptr<Registry>> openSystem();
    // One registry over the database at `path` (created when missing), with no system part. Each
    // opening is independent.
    static Result<std::unique_ptr<Registry>> open(const std::string& path);
    // The user's registry: <per-user state>/vantry/registry.db
    static std::string defaultPath();
    // The system registry: <root>/var/lib/corvane/vantry/registry.db
    static std::string systemPath();
    ~Registry();

    PlugInRecordPtr plugInForUUID(const UUID& uuid);
    PlugInRecordPtr plugInForPath(const std::string& bundlePath);
    ApplicationRecordPtr applicationForPath(const std::string& bundlePath);
    // The same for a path already in canonical form (layout::canonicalPath), not resolved again.
    PlugInRecordPtr plugInAtCanonicalPath(const std::string& canonicalPath);
    ApplicationRecordPtr applicationAtCanonicalPath(const std::string& canonicalPath);
    std::vector<PlugInRecordPtr> installedPlugIns();
    // Every registered application, with or without plug-ins, ordered by bundle path.
    std::vector<ApplicationRecordPtr> installedApplications();
    // The plug-ins that may fit `pattern` and that `filter` accepts. The registry drops a plug-in
    // only when the pattern's exact test would certainly fail; the filter is called with the
    // plug-in's identifier and entitlements, and decides whether the plug-in is in the answer.
    std::vector<PlugInRecordPtr> query(
        const Value& pattern, const std::function<bool(const std::string&, const Value&)>& filter);

    // Registers an application (with its plug-ins) or a stand-alone plug-in. An unchanged bundle
    // changes nothing; a changed one replaces its records. Refused with the reason when the bundle
    // cannot be read; the database is then unchanged. A bundle in the system applications
    // directory, or one the system registry holds, goes to the system registry (refused when this
    // process may not write it); any other to the user's.
    Status registerBundle(const std::string& path, bool placeholder = false);
    Status unregisterBundle(const std::string& path);
    // Whether registering or unregistering `path` writes the system registry.
    bool isSystemBundle(const std::string& path);
    // Brings the registry that holds `directory` (as registerBundle chooses) in step with it,
    // in one transaction: registers what is new, registers again what changed, unregisters what
    // was registered under the directory and is gone or can no longer be read.
    Result<SyncReport> sync(const std::string& directory);
    // Reads a bundle as registration would and says why it would be refused; writes nothing and
    // needs no database.
    static Status checkBundle(const std::string& path);
    // The paths registered so far, for rebuilding a damaged database.
    std::vector<std::string> registeredPaths();

    // Calls `observer` for every install and uninstall after this call until the subscription
    // ends; the observer must outlive the subscription.
    Subscription subscribe(Observer& observer);
    void dropCaches();
    // A number that changes whenever the registry's contents may have changed (a commit by any
    // writer, or dropCaches): while it stays, every query has the same answer.
    uint64_t contentVersion();

    // Moves the database at `path` aside (damaged or not) and registers again every path that was
    // registered in it and can still be read. Returns the paths that could not be registered.
    static Result<std::vector<std::string>> rebuild(const std::string& path);

    // The database written by default: the user's, or the system one when it is alone.
    const std::string& path() const;

private:
    Registry(std::shared_ptr<Store> user, std::shared_ptr<Store> system);
    // The stores present, the system one first.
    std::vector<Store*> stores() const;
    Result<Store*> writerFor(const std::string& canonicalPath);
    std::shared_ptr<Store> user_, system_;
};

}  // namespace corvane::vantry
