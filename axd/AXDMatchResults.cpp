#include "axd/AXDMatchResults.h"

#include "Annexa/AXProtocol.h"

namespace annexa {

AXDMatchResults::AXDMatchResults(uint64_t flags, size_t expected) : flags_(flags) {
    order_.reserve(expected);
    size_t slots = 16;
    while (slots < 2 * expected) slots *= 2;
    chains_.resize(slots);
}

uint32_t* AXDMatchResults::chainOf(std::string_view identifier, uint32_t naming) {
    auto hash = static_cast<uint32_t>(std::hash<std::string_view>{}(identifier));
    size_t mask = chains_.size() - 1;
    for (size_t i = hash & mask;; i = (i + 1) & mask) {
        Chain& slot = chains_[i];
        if (slot.named == kNone) {
            if (naming == kNone) return nullptr;
            slot = Chain{hash, naming, kNone};
            if (++chainCount_ * 2 <= chains_.size()) return &slot.head;
            growChains();
            return chainOf(identifier);
        }
        if (slot.hash == hash && order_[slot.named].identifier() == identifier) return &slot.head;
    }
}

void AXDMatchResults::growChains() {
    std::vector<Chain> old(chains_.size() * 2);
    old.swap(chains_);
    size_t mask = chains_.size() - 1;
    for (const Chain& chain : old) {
        if (chain.named == kNone) continue;
        size_t i = chain.hash & mask;
        while (chains_[i].named != kNone) i = (i + 1) & mask;
        chains_[i] = chain;
    }
}

// A chosen form says what its plug-in says: its "version", "systemResident", "lastmodified" and
// "uuid" are read from the plug-in.
bool AXDMatchResults::admit(const AXDPlugIn& p, Outcomes* outcomes) {
    using namespace discovery;
    const AXDPlugIn::WalkFacts& facts = p.walkFacts();
    uint32_t* head = chainOf(facts.identifier);
    if (!head) return true;
    // Walks the identifier's chain; `link` is what points at the entry looked at.
    for (uint32_t* link = head; *link != kNone; link = &order_[*link].nextChosen) {
        Entry& chosen = order_[*link];
        const AXDPlugIn& m = *chosen.plugIn;
        Ordering order = compareVersionString(facts.version, m.walkFacts().version);
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
            chosen.displaced = true;
            *link = chosen.nextChosen;
        } else if (outcomes) {
            (*outcomes)[&p] = "collapsed in favour of " + m.uuid()->string();
        }
        return keepP;
    }
    return true;
}

void AXDMatchResults::append(const AXDPlugIn& p, AXDPlugIn::EncodedFormPtr form) {
    auto index = static_cast<uint32_t>(order_.size());
    order_.push_back(Entry{&p, std::move(form), {}, {}, false, kNone});
    const AXDPlugIn::WalkFacts& facts = p.walkFacts();
    uint32_t* link = chainOf(facts.identifier, index);
    while (*link != kNone) link = &order_[*link].nextChosen;
    *link = index;
    // A later declaration of the same identifier takes the entry over.
    for (const std::string& name : facts.replaces) overrides_[name] = index;
}

std::vector<AXDMatchResults::Entry*> AXDMatchResults::finish(
    std::vector<std::pair<std::string, std::string>>& overrides) {
    std::vector<Entry*> answer;
    answer.reserve(order_.size());
    for (auto& entry : order_)
        if (!entry.displaced) answer.push_back(&entry);
    if (overrides_.empty()) return answer;
    for (Entry* f : answer) {
        auto o = overrides_.find(f->identifier());
        if (o == overrides_.end()) continue;
        Entry& replacing = order_[o->second];
        std::string overriderUuid = replacing.plugIn->uuid()->string();
        f->overrider = overriderUuid;
        // Written on the replacing form whether or not the answer still shows it.
        replacing.overriding = std::string(f->identifier());
        overrides.emplace_back(std::move(overriderUuid), f->plugIn->uuid()->string());
    }
    return answer;
}

}  // namespace annexa
