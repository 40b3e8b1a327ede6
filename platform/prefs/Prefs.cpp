#include "platform/prefs/Prefs.h"

#include <unistd.h>

#include <cerrno>

#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"

namespace corvane::prefs {

namespace {

bool usableDomain(const std::string& domain) {
    return !domain.empty() && domain[0] != '.' && domain.find('/') == std::string::npos &&
           domain.find('\0') == std::string::npos;
}

std::string hostName() {
    char name[256] = {};
    if (gethostname(name, sizeof name - 1) != 0 || !name[0]) return "localhost";
    return name;
}

Value readDomain(const std::string& domain) {
    auto v = plist::readFile(domainPath(domain));
    if (!v || !v->isDictionary()) return Value(Dictionary{});
    return *v;
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
