// The forms a "match" chooses, as its candidates come in the database's order: registrations of one
// identifier collapse to one answer (or to one per version, by the flags), and plug-ins that
// declare they replace another identifier mark the forms of that identifier and are marked back.
//
// A chosen form that a later registration displaces leaves the answer but not the walk's memory:
// every form is owned by a shared entry, and the list, the per-identifier index and the override
// table each hold entries, never positions in a container. So a replacement declared by a form that
// was displaced afterwards still names it (its UUID), and the mark it would get is written on an
// entry that no answer shows.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
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
        std::string identifier;
        std::optional<std::string> overrider;   // the replacing plug-in's UUID text
        std::optional<std::string> overriding;  // the identifier this plug-in replaces
        bool displaced = false;
    };
    using EntryPtr = std::shared_ptr<Entry>;
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
    std::vector<EntryPtr> finish(std::vector<std::pair<std::string, std::string>>& overrides);

private:
    const uint64_t flags_;
    std::vector<EntryPtr> order_;  // every appended entry; displaced ones are skipped at the end
    std::unordered_map<std::string, std::vector<EntryPtr>> byIdentifier_;  // chosen, in answer order
    std::unordered_map<std::string, EntryPtr> overrides_;  // replaced identifier -> replacing form
};

}  // namespace annexa
