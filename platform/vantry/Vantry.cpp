#include "platform/vantry/Vantry.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sqlite3.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <map>
#include <thread>
#include <unordered_map>

#include "platform/bundle/Bundle.h"
#include "platform/codesign/CodeSign.h"
#include "platform/containers/Containers.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"
#include "platform/sdk/Sdk.h"

namespace corvane::vantry {

namespace {

constexpr const char* kDomain = "com.corvane.vantry";
constexpr int kSchemaVersion = 1;
constexpr int64_t kJournalKeepSeconds = 600;
constexpr int kInstall = 1;
constexpr int kUninstall = 2;

const log::Handle& vtLog() {
    static const log::Handle h(kDomain, "vantry");
    return h;
}

Error refusal(std::string text) { return Error{kDomain, 1, std::move(text)}; }

std::optional<std::string> canonical(const std::string& path) {
    char buf[PATH_MAX];
    if (!realpath(path.c_str(), buf)) return std::nullopt;
    return std::string(buf);
}

std::optional<std::string> stringAt(const Value& v, std::string_view key) {
    const Value* found = v.find(key);
    if (found && found->isString()) return *found->asString();
    return std::nullopt;
}

std::string fileStamp(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return "-";
    return std::to_string(st.st_size) + ":" + std::to_string(st.st_mtim.tv_sec) + "." +
           std::to_string(st.st_mtim.tv_nsec);
}

// The user's languages, most preferred first: "de_DE", then "de".
std::vector<std::string> languages() {
    const char* value = nullptr;
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        const char* v = std::getenv(name);
        if (v && *v) {
            value = v;
            break;
        }
    }
    std::vector<std::string> out;
    if (!value) return out;
    std::string lang = value;
    lang = lang.substr(0, lang.find_first_of(".@"));
    if (lang.empty() || lang == "C" || lang == "POSIX") return out;
    out.push_back(lang);
    size_t underscore = lang.find('_');
    if (underscore != std::string::npos) out.push_back(lang.substr(0, underscore));
    return out;
}

std::pair<std::optional<std::string>, std::optional<std::string>> localizedNames(const std::string& bundle,
                                                                                  const Value& info) {
    Value table;
    for (const auto& lang : languages()) {
        auto t = plist::readFile(bundle + "/Names/" + lang + ".plist");
        if (t && t->isDictionary()) {
            table = *t;
            break;
        }
    }
    auto pick = [&](const char* key) {
        auto v = stringAt(table, key);
        return v ? v : stringAt(info, key);
    };
    auto display = pick("KFBundleDisplayName");
    auto shortName = pick("KFBundleName");
    return {display ? display : shortName, shortName};
}

// What the exact pattern test of a key reads from a plug-in: the attribute of that name, else the
// Info.plist entry; "KSExtensionIdentifier" is the plug-in identifier.
struct Subject {
    int kind = 0;  // 0 absent, 1 a string (in `text`), 2 something else
    std::string text;
};
Subject subjectOf(const Value& plugin, const Value& info, const std::string& key) {
    const Value* v = plugin["KSExtensionAttributes"].find(key);
    if (!v) v = info.find(key);
    if (!v) return {};
    if (v->isString()) return {1, *v->asString()};
    return {2, {}};
}

const char* kIndexedKeys[] = {"KSExtensionIdentifier", "KSExtensionPointIdentifier", "KSExtensionPointName"};
const char* kIndexColumns[] = {"k_id", "k_point", "k_name"};

// A pattern the exact test treats as plain equality: a string that does not begin with an
// operator, or one that begins with "=".
std::optional<std::string> plainEquality(const Value& pattern) {
    const std::string* s = pattern.asString();
    if (!s) return std::nullopt;
    if (!s->empty() && (*s)[0] == '=') return s->substr(1);
    if (!s->empty() && ((*s)[0] == '?' || (*s)[0] == '<' || (*s)[0] == '>')) return std::nullopt;
    return *s;
}

}  // namespace

std::string versionKey(std::string_view s);

// ---- records

Value PlugInRecord::lookup(Scope scope, std::string_view key) const {
    switch (scope) {
        case Scope::Attributes: return plugin_["KSExtensionAttributes"][key];
        case Scope::PlugIn: return plugin_[key];
        case Scope::InfoPlist: return info_[key];
    }
    return Value();
}

Value ApplicationRecord::serialize() const {
    Dictionary d{{"path", bundlePath_}, {"identifier", identifier_}, {"placeholder", placeholder_}};
    if (localizedName_) d.emplace("name", *localizedName_);
    if (receipt_) d.emplace("receipt", *receipt_);
    return Value(std::move(d));
}

std::vector<PlugInRecordPtr> ApplicationRecord::plugIns() const {
    return plugIns_ ? plugIns_() : std::vector<PlugInRecordPtr>{};
}

std::string ApplicationRecord::description() const { return "<application " + identifier_ + " " + bundlePath_ + ">"; }

Value PlugInRecord::serialize() const {
    Dictionary d{{"uuid", uuid_.string()},       {"path", bundlePath_},
                 {"identifier", identifier_},    {"bundleIdentifier", bundleIdentifier_},
                 {"originalIdentifier", originalIdentifier_}, {"version", bundleVersion_},
                 {"plugin", plugin_},            {"info", info_},
                 {"entitlements", entitlements_}, {"registered", Value(registered_)},
                 {"system", system_}};
    if (container_) d.emplace("container", *container_);
    if (localizedName_) d.emplace("name", *localizedName_);
    if (localizedShortName_) d.emplace("shortName", *localizedShortName_);
    if (application_) d.emplace("application", application_->serialize());
    return Value(std::move(d));
}

PlugInRecordPtr PlugInRecord::deserialize(const Value& v, ApplicationRecordPtr application) {
    auto uuid = UUID::parse(stringAt(v, "uuid").value_or(""));
    auto path = stringAt(v, "path");
    if (!uuid || !path) return nullptr;
    auto r = std::make_shared<PlugInRecord>();
    r->uuid_ = *uuid;
    r->bundlePath_ = *path;
    r->identifier_ = stringAt(v, "identifier").value_or("");
    r->bundleIdentifier_ = stringAt(v, "bundleIdentifier").value_or("");
    r->originalIdentifier_ = stringAt(v, "originalIdentifier").value_or("");
    r->bundleVersion_ = stringAt(v, "version").value_or("");
    r->plugin_ = v["plugin"];
    r->info_ = v["info"];
    r->entitlements_ = v["entitlements"].isDictionary() ? v["entitlements"] : Value(Dictionary{});
    if (const Date* d = v["registered"].asDate()) r->registered_ = *d;
    r->system_ = v["system"].isTrue();
    r->container_ = stringAt(v, "container");
    r->localizedName_ = stringAt(v, "name");
    r->localizedShortName_ = stringAt(v, "shortName");
    if (!application && v.has("application")) {
        // An application as it was (the journal's copy): no live plug-in list.
        const Value& a = v["application"];
        auto app = std::make_shared<ApplicationRecord>();
        app->bundlePath_ = stringAt(a, "path").value_or("");
        app->identifier_ = stringAt(a, "identifier").value_or("");
        app->localizedName_ = stringAt(a, "name");
        app->receipt_ = stringAt(a, "receipt");
        app->placeholder_ = a["placeholder"].isTrue();
        application = app;
    }
    r->application_ = std::move(application);
    return r;
}

std::string PlugInRecord::description() const {
    return "<plug-in " + identifier_ + " " + uuid_.string() + " " + bundlePath_ + ">";
}

// ---- the store

namespace {

struct Statement {
    sqlite3_stmt* s = nullptr;
    Statement(sqlite3* db, const char* sql) { sqlite3_prepare_v2(db, sql, -1, &s, nullptr); }
    ~Statement() { sqlite3_finalize(s); }
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;
    explicit operator bool() const { return s != nullptr; }
    void bind(int i, const std::string& v) { sqlite3_bind_text(s, i, v.data(), static_cast<int>(v.size()), SQLITE_TRANSIENT); }
    void bind(int i, int64_t v) { sqlite3_bind_int64(s, i, v); }
    void bindNull(int i) { sqlite3_bind_null(s, i); }
    void bindBlob(int i, const void* p, size_t n) { sqlite3_bind_blob(s, i, p, static_cast<int>(n), SQLITE_TRANSIENT); }
    int step() { return sqlite3_step(s); }
    std::string text(int i) const {
        const auto* t = sqlite3_column_text(s, i);
        return t ? std::string(reinterpret_cast<const char*>(t), static_cast<size_t>(sqlite3_column_bytes(s, i))) : std::string();
    }
    std::string_view blob(int i) const {
        return {static_cast<const char*>(sqlite3_column_blob(s, i)), static_cast<size_t>(sqlite3_column_bytes(s, i))};
    }
    int64_t integer(int i) const { return sqlite3_column_int64(s, i); }
    bool isNull(int i) const { return sqlite3_column_type(s, i) == SQLITE_NULL; }
};

// One plug-in as scanned from disk, before it has a UUID.
struct Scanned {
    std::string path, identifier, bundleIdentifier, bundleVersion, fingerprint;
    Value info, plugin, entitlements;
    bool system = false;
    std::optional<std::string> container, name, shortName;
};

}  // namespace

class Store : public std::enable_shared_from_this<Store> {
public:
    static Result<std::shared_ptr<Store>> open(const std::string& path);
    ~Store();

    const std::string path_;
    sqlite3* db_ = nullptr;
    std::mutex mutex_;
    int64_t dataVersion_ = -1;
    std::unordered_map<UUID, PlugInRecordPtr, UUIDHash> byUUID_;
    std::map<std::string, ApplicationRecordPtr> apps_;
    // events
    std::mutex observersMutex_;
    std::vector<std::shared_ptr<Observer>> observers_;
    std::thread watcher_;
    int stopFd_ = -1;
    int64_t lastSeq_ = 0;

    explicit Store(std::string path) : path_(std::move(path)) {}

    std::string directory() const { return path_.substr(0, path_.rfind('/')); }
    std::string wakePath() const { return path_ + ".events"; }
    std::string pathsFile() const { return path_ + ".paths"; }

    Error sqlError(const char* what) const {
        int rc = sqlite3_errcode(db_);
        std::string text = std::string(what) + ": " + sqlite3_errmsg(db_);
        if (rc == SQLITE_CORRUPT || rc == SQLITE_NOTADB)
            text = "registry database " + path_ + " is damaged (" + sqlite3_errmsg(db_) + "); run `vantry rebuild`";
        return Error{kDomain, rc, text};
    }

    Status exec(const char* sql) {
        char* msg = nullptr;
        if (sqlite3_exec(db_, sql, nullptr, nullptr, &msg) != SQLITE_OK) {
            sqlite3_free(msg);
            return sqlError(sql);
        }
        return {};
    }

    Status migrate() {
        if (Status err = exec("CREATE TABLE IF NOT EXISTS meta (key TEXT PRIMARY KEY, value TEXT)"); !err.ok()) return err;
        Statement q(db_, "SELECT value FROM meta WHERE key = 'schema'");
        if (!q) return sqlError("reading the schema version");
        int version = q.step() == SQLITE_ROW ? std::atoi(q.text(0).c_str()) : 0;
        if (version > kSchemaVersion)
            return refusal("registry database " + path_ + " is of a newer release (schema " + std::to_string(version) + ")");
        if (version == kSchemaVersion) return {};
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

    // Drops the in-memory records when another connection (another process, say) committed.
    void checkFreshness() {
        Statement q(db_, "PRAGMA data_version");
        int64_t v = q && q.step() == SQLITE_ROW ? q.integer(0) : -2;
        if (v != dataVersion_) {
            byUUID_.clear();
            apps_.clear();
            dataVersion_ = v;
        }
    }

    ApplicationRecordPtr appFromRow(const std::string& appPath) {
        auto it = apps_.find(appPath);
        if (it != apps_.end()) return it->second;
        Statement q(db_, "SELECT record FROM applications WHERE path = ?");
        q.bind(1, appPath);
        if (q.step() != SQLITE_ROW) return nullptr;
        auto v = plist::parse(q.blob(0));
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

    // Builds (or takes from memory) the record of a row: uuid, record blob, app path.
    PlugInRecordPtr recordFromRow(const std::string& uuidText, std::string_view blob, const std::string& appPath) {
        auto uuid = UUID::parse(uuidText);
        if (!uuid) return nullptr;
        auto it = byUUID_.find(*uuid);
        if (it != byUUID_.end()) return it->second;
        auto v = plist::parse(blob);
        if (!v) return nullptr;
        ApplicationRecordPtr app = appPath.empty() ? nullptr : appFromRow(appPath);
        auto r = PlugInRecord::deserialize(*v, app);
        if (r) byUUID_[*uuid] = r;
        return r;
    }

    std::vector<PlugInRecordPtr> selectPlugIns(const std::string& where, const std::vector<std::string>& args) {
        std::lock_guard lock(mutex_);
        checkFreshness();
        Statement q(db_, ("SELECT uuid, record, ifnull(app_path, '') FROM plugins " + where).c_str());
        for (size_t i = 0; i < args.size(); ++i) q.bind(static_cast<int>(i + 1), args[i]);
        std::vector<PlugInRecordPtr> out;
        while (q && q.step() == SQLITE_ROW)
            if (auto r = recordFromRow(q.text(0), q.blob(1), q.text(2))) out.push_back(std::move(r));
        return out;
    }

    std::vector<PlugInRecordPtr> plugInsOf(const std::string& appPath) {
        return selectPlugIns("WHERE app_path = ? ORDER BY path", {appPath});
    }

    // ---- registration

    // Reads one plug-in bundle. Refused when it cannot be read or has no identifier.
    Result<Scanned> scanPlugIn(const std::string& path) {
        Value info = [&] {
            auto v = plist::readFile(path + "/Info.plist");
            return v && v->isDictionary() ? *v : Value();
        }();
        if (info.isNull()) return refusal("malformed or missing Info.plist in " + path);
        if (!info["KSExtension"].isDictionary()) return refusal("no plug-in dictionary (KSExtension) in " + path);
        Scanned s;
        s.path = path;
        s.bundleIdentifier = stringAt(info, "KFBundleIdentifier").value_or("");
        auto extId = stringAt(info["KSExtension"], "KSExtensionIdentifier");
        s.identifier = extId ? *extId : s.bundleIdentifier;
        if (s.identifier.empty()) return refusal("plug-in without identifier: " + path);
        s.bundleVersion = stringAt(info, "KFBundleVersion").value_or("");
        auto resolved = sdk::resolve(info);
        s.info = resolved.info;
        s.plugin = resolved.plugin;
        s.entitlements = codesign::entitlementsOfBundle(path);
        std::string system = layout::systemRoot() + "/";
        s.system = path.rfind(system, 0) == 0;
        if (!(s.plugin["KSExtensionProtocol"] == Value("#Data"))) {
            auto container = containers::lookupDataContainer(containers::kPlugInDataClass, s.identifier, true);
            if (!container) return refusal("no data container for " + path + ": " + container.error().description());
            s.container = *container;
        }
        std::tie(s.name, s.shortName) = localizedNames(path, info);
        std::string exe = path + "/" + stringAt(info, "KFBundleExecutable").value_or("");
        s.fingerprint = std::to_string(std::hash<std::string>()(
            info.description() + "|" + s.entitlements.description() + "|" + fileStamp(exe) + "|" +
            s.name.value_or("") + "|" + s.shortName.value_or("") + "|" + s.plugin.description()));
        return s;
    }

    PlugInRecordPtr makeRecord(const Scanned& s, const ApplicationRecordPtr& app) {
        auto r = std::make_shared<PlugInRecord>();
        r->uuid_ = UUID::random();
        r->bundlePath_ = s.path;
        r->identifier_ = s.identifier;
        r->bundleIdentifier_ = s.bundleIdentifier;
        r->originalIdentifier_ = s.bundleIdentifier.empty() ? s.identifier : s.bundleIdentifier;
        r->bundleVersion_ = s.bundleVersion;
        r->plugin_ = s.plugin;
        r->info_ = s.info;
        r->entitlements_ = s.entitlements;
        r->registered_ = Date::now();
        r->system_ = s.system;
        r->application_ = app;
        r->container_ = s.container;
        r->localizedName_ = s.name;
        r->localizedShortName_ = s.shortName;
        return r;
    }

    Status insertPlugIn(const PlugInRecordPtr& r, const std::string& appPath, const std::string& fingerprint) {
        Statement ins(db_,
                      "INSERT INTO plugins (uuid, path, app_path, identifier, entitlements, record, k_id_kind, k_id,"
                      " k_point_kind, k_point, k_name_kind, k_name, fingerprint) VALUES (?,?,?,?,?,?,?,?,?,?,?,?,?)");
        if (!ins) return sqlError("preparing an insert");
        auto record = plist::toXML(r->serialize());
        auto ents = plist::toXML(r->entitlements());
        if (!record || !ents) return refusal("plug-in metadata without property-list form in " + r->bundlePath());
        ins.bind(1, r->uuid().string());
        ins.bind(2, r->bundlePath());
        if (appPath.empty()) {
            ins.bindNull(3);
        } else {
            ins.bind(3, appPath);
        }
        ins.bind(4, r->identifier());
        ins.bindBlob(5, ents->data(), ents->size());
        ins.bindBlob(6, record->data(), record->size());
        for (int k = 0; k < 3; ++k) {
            Subject subject = k == 0 ? Subject{1, r->identifier()}
                                     : subjectOf(r->pluginDictionary(), r->infoDictionary(), kIndexedKeys[k]);
            ins.bind(7 + 2 * k, int64_t{subject.kind});
            if (subject.kind == 1) {
                ins.bind(8 + 2 * k, versionKey(subject.text));
            } else {
                ins.bindNull(8 + 2 * k);
            }
        }
        ins.bind(13, fingerprint);
        if (ins.step() != SQLITE_DONE) return sqlError("recording a plug-in");
        return {};
    }

    Status journal(int kind, const std::vector<PlugInRecordPtr>& records) {
        if (records.empty()) return {};
        Array list;
        for (const auto& r : records) list.push_back(r->serialize());
        auto xml = plist::toXML(Value(std::move(list)));
        if (!xml) return xml.error();
        Statement ins(db_, "INSERT INTO journal (kind, records, at) VALUES (?, ?, ?)");
        ins.bind(1, int64_t{kind});
        ins.bindBlob(2, xml->data(), xml->size());
        ins.bind(3, Date::now().wholeSeconds());
        if (ins.step() != SQLITE_DONE) return sqlError("writing the journal");
        Statement prune(db_, "DELETE FROM journal WHERE at < ?");
        prune.bind(1, Date::now().wholeSeconds() - kJournalKeepSeconds);
        prune.step();
        return {};
    }

    // Existing plug-ins at the given condition: path -> (uuid, fingerprint).
    std::map<std::string, std::pair<std::string, std::string>> existing(const char* where, const std::string& arg) {
        Statement q(db_, (std::string("SELECT path, uuid, fingerprint FROM plugins WHERE ") + where).c_str());
        q.bind(1, arg);
        std::map<std::string, std::pair<std::string, std::string>> out;
        while (q && q.step() == SQLITE_ROW) out[q.text(0)] = {q.text(1), q.text(2)};
        return out;
    }

    PlugInRecordPtr recordByUUIDText(const std::string& uuid) {
        Statement q(db_, "SELECT uuid, record, ifnull(app_path, '') FROM plugins WHERE uuid = ?");
        q.bind(1, uuid);
        if (q.step() != SQLITE_ROW) return nullptr;
        return recordFromRow(q.text(0), q.blob(1), q.text(2));
    }

    Status deletePlugIn(const std::string& uuid) {
        Statement del(db_, "DELETE FROM plugins WHERE uuid = ?");
        del.bind(1, uuid);
        if (del.step() != SQLITE_DONE) return sqlError("removing a plug-in");
        return {};
    }

    void wake() {
        int fd = ::open(wakePath().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd >= 0) {
            (void)!::write(fd, "1", 1);
            ::close(fd);
        }
    }

    void rememberPaths() {
        Statement q(db_, "SELECT path FROM applications UNION SELECT path FROM plugins WHERE app_path IS NULL ORDER BY 1");
        std::string list;
        while (q && q.step() == SQLITE_ROW) list += q.text(0) + "\n";
        (void)plist::writeFileAtomically(pathsFile(), list, 0644);
    }

    // Runs `body` in one write transaction; on success records journal entries, remembers the
    // registered paths and wakes observers.
    Status write(const std::function<Status(std::vector<PlugInRecordPtr>&, std::vector<PlugInRecordPtr>&)>& body) {
        std::lock_guard lock(mutex_);
        checkFreshness();
        if (Status err = exec("BEGIN IMMEDIATE"); !err.ok()) return err;
        std::vector<PlugInRecordPtr> installed;
        std::vector<PlugInRecordPtr> uninstalled;
        Status status = body(installed, uninstalled);
        if (status.ok()) status = journal(kUninstall, uninstalled);
        if (status.ok()) status = journal(kInstall, installed);
        if (!status.ok() || (installed.empty() && uninstalled.empty() && !changedOther_)) {
            (void)exec("ROLLBACK");
            changedOther_ = false;
            return status;
        }
        changedOther_ = false;
        if (Status committed = exec("COMMIT"); !committed.ok()) {
            (void)exec("ROLLBACK");
            return committed;
        }
        byUUID_.clear();
        apps_.clear();
        rememberPaths();
        wake();
        return {};
    }
    bool changedOther_ = false;  // a write that changed rows without plug-in events (an app alone)

    Status registerBundle(const std::string& given, bool placeholder) {
        auto path = canonical(given);
        struct stat st {};
        if (!path || ::stat(path->c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return refusal("not a bundle: " + given);
        auto info = plist::readFile(*path + "/Info.plist");
        if (!info || !info->isDictionary()) return refusal("malformed or missing Info.plist in " + *path);

        if ((*info)["KSExtension"].isDictionary()) {
            auto scanned = scanPlugIn(*path);
            if (!scanned) return scanned.error();
            return write([&](auto& installed, auto& uninstalled) -> Status {
                auto old = existing("path = ?", *path);
                if (!old.empty() && old.begin()->second.second == scanned->fingerprint) return {};
                if (!old.empty()) {
                    if (auto r = recordByUUIDText(old.begin()->second.first)) uninstalled.push_back(r);
                    if (Status err = deletePlugIn(old.begin()->second.first); !err.ok()) return err;
                }
                auto r = makeRecord(*scanned, nullptr);
                if (Status err = insertPlugIn(r, "", scanned->fingerprint); !err.ok()) return err;
                installed.push_back(r);
                return {};
            });
        }

        auto appId = stringAt(*info, "KFBundleIdentifier");
        if (!appId) return refusal("application without identifier (KFBundleIdentifier): " + *path);
        // Scan every plug-in first: a bundle that cannot be read leaves the database as it was.
        std::vector<Scanned> scanned;
        std::string plugInsDir = *path + "/PlugIns";
        if (DIR* d = opendir(plugInsDir.c_str())) {
            std::vector<std::string> names;
            while (struct dirent* e = readdir(d)) {
                std::string n = e->d_name;
                if (n.size() > 6 && n.substr(n.size() - 6) == ".appex") names.push_back(n);
            }
            closedir(d);
            std::sort(names.begin(), names.end());
            for (const auto& n : names) {
                auto p = canonical(plugInsDir + "/" + n);
                if (!p) {
                    return refusal((errno == ELOOP ? "symbolic link loop under PlugIns/: " : "unreadable plug-in: ") +
                                   plugInsDir + "/" + n);
                }
                auto s = scanPlugIn(*p);
                if (!s) return s.error();
                scanned.push_back(std::move(*s));
            }
        }
        auto [name, shortName] = localizedNames(*path, *info);
        Dictionary appRecord{{"identifier", *appId}, {"placeholder", placeholder}};
        if (name) appRecord.emplace("name", *name);
        std::string receipt = *path + "/" + bundle::kReceiptFileName;
        if (::stat(receipt.c_str(), &st) == 0 && S_ISREG(st.st_mode)) appRecord.emplace("receipt", receipt);
        std::string appFingerprint = Value(appRecord).description();

        return write([&](auto& installed, auto& uninstalled) -> Status {
            Statement old(db_, "SELECT fingerprint FROM applications WHERE path = ?");
            old.bind(1, *path);
            bool appChanged = old.step() != SQLITE_ROW || old.text(0) != appFingerprint;
            if (appChanged) {
                auto xml = plist::toXML(Value(appRecord));
                if (!xml) return xml.error();
                Statement up(db_,
                             "INSERT INTO applications (path, identifier, record, fingerprint) VALUES (?,?,?,?) "
                             "ON CONFLICT(path) DO UPDATE SET identifier = excluded.identifier, "
                             "record = excluded.record, fingerprint = excluded.fingerprint");
                up.bind(1, *path);
                up.bind(2, *appId);
                up.bindBlob(3, xml->data(), xml->size());
                up.bind(4, appFingerprint);
                if (up.step() != SQLITE_DONE) return sqlError("recording an application");
                apps_.erase(*path);
                changedOther_ = true;
            }
            auto before = existing("app_path = ?", *path);
            ApplicationRecordPtr app = appFromRow(*path);
            // Plug-ins that went away or changed are uninstalled; new and changed ones installed;
            // unchanged ones keep their UUIDs, unless the application's own record changed (they
            // carry it).
            for (const auto& entry : before) {
                const std::string& p = entry.first;
                const auto& row = entry.second;
                auto same = std::find_if(scanned.begin(), scanned.end(), [&](const Scanned& s) {
                    return s.path == p && s.fingerprint == row.second && !appChanged;
                });
                if (same != scanned.end()) continue;
                if (auto r = recordByUUIDText(row.first)) uninstalled.push_back(r);
                if (Status err = deletePlugIn(row.first); !err.ok()) return err;
            }
            for (const auto& s : scanned) {
                auto it = before.find(s.path);
                if (it != before.end() && it->second.second == s.fingerprint && !appChanged) continue;
                auto r = makeRecord(s, app);
                if (Status err = insertPlugIn(r, *path, s.fingerprint); !err.ok()) {
                    if (sqlite3_errcode(db_) == SQLITE_CONSTRAINT)
                        return refusal(s.path + " is already registered elsewhere");
                    return err;
                }
                installed.push_back(r);
            }
            return {};
        });
    }

    Status unregisterBundle(const std::string& given) {
        std::vector<std::string> candidates{given};
        if (auto p = canonical(given); p && *p != given) candidates.insert(candidates.begin(), *p);
        return write([&](auto&, auto& uninstalled) -> Status {
            for (const auto& path : candidates) {
                auto plugins = existing("app_path = ?", path);
                Statement app(db_, "SELECT 1 FROM applications WHERE path = ?");
                app.bind(1, path);
                bool isApp = app.step() == SQLITE_ROW;
                if (!isApp) plugins = existing("path = ?", path);
                if (!isApp && plugins.empty()) continue;
                for (const auto& [p, row] : plugins) {
                    if (auto r = recordByUUIDText(row.first)) uninstalled.push_back(r);
                    if (Status err = deletePlugIn(row.first); !err.ok()) return err;
                }
                if (isApp) {
                    Statement del(db_, "DELETE FROM applications WHERE path = ?");
                    del.bind(1, path);
                    if (del.step() != SQLITE_DONE) return sqlError("removing an application");
                    changedOther_ = true;
                }
                return {};
            }
            return refusal("not registered: " + given);
        });
    }

    // ---- events

    void startWatcher() {
        {
            std::lock_guard lock(mutex_);
            Statement q(db_, "SELECT ifnull(max(seq), 0) FROM journal");
            lastSeq_ = q && q.step() == SQLITE_ROW ? q.integer(0) : 0;
        }
        int in = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
        inotify_add_watch(in, directory().c_str(), IN_CLOSE_WRITE | IN_MOVED_TO);
        stopFd_ = eventfd(0, EFD_CLOEXEC);
        std::string wakeName = wakePath().substr(wakePath().rfind('/') + 1);
        std::weak_ptr<Store> weak = weak_from_this();
        int stop = stopFd_;
        watcher_ = std::thread([weak, in, stop, wakeName] {
            pthread_setname_np(pthread_self(), "vantry.events");
            alignas(struct inotify_event) char buf[4096];
            for (;;) {
                struct pollfd fds[2] = {{in, POLLIN, 0}, {stop, POLLIN, 0}};
                if (poll(fds, 2, -1) < 0 && errno != EINTR) break;
                if (fds[1].revents) break;
                bool woke = false;
                ssize_t n;
                while ((n = ::read(in, buf, sizeof buf)) > 0) {
                    for (char* p = buf; p < buf + n;) {
                        auto* ev = reinterpret_cast<struct inotify_event*>(p);
                        if (ev->len && wakeName == ev->name) woke = true;
                        p += sizeof(struct inotify_event) + ev->len;
                    }
                }
                if (!woke) continue;
                auto store = weak.lock();
                if (!store) break;
                store->deliverNewEvents();
            }
            ::close(in);
        });
    }

    void deliverNewEvents() {
        std::vector<std::pair<int, std::vector<PlugInRecordPtr>>> events;
        {
            std::lock_guard lock(mutex_);
            Statement q(db_, "SELECT seq, kind, records FROM journal WHERE seq > ? ORDER BY seq");
            q.bind(1, lastSeq_);
            while (q && q.step() == SQLITE_ROW) {
                lastSeq_ = q.integer(0);
                auto list = plist::parse(q.blob(2));
                std::vector<PlugInRecordPtr> records;
                if (list && list->isArray())
                    for (const Value& v : *list->asArray())
                        if (auto r = PlugInRecord::deserialize(v, nullptr)) records.push_back(r);
                events.emplace_back(static_cast<int>(q.integer(1)), std::move(records));
            }
        }
        std::vector<std::shared_ptr<Observer>> observers;
        {
            std::lock_guard lock(observersMutex_);
            observers = observers_;
        }
        for (const auto& [kind, records] : events) {
            for (const auto& o : observers) {
                if (kind == kInstall) {
                    o->pluginsDidInstall(records);
                } else {
                    o->pluginsWillUninstall(records);
                }
            }
        }
    }
};

Result<std::shared_ptr<Store>> Store::open(const std::string& path) {
    auto store = std::make_shared<Store>(path);
    if (Status err = layout::makeDirectories(store->directory(), 0755); !err.ok()) return err.error();
    if (sqlite3_open_v2(path.c_str(), &store->db_,
                        SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_FULLMUTEX, nullptr) != SQLITE_OK)
        return store->sqlError("opening the registry");
    // A writer in another process holds the lock for a few milliseconds at most; wait that long,
    // boundedly.
    sqlite3_busy_timeout(store->db_, 5000);
    if (Status err = store->exec("PRAGMA journal_mode=WAL"); !err.ok()) return err.error();
    if (Status err = store->exec("PRAGMA foreign_keys=ON"); !err.ok()) return err.error();
    if (Status err = store->migrate(); !err.ok()) return err.error();
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
    sqlite3_close_v2(db_);
}

// ---- Registry

// Equal under the numeric-aware comparison exactly when equal after this: leading zeros of every
// run of digits dropped (one digit kept).
std::string versionKey(std::string_view s) {
    std::string out;
    for (size_t i = 0; i < s.size();) {
        if (s[i] >= '0' && s[i] <= '9') {
            size_t j = i;
            while (j + 1 < s.size() && s[j] == '0' && s[j + 1] >= '0' && s[j + 1] <= '9') ++j;
            while (j < s.size() && s[j] >= '0' && s[j] <= '9') out.push_back(s[j++]);
            i = j;
        } else {
            out.push_back(s[i++]);
        }
    }
    return out;
}

Registry::Registry(std::shared_ptr<Store> store) : store_(std::move(store)) {}
Registry::~Registry() = default;

std::string Registry::defaultPath() { return layout::stateDir() + "/vantry/registry.db"; }

Result<std::unique_ptr<Registry>> Registry::open(const std::string& path) {
    auto store = Store::open(path);
    if (!store) return store.error();
    return std::unique_ptr<Registry>(new Registry(*store));
}

const std::string& Registry::path() const { return store_->path_; }

PlugInRecordPtr Registry::plugInForUUID(const UUID& uuid) {
    {
        std::lock_guard lock(store_->mutex_);
        store_->checkFreshness();
        auto it = store_->byUUID_.find(uuid);
        if (it != store_->byUUID_.end()) return it->second;
    }
    auto found = store_->selectPlugIns("WHERE uuid = ?", {uuid.string()});
    return found.empty() ? nullptr : found.front();
}

PlugInRecordPtr Registry::plugInForPath(const std::string& bundlePath) {
    auto found = store_->selectPlugIns("WHERE path = ?", {canonical(bundlePath).value_or(bundlePath)});
    return found.empty() ? nullptr : found.front();
}

ApplicationRecordPtr Registry::applicationForPath(const std::string& bundlePath) {
    std::lock_guard lock(store_->mutex_);
    store_->checkFreshness();
    return store_->appFromRow(canonical(bundlePath).value_or(bundlePath));
}

std::vector<PlugInRecordPtr> Registry::installedPlugIns() { return store_->selectPlugIns("ORDER BY path", {}); }

std::vector<PlugInRecordPtr> Registry::query(
    const Value& pattern, const std::function<bool(const std::string&, const Value&)>& filter) {
    std::string where;
    std::vector<std::string> args;
    for (int k = 0; k < 3; ++k) {
        const Value* p = pattern.find(kIndexedKeys[k]);
        if (!p) continue;
        std::vector<std::string> wanted;
        if (auto one = plainEquality(*p)) {
            wanted.push_back(versionKey(*one));
        } else if (const Array* list = p->asArray()) {
            for (const Value& e : *list) {
                auto each = plainEquality(e);
                if (!each) {
                    wanted.clear();
                    break;
                }
                wanted.push_back(versionKey(*each));
            }
        }
        if (wanted.empty()) continue;
        std::string col = kIndexColumns[k];
        std::string in;
        for (const auto& w : wanted) {
            in += in.empty() ? "?" : ",?";
            args.push_back(w);
        }
        where += (where.empty() ? "WHERE " : " AND ") + std::string("((") + col + "_kind = 1 AND " + col +
                 " IN (" + in + ")) OR " + col + "_kind = 2)";
    }
    std::lock_guard lock(store_->mutex_);
    store_->checkFreshness();
    Statement q(store_->db_, ("SELECT uuid, identifier, entitlements, record, ifnull(app_path, '') FROM plugins " +
                              where + " ORDER BY path").c_str());
    for (size_t i = 0; i < args.size(); ++i) q.bind(static_cast<int>(i + 1), args[i]);
    std::vector<PlugInRecordPtr> out;
    while (q && q.step() == SQLITE_ROW) {
        if (filter) {
            auto ents = plist::parse(q.blob(2));
            if (!filter(q.text(1), ents ? *ents : Value(Dictionary{}))) continue;
        }
        if (auto r = store_->recordFromRow(q.text(0), q.blob(3), q.text(4))) out.push_back(std::move(r));
    }
    return out;
}

Status Registry::registerBundle(const std::string& path, bool placeholder) {
    return store_->registerBundle(path, placeholder);
}

Status Registry::unregisterBundle(const std::string& path) { return store_->unregisterBundle(path); }

std::vector<std::string> Registry::registeredPaths() {
    std::lock_guard lock(store_->mutex_);
    Statement q(store_->db_,
                "SELECT path FROM applications UNION SELECT path FROM plugins WHERE app_path IS NULL ORDER BY 1");
    std::vector<std::string> out;
    while (q && q.step() == SQLITE_ROW) out.push_back(q.text(0));
    return out;
}

void Registry::addObserver(std::shared_ptr<Observer> observer) {
    bool first;
    {
        std::lock_guard lock(store_->observersMutex_);
        first = store_->observers_.empty();
        store_->observers_.push_back(std::move(observer));
    }
    if (first) store_->startWatcher();
}

void Registry::dropCaches() {
    std::lock_guard lock(store_->mutex_);
    store_->byUUID_.clear();
    store_->apps_.clear();
}

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
