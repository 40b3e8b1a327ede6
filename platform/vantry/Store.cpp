// The store: the database's schema, reading records (with an in-memory cache kept fresh across
// processes) and registration in one write transaction each.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "platform/bundle/Bundle.h"
#include "platform/containers/Containers.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"
#include "platform/vantry/Store.h"

#include <cstring>

namespace corvane::vantry {

std::optional<std::string> encodeRecord(const Value& record) {
    std::string out(kRecordMarker);
    if (!rpx::wire::appendElement(out, record)) return std::nullopt;
    return out;
}

std::optional<Value> decodeRecord(std::string_view bytes) {
    if (bytes.substr(0, kRecordMarker.size()) == kRecordMarker)
        return rpx::wire::decodeValue(bytes.substr(kRecordMarker.size()), {}, rpx::kMaxDepth);
    auto parsed = plist::parse(bytes);
    if (!parsed) return std::nullopt;
    return std::move(*parsed);
}

namespace {

constexpr int kSchemaVersion = 1;
constexpr int64_t kJournalKeepSeconds = 600;

}  // namespace

const log::Handle& vtLog() {
    static const log::Handle h(kDomain, "vantry");
    return h;
}

Error refusal(std::string text) { return Error{kDomain, 1, std::move(text)}; }

std::optional<std::string> stringAt(const Value& v, std::string_view key) {
    const Value* found = v.find(key);
    if (found && found->isString()) return *found->asString();
    return std::nullopt;
}

Result<std::shared_ptr<Store>> Store::open(const std::string& path, StoreOptions options) {
    auto store = std::make_shared<Store>(path, options);
    if (!options.readOnly) {
        if (Status err = layout::makeDirectories(store->directory(), 0755); !err.ok()) return err.error();
    }
    int flags = (options.readOnly ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE) |
                SQLITE_OPEN_FULLMUTEX;
    if (sqlite3_open_v2(path.c_str(), &store->db_, flags, nullptr) != SQLITE_OK)
        return store->sqlError("opening the registry");
    // A writer in another process holds the lock for a few milliseconds at most; wait that long,
    // boundedly.
    sqlite3_busy_timeout(store->db_, 5000);
    // Answers are kept in memory until the data changes (rowsOf), so pages are read again only
    // after a change: a small page cache (the default is 2 MiB) costs little.
    if (Status err = store->exec("PRAGMA cache_size=-256"); !err.ok()) return err.error();
    if (options.readOnly) {
        if (Status err = store->checkSchema(); !err.ok()) return err.error();
        return store;
    }
    const char* journal = options.shared ? "PRAGMA journal_mode=DELETE" : "PRAGMA journal_mode=WAL";
    if (Status err = store->exec(journal); !err.ok()) return err.error();
    if (Status err = store->exec("PRAGMA foreign_keys=ON"); !err.ok()) return err.error();
    if (!options.shared) {
        // Each commit syncs the write-ahead log once; each checkpoint syncs it and the database
        // again, and the log's restart once more. Checkpointing at 16 MiB of log rather than 4 lets
        // an application of thousands of plug-ins register with one checkpoint or none, and the
        // log is cut back to 4 MiB when it restarts, so an idle registry keeps no more on disk.
        if (Status err = store->exec("PRAGMA wal_autocheckpoint=4096"); !err.ok()) return err.error();
        if (Status err = store->exec("PRAGMA journal_size_limit=4194304"); !err.ok()) return err.error();
    }
    if (Status err = store->migrate(); !err.ok()) return err.error();
    // Every user reads the shared registry, whatever the writer's umask.
    if (options.shared && ::chmod(path.c_str(), 0644) != 0) return Error::posix(errno, path);
    return store;
}

Store::~Store() {
    if (watcher_.joinable()) {
        uint64_t one = 1;
        (void)!::write(stopFd_, &one, sizeof one);
        if (watcher_.get_id() == std::this_thread::get_id()) {
            watcher_.detach();
        } else {
            watcher_.join();
        }
    }
    if (stopFd_ >= 0) ::close(stopFd_);
    {
        MutexLock lock(mutex_);
        dataVersion_.reset();
        kept_.clear();
    }
    sqlite3_close_v2(db_);
}

Error Store::sqlError(const char* what) const {
    int rc = sqlite3_errcode(db_);
    // Which database, at which step, and for a failed system call its reason (a full disk, a
    // read-only file system).
    std::string text = "registry database " + path_ + ": " + what + ": " + sqlite3_errmsg(db_);
    if (int err = sqlite3_system_errno(db_); err != 0 && (rc & 0xff) != SQLITE_CONSTRAINT)
        text += std::string(" (") + std::strerror(err) + ")";
    if (rc == SQLITE_CORRUPT || rc == SQLITE_NOTADB)
        text = "registry database " + path_ + " is damaged (" + sqlite3_errmsg(db_) + "); run `vantry rebuild`";
    return Error{kDomain, rc, text};
}

StatementUse Store::kept(const char* sql) {
    auto& statement = kept_[sql];
    if (!statement) statement = std::make_unique<Statement>(db_, sql, SQLITE_PREPARE_PERSISTENT);
    return StatementUse(*statement);
}

Status Store::exec(const char* sql) {
    char* msg = nullptr;
    if (sqlite3_exec(db_, sql, nullptr, nullptr, &msg) != SQLITE_OK) {
        sqlite3_free(msg);
        return sqlError(sql);
    }
    return {};
}

Result<int> Store::schemaVersion() {
    Statement q(db_, "SELECT value FROM meta WHERE key = 'schema'");
    if (!q) return sqlError("reading the schema version");
    int version = q.step() == SQLITE_ROW ? std::atoi(q.text(0).c_str()) : 0;
    if (version > kSchemaVersion)
        return refusal("registry database " + path_ + " is of a newer release (schema " + std::to_string(version) + ")");
    return version;
}

Status Store::checkSchema() {
    auto version = schemaVersion();
    if (!version) return version.error();
    if (*version != kSchemaVersion)
        return refusal("registry database " + path_ + " is of an older release; its next writer brings it up to date (as root: vantry --system sync)");
    return {};
}

Status Store::migrate() {
    if (Status err = exec("CREATE TABLE IF NOT EXISTS meta (key TEXT PRIMARY KEY, value TEXT)"); !err.ok()) return err;
    auto version = schemaVersion();
    if (!version) return version.error();
    if (*version == kSchemaVersion) return {};
    // Version 0 -> 1: the first schema.
    return exec(
        "BEGIN;"
        "CREATE TABLE applications (path TEXT PRIMARY KEY, identifier TEXT NOT NULL, record BLOB NOT NULL,"
        "  fingerprint TEXT NOT NULL);"
        "CREATE TABLE plugins (uuid TEXT PRIMARY KEY, path TEXT UNIQUE NOT NULL,"
        "  app_path TEXT REFERENCES applications(path) ON DELETE CASCADE,"
        "  identifier TEXT NOT NULL, entitlements BLOB NOT NULL, record BLOB NOT NULL,"
        "  k_id_kind INTEGER, k_id TEXT, k_point_kind INTEGER, k_point TEXT, k_name_kind INTEGER, k_name TEXT,"
        "  fingerprint TEXT NOT NULL);"
        "CREATE INDEX plugins_app ON plugins(app_path);"
        "CREATE INDEX plugins_k_id ON plugins(k_id_kind, k_id);"
        "CREATE INDEX plugins_k_point ON plugins(k_point_kind, k_point);"
        "CREATE INDEX plugins_k_name ON plugins(k_name_kind, k_name);"
        "CREATE TABLE journal (seq INTEGER PRIMARY KEY AUTOINCREMENT, kind INTEGER NOT NULL,"
        "  records BLOB NOT NULL, at INTEGER NOT NULL);"
        "INSERT OR REPLACE INTO meta VALUES ('schema', '1');"
        "COMMIT;");
}

void Store::checkFreshness() {
    // Asking SQLite takes a read transaction and its file locks, the larger part of a query
    // answered from memory. Every writer touches the wake file after its commit (wake()), so the
    // version is asked only after one did, and once a second in case a writer died in between.
    if (!commits_) commits_ = std::make_unique<notify::ChangeWatch>(directory(), wakeName());
    auto now = std::chrono::steady_clock::now();
    if (!commits_->changed() && now - versionAskedAt_ < std::chrono::seconds(1)) return;
    versionAskedAt_ = now;
    if (!dataVersion_) dataVersion_ = std::make_unique<Statement>(db_, "PRAGMA data_version");
    int64_t v = *dataVersion_ && dataVersion_->step() == SQLITE_ROW ? dataVersion_->integer(0) : -2;
    dataVersion_->reset();
    if (v != seenDataVersion_) {
        forgetRecords();
        seenDataVersion_ = v;
    }
}

void Store::forgetRecords() {
    ++forgotten_;
    byUUID_.clear();
    apps_.clear();
    rows_.clear();
}

Store::Rows Store::rowsOf(const std::string& sql, const std::vector<std::string>& args) {
    std::string key = sql;
    for (const auto& a : args) key += '\0' + a;
    if (auto it = rows_.find(key); it != rows_.end()) return it->second;
    Statement q(db_, sql.c_str());
    for (size_t i = 0; i < args.size(); ++i) q.bind(static_cast<int>(i + 1), args[i]);
    auto rows = std::make_shared<std::vector<PlugInRecordPtr>>();
    while (q && q.step() == SQLITE_ROW) {
        if (auto record = recordFromRow(q)) rows->push_back(std::move(record));
    }
    // Hosts ask a handful of different questions; a flood of distinct ones must not grow memory.
    if (rows_.size() >= 256) rows_.clear();
    rows_.emplace(std::move(key), rows);
    return rows;
}

ApplicationRecordPtr Store::appFromRow(const std::string& appPath) {
    auto it = apps_.find(appPath);
    if (it != apps_.end()) return it->second;
    Statement q(db_, "SELECT record FROM applications WHERE path = ?");
    q.bind(1, appPath);
    if (q.step() != SQLITE_ROW) return nullptr;
    auto v = decodeRecord(q.blob(0));
    if (!v) return nullptr;
    auto app = std::make_shared<ApplicationRecord>();
    app->bundlePath_ = appPath;
    app->identifier_ = stringAt(*v, "identifier").value_or("");
    app->localizedName_ = stringAt(*v, "name");
    app->receipt_ = stringAt(*v, "receipt");
    app->placeholder_ = (*v)["placeholder"].isTrue();
    std::weak_ptr<Store> weak = weak_from_this();
    app->plugIns_ = [weak, appPath] {
        auto store = weak.lock();
        return store ? store->plugInsOf(appPath) : std::vector<PlugInRecordPtr>{};
    };
    apps_[appPath] = app;
    return app;
}

PlugInRecordPtr Store::recordFromRow(const Statement& row) {
    std::string uuidText = row.text(0);
    auto uuid = UUID::parse(uuidText);
    if (!uuid) return nullptr;
    auto it = byUUID_.find(*uuid);
    if (it != byUUID_.end()) return it->second;
    auto v = decodeRecord(row.blob(1));
    if (!v) return nullptr;
    std::string appPath = row.text(2), path = row.text(3), identifier = row.text(4);
    ApplicationRecordPtr app = appPath.empty() ? nullptr : appFromRow(appPath);
    auto r = PlugInRecord::read(*v, app, {uuidText, path, identifier});
    if (!r) return nullptr;
    nameReadersContainer(*r);
    byUUID_[*uuid] = r;
    return r;
}

void Store::nameReadersContainer(PlugInRecord& r) {
    r.container_.reset();
    if (r.plugin_["KSExtensionProtocol"] == Value("#Data")) return;
    if (auto container = containers::dataContainerPath(containers::kPlugInDataClass, r.identifier_))
        r.container_ = *container;
}

std::vector<PlugInRecordPtr> Store::selectPlugIns(const std::string& where, const std::vector<std::string>& args) {
    MutexLock lock(mutex_);
    checkFreshness();
    return *rowsOf(std::string(kRecordColumns) + where, args);
}

std::vector<PlugInRecordPtr> Store::plugInsOf(const std::string& appPath) {
    return selectPlugIns("WHERE app_path = ? ORDER BY path", {appPath});
}

PlugInRecordPtr Store::plugInForUUID(const UUID& uuid) {
    {
        MutexLock lock(mutex_);
        checkFreshness();
        auto it = byUUID_.find(uuid);
        if (it != byUUID_.end()) return it->second;
    }
    auto found = selectPlugIns("WHERE uuid = ?", {uuid.string()});
    return found.empty() ? nullptr : found.front();
}

ApplicationRecordPtr Store::applicationForPath(const std::string& path) {
    MutexLock lock(mutex_);
    checkFreshness();
    return appFromRow(path);
}

std::vector<std::string> Store::registeredPaths() {
    MutexLock lock(mutex_);
    return registeredPathsLocked();
}

std::vector<std::string> Store::registeredPathsLocked() {
    Statement q(db_, "SELECT path FROM applications UNION SELECT path FROM plugins WHERE app_path IS NULL ORDER BY 1");
    std::vector<std::string> out;
    while (q && q.step() == SQLITE_ROW) out.push_back(q.text(0));
    return out;
}

std::vector<ApplicationRecordPtr> Store::installedApplications() {
    MutexLock lock(mutex_);
    checkFreshness();
    std::vector<std::string> paths;
    Statement q(db_, "SELECT path FROM applications ORDER BY path");
    while (q && q.step() == SQLITE_ROW) paths.push_back(q.text(0));
    std::vector<ApplicationRecordPtr> out;
    for (const auto& p : paths)
        if (auto app = appFromRow(p)) out.push_back(std::move(app));
    return out;
}

void Store::dropCaches() {
    MutexLock lock(mutex_);
    forgetRecords();
}

uint64_t Store::contentVersion() {
    MutexLock lock(mutex_);
    checkFreshness();
    return forgotten_;
}

// ---- registration

Status Store::insertPlugIn(const PlugInRecordPtr& r, const std::string& appPath, const std::string& fingerprint) {
    StatementUse ins = kept(
        "INSERT INTO plugins (uuid, path, app_path, identifier, entitlements, record, k_id_kind, k_id,"
        " k_point_kind, k_point, k_name_kind, k_name, fingerprint) VALUES (?,?,?,?,?,?,?,?,?,?,?,?,?)");
    if (!ins) return sqlError("preparing an insert");
    auto record = encodeRecord(r->storedForm(PlugInRecord::StoredIn::Table));
    if (!record) return refusal("plug-in metadata that cannot be recorded in " + r->bundlePath());
    ins->bind(1, r->uuid().string());
    ins->bind(2, r->bundlePath());
    if (appPath.empty()) {
        ins->bindNull(3);
    } else {
        ins->bind(3, appPath);
    }
    ins->bind(4, r->identifier());
    // The entitlements are part of the record; the column of the first schema stays, empty.
    ins->bindBlob(5, "", 0);
    ins->bindBlob(6, record->data(), record->size());
    for (int k = 0; k < 3; ++k) {
        Subject subject = k == 0 ? Subject{SubjectKind::Text, r->identifier()}
                                 : subjectOf(r->pluginDictionary(), r->infoDictionary(), kIndexedKeys[k].key);
        ins->bind(7 + 2 * k, static_cast<int64_t>(subject.kind));
        if (subject.kind == SubjectKind::Text) {
            ins->bind(8 + 2 * k, versionKey(subject.text));
        } else {
            ins->bindNull(8 + 2 * k);
        }
    }
    ins->bind(13, fingerprint);
    if (ins->step() != SQLITE_DONE) return sqlError("recording a plug-in");
    return {};
}

Status Store::journal(JournalKind kind, const std::vector<PlugInRecordPtr>& records) {
    if (records.empty()) return {};
    // An uninstalled plug-in's row is gone with this transaction: its entry keeps the record. An
    // installed one's row holds it; its entry names it by UUID (newJournalEntries).
    Array list;
    for (const auto& r : records) {
        list.push_back(kind == JournalKind::Uninstall ? r->storedForm(PlugInRecord::StoredIn::Journal)
                                                      : Value(r->uuid().string()));
    }
    auto encoded = encodeRecord(Value(std::move(list)));
    if (!encoded) return refusal("plug-in metadata that cannot be journalled");
    Statement ins(db_, "INSERT INTO journal (kind, records, at) VALUES (?, ?, ?)");
    ins.bind(1, static_cast<int64_t>(kind));
    ins.bindBlob(2, encoded->data(), encoded->size());
    ins.bind(3, Date::now().wholeSeconds());
    if (ins.step() != SQLITE_DONE) return sqlError("writing the journal");
    Statement prune(db_, "DELETE FROM journal WHERE at < ?");
    prune.bind(1, Date::now().wholeSeconds() - kJournalKeepSeconds);
    prune.step();
    return {};
}

std::map<std::string, StoredPlugIn> Store::existing(const char* where, const std::string& arg) {
    Statement q(db_, (std::string("SELECT path, uuid, fingerprint FROM plugins WHERE ") + where).c_str());
    q.bind(1, arg);
    std::map<std::string, StoredPlugIn> out;
    while (q && q.step() == SQLITE_ROW) out[q.text(0)] = StoredPlugIn{q.text(1), q.text(2)};
    return out;
}

PlugInRecordPtr Store::recordByUUIDText(const std::string& uuid) {
    Statement q(db_, (std::string(kRecordColumns) + "WHERE uuid = ?").c_str());
    q.bind(1, uuid);
    if (q.step() != SQLITE_ROW) return nullptr;
    return recordFromRow(q);
}

Status Store::deletePlugIn(const std::string& uuid) {
    StatementUse del = kept("DELETE FROM plugins WHERE uuid = ?");
    del->bind(1, uuid);
    if (del->step() != SQLITE_DONE) return sqlError("removing a plug-in");
    return {};
}

void Store::wake() {
    int fd = ::open(wakePath().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd >= 0) {
        (void)!::write(fd, "1", 1);
        ::close(fd);
    }
}

void Store::rememberPaths() {
    Statement q(db_, "SELECT path FROM applications UNION SELECT path FROM plugins WHERE app_path IS NULL ORDER BY 1");
    std::string list;
    while (q && q.step() == SQLITE_ROW) list += q.text(0) + "\n";
    // Not synced: the list is only read to rebuild a damaged database, and the commit it follows
    // is durable on its own (its one fsync). After a crash the file holds the old list or the new
    // one; a rebuild from the older list misses only what was registered just before a crash that
    // also damaged the database, and syncing the directories registers it again.
    (void)plist::writeFileAtomically(pathsFile(), list, 0644, plist::Durability::Unsynced);
}

Status Store::write(const WriteBody& body) {
    MutexLock lock(mutex_);
    checkFreshness();
    if (Status err = exec("BEGIN IMMEDIATE"); !err.ok()) return err;
    Events events;
    Status status = body(events);
    if (status.ok()) status = journal(JournalKind::Uninstall, events.uninstalled);
    if (status.ok()) status = journal(JournalKind::Install, events.installed);
    if (!status.ok() || (events.installed.empty() && events.uninstalled.empty() && !events.changedOther)) {
        (void)exec("ROLLBACK");
        if (!status.ok()) forgetRecords();  // records built inside the transaction are gone with it
        return status;
    }
    if (Status committed = exec("COMMIT"); !committed.ok()) {
        (void)exec("ROLLBACK");
        forgetRecords();
        return committed;
    }
    forgetRecords();
    rememberPaths();
    wake();
    return {};
}

Result<ScannedBundle> Store::scanBundle(const std::string& given, bool placeholder) {
    auto path = layout::canonicalPath(given);
    struct stat st {};
    if (!path || ::stat(path->c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return refusal("not a bundle: " + given);
    auto info = readInfoDictionary(*path);
    if (!info) return info.error();
    ScannedBundle bundle;
    bundle.path = *path;
    if ((*info)["KSExtension"].isDictionary()) {
        auto scanned = scanPlugIn(*path);
        if (!scanned) return scanned.error();
        bundle.plugIns.push_back(std::move(*scanned));
        return bundle;
    }
    auto appId = stringAt(*info, "KFBundleIdentifier");
    if (!appId) return refusal("application without identifier (KFBundleIdentifier): " + *path);
    // Every plug-in is read first: a bundle that cannot be read leaves the database as it was.
    auto plugInPaths = plugInPathsOf(*path);
    if (!plugInPaths) return plugInPaths.error();
    for (const auto& p : *plugInPaths) {
        auto s = scanPlugIn(p);
        if (!s) return s.error();
        bundle.plugIns.push_back(std::move(*s));
    }
    LocalizedNames names = localizedNames(*path, *info);
    bundle.application = true;
    bundle.identifier = *appId;
    bundle.record = Dictionary{{"identifier", *appId}, {"placeholder", placeholder}};
    if (names.display) bundle.record.emplace("name", *names.display);
    std::string receipt = *path + "/" + bundle::kReceiptFileName;
    if (::stat(receipt.c_str(), &st) == 0 && S_ISREG(st.st_mode)) bundle.record.emplace("receipt", receipt);
    bundle.fingerprint = Value(bundle.record).description();
    return bundle;
}

Status Store::storePlugIn(const ScannedPlugIn& scanned, Events& events) {
    auto old = existing("path = ?", scanned.path);
    if (!old.empty() && old.begin()->second.fingerprint == scanned.fingerprint) return {};
    if (!old.empty()) {
        if (auto r = recordByUUIDText(old.begin()->second.uuid)) events.uninstalled.push_back(r);
        if (Status err = deletePlugIn(old.begin()->second.uuid); !err.ok()) return err;
    }
    auto r = makeRecord(scanned, nullptr);
    if (Status err = insertPlugIn(r, "", scanned.fingerprint); !err.ok()) return err;
    events.installed.push_back(r);
    return {};
}

Status Store::storeApplication(const ScannedBundle& bundle, Events& events) {
    const std::string& path = bundle.path;
    Statement old(db_, "SELECT fingerprint FROM applications WHERE path = ?");
    old.bind(1, path);
    bool appChanged = old.step() != SQLITE_ROW || old.text(0) != bundle.fingerprint;
    if (appChanged) {
        auto encoded = encodeRecord(Value(bundle.record));
        if (!encoded) return refusal("application metadata that cannot be recorded in " + path);
        Statement up(db_,
                     "INSERT INTO applications (path, identifier, record, fingerprint) VALUES (?,?,?,?) "
                     "ON CONFLICT(path) DO UPDATE SET identifier = excluded.identifier, "
                     "record = excluded.record, fingerprint = excluded.fingerprint");
        up.bind(1, path);
        up.bind(2, bundle.identifier);
        up.bindBlob(3, encoded->data(), encoded->size());
        up.bind(4, bundle.fingerprint);
        if (up.step() != SQLITE_DONE) return sqlError("recording an application");
        apps_.erase(path);
        rows_.clear();  // their records name the application's old record
        events.changedOther = true;
    }
    auto before = existing("app_path = ?", path);
    ApplicationRecordPtr app = appFromRow(path);
    // Plug-ins that went away or changed are uninstalled; new and changed ones installed;
    // unchanged ones keep their UUIDs, unless the application's own record changed (they carry
    // it).
    for (const auto& entry : before) {
        const std::string& p = entry.first;
        const StoredPlugIn& row = entry.second;
        auto same = std::find_if(bundle.plugIns.begin(), bundle.plugIns.end(), [&](const ScannedPlugIn& s) {
            return s.path == p && s.fingerprint == row.fingerprint && !appChanged;
        });
        if (same != bundle.plugIns.end()) continue;
        if (auto r = recordByUUIDText(row.uuid)) events.uninstalled.push_back(r);
        if (Status err = deletePlugIn(row.uuid); !err.ok()) return err;
    }
    for (const auto& s : bundle.plugIns) {
        auto it = before.find(s.path);
        if (it != before.end() && it->second.fingerprint == s.fingerprint && !appChanged) continue;
        auto r = makeRecord(s, app);
        if (Status err = insertPlugIn(r, path, s.fingerprint); !err.ok()) {
            if (sqlite3_errcode(db_) == SQLITE_CONSTRAINT) return refusal(s.path + " is already registered elsewhere");
            return err;
        }
        events.installed.push_back(r);
    }
    return {};
}

Status Store::storeBundle(const ScannedBundle& bundle, Events& events) {
    if (bundle.application) return storeApplication(bundle, events);
    return storePlugIn(bundle.plugIns.front(), events);
}

Status Store::registerBundle(const std::string& given, bool placeholder) {
    auto bundle = scanBundle(given, placeholder);
    if (!bundle) return bundle.error();
    return write([&](Events& events) -> Status {
        mutex_.assertHeld();
        return storeBundle(*bundle, events);
    });
}

Result<bool> Store::removeBundle(const std::string& path, Events& events) {
    auto plugins = existing("app_path = ?", path);
    Statement app(db_, "SELECT 1 FROM applications WHERE path = ?");
    app.bind(1, path);
    bool isApp = app.step() == SQLITE_ROW;
    if (!isApp) plugins = existing("path = ?", path);
    if (!isApp && plugins.empty()) return false;
    for (const auto& [p, row] : plugins) {
        if (auto r = recordByUUIDText(row.uuid)) events.uninstalled.push_back(r);
        if (Status err = deletePlugIn(row.uuid); !err.ok()) return err.error();
    }
    if (isApp) {
        Statement del(db_, "DELETE FROM applications WHERE path = ?");
        del.bind(1, path);
        if (del.step() != SQLITE_DONE) return sqlError("removing an application");
        events.changedOther = true;
    }
    return true;
}

bool Store::holdsBundle(const std::string& path) {
    MutexLock lock(mutex_);
    return holdsBundleLocked(path);
}

bool Store::holdsBundleLocked(const std::string& path) {
    Statement q(db_, "SELECT 1 FROM applications WHERE path = ?1 UNION ALL SELECT 1 FROM plugins WHERE path = ?1");
    q.bind(1, path);
    return q.step() == SQLITE_ROW;
}

Status Store::unregisterBundle(const std::string& given) {
    std::vector<std::string> candidates{given};
    if (auto p = layout::canonicalPath(given); p && *p != given) candidates.insert(candidates.begin(), *p);
    return write([&](Events& events) -> Status {
        mutex_.assertHeld();
        for (const auto& path : candidates) {
            auto removed = removeBundle(path, events);
            if (!removed) return removed.error();
            if (*removed) return {};
        }
        return refusal("not registered: " + given);
    });
}

Result<SyncReport> Store::sync(const std::string& directory) {
    SyncReport report;
    std::vector<ScannedBundle> present;
    std::vector<std::string> names;
    if (DIR* d = opendir(directory.c_str())) {
        while (struct dirent* e = readdir(d)) {
            std::string n = e->d_name;
            if (n != "." && n != "..") names.push_back(n);
        }
        closedir(d);
    } else if (errno != ENOENT) {
        return Error::posix(errno, directory);
    }
    std::sort(names.begin(), names.end());
    for (const auto& n : names) {
        std::string path = directory + "/" + n;
        auto bundle = scanBundle(path, false);
        if (!bundle) {
            report.refused.emplace_back(path, bundle.error().description());
            continue;
        }
        // A link to a bundle elsewhere would be registered at its target, where no later sync of
        // this directory would see it leave.
        if (!layout::isBeneath(bundle->path, directory)) {
            report.refused.emplace_back(path, path + " leads out of " + directory + " (to " + bundle->path + ")");
            continue;
        }
        present.push_back(std::move(*bundle));
    }
    Status written = write([&](Events& events) -> Status {
        mutex_.assertHeld();
        // What is registered under the directory and is no longer there (or no longer readable)
        // goes first, so that a bundle renamed within the directory keeps no stale row.
        for (const auto& path : registeredPathsLocked()) {
            if (!layout::isBeneath(path, directory)) continue;
            bool stays = std::any_of(present.begin(), present.end(), [&](const auto& b) { return b.path == path; });
            if (stays) continue;
            auto removed = removeBundle(path, events);
            if (!removed) return removed.error();
            report.unregistered.push_back(path);
        }
        for (const auto& bundle : present) {
            // Each bundle in a savepoint of its own: one that cannot be stored leaves the others.
            Events own;
            bool known = holdsBundleLocked(bundle.path);
            if (Status err = exec("SAVEPOINT bundle"); !err.ok()) return err;
            if (Status err = storeBundle(bundle, own); !err.ok()) {
                if (Status undone = exec("ROLLBACK TO bundle"); !undone.ok()) return undone;
                (void)exec("RELEASE bundle");
                forgetRecords();
                report.refused.emplace_back(bundle.path, err.error().description());
                continue;
            }
            if (Status err = exec("RELEASE bundle"); !err.ok()) return err;
            if (!known) {
                report.registered.push_back(bundle.path);
            } else if (!own.installed.empty() || !own.uninstalled.empty() || own.changedOther) {
                report.updated.push_back(bundle.path);
            }
            events.add(std::move(own));
        }
        return {};
    });
    if (!written.ok()) return written.error();
    return report;
}

}  // namespace corvane::vantry
