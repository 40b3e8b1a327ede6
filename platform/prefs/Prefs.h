// The preference store: one property-list file per domain for the current user and this host,
// <per-user configuration>/preferences/ByHost/<domain>.<host name>.plist. A change made by another
// process is seen by the next read: what was read is kept only until a file of the directory
// changes (inotify), so reads in between cost no file access.
//
// Thread-safety: every function may be called from any thread; writes replace the file atomically.
#pragma once

#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::prefs {

// The file that holds a domain's values.
std::string domainPath(const std::string& domain);

// Re-reads the domain from storage. Every read already sees each finished write, so this only
// exists for callers that state the intent; it checks that the domain name is usable.
Status synchronize(const std::string& domain);

// The value of `key` in `domain`, or null when it is not set (or the file cannot be read).
Value copyValue(const std::string& key, const std::string& domain);

// Sets (or, with a null value, removes) one key of a domain.
Status setValue(const std::string& key, const Value& value, const std::string& domain);

// A per-process view of settings over a search list of domains: a key is looked up in each domain
// in the order they were added.
class UserDefaults {
public:
    UserDefaults() = default;
    virtual ~UserDefaults() = default;

    void addSuite(const std::string& domain);
    const std::vector<std::string>& suites() const { return suites_; }
    // The first value found for `key` in the search list, or null.
    Value objectForKey(const std::string& key) const;

private:
    std::vector<std::string> suites_;
};

}  // namespace corvane::prefs
