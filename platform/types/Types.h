// Type identifiers and activation rules (docs/activation-rules.md).
//
// Type identifiers are MIME types ("image/png"); which type conforms to which comes from the
// shared-mime-info database every Linux desktop has: its `aliases` and `subclasses` files under
// <share>/mime (the platform root's usr/share/mime when it has one, else /usr/share/mime). An
// application that brings new types installs a shared-mime-info package file the ordinary way.
//
// typeConformsTo(a, b) holds when, type names compared without regard to case:
//   - a equals b once aliases are resolved, or
//   - b is an ancestor of a through the subclass graph (cycles are tolerated), or
//   - b is text/plain and a is any text/... type, or
//   - b is application/octet-stream and a is anything but an inode/... type, or
//   - b is a wildcard "major/*" and a's major part is major.
//
// The process's database is read once and read again when its files change (inotify), on a thread
// of its own: a conformance question never reads a file.
//
// Thread-safety: everything here may be used from any thread.
#pragma once

#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace corvane::types {

// One reading of the database: immutable.
class TypeDatabase {
public:
    // Reads `<mimeDirectory>/aliases` and `<mimeDirectory>/subclasses`; missing or unreadable files
    // give a database with the built-in rules only.
    static std::shared_ptr<const TypeDatabase> read(const std::string& mimeDirectory);

    // The type an alias stands for, in lower case; other types as given, in lower case.
    std::string canonical(std::string_view type) const;
    bool conformsTo(std::string_view type, std::string_view to) const;

private:
    std::map<std::string, std::string, std::less<>> aliases_;
    std::map<std::string, std::set<std::string>, std::less<>> parents_;
};

// The mime directory of the platform root.
std::string mimeDirectory();

// The process's database, kept up to date with its files.
std::shared_ptr<const TypeDatabase> database();

// typeConformsTo over the process's database.
bool typeConformsTo(std::string_view type, std::string_view to);

// Whether a plug-in's activation rule accepts a host's offer. The rule is the boolean true
// (anything) or a dictionary from a type identifier to the greatest number of items of that type,
// or of types conforming to it, that the plug-in takes. The offer is {"items": [type, ...]}, one
// entry per item. The rule matches when the offer has at least one item, every item conforms to a
// key of the rule, and for every key the items conforming to it are no more than its number.
// Anything malformed answers false.
bool activationRuleMatches(const Value& rule, const Value& offer);
bool activationRuleMatches(const TypeDatabase& types, const Value& rule, const Value& offer);

}  // namespace corvane::types
