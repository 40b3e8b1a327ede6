#include "axd/AXDUserPrefs.h"

namespace annexa {

AXDUserPrefs::AXDUserPrefs() { addSuite(kDomain); }

Value AXDUserPrefs::exclusions() const {
    (void)corvane::prefs::synchronize(kDomain);
    return corvane::prefs::copyValue(kExclusionsKey, kDomain);
}

std::vector<Value> AXDUserPrefs::exclusionPatterns() const {
    std::vector<Value> patterns;
    Value stored = exclusions();
    if (const Array* list = stored.asArray()) {
        for (const Value& element : *list)
            if (element.isDictionary()) patterns.push_back(element);
    }
    return patterns;
}

}  // namespace annexa
