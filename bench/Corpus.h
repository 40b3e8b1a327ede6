// The plug-ins the discovery benchmarks measure, generated under a private platform root: N
// plug-ins, 100 to an application; every extension point name served by 10 of them; one in ten
// elected; every 50th shares its identifier with the one before, at a higher version.
#pragma once

#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "Annexa/AXUtilities.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Vantry.h"

namespace axbench {

struct Corpus {
    std::vector<std::string> apps, plugInPaths;
    corvane::Dictionary annotations;  // identifier -> annotation, as axd's annotation file keeps them
    int points = 0;                   // extension point names "point0"...
};

// Writes the bundles under `root` (CORVANE_ROOT must name it) and registers them.
inline bool makeCorpus(const std::string& root, int plugins, Corpus& corpus) {
    constexpr int kPerApp = 100;
    using corvane::dict;
    using corvane::Value;
    corpus.points = std::max(1, plugins / 10);
    for (int a = 0; a * kPerApp < plugins; ++a) {
        std::string app = root + "/Apps/App" + std::to_string(a) + ".app";
        std::filesystem::create_directories(app + "/PlugIns");
        (void)corvane::plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.app" + std::to_string(a)}}));
        for (int p = 0; p < kPerApp && a * kPerApp + p < plugins; ++p) {
            int n = a * kPerApp + p;
            bool twin = n % 50 == 1;
            std::string identifier = "com.bench.plugin" + std::to_string(twin ? n - 1 : n);
            std::string dir = app + "/PlugIns/P" + std::to_string(p) + ".appex";
            std::filesystem::create_directories(dir);
            Value attrs = dict({{"KSExtensionPointName", "point" + std::to_string(n % corpus.points)},
                                {"KSExtensionVersion", twin ? "2.0" : "1.0"}});
            (void)corvane::plist::writeXMLFile(dir + "/Info.plist",
                                               dict({{"KFBundleIdentifier", identifier},
                                                     {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                                           {"KSExtensionProtocol", "#Data"},
                                                                           {"KSExtensionAttributes", attrs}})}}));
            corpus.plugInPaths.push_back(dir);
            if (n % 10 == 0) corpus.annotations[identifier] = dict({{"election", 1}});
        }
        corpus.apps.push_back(app);
    }
    auto registry = corvane::vantry::Registry::open(corvane::vantry::Registry::defaultPath());
    if (!registry) return false;
    for (const auto& app : corpus.apps)
        if (!(*registry)->registerBundle(app).ok()) return false;
    return true;
}

// What a host spends finding the plug-ins itself: reads every Info.plist and keeps the highest
// version of each identifier. Returns how many it found.
inline size_t hostScan(const Corpus& corpus) {
    std::map<std::string, std::string> best;  // identifier -> highest version
    for (const auto& dir : corpus.plugInPaths) {
        auto info = corvane::plist::readFile(dir + "/Info.plist");
        if (!info) continue;
        const std::string* id = (*info)["KFBundleIdentifier"].asString();
        const std::string* version = (*info)["KSExtension"]["KSExtensionAttributes"]["KSExtensionVersion"].asString();
        if (!id || !version) continue;
        auto it = best.find(*id);
        if (it == best.end() || annexa::compareVersionString(*version, it->second) == annexa::Ordering::Descending)
            best[*id] = *version;
    }
    return best.size();
}

}  // namespace axbench
