// "match": discovery. The candidates of the database's query go, in its order, through visibility,
// the host's rules, the user's exclusions, authorization and export; registrations of one
// identifier collapse to one answer; plug-ins that replace others are marked. With the flag of our
// own, the reply also says for every installed plug-in the step that left it out.
#include <algorithm>
#include <deque>
#include <map>
#include <unordered_set>

#include "Annexa/AXProtocol.h"
#include "Annexa/AXMessage.h"
#include "axd/AXDMatchResults.h"
#include "axd/AXDRpxClient.h"
#include "axd/AXDServer.h"
#include "axd/Transaction.h"
#include "platform/codesign/CodeSign.h"
#include "platform/rpx/Wire.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/trace/Trace.h"
#include "platform/types/Types.h"

namespace annexa {

namespace log = corvane::log;

namespace {

// The "matches" array as the wire carries it: each chosen plug-in's encoded form with this
// request's annotations and replacement marks in front. The forms are not copied: the array is
// put together from this request's own bytes and the forms where their plug-ins keep them, and the
// reply goes to the socket so. Null when a form holds a value that a message cannot carry, as the
// reply conversion would give.
Value encodeMatches(const std::vector<AXDMatchResults::Entry*>& list, const std::vector<Value>& annotations) {
    namespace wire = corvane::rpx::wire;
    auto own = std::make_shared<std::string>();
    own->reserve(16 + list.size() * 64);
    wire::appendArrayHeader(*own, static_cast<uint32_t>(list.size()));
    std::vector<size_t> ownEnds;  // where each form's own bytes end in `own`
    ownEnds.reserve(list.size());
    size_t nesting = 0;
    uint32_t kinds = 0;
    for (size_t i = 0; i < list.size(); ++i) {
        const AXDMatchResults::Entry& chosen = *list[i];
        const Value& annotation = annotations[i];
        uint32_t count = chosen.form->count + 1 + (chosen.overrider ? 1 : 0) + (chosen.overriding ? 1 : 0);
        wire::appendDictionaryHeader(*own, count);
        bool written = wire::appendEntry(*own, form::kAnnotations, annotation);
        if (chosen.overrider) written = written && wire::appendEntry(*own, form::kOverrider, Value(*chosen.overrider));
        if (chosen.overriding) written = written && wire::appendEntry(*own, form::kOverriding, Value(*chosen.overriding));
        if (!written) return Value();
        ownEnds.push_back(own->size());
        nesting = std::max({nesting, chosen.form->nesting + 1, wire::nestingOf(annotation) + 2});
        kinds |= chosen.form->kindsInside | annotation.kindsInside();
    }
    Value::Encoding::Pieces pieces;
    pieces.bytes.reserve(2 * list.size());
    pieces.owners.reserve(list.size() + 1);
    size_t from = 0, next = 0;
    for (const auto& chosen : list) {
        pieces.bytes.emplace_back(own->data() + from, ownEnds[next] - from);
        from = ownEnds[next++];
        pieces.bytes.emplace_back(chosen->form->entries);
        pieces.owners.push_back(chosen->form);
        pieces.size += chosen->form->entries.size();
    }
    if (from < own->size()) pieces.bytes.emplace_back(own->data() + from, own->size() - from);  // no forms
    pieces.size += own->size();
    pieces.owners.push_back(std::move(own));
    // The reply conversion reads what the encoded array holds without decoding it.
    return convertValueToMessage(wire::encodedPieces(std::move(pieces), nesting, kinds));
}

}  // namespace

// How large the rules of one "match" may be, since every rule is tested against every candidate:
// keys, strings in one array pattern, items a host offers (an offer is a dictionary pattern), and
// the bytes of one string.
constexpr size_t kMaxRuleKeys = 64;
constexpr size_t kMaxPatternElements = 256;
constexpr size_t kMaxOfferedItems = 1024;
constexpr size_t kMaxPatternBytes = 4096;
// And the encoded rules as a whole, looked at before anything in them is decoded: rules within the
// bounds above, written as a host writes them, take a few kilobytes.
constexpr size_t kMaxRulesBytes = 256 * 1024;

namespace {

// What makes rules too large to be served, or nothing.
std::optional<std::string> rulesBeyondBounds(const Value& rules) {
    const Dictionary* tests = rules.asDictionary();
    if (!tests) return std::nullopt;
    if (tests->size() > kMaxRuleKeys) return "at most " + std::to_string(kMaxRuleKeys) + " keys";
    auto longText = [](const Value& v) { return v.isString() && v.asString()->size() > kMaxPatternBytes; };
    for (const auto& [key, pattern] : *tests) {
        if (key.size() > kMaxPatternBytes || longText(pattern)) return "a key or pattern longer than 4096 bytes";
        if (const Array* many = pattern.asArray()) {
            if (many->size() > kMaxPatternElements) return "at most " + std::to_string(kMaxPatternElements) + " patterns under " + key;
            for (const Value& e : *many)
                if (longText(e)) return "a pattern longer than 4096 bytes under " + key;
        } else if (const Dictionary* offer = pattern.asDictionary()) {
            if (offer->size() > 16) return "an offer under " + key + " with more than 16 keys";
            for (const auto& [name, items] : *offer) {
                const Array* list = items.asArray();
                if (list && list->size() > kMaxOfferedItems)
                    return "at most " + std::to_string(kMaxOfferedItems) + " offered items under " + key;
                if (longText(items)) return "an offered type longer than 4096 bytes under " + key;
                if (list) {
                    for (const Value& e : *list)
                        if (longText(e) || e.isArray() || e.isDictionary()) return "an offered item that is no type under " + key;
                }
            }
        }
    }
    return std::nullopt;
}

}  // namespace

// What a "match" depends on besides the host, its rules and its flags. The request reads them once,
// at its start, and its walk uses what it read.
struct MatchInputs {
    uint64_t registry = 0;     // the registry's contents
    uint64_t annotations = 0;  // the annotation table
    uint64_t forms = 0;        // the plug-ins' kept forms
    uint64_t holds = 0;        // the hold list (a kept answer keeps no hold, so none outlives its release)
    std::vector<Value> exclusions;
    std::shared_ptr<const corvane::types::TypeDatabase> types;  // for type tests in patterns
    bool operator==(const MatchInputs&) const = default;
};

// A walk's answer, with the log lines it wrote: an answer given again writes them again.
struct MatchAnswer {
    Value matches;       // the encoded array; null for a version without "matches"
    Value explanations;  // with the explain flag only
    unsigned raw = 0;    // the registry's candidates
    unsigned returned = 0;
    std::vector<std::string> logged;        // debug lines: exclusions and authorization
    std::vector<std::string> exportErrors;  // error lines
    std::vector<std::pair<std::string, std::string>> overrides;  // overrider, overridden (info lines)
};

namespace {

MatchInputs currentMatchInputs(AXDServer& server) {
    MatchInputs inputs;
    // The versions first: a change after this point is seen by the next request.
    inputs.registry = server.workspace().contentVersion();
    inputs.annotations = AXDAnnotationStore::changeCount();
    inputs.forms = AXDPlugIn::formsDropped();
    inputs.holds = server.holdsChangeCount();
    inputs.types = corvane::types::database();
    inputs.exclusions = server.userPrefs().exclusionPatterns();
    return inputs;
}

// The last answers to "match", for the few requests asked last. While nothing an answer depends on
// changed, a host that asks the same again (the same rules and flags) gets the same answer without
// a walk. A host connection is one identity (its entitlements and bundle do not change), so the
// key is the connection itself.
class KeptAnswers {
public:
    struct Key {
        std::weak_ptr<AXDRpxClient> client;
        Value rules;  // null for none
        uint64_t flags;
        uint64_t version;
    };
    std::shared_ptr<const MatchAnswer> find(const Key& key, const MatchInputs& inputs) {
        corvane::MutexLock lock(mutex_);
        for (auto it = kept_.begin(); it != kept_.end(); ++it) {
            if (!sameKey(it->key, key)) continue;
            if (!(it->inputs == inputs)) {
                kept_.erase(it);
                return nullptr;
            }
            return it->answer;
        }
        return nullptr;
    }
    void keep(Key key, const MatchInputs& inputs, std::shared_ptr<const MatchAnswer> answer) {
        corvane::MutexLock lock(mutex_);
        // Answers of hosts that went, and the oldest beyond the few kept, go.
        std::erase_if(kept_, [&](const Kept& k) { return k.key.client.expired() || sameKey(k.key, key); });
        size_t forms = answer->returned;
        for (const Kept& k : kept_) forms += k.answer->returned;
        while (!kept_.empty() && (kept_.size() >= kMaxKept || forms > kMaxKeptForms)) {
            forms -= kept_.front().answer->returned;
            kept_.pop_front();
        }
        kept_.push_back(Kept{std::move(key), inputs, std::move(answer)});
    }

private:
    // An answer of every plug-in holds about 100 bytes of its own per form (the rest refers to the
    // forms their plug-ins keep): a few of those, or many short answers.
    static constexpr size_t kMaxKept = 16;
    static constexpr size_t kMaxKeptForms = 25000;
    struct Kept {
        Key key;
        MatchInputs inputs;
        std::shared_ptr<const MatchAnswer> answer;
    };
    static bool sameKey(const Key& a, const Key& b) {
        // The same connection, without taking a reference to it.
        bool sameClient = !a.client.owner_before(b.client) && !b.client.owner_before(a.client);
        return a.flags == b.flags && a.version == b.version && sameClient && a.rules == b.rules;
    }
    corvane::Mutex mutex_;
    std::deque<Kept> kept_ GUARDED_BY(mutex_);
};

KeptAnswers& keptAnswers() {
    static auto* answers = new KeptAnswers();  // for the process's life, as the server
    return *answers;
}

}  // namespace

std::optional<std::string> Transaction::matchRefusal(
    const AXDPlugIn& p, const Value& rules, uint64_t flags, const std::vector<Value>& exclusions,
    const MatchHolds& holds, std::vector<std::string>& logged, bool worded) {
    using namespace discovery;
    if (!(flags & kAll)) {
        if (!p.onSystemVolume()) {
            if (!p.walkFacts().inApplication) return std::string("not on the system volume and not inside an application");
            if (flags & kSystemOnly) return std::string("not on the system volume");
        }
        if (p.walkFacts().dedicated) {
            auto bundle = explainedHost_ ? explainedHost_->bundle : client_->bundle();
            auto plugIns = bundle ? bundle->plugInsPath() : std::nullopt;
            if (!plugIns || p.path().rfind(*plugIns, 0) != 0) return std::string("dedicated to another application");
        }
        if (holds && !holds->empty() && holds->count(*p.uuid())) return std::string("held");
    }
    if (const Dictionary* tests = rules.asDictionary()) {
        for (const auto& [key, pattern] : *tests)
            if (!p.matchKeyPattern(key, pattern))
                return worded ? "rule " + key + " does not match: " + pattern.description() : std::string("rule");
    }
    for (const Value& exclusion : exclusions) {
        if (!p.match(exclusion)) continue;
        logged.push_back(log::formatText("client %d plugin %@ globally excluded", client_->pid(), p.uuid()));
        return worded ? "excluded by the user: " + exclusion.description() : std::string("excluded");
    }
    if (!(flags & kAll)) {
        auto reason = explainedHost_ ? p.allowForHost([this](const std::string& key) { return explainedHost_->entitlements[key]; })
                                     : p.allowForClient(*client_);
        if (reason) {
            logged.push_back(
                log::formatText("client %d cannot use plugin %@: %@", client_->pid(), p.uuid(), *reason));
            return "not allowed: " + *reason;
        }
    }
    return std::nullopt;
}

std::shared_ptr<const MatchAnswer> Transaction::walkForMatch(const Value& rules, uint64_t flags, bool explain,
                                                          const MatchInputs& inputs, const MatchHolds& holds) {
    auto answer = std::make_shared<MatchAnswer>();
    std::vector<AXDPlugInPtr> candidates = server().findPlugIns(rules);
    answer->raw = static_cast<unsigned>(candidates.size());
    AXD_TRACE(discover__raw, answer->raw);

    AXDMatchResults::Outcomes outcomes;  // explain only
    AXDMatchResults::Outcomes* outcome = explain ? &outcomes : nullptr;
    AXDMatchResults results(flags, candidates.size());
    for (const auto& p : candidates) {
        if (auto refusal = matchRefusal(*p, rules, flags, inputs.exclusions, holds, answer->logged, explain)) {
            if (outcome) outcomes[p.get()] = *refusal;
            continue;
        }
        auto encoded = p->encodedForm();
        if (!encoded) {
            answer->exportErrors.push_back(log::formatText("failed to export matching plug-in %@: %@",
                                                           p->uuid()->string(), encoded.error()));
            if (outcome) outcomes[p.get()] = "cannot be exported: " + encoded.error().description();
            continue;
        }
        if (!results.admit(*p, outcome)) continue;
        results.append(*p, *encoded);
        if (outcome) outcomes[p.get()] = "returned";
    }
    std::vector<AXDMatchResults::Entry*> chosen = results.finish(answer->overrides);
    answer->returned = static_cast<unsigned>(chosen.size());
    // The annotations of the forms that stay, all in one visit to the database.
    std::vector<const AXDPlugIn*> chosenPlugIns;
    chosenPlugIns.reserve(chosen.size());
    for (const auto& entry : chosen) chosenPlugIns.push_back(entry->plugIn);
    std::vector<Value> annotations = server().annotationsForPlugIns(chosenPlugIns);
    for (Value& annotation : annotations)
        if (annotation.isNull()) annotation = Value(Dictionary{});
    if (version() == kCurrentProtocolVersion) answer->matches = encodeMatches(chosen, annotations);
    if (explain) answer->explanations = explainAll(candidates, outcomes, rules, flags, inputs, holds);
    return answer;
}

Value Transaction::explainAll(const std::vector<AXDPlugInPtr>& candidates, AXDMatchResults::Outcomes& outcomes,
                              const Value& rules, uint64_t flags, const MatchInputs& inputs, const MatchHolds& holds) {
    // Every installed plug-in is explained, in the registry's order, to a client with the manager
    // entitlement; to any other, only the plug-ins it could be returned (those its visibility and
    // authorization let it see), so that an explanation names nothing the host may not see. One the
    // registry's query did not give (only its election filter drops what the rules would take) says
    // why: the step that refuses it, else the election filter.
    bool everything = client_->hasEntitlement(keys::kManagerEntitlement);
    std::vector<AXDPlugInPtr> installed = server().findPlugIns(Value());
    std::unordered_set<const AXDPlugIn*> given;
    for (const auto& p : candidates) given.insert(p.get());
    std::vector<std::string> unlogged;
    Array explanations;
    explanations.reserve(installed.size());
    for (const auto& p : installed) {
        // (What the host may see, whatever it asked for: system only or not.)
        if (!everything && matchRefusal(*p, Value(), flags & ~discovery::kSystemOnly, {}, holds, unlogged, false)) continue;
        std::string outcome;
        if (given.count(p.get())) {
            outcome = outcomes[p.get()];
        } else if (auto refusal = matchRefusal(*p, rules, flags, inputs.exclusions, holds, unlogged, true)) {
            outcome = *refusal;
        } else {
            outcome = "left out by the election filter: its election reads as " + server().electionText(*p);
        }
        explanations.push_back(corvane::dict({{"uuid", p->uuid()->string()},
                                              {"identifier", p->identifier().value_or("")},
                                              {"path", p->path()},
                                              {"outcome", std::move(outcome)}}));
    }
    return Value(std::move(explanations));
}

bool Transaction::readExplainedHost(bool explain) {
    const Value& entry = request()[message::kHost];
    if (entry.isNull()) return true;
    // Another application's view names what it may see: only for a manager, and only explained.
    if (!explain || !client_->hasEntitlement(keys::kManagerEntitlement)) {
        failMessage(AXErrorCode::NotEntitled, "unauthorized discovery key (host)");
        return false;
    }
    const std::string* path = entry.asString();
    if (!path || path->empty() || path->front() != '/' || path->size() > 4096) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (host: not an absolute path)");
        return false;
    }
    auto application = server().workspace().applicationForPath(*path);
    if (!application) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (host: no registered application there)");
        return false;
    }
    explainedHost_ = ExplainedHost{AXBundle::initWithPath(application->bundlePath()),
                                   corvane::codesign::entitlementsOfBundle(application->bundlePath())};
    return true;
}

void Transaction::matchPlugIns() {
    using namespace discovery;
    const Value& rulesEntry = request()[message::kRules];
    if (!rulesEntry.isNull() && !rulesEntry.isDictionary()) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (bad rules dictionary)");
        return;
    }
    if (const auto* encoded = rulesEntry.encoding(); encoded && encoded->bytes.size() > kMaxRulesBytes) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (rules: more than " +
                                                     std::to_string(kMaxRulesBytes / 1024) + " KiB)");
        return;
    }
    Value rules = rulesEntry.isNull() ? Value() : convertMessageToValue(rulesEntry);
    if (auto beyond = rulesBeyondBounds(rules)) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (rules: " + *beyond + ")");
        return;
    }
    uint64_t flags = flagsArgument();
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
    if (!readExplainedHost(explain)) return;
    MatchInputs inputs = currentMatchInputs(server());
    // Empty rules are no rules.
    if (const Dictionary* tests = rules.asDictionary(); tests && tests->empty()) rules = Value();
    // An explanation is not kept: it is asked rarely, and it is as long as the registry. Nor is
    // the answer to rules that came encoded (at least half a kilobyte in a large frame): its key
    // would keep the whole request's bytes.
    bool keepable = !explain && !rulesEntry.encoding();
    KeptAnswers::Key key{client_, rules, flags, version()};
    auto answer = keepable ? keptAnswers().find(key, inputs) : nullptr;
    bool walked = false;
    if (!answer) {
        answer = walkForMatch(rules, flags, explain, inputs, server().heldPlugIns());
        walked = true;
        if (keepable) keptAnswers().keep(std::move(key), inputs, answer);
    } else {
        AXD_TRACE(discover__raw, answer->raw);
    }
    for (const auto& line : answer->logged) log::debug(logOps(), "%{public}s", line);
    for (const auto& line : answer->exportErrors) log::error(logOps(), "%{public}s", line);
    for (const auto& [overrider, overridden] : answer->overrides)
        log::info(logOps(), "plug-in %{public}@ overrides %{public}@", overrider, overridden);
    log::info(logOps(), "match returned %u plug-ins", answer->returned);
    // What the reply conversion gives for this request's version: nothing but at the current one.
    if (version() == kCurrentProtocolVersion) reply()[message::kMatches] = answer->matches;
    if (explain) reply()["explanations"] = answer->explanations;
    log::debug(logOps(), "reply marshalled");
    done();
    // What the walk used is given back once the reply is on its way, not before.
    if (walked) giveBackMemoryAfter(answer->raw);
}

}  // namespace annexa
