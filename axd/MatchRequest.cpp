// "match": discovery. The candidates of the database's query go, in its order, through visibility,
// the host's rules, the user's exclusions, authorization and export; registrations of one
// identifier collapse to one answer; plug-ins that replace others are marked. With the flag of our
// own, the reply also says for every installed plug-in the step that left it out.
#include <list>
#include <map>
#include <unordered_map>

#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXMessage.h"
#include "axd/AXDRpxClient.h"
#include "axd/AXDServer.h"
#include "axd/Transaction.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

namespace {

// One form chosen so far.
struct Chosen {
    Dictionary form;
    const AXDPlugIn* plugIn;
};
using ResultList = std::list<Chosen>;

// The result list, with every identifier's entries in list order: collapsing looks at the forms of
// one identifier without walking the whole list.
class Results {
public:
    ResultList& list() { return list_; }
    std::vector<ResultList::iterator>& of(const std::string& identifier) { return byIdentifier_[identifier]; }
    void append(const std::string& identifier, Chosen chosen) {
        list_.push_back(std::move(chosen));
        of(identifier).push_back(std::prev(list_.end()));
    }
    void remove(const std::string& identifier, size_t index) {
        auto& entries = of(identifier);
        list_.erase(entries[index]);
        entries.erase(entries.begin() + static_cast<long>(index));
    }

private:
    ResultList list_;
    std::unordered_map<std::string, std::vector<ResultList::iterator>> byIdentifier_;
};

std::string stringIn(const Dictionary& form, const char* key) {
    auto it = form.find(key);
    const std::string* s = it == form.end() ? nullptr : it->second.asString();
    return s ? *s : std::string();
}

// Decides between p and the forms of the same identifier chosen so far: false drops p; true lets
// it go on, after removing the form it displaces, if any.
bool collapse(const AXDPlugIn& p, Results& results, uint64_t flags, std::map<const AXDPlugIn*, std::string>& outcome,
              bool explain) {
    using namespace discovery;
    std::string identifier = p.identifier().value_or("");
    auto& same = results.of(identifier);
    Value version = p.version();
    const std::string* pVersion = version.asString();
    for (size_t i = 0; i < same.size(); ++i) {
        const Dictionary& m = same[i]->form;
        Ordering order = compareVersionString(pVersion ? *pVersion : "", stringIn(m, "version"));
        bool newer = order == Ordering::Descending;
        bool equal = order == Ordering::Same;
        auto mSystem = m.find("systemResident");
        auto mModified = m.find("lastmodified");
        bool preferP = (p.onSystemVolume() && !(mSystem != m.end() && mSystem->second.isTrue())) ||
                       p.lastModified() > (mModified != m.end() ? mModified->second.int64Value().value_or(0) : 0);
        bool decided = false;
        bool keepP = false;
        if (!(flags & kAllVersions)) {
            decided = true;
            keepP = newer || (equal && preferP);
        } else if (equal && !(flags & kDuplicates)) {
            decided = true;
            keepP = preferP;
        }
        if (!decided) continue;
        const AXDPlugIn* other = same[i]->plugIn;
        std::string otherUuid = stringIn(m, "uuid");
        if (keepP) {
            if (explain) outcome[other] = "collapsed in favour of " + p.uuid()->string();
            results.remove(identifier, i);
        } else if (explain) {
            outcome[&p] = "collapsed in favour of " + otherUuid;
        }
        return keepP;
    }
    return true;
}

}  // namespace

std::optional<std::string> Transaction::matchRefusal(const AXDPlugIn& p, const Value& rules, uint64_t flags,
                                                     const std::vector<Value>& exclusions) {
    using namespace discovery;
    if (!(flags & kAll)) {
        if (!p.onSystemVolume()) {
            if (!p.containingUrl()) return std::string("not on the system volume and not inside an application");
            if (flags & kSystemOnly) return std::string("not on the system volume");
        }
        if (p.isDedicated()) {
            auto bundle = client_->bundle();
            auto plugIns = bundle ? bundle->plugInsPath() : std::nullopt;
            if (!plugIns || p.path().rfind(*plugIns, 0) != 0) return std::string("dedicated to another application");
        }
        if (server().holdOnPlugIn(p)) return std::string("held");
    }
    if (const Dictionary* tests = rules.asDictionary()) {
        for (const auto& [key, pattern] : *tests)
            if (!p.matchKeyPattern(key, pattern)) return "rule " + key + " does not match: " + pattern.description();
    }
    for (const Value& exclusion : exclusions) {
        if (!p.match(exclusion)) continue;
        log::debug(logOps(), "client %d plugin %{public}@ globally excluded", client_->pid(), p.uuid()->string());
        return "excluded by the user: " + exclusion.description();
    }
    if (!(flags & kAll)) {
        if (auto reason = p.allowForClient(*client_)) {
            log::debug(logOps(), "client %d cannot use plugin %{public}@: %{public}@", client_->pid(), p.uuid()->string(),
                       *reason);
            return "not allowed: " + *reason;
        }
    }
    return std::nullopt;
}

void Transaction::matchPlugIns() {
    using namespace discovery;
    const Value& rulesEntry = request()[message::kRules];
    if (!rulesEntry.isNull() && !rulesEntry.isDictionary()) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (bad rules dictionary)");
        return;
    }
    Value rules = rulesEntry.isNull() ? Value() : convertMessageToValue(rulesEntry);
    uint64_t flags = request()[message::kFlags].uint64Value().value_or(0);
    if ((flags & kAll) && (!client_->hasEntitlement(keys::kManagerEntitlement) || corvane::sandbox::isSandboxed(client_->pid()))) {
        failMessage(AXErrorCode::NotEntitled, "unauthorized discovery flag (AXDiscoverAll)");
        return;
    }
    // The explanation names plug-ins the host may not see: not for sandboxed callers.
    bool explain = flags & kExplain;
    if (explain && corvane::sandbox::isSandboxed(client_->pid())) {
        failMessage(AXErrorCode::NotEntitled, "unauthorized discovery flag (explain)");
        return;
    }
    std::vector<Value> exclusions = server().userPrefs().exclusionPatterns();
    // Explaining looks at every installed plug-in: the registry's query never drops one that the
    // rules would take, so what is returned is the same.
    std::vector<AXDPlugInPtr> candidates = server().findPlugIns(explain ? Value() : rules);
    AXD_TRACE(discover__raw, static_cast<unsigned>(candidates.size()));

    std::map<const AXDPlugIn*, std::string> outcome;  // explain only
    Results results;
    std::unordered_map<std::string, ResultList::iterator> overrides;
    for (const auto& p : candidates) {
        if (auto refusal = matchRefusal(*p, rules, flags, exclusions)) {
            if (explain) outcome[p.get()] = *refusal;
            continue;
        }
        auto exported = p->exportForm();
        if (!exported) {
            log::error(logOps(), "failed to export matching plug-in %{public}@: %{public}@", p->uuid()->string(),
                       exported.error());
            if (explain) outcome[p.get()] = "cannot be exported: " + exported.error().description();
            continue;
        }
        if (!collapse(*p, results, flags, outcome, explain)) continue;
        Dictionary form = *exported->asDictionary();
        addAnnotationForPlugIn(*p, form);
        p->augmentForm(form);
        std::string identifier = p->identifier().value_or("");
        results.append(identifier, Chosen{std::move(form), p.get()});
        if (explain) outcome[p.get()] = "returned";
        Value replaces = p->valueForEntitlement(keys::kReplaceEntitlement);
        if (const std::string* one = replaces.asString()) {
            overrides[*one] = std::prev(results.list().end());
        } else if (const Array* many = replaces.asArray()) {
            for (const Value& e : *many)
                if (const std::string* name = e.asString()) overrides[*name] = std::prev(results.list().end());
        }
    }
    for (auto& chosen : results.list()) {
        auto o = overrides.find(stringIn(chosen.form, "identifier"));
        if (o == overrides.end()) continue;
        chosen.form["overrider"] = o->second->form["uuid"];
        o->second->form["overriding"] = chosen.form["identifier"];
        log::info(logOps(), "plug-in %{public}@ overrides %{public}@", o->second->form["uuid"], chosen.form["uuid"]);
    }
    log::info(logOps(), "match returned %u plug-ins", static_cast<unsigned>(results.list().size()));
    Array forms;
    for (auto& chosen : results.list()) forms.push_back(Value(std::move(chosen.form)));
    if (auto converted = AXDaemonClient::convertToRPX(Value(std::move(forms)), version())) reply()[message::kMatches] = *converted;
    if (explain) {
        Array explanations;
        for (const auto& p : candidates) {
            explanations.push_back(corvane::dict({{"uuid", p->uuid()->string()},
                                                  {"identifier", p->identifier().value_or("")},
                                                  {"path", p->path()},
                                                  {"outcome", outcome[p.get()]}}));
        }
        reply()["explanations"] = Value(std::move(explanations));
    }
    log::debug(logOps(), "reply marshalled");
    done();
}

}  // namespace annexa
