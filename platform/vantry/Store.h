// The registry's implementation, shared by its files; not part of the public interface.
#pragma once

#include <sqlite3.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/log/Log.h"
#include "platform/notify/Notify.h"
#include "platform/vantry/Vantry.h"

namespace corvane::vantry {

inline constexpr const char* kDomain = "com.corvane.vantry";

const log::Handle& vtLog();
// A registration the registry refuses, with the reason.
Error refusal(std::string text);
// The string at `key` of a dictionary, or nullopt.
std::optional<std::string> stringAt(const Value& v, std::string_view key);

// ---- SQLite

// One prepared statement; an empty one (a failed prepare) steps to an error.
// A record's bytes in the database: the rpx value encoding behind kRecordMarker, which reads
// without parsing text.
// Rows written before it are XML property lists; they are still read, and written anew with the
// bundle's next registration.
inline constexpr std::string_view kRecordMarker{"\0vr1", 4};
std::optional<std::string> encodeRecord(const Value& record);
std::optional<Value> decodeRecord(std::string_view bytes);

// What a read of plug-in records selects, before its condition: the columns recordFromRow reads.
inline constexpr std::string_view kRecordColumns =
    "SELECT uuid, record, ifnull(app_path, ''), path, identifier FROM plugins ";

struct Statement {
    sqlite3_stmt* s = nullptr;
    Statement(sqlite3* db, const char* sql, unsigned flags = 0) { sqlite3_prepare_v3(db, sql, -1, flags, &s, nullptr); }
    ~Statement() { sqlite3_finalize(s); }
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;
    explicit operator bool() const { return s != nullptr; }
    void bind(int i, const std::string& v) { sqlite3_bind_text(s, i, v.data(), static_cast<int>(v.size()), SQLITE_TRANSIENT); }
    void bind(int i, int64_t v) { sqlite3_bind_int64(s, i, v); }
    void bindNull(int i) { sqlite3_bind_null(s, i); }
    void bindBlob(int i, const void* p, size_t n) { sqlite3_bind_blob(s, i, p, static_cast<int>(n), SQLITE_TRANSIENT); }
    int step() { return sqlite3_step(s); }
    // Makes the statement ready to step again from the start.
    void reset() { sqlite3_reset(s); }
    std::string text(int i) const {
        const auto* t = sqlite3_column_text(s, i);
        return t ? std::string(reinterpret_cast<const char*>(t), static_cast<size_t>(sqlite3_column_bytes(s, i))) : std::string();
    }
    std::string_view blob(int i) const {
        return {static_cast<const char*>(sqlite3_column_blob(s, i)), static_cast<size_t>(sqlite3_column_bytes(s, i))};
    }
    int64_t integer(int i) const { return sqlite3_column_int64(s, i); }
};

// One use of a statement the store keeps prepared: when the use ends it is reset and its
// bindings cleared, so that it holds no read transaction meanwhile.
class StatementUse {
public:
    explicit StatementUse(Statement& statement) : statement_(statement) {}
    ~StatementUse() {
        statement_.reset();
        sqlite3_clear_bindings(statement_.s);
    }
    StatementUse(const StatementUse&) = delete;
    StatementUse& operator=(const StatementUse&) = delete;
    Statement* operator->() const { return &statement_; }
    explicit operator bool() const { return bool(statement_); }

private:
    Statement& statement_;
};

// ---- indexed keys and the numeric-aware key

// What the exact pattern test of a key reads from a plug-in: the attribute of that name, else the
// Info.plist entry; "KSExtensionIdentifier" is the plug-in identifier. Stored as an integer.
enum class SubjectKind : int64_t { Absent = 0, Text = 1, Other = 2 };
struct Subject {
    SubjectKind kind = SubjectKind::Absent;
    std::string text;  // when kind is Text
};
Subject subjectOf(const Value& plugin, const Value& info, const std::string& key);

// The keys with an index, and their columns (each with a "<column>_kind" beside it).
struct IndexedKey {
    const char* key;
    const char* column;
};
inline constexpr IndexedKey kIndexedKeys[] = {{"KSExtensionIdentifier", "k_id"},
                                              {"KSExtensionPointIdentifier", "k_point"},
                                              {"KSExtensionPointName", "k_name"}};

// Equal under the numeric-aware version comparison exactly when equal after this: leading zeros of
// every run of digits dropped (one digit kept).
std::string versionKey(std::string_view s);

// ---- scanning bundles

// One plug-in as read from disk, before it has a UUID.
struct ScannedPlugIn {
    std::string path, identifier, bundleIdentifier, bundleVersion;
    std::string fingerprint;  // changes whenever anything the record holds changes
    Value info, plugin, entitlements;
    bool system = false;
    std::optional<std::string> name, shortName;
};

struct LocalizedNames {
    std::optional<std::string> display, shortName;
};

// A plug-in bundle's Info.plist, refused when it cannot be read, is no plug-in or has no identifier.
Result<Value> readPlugInInfo(const std::string& path);
// The bundle's Info.plist as a dictionary, or a refusal that says what is wrong and where: missing,
// unreadable (a FIFO, a link, too large), malformed (with the parser's place), or no dictionary.
Result<Value> readInfoDictionary(const std::string& bundlePath);
// Reads one plug-in bundle at a canonical path. Refused when it cannot be read, has no identifier,
// or (unless a data plug-in) an identifier that names no data container.
Result<ScannedPlugIn> scanPlugIn(const std::string& path);
// The plug-in bundles under an application's PlugIns/, canonical and in order; refused on a link
// loop or an unreadable entry.
Result<std::vector<std::string>> plugInPathsOf(const std::string& appPath);
// Registration's reading of a bundle, without registering it.
Status checkBundle(const std::string& path);
// The display and short names of a bundle in the user's language.
LocalizedNames localizedNames(const std::string& bundle, const Value& info);
// A new record (with a fresh UUID) for a scanned plug-in.
PlugInRecordPtr makeRecord(const ScannedPlugIn& s, const ApplicationRecordPtr& app);

// ---- the store

// A bundle read from disk, ready to be written in a transaction: an application with its plug-ins,
// or one plug-in alone.
struct ScannedBundle {
    std::string path;
    bool application = false;
    std::string identifier, fingerprint;  // of an application
    Dictionary record;                    // of an application
    std::vector<ScannedPlugIn> plugIns;
};

// What one write changed: the events it journals, and whether rows without events changed (an
// application alone).
struct Events {
    std::vector<PlugInRecordPtr> installed, uninstalled;
    bool changedOther = false;
    void add(Events&& more) {
        installed.insert(installed.end(), more.installed.begin(), more.installed.end());
        uninstalled.insert(uninstalled.end(), more.uninstalled.begin(), more.uninstalled.end());
        changedOther = changedOther || more.changedOther;
    }
};

// The kind of a journal entry, as stored.
enum class JournalKind : int64_t { Install = 1, Uninstall = 2 };

// A journal entry as observers get it.
struct JournalEntry {
    JournalKind kind;
    std::vector<PlugInRecordPtr> records;
};

// A plug-in row as registration compares it.
struct StoredPlugIn {
    std::string uuid;
    std::string fingerprint;
};

// How a store is opened.
struct StoreOptions {
    // The database must exist and nothing is written to it.
    bool readOnly = false;
    // Shared by every user of the machine (the system registry): a rollback journal instead of
    // WAL, because a reader of a WAL database must be able to write its index file, and users may
    // only read this one; files readable by all; and each reader's own data containers.
    bool shared = false;
};

// The database and the records built from it. The SQLite handle is opened in serialized mode; the
// records built from it, and every multi-statement use of it, are guarded by `mutex_`.
class Store : public std::enable_shared_from_this<Store> {
public:
    static Result<std::shared_ptr<Store>> open(const std::string& path, StoreOptions options = {});
    Store(std::string path, StoreOptions options) : path_(std::move(path)), options_(options) {}
    ~Store();
    Store(const Store&) = delete;
    Store& operator=(const Store&) = delete;

    const std::string& path() const { return path_; }
    const StoreOptions& options() const { return options_; }

    // Reads.
    PlugInRecordPtr plugInForUUID(const UUID& uuid) EXCLUDES(mutex_);
    ApplicationRecordPtr applicationForPath(const std::string& path) EXCLUDES(mutex_);
    std::vector<PlugInRecordPtr> selectPlugIns(const std::string& where, const std::vector<std::string>& args)
        EXCLUDES(mutex_);
    std::vector<PlugInRecordPtr> plugInsOf(const std::string& appPath) EXCLUDES(mutex_);
    std::vector<PlugInRecordPtr> query(const Value& pattern,
                                       const std::function<bool(const std::string&, const Value&)>& filter)
        EXCLUDES(mutex_);
    std::vector<std::string> registeredPaths() EXCLUDES(mutex_);
    std::vector<ApplicationRecordPtr> installedApplications() EXCLUDES(mutex_);
    void dropCaches() EXCLUDES(mutex_);
    // Changes whenever records built earlier may no longer be what the database holds.
    uint64_t contentVersion() EXCLUDES(mutex_);

    // Whether an application or plug-in is registered at this canonical path.
    bool holdsBundle(const std::string& path) EXCLUDES(mutex_);

    // Writes.
    Status registerBundle(const std::string& given, bool placeholder) EXCLUDES(mutex_);
    Status unregisterBundle(const std::string& given) EXCLUDES(mutex_);
    Result<SyncReport> sync(const std::string& directory) EXCLUDES(mutex_);

    // Events (Events.cpp).
    Subscription subscribe(Observer& observer) EXCLUDES(observersMutex_);
    void unsubscribe(uint64_t id) EXCLUDES(observersMutex_, deliveryMutex_);

private:
    using WriteBody = std::function<Status(Events& events)>;

    std::string directory() const { return path_.substr(0, path_.rfind('/')); }
    std::string wakePath() const { return path_ + ".events"; }
    std::string wakeName() const { return wakePath().substr(directory().size() + 1); }
    std::string pathsFile() const { return path_ + ".paths"; }

    Error sqlError(const char* what) const;
    // The statement of `sql` (a literal: kept by its address), prepared at its first use.
    StatementUse kept(const char* sql) REQUIRES(mutex_);
    Status exec(const char* sql);
    Result<int> schemaVersion();
    // For a reader that may not migrate: the schema must be this release's.
    Status checkSchema();
    Status migrate();
    void checkFreshness() REQUIRES(mutex_);
    // Drops every record and query answer built from the database.
    void forgetRecords() REQUIRES(mutex_);
    // One row of a query's answer, as the query's filter sees it.
    using Rows = std::shared_ptr<const std::vector<PlugInRecordPtr>>;
    // The records of a SELECT of kRecordColumns, from memory while the database has not changed.
    Rows rowsOf(const std::string& sql, const std::vector<std::string>& args) REQUIRES(mutex_);
    ApplicationRecordPtr appFromRow(const std::string& appPath) REQUIRES(mutex_);
    // The record of a row of kRecordColumns.
    PlugInRecordPtr recordFromRow(const Statement& row) REQUIRES(mutex_);
    // A record names no data container as stored; each reader's is its own (a shared registry
    // has many readers).
    static void nameReadersContainer(PlugInRecord& r);
    Status insertPlugIn(const PlugInRecordPtr& r, const std::string& appPath, const std::string& fingerprint)
        REQUIRES(mutex_);
    Status journal(JournalKind kind, const std::vector<PlugInRecordPtr>& records) REQUIRES(mutex_);
    // Plug-ins at the given condition, by path.
    std::map<std::string, StoredPlugIn> existing(const char* where, const std::string& arg) REQUIRES(mutex_);
    PlugInRecordPtr recordByUUIDText(const std::string& uuid) REQUIRES(mutex_);
    Status deletePlugIn(const std::string& uuid) REQUIRES(mutex_);
    void wake();
    void rememberPaths() REQUIRES(mutex_);
    // Runs `body` in one write transaction, under the mutex; on success records journal entries,
    // remembers the registered paths and wakes observers.
    Status write(const WriteBody& body) EXCLUDES(mutex_);
    Result<ScannedBundle> scanBundle(const std::string& given, bool placeholder);
    Status storePlugIn(const ScannedPlugIn& scanned, Events& events) REQUIRES(mutex_);
    Status storeApplication(const ScannedBundle& bundle, Events& events) REQUIRES(mutex_);
    Status storeBundle(const ScannedBundle& bundle, Events& events) REQUIRES(mutex_);
    // Whether something was registered at `path` (and is now removed).
    Result<bool> removeBundle(const std::string& path, Events& events) REQUIRES(mutex_);
    bool holdsBundleLocked(const std::string& path) REQUIRES(mutex_);
    std::vector<std::string> registeredPathsLocked() REQUIRES(mutex_);

    void startWatcher() REQUIRES(observersMutex_);
    // The journal's entries after the last one read, with their records.
    std::vector<JournalEntry> newJournalEntries() REQUIRES(mutex_);
    void deliverNewEvents() EXCLUDES(mutex_, observersMutex_);

    const std::string path_;
    const StoreOptions options_;
    sqlite3* db_ = nullptr;
    Mutex mutex_;
    int64_t seenDataVersion_ GUARDED_BY(mutex_) = -1;
    uint64_t forgotten_ GUARDED_BY(mutex_) = 0;  // times the records were forgotten
    std::unordered_map<UUID, PlugInRecordPtr, UUIDHash> byUUID_ GUARDED_BY(mutex_);
    std::map<std::string, ApplicationRecordPtr> apps_ GUARDED_BY(mutex_);
    // Answers of queries by their SQL and arguments; a few hundred at most.
    std::unordered_map<std::string, Rows> rows_ GUARDED_BY(mutex_);
    std::unique_ptr<Statement> dataVersion_ GUARDED_BY(mutex_);
    std::unordered_map<const char*, std::unique_ptr<Statement>> kept_ GUARDED_BY(mutex_);
    // Announcements of other writers' commits (the wake file), and when the data version was
    // last asked.
    std::unique_ptr<notify::ChangeWatch> commits_ GUARDED_BY(mutex_);
    std::chrono::steady_clock::time_point versionAskedAt_ GUARDED_BY(mutex_);
    int64_t lastSeq_ GUARDED_BY(mutex_) = 0;

    // Observers are called on the thread "vantry.events", one round of events at a time, while
    // `deliveryMutex_` is held; `observersMutex_` guards the list.
    Mutex observersMutex_;
    Mutex deliveryMutex_;
    std::map<uint64_t, Observer*> observers_ GUARDED_BY(observersMutex_);
    uint64_t nextObserver_ GUARDED_BY(observersMutex_) = 1;
    bool watching_ GUARDED_BY(observersMutex_) = false;
    std::thread watcher_;
    std::atomic<std::thread::id> watcherId_{};
    int stopFd_ = -1;
};

}  // namespace corvane::vantry
