// The daemon's preference domain "com.corvane.annexa.userprefs": the user's global exclusions,
// pattern dictionaries naming plug-ins that discovery never returns. An edit by another process
// takes effect with the next request (the preference store notices changed files); the daemon never
// writes the domain.
#pragma once

#include <vector>

#include "Annexa/AXUtilities.h"
#include "platform/prefs/Prefs.h"

namespace annexa {

// Thread-safe: holds nothing but its search list.
class AXDUserPrefs : public corvane::prefs::UserDefaults {
public:
    static constexpr const char* kDomain = "com.corvane.annexa.userprefs";
    static constexpr const char* kExclusionsKey = "exclusions";

    AXDUserPrefs();

    // The stored value of "exclusions", as stored (null when not set).
    Value exclusions() const;
    // The exclusions that are pattern dictionaries: a value of another shape counts as no
    // exclusions, an element that is no dictionary as no exclusion.
    std::vector<Value> exclusionPatterns() const;
};

}  // namespace annexa
