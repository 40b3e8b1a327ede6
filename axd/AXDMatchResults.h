// The forms a "match" chooses, as its candidates come in the database's order: registrations of one
// identifier collapse to one answer (or to one per version, by the flags), and plug-ins that
// declare they replace another identifier mark the forms of that identifier and are marked back.
//
// A chosen form that a later registration displaces leaves the answer but not the walk's memory:
// every entry stays in one list that only grows, and the per-identifier chains and the override
// table name entries by their place in it. So a replacement declared by a form that was displaced
// afterwards still names it (its UUID), and the mark it would get is written on an entry that no
// answer shows.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "axd/AXDPlugIn.h"

namespace annexa {

// Lives on: the thread of the one request that walks.
class AXDMatchResults {
public:
    struct Entry {
        const AXDPlugIn* plugIn;  // owned by the walk's candidates, which outlive the results
        AXDPlugIn::EncodedFormPtr form;
        std::optional<std::string> overrider;   // the replacing plug-in's UUID text
        std::optional<std::string> overriding;  // the identifier this plug-in replaces
        bool displaced = false;
        uint32_t nextChosen = kNone;  // the next chosen entry of the same identifier
        std::string_view identifier() const { return plugIn->walkFacts().identifier; }
    };
    // Why a plug-in was left out or kept, by plug-in; filled only when the walk explains.
    using Outcomes = std::map<const AXDPlugIn*, std::string>;

    AXDMatchResults(uint64_t flags, size_t expected);

    // Collapsing: whether `plugIn` goes on, against the forms of its identifier chosen so far. A form
    // it displaces leaves the answer (its outcome says in favour of which); when it loses, its own
    // outcome says so.
    bool admit(const AXDPlugIn& plugIn, Outcomes* outcomes);
    // Appends the plug-in's form, and takes its replacement declaration (the replace-plugin
    // entitlement, a string or an array of them) into the override table; a later declaration of
    // the same identifier takes the entry over.
    void append(const AXDPlugIn& plugIn, AXDPlugIn::EncodedFormPtr form);
    // The chosen forms in answer order, with the replacement marks set; `overrides` gets (overrider
    // UUID, overridden UUID) for each form marked, for the log.
    // The entries live as long as the results.
    std::vector<Entry*> finish(std::vector<std::pair<std::string, std::string>>& overrides);

private:
    static constexpr uint32_t kNone = UINT32_MAX;
    // The chosen entries of one identifier, in answer order: `head` begins the chain through
    // Entry::nextChosen (kNone when every entry was displaced), and `named` is an entry of the
    // identifier, which says what the slot's key is.
    struct Chain {
        uint32_t hash = 0, named = kNone, head = kNone;
    };
    // The head of an identifier's chain. When it has none: null, or with `naming` (an entry of
    // the identifier) a new empty chain.
    uint32_t* chainOf(std::string_view identifier, uint32_t naming = kNone);
    void growChains();

    const uint64_t flags_;
    // Every appended entry; displaced ones are skipped at the end. The keys below are views of
    // the plug-ins' own walk facts, which outlive the results as the plug-ins do.
    std::vector<Entry> order_;
    // Identifier -> chain, by open addressing in a table at most half full: a walk of thousands
    // of plug-ins makes no allocation per identifier.
    std::vector<Chain> chains_;
    size_t chainCount_ = 0;
    std::unordered_map<std::string_view, uint32_t> overrides_;  // replaced identifier -> replacing entry
};

}  // namespace annexa
