// Discovery queries: the indexed keys that narrow a pattern down in SQL, before the exact test.
#include "platform/plist/Plist.h"
#include "platform/vantry/Store.h"

namespace corvane::vantry {

namespace {

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

Subject subjectOf(const Value& plugin, const Value& info, const std::string& key) {
    const Value* v = plugin["KSExtensionAttributes"].find(key);
    if (!v) v = info.find(key);
    if (!v) return {};
    if (v->isString()) return {SubjectKind::Text, *v->asString()};
    return {SubjectKind::Other, {}};
}

std::vector<PlugInRecordPtr> Store::query(
    const Value& pattern, const std::function<bool(const std::string&, const Value&)>& filter) {
    std::string where;
    std::vector<std::string> args;
    for (int k = 0; k < 3; ++k) {
        const Value* p = pattern.find(kIndexedKeys[k].key);
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
        std::string col = kIndexedKeys[k].column;
        std::string in;
        for (const auto& w : wanted) {
            in += in.empty() ? "?" : ",?";
            args.push_back(w);
        }
        where += (where.empty() ? "WHERE " : " AND ") + std::string("((") + col + "_kind = 1 AND " + col +
                 " IN (" + in + ")) OR " + col + "_kind = 2)";
    }
    Rows rows;
    {
        MutexLock lock(mutex_);
        checkFreshness();
        rows = rowsOf(std::string(kRecordColumns) + where +
                          " ORDER BY path",
                      args);
    }
    // The filter runs outside the lock: it may look elsewhere (the daemon's annotations) for long.
    std::vector<PlugInRecordPtr> out;
    for (const PlugInRecordPtr& record : *rows)
        if (!filter || filter(record->identifier(), record->entitlements())) out.push_back(record);
    return out;
}

}  // namespace corvane::vantry
