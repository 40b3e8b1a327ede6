// The pattern language of discovery rules, exclusions and host restrictions, evaluated against one
// daemon plug-in record.
#include <string_view>

#include "axd/AXDPlugIn.h"
#include "axd/AXDServer.h"
#include "platform/types/Types.h"

namespace annexa {

namespace log = corvane::log;

namespace {

constexpr std::string_view kEntitlementPrefix = "ENTITLEMENT:";
constexpr std::string_view kConformsOperator = "?TY-CONFORMS:";
constexpr std::string_view kIsOperator = "?TY-IS:";

bool startsWith(std::string_view s, std::string_view prefix) { return s.substr(0, prefix.size()) == prefix; }

// A comparison operator: its prefix, the ordering it expects, and whether the answer is negated.
struct Comparison {
    std::string_view prefix;
    Ordering expected;
    bool negate;
};
// Tried in this order: the first prefix that fits wins, so "<=" is never read as "<".
constexpr Comparison kComparisons[] = {
    {"<>", Ordering::Same, true},      {"<=", Ordering::Descending, true}, {">=", Ordering::Ascending, true},
    {"=", Ordering::Same, false},      {"<", Ordering::Ascending, false},  {">", Ordering::Descending, false},
};

// The user's election as the pattern language reads it: the annotation's "election" as an integer
// (0 without one), bits 8 to 15 cleared, as decimal text.
std::string electionText(const AXDPlugIn& plugIn) {
    AXDServer* server = AXDServer::server();
    Value annotation = server ? server->annotationForPlugIn(plugIn) : Value();
    int64_t election = integerValueOf(annotation[keys::kElection]);
    election &= ~int64_t{0xff00};
    return std::to_string(election);
}

}  // namespace

bool AXDPlugIn::match(const Value& patterns) const {
    if (patterns.isNull()) return true;
    const Dictionary* tests = patterns.asDictionary();
    if (!tests) return false;
    for (const auto& [key, pattern] : *tests)
        if (!matchKeyPattern(key, pattern)) return false;
    return true;
}

bool AXDPlugIn::matchKeyPattern(const std::string& key, const Value& pattern) const {
    // The subject.
    Value subject;
    bool found = false;
    if (startsWith(key, kEntitlementPrefix)) {
        subject = valueForEntitlement(key.substr(kEntitlementPrefix.size()));
        found = true;  // nothing else is consulted for such a key
    } else if (key == keys::kExtensionIdentifier) {
        if (auto id = identifier()) {
            subject = Value(*id);
            found = true;
        }
    } else if (key == "com.corvane.uuid") {
        if (auto id = uuid()) {
            subject = Value(id->string());
            found = true;
        }
    } else if (key == "KSUserElection") {
        subject = Value(electionText(*this));
        found = true;
    } else if (key == "KSExtensionContainingApp") {
        auto containing = containingPath();
        if (!containing) return false;  // whatever the pattern, also false
        subject = Value(*containing);
        found = true;
    }
    if (!found) {
        subject = attribute(key);
        if (subject.isNull()) subject = infoKey(key);
    }

    // The test.
    if (pattern.isTrue()) return !subject.isNull() && !subject.isFalse();
    if (pattern.isFalse()) return subject.isNull() || subject.isFalse();
    if (subject.isNull()) return false;
    if (pattern.isDictionary()) return matchDictionaryPattern(subject, pattern);
    if (const std::string* text = subject.asString()) return matchValuePatterns(*text, pattern);
    if (const Array* elements = subject.asArray()) {
        for (const Value& e : *elements) {
            const std::string* text = e.asString();
            if (text && matchValuePatterns(*text, pattern)) return true;
        }
        return false;
    }
    return false;
}

bool AXDPlugIn::matchValuePatterns(const std::string& subject, const Value& patterns) const {
    if (const std::string* one = patterns.asString()) return matchValuePattern(subject, *one);
    if (const Array* many = patterns.asArray()) {
        for (const Value& p : *many) {
            const std::string* text = p.asString();
            if (text && matchValuePattern(subject, *text)) return true;
        }
    }
    return false;
}

bool AXDPlugIn::matchValuePattern(const std::string& subject, const std::string& pattern) const {
    if (startsWith(pattern, "?")) {
        if (startsWith(pattern, kConformsOperator))
            return corvane::types::typeConformsTo(subject, std::string_view(pattern).substr(kConformsOperator.size()));
        if (startsWith(pattern, kIsOperator))
            return corvane::types::typeConformsTo(std::string_view(pattern).substr(kIsOperator.size()), subject);
        log::info(logOps(), "unrecognized match operator:%@", pattern);
        return false;
    }
    // The operand is taken exactly as written, blanks and all; it may be empty.
    Comparison comparison{"", Ordering::Same, false};
    for (const auto& c : kComparisons) {
        if (startsWith(pattern, c.prefix)) {
            comparison = c;
            break;
        }
    }
    std::string_view operand = std::string_view(pattern).substr(comparison.prefix.size());
    bool expected = compareVersionString(subject, operand) == comparison.expected;
    return expected != comparison.negate;
}

bool AXDPlugIn::matchDictionaryPattern(const Value& subject, const Value& pattern) const {
    log::debug(logExtension(), "evaluating KSExtension filter: %@ value: %@", pattern, subject);
    return corvane::types::activationRuleMatches(subject, pattern);
}

}  // namespace annexa
