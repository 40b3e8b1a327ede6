#include "platform/types/Types.h"

#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>
#include <vector>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"

namespace corvane::types {

namespace {

const log::Handle& extensionLog() {
    static const log::Handle h("com.corvane.Annexa", "extension");
    return h;
}

std::string lower(std::string_view s) {
    std::string out(s);
    std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return std::tolower(c); });
    return out;
}

std::string_view majorOf(std::string_view type) { return type.substr(0, type.find('/')); }

// Calls `pair` for every line "first second" of a database file.
template <class F>
void readPairs(const std::string& path, F pair) {
    std::ifstream in(path);
    std::string line;
    while (std::getline(in, line)) {
        std::istringstream words(line);
        std::string first, second;
        if (words >> first >> second) pair(lower(first), lower(second));
    }
}

// The process's database and the thread that keeps it current.
struct Watched {
    Mutex mutex;
    std::shared_ptr<const TypeDatabase> current GUARDED_BY(mutex);
};

Watched& watched() {
    static auto* w = new Watched();  // for the process's life, as its watcher thread
    return *w;
}

void watch(const std::string& directory) {
    int in = inotify_init1(IN_CLOEXEC);
    if (in < 0 || inotify_add_watch(in, directory.c_str(), IN_CLOSE_WRITE | IN_MOVED_TO | IN_CREATE | IN_DELETE) < 0) {
        if (in >= 0) ::close(in);
        return;  // no directory to watch: the built-in rules stay
    }
    std::thread([in, directory] {
        pthread_setname_np(pthread_self(), "types.watch");
        alignas(struct inotify_event) char buf[4096];
        for (;;) {
            ssize_t n = ::read(in, buf, sizeof buf);
            if (n <= 0) continue;
            bool changed = false;
            for (char* p = buf; p < buf + n; p += sizeof(struct inotify_event) + reinterpret_cast<inotify_event*>(p)->len) {
                auto* ev = reinterpret_cast<inotify_event*>(p);
                std::string name = ev->len ? ev->name : "";
                if (name == "aliases" || name == "subclasses") changed = true;
            }
            if (!changed) continue;
            auto fresh = TypeDatabase::read(directory);
            MutexLock lock(watched().mutex);
            watched().current = std::move(fresh);
        }
    }).detach();
}

}  // namespace

std::shared_ptr<const TypeDatabase> TypeDatabase::read(const std::string& mimeDirectory) {
    auto db = std::make_shared<TypeDatabase>();
    readPairs(mimeDirectory + "/aliases", [&](std::string alias, std::string type) {
        db->aliases_.emplace(std::move(alias), std::move(type));
    });
    readPairs(mimeDirectory + "/subclasses", [&](std::string type, std::string parent) {
        db->parents_[type].insert(std::move(parent));
    });
    return db;
}

std::string TypeDatabase::canonical(std::string_view type) const {
    std::string t = lower(type);
    auto it = aliases_.find(t);
    return it == aliases_.end() ? t : it->second;
}

bool TypeDatabase::conformsTo(std::string_view type, std::string_view to) const {
    std::string a = canonical(type);
    std::string b = canonical(to);
    if (a.empty() || b.empty()) return false;
    if (a == b) return true;
    if (b.size() > 2 && b.compare(b.size() - 2, 2, "/*") == 0) return majorOf(a) == majorOf(b);
    if (b == "text/plain" && majorOf(a) == "text") return true;
    if (b == "application/octet-stream" && majorOf(a) != "inode") return true;
    // Ancestors through the subclass graph, each visited once (the files may hold cycles).
    std::set<std::string> seen{a};
    std::vector<std::string> pending{a};
    while (!pending.empty()) {
        std::string t = std::move(pending.back());
        pending.pop_back();
        auto it = parents_.find(t);
        if (it == parents_.end()) continue;
        for (const auto& parent : it->second) {
            std::string p = canonical(parent);
            if (p == b) return true;
            // A parent that is text/plain makes its child text too, whatever its major part.
            if (b == "text/plain" && majorOf(p) == "text") return true;
            if (seen.insert(p).second) pending.push_back(p);
        }
    }
    return false;
}

std::string mimeDirectory() {
    std::string rooted = layout::underRoot("/usr/share/mime");
    if (!layout::root().empty() && layout::canonicalPath(rooted)) return rooted;
    return "/usr/share/mime";
}

std::shared_ptr<const TypeDatabase> database() {
    static std::once_flag once;
    std::call_once(once, [] {
        std::string directory = mimeDirectory();
        auto first = TypeDatabase::read(directory);
        {
            MutexLock lock(watched().mutex);
            watched().current = std::move(first);
        }
        watch(directory);
    });
    MutexLock lock(watched().mutex);
    return watched().current;
}

bool typeConformsTo(std::string_view type, std::string_view to) { return database()->conformsTo(type, to); }

bool activationRuleMatches(const Value& rule, const Value& offer) { return activationRuleMatches(*database(), rule, offer); }

bool activationRuleMatches(const TypeDatabase& types, const Value& rule, const Value& offer) {
    if (rule.isBool()) return rule.isTrue();
    const Dictionary* limits = rule.asDictionary();
    const Array* items = offer["items"].asArray();
    auto refuse = [&](const char* why) {
        log::debug(extensionLog(), "activation rule %@ does not take %@: %{public}s", rule, offer, why);
        return false;
    };
    if (!limits || limits->empty()) return refuse("the rule is neither true nor a dictionary of types");
    if (!items || items->empty()) return refuse("the offer has no items");
    for (const auto& [type, most] : *limits) {
        if (!most.isInteger() || most.int64Value().value_or(-1) < 0 || type.empty())
            return refuse("a type's number is not a count");
    }
    std::map<std::string_view, uint64_t> taken;
    for (const Value& item : *items) {
        const std::string* type = item.asString();
        if (!type || type->empty()) return refuse("an item is not a type identifier");
        bool fits = false;
        for (const auto& [key, most] : *limits) {
            if (!types.conformsTo(*type, key)) continue;
            fits = true;
            if (++taken[key] > *most.uint64Value()) return refuse("more items of a type than the rule takes");
        }
        if (!fits) return refuse("an item fits no type of the rule");
    }
    return true;
}

}  // namespace corvane::types
