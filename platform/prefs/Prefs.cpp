#include "platform/prefs/Prefs.h"

#include <unistd.h>

#include <cerrno>
#include <map>
#include <memory>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/layout/Layout.h"
#include "platform/notify/Notify.h"
#include "platform/plist/Plist.h"

namespace corvane::prefs {

namespace {

bool usableDomain(const std::string& domain) {
    return !domain.empty() && domain[0] != '.' && domain.find('/') == std::string::npos &&
           domain.find('\0') == std::string::npos;
}

// Read once: the host's name is part of every domain's path, and a daemon asks for its domain on
// every request.
const std::string& hostName() {
    static const std::string name = [] {
        char text[256] = {};
        if (gethostname(text, sizeof text - 1) != 0 || !text[0]) return std::string("localhost");
        return std::string(text);
    }();
    return name;
}

// The domains read from one directory, kept until a file in it changes: a daemon that consults
// its preferences on every request reads a file only after someone wrote one.
struct ReadDomains {
    Mutex mutex;
    std::unique_ptr<notify::ChangeWatch> watch GUARDED_BY(mutex);
    std::map<std::string, Value, std::less<>> byPath GUARDED_BY(mutex);
};

Value readDomain(const std::string& domain) {
    static ReadDomains& read = *new ReadDomains;  // lives for the process's life
    std::string path = domainPath(domain);
    std::string dir = path.substr(0, path.rfind('/'));
    MutexLock lock(read.mutex);
    if (!read.watch || read.watch->directory() != dir) read.watch = std::make_unique<notify::ChangeWatch>(dir);
    if (read.watch->changed()) read.byPath.clear();
    if (auto it = read.byPath.find(path); it != read.byPath.end()) return it->second;
    auto v = plist::readFile(path);
    Value value = v && v->isDictionary() ? std::move(*v) : Value(Dictionary{});
    read.byPath.emplace(path, value);
    return value;
}

}  // namespace

std::string domainPath(const std::string& domain) {
    return layout::userConfigDir() + "/preferences/ByHost/" + domain + "." + hostName() + ".plist";
}

Status synchronize(const std::string& domain) {
    if (!usableDomain(domain)) return Error::posix(EINVAL, "preference domain " + domain);
    return {};
}

Value copyValue(const std::string& key, const std::string& domain) {
    if (!usableDomain(domain)) return Value();
    return readDomain(domain)[key];
}

Status setValue(const std::string& key, const Value& value, const std::string& domain) {
    if (!usableDomain(domain)) return Error::posix(EINVAL, "preference domain " + domain);
    std::string path = domainPath(domain);
    if (Status made = layout::makeDirectories(path.substr(0, path.rfind('/')), 0700); !made.ok()) return made;
    Value current = readDomain(domain);
    Dictionary d = *current.asDictionary();
    if (value.isNull()) {
        d.erase(key);
    } else {
        d.insert_or_assign(key, value);
    }
    return plist::writeXMLFile(path, Value(std::move(d)), 0600);
}

void UserDefaults::addSuite(const std::string& domain) { suites_.push_back(domain); }

Value UserDefaults::objectForKey(const std::string& key) const {
    for (const std::string& domain : suites_) {
        Value v = copyValue(key, domain);
        if (!v.isNull()) return v;
    }
    return Value();
}

}  // namespace corvane::prefs
