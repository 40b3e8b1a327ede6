// The walk's collapsing and replacement marks against a plain computation of the same rules, over
// thousands of random small registries: several versions of a few identifiers, on the system
// volume or not, registered at nearly the same second, some declaring that they replace others
// (their own identifier, an absent one, several at once), some held.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <map>
#include <random>
#include <set>

#include "Annexa/AXProtocol.h"
#include "axd/AXDMatchResults.h"

using annexa::AXDMatchResults;
using annexa::AXDPlugIn;
using annexa::AXDPlugInPtr;
using annexa::Dictionary;
using annexa::Value;
using corvane::dict;
namespace discovery = annexa::discovery;
namespace vantry = corvane::vantry;

namespace {

// One registration as the test draws it.
struct Drawn {
    std::string uuid, identifier, version;
    bool system = false;
    int64_t registered = 0;
    std::vector<std::string> replaces;  // what its replace-plugin entitlement names
    bool asArray = false;               // the entitlement is an array (with a number among the names)
    bool held = false;
};

AXDPlugInPtr plugInOf(const Drawn& d) {
    Dictionary entitlements;
    if (!d.replaces.empty()) {
        if (d.asArray) {
            corvane::Array names{Value(7)};
            for (const auto& r : d.replaces) names.push_back(Value(r));
            entitlements.emplace("com.corvane.developer.replace-plugin", Value(std::move(names)));
        } else {
            entitlements.emplace("com.corvane.developer.replace-plugin", Value(d.replaces.front()));
        }
    }
    Dictionary record{
        {"uuid", d.uuid},
        {"path", "/Apps/A" + d.uuid.substr(0, 8) + ".app/PlugIns/P.appex"},
        {"identifier", d.identifier},
        {"bundleIdentifier", d.identifier},
        {"version", d.version},
        {"plugin", dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", d.version}})}})},
        {"info", dict({{"KSExtension", dict({})}})},
        {"entitlements", Value(std::move(entitlements))},
        {"registered", Value(corvane::Date{d.registered * 1000000})},
        {"system", d.system},
        {"container", "/containers/" + d.uuid},
        {"application", dict({{"path", "/Apps/A" + d.uuid.substr(0, 8) + ".app"}, {"identifier", "com.example.app"}})},
    };
    return AXDPlugIn::fromRegistryRecord(vantry::PlugInRecord::deserialize(Value(std::move(record)), nullptr));
}

std::vector<Drawn> drawRegistry(std::mt19937& random) {
    const char* identifiers[] = {"a", "b", "c"};
    const char* versions[] = {"1", "1.0", "1.9", "1.10", "2"};
    auto pick = [&](int n) { return static_cast<int>(random() % static_cast<unsigned>(n)); };
    std::vector<Drawn> registry(static_cast<size_t>(1 + pick(9)));
    for (auto& d : registry) {
        d.uuid = corvane::UUID::random().string();
        d.identifier = identifiers[pick(3)];
        d.version = versions[pick(5)];
        d.system = pick(3) == 0;
        d.registered = 100 + pick(3);
        d.held = pick(6) == 0;
        int declares = pick(4);  // mostly none
        for (int i = 0; i < declares - 1; ++i) d.replaces.push_back(i == 1 ? "z" : identifiers[pick(3)]);
        d.asArray = d.replaces.size() > 1 || (!d.replaces.empty() && pick(2) == 0);
    }
    return registry;
}

// The rules, written out plainly: a list walked in order, registrations compared as the daemon
// describes it, the override table naming candidates by their place in the registry.
struct Expected {
    std::vector<std::string> uuids;                  // in answer order
    std::map<std::string, std::string> overrider;    // uuid -> replacing uuid
    std::map<std::string, std::string> overriding;   // uuid -> identifier replaced
};

Expected reference(const std::vector<Drawn>& registry, uint64_t flags) {
    using annexa::Ordering;
    std::vector<size_t> result;
    std::map<std::string, size_t> table;
    for (size_t p = 0; p < registry.size(); ++p) {
        const Drawn& pd = registry[p];
        if (pd.held) continue;
        bool goesOn = true;
        for (size_t i = 0; i < result.size(); ++i) {
            const Drawn& md = registry[result[i]];
            if (md.identifier != pd.identifier) continue;
            Ordering order = annexa::compareVersionString(pd.version, md.version);
            bool preferP = (pd.system && !md.system) || pd.registered > md.registered;
            bool decided = false, keepP = false;
            if (!(flags & discovery::kAllVersions)) {
                decided = true;
                keepP = order == Ordering::Descending || (order == Ordering::Same && preferP);
            } else if (order == Ordering::Same && !(flags & discovery::kDuplicates)) {
                decided = true;
                keepP = preferP;
            }
            if (!decided) continue;
            if (keepP) {
                result.erase(result.begin() + static_cast<long>(i));
            } else {
                goesOn = false;
            }
            break;
        }
        if (!goesOn) continue;
        result.push_back(p);
        for (const auto& name : pd.replaces) table[name] = p;
    }
    Expected e;
    for (size_t f : result) {
        e.uuids.push_back(registry[f].uuid);
        auto o = table.find(registry[f].identifier);
        if (o == table.end()) continue;
        e.overrider[registry[f].uuid] = registry[o->second].uuid;
        if (std::find(result.begin(), result.end(), o->second) != result.end())
            e.overriding[registry[o->second].uuid] = registry[f].identifier;
    }
    return e;
}

}  // namespace

TEST(AXDMatchResults, RandomRegistriesCollapseAndMarkAsTheRulesSay) {
    const uint64_t flagChoices[] = {0, discovery::kAllVersions, discovery::kDuplicates,
                                    discovery::kAllVersions | discovery::kDuplicates};
    unsigned seed = 1;
    if (const char* s = std::getenv("AX_WALK_SEED")) seed = static_cast<unsigned>(std::strtoul(s, nullptr, 10));
    std::mt19937 random(seed);
    for (int round = 0; round < 4000; ++round) {
        std::vector<Drawn> registry = drawRegistry(random);
        uint64_t flags = flagChoices[random() % 4];
        std::vector<AXDPlugInPtr> candidates;
        for (const auto& d : registry) candidates.push_back(plugInOf(d));
        for (const auto& c : candidates) ASSERT_TRUE(c);

        AXDMatchResults results(flags, candidates.size());
        for (size_t i = 0; i < candidates.size(); ++i) {
            if (registry[i].held) continue;  // left out before the walk collapses
            if (results.admit(*candidates[i], nullptr)) results.append(*candidates[i], nullptr);
        }
        std::vector<std::pair<std::string, std::string>> logged;
        auto chosen = results.finish(logged);

        Expected got;
        for (const auto& entry : chosen) {
            std::string uuid = entry->plugIn->uuid()->string();
            got.uuids.push_back(uuid);
            if (entry->overrider) got.overrider[uuid] = *entry->overrider;
            if (entry->overriding) got.overriding[uuid] = *entry->overriding;
        }
        Expected expected = reference(registry, flags);
        std::string context = "seed " + std::to_string(seed) + " round " + std::to_string(round);
        ASSERT_EQ(got.uuids, expected.uuids) << context;
        ASSERT_EQ(got.overrider, expected.overrider) << context;
        ASSERT_EQ(got.overriding, expected.overriding) << context;
        ASSERT_EQ(logged.size(), got.overrider.size()) << context;

        // What every answer keeps, said directly.
        std::map<std::string, const Drawn*> byUuid;
        for (const auto& d : registry) byUuid[d.uuid] = &d;
        std::map<std::string, int> perIdentifier;
        for (const auto& uuid : got.uuids) {
            const Drawn& d = *byUuid[uuid];
            ++perIdentifier[d.identifier];
            if (flags & discovery::kAllVersions) continue;
            for (const auto& other : registry) {
                if (other.held || other.identifier != d.identifier) continue;
                ASSERT_NE(annexa::compareVersionString(other.version, d.version), annexa::Ordering::Descending)
                    << context << ": a higher version of " << d.identifier << " was left out";
            }
        }
        for (const auto& [identifier, n] : perIdentifier) {
            if (flags & discovery::kAllVersions) break;
            ASSERT_EQ(n, 1) << context << ": " << identifier;
        }
        for (const auto& [uuid, by] : got.overrider) {
            const auto& names = byUuid[by]->replaces;
            ASSERT_NE(std::find(names.begin(), names.end(), byUuid[uuid]->identifier), names.end())
                << context << ": " << by << " never declared it replaces " << byUuid[uuid]->identifier;
        }
        for (const auto& [uuid, identifier] : got.overriding) {
            const auto& names = byUuid[uuid]->replaces;
            ASSERT_NE(std::find(names.begin(), names.end(), identifier), names.end()) << context;
        }
    }
}

// X 1.0 declares it replaces Y; X 2.0 displaces it and declares nothing. Y is marked by the
// registration that declared the replacement, and X 2.0 carries no mark.
TEST(AXDMatchResults, AReplacementDeclaredByADisplacedFormStillNamesIt) {
    Drawn x1{corvane::UUID::random().string(), "com.example.x", "1.0", false, 100, {"com.example.y"}};
    Drawn x2{corvane::UUID::random().string(), "com.example.x", "2.0", false, 101, {}};
    Drawn y{corvane::UUID::random().string(), "com.example.y", "1.0", false, 100, {}};
    std::vector<AXDPlugInPtr> candidates{plugInOf(x1), plugInOf(x2), plugInOf(y)};
    AXDMatchResults results(0, 3);
    AXDMatchResults::Outcomes outcomes;
    for (const auto& c : candidates)
        if (results.admit(*c, &outcomes)) results.append(*c, nullptr);
    std::vector<std::pair<std::string, std::string>> logged;
    auto chosen = results.finish(logged);
    ASSERT_EQ(chosen.size(), 2u);
    EXPECT_EQ(chosen[0]->plugIn, candidates[1].get());
    EXPECT_FALSE(chosen[0]->overrider);
    EXPECT_FALSE(chosen[0]->overriding);
    EXPECT_EQ(chosen[1]->overrider, std::optional<std::string>(x1.uuid));
    EXPECT_EQ(outcomes[candidates[0].get()], "collapsed in favour of " + x2.uuid);
    EXPECT_EQ(logged, (std::vector<std::pair<std::string, std::string>>{{x1.uuid, y.uuid}}));
}

// Results told to expect fewer candidates than come grow their table as they fill: forty
// registrations of twenty identifiers, told none, collapse as forty expected ones do.
TEST(AXDMatchResults, MoreCandidatesThanExpectedCollapseTheSame) {
    std::vector<AXDPlugInPtr> candidates;
    std::vector<std::string> newer;
    for (int i = 0; i < 40; ++i) {
        Drawn d{corvane::UUID::random().string(), "com.example.p" + std::to_string(i % 20), i < 20 ? "1" : "2", false,
                100, {}};
        candidates.push_back(plugInOf(d));
        if (i >= 20) newer.push_back(d.uuid);
    }
    for (size_t expected : {size_t{0}, candidates.size()}) {
        AXDMatchResults results(0, expected);
        for (const auto& c : candidates)
            if (results.admit(*c, nullptr)) results.append(*c, nullptr);
        std::vector<std::pair<std::string, std::string>> logged;
        std::vector<std::string> got;
        for (const auto* entry : results.finish(logged)) got.push_back(entry->plugIn->uuid()->string());
        EXPECT_EQ(got, newer) << "expected " << expected;
    }
}
