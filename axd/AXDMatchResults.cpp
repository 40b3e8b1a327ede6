#include "axd/AXDMatchResults.h"

#include <algorithm>

#include "Annexa/AXProtocol.h"

namespace annexa {

namespace {

std::string versionText(const AXDPlugIn& p) {
    Value version = p.version();
    const std::string* text = version.asString();
    return text ? *text : std::string();
}

}  // namespace

AXDMatchResults::AXDMatchResults(uint64_t flags, size_t expected) : flags_(flags) {
    order_.reserve(expected);
    byIdentifier_.reserve(expected);
}

// A chosen form says what its plug-in says: its "version", "systemResident", "lastmodified" and
// "uuid" are read from the plug-in.
bool AXDMatchResults::admit(const AXDPlugIn& p, Outcomes* outcomes) {
    using namespace discovery;
    auto same = byIdentifier_.find(p.identifier().value_or(""));
    if (same == byIdentifier_.end() || same->second.empty()) return true;
    std::vector<EntryPtr>& chosen = same->second;
    std::string pVersion = versionText(p);
    for (size_t i = 0; i < chosen.size(); ++i) {
        const AXDPlugIn& m = *chosen[i]->plugIn;
        Ordering order = compareVersionString(pVersion, versionText(m));
        bool newer = order == Ordering::Descending;
        bool equal = order == Ordering::Same;
        bool preferP = (p.onSystemVolume() && !m.onSystemVolume()) || p.lastModified() > m.lastModified();
        bool keepP;
        if (!(flags_ & kAllVersions)) {
            keepP = newer || (equal && preferP);
        } else if (equal && !(flags_ & kDuplicates)) {
            keepP = preferP;
        } else {
            continue;  // every version stays: look at the next form of the identifier
        }
        if (keepP) {
            if (outcomes) (*outcomes)[&m] = "collapsed in favour of " + p.uuid()->string();
            chosen[i]->displaced = true;
            chosen.erase(chosen.begin() + static_cast<std::ptrdiff_t>(i));
        } else if (outcomes) {
            (*outcomes)[&p] = "collapsed in favour of " + m.uuid()->string();
        }
        return keepP;
    }
    return true;
}

void AXDMatchResults::append(const AXDPlugIn& p, AXDPlugIn::EncodedFormPtr form) {
    auto entry = std::make_shared<Entry>(Entry{&p, std::move(form), p.identifier().value_or(""), {}, {}});
    order_.push_back(entry);
    byIdentifier_[entry->identifier].push_back(entry);
    Value replaces = p.valueForEntitlement(keys::kReplaceEntitlement);
    if (const std::string* one = replaces.asString()) {
        overrides_[*one] = entry;
    } else if (const Array* many = replaces.asArray()) {
        for (const Value& e : *many)
            if (const std::string* name = e.asString()) overrides_[*name] = entry;
    }
}

std::vector<AXDMatchResults::EntryPtr> AXDMatchResults::finish(
    std::vector<std::pair<std::string, std::string>>& overrides) {
    std::vector<EntryPtr> answer;
    answer.reserve(order_.size());
    for (auto& entry : order_)
        if (!entry->displaced) answer.push_back(entry);
    if (overrides_.empty()) return answer;
    for (auto& f : answer) {
        auto o = overrides_.find(f->identifier);
        if (o == overrides_.end()) continue;
        std::string overriderUuid = o->second->plugIn->uuid()->string();
        f->overrider = overriderUuid;
        // Written on the replacing form whether or not the answer still shows it.
        o->second->overriding = f->identifier;
        overrides.emplace_back(std::move(overriderUuid), f->plugIn->uuid()->string());
    }
    return answer;
}

}  // namespace annexa
