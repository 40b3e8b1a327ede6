// axbench registry: generates plug-in bundles in a private platform root, registers them, and times
// lookups by UUID, by path, and a query answering 10 plug-ins among all of them.

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "bench/Bench.h"
#include "bench/SyncCounter.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Vantry.h"

using namespace corvane;

namespace {

constexpr int kPerApp = 100;

int runRegistry(int argc, char** argv) {
    int plugins = 10000;
    for (int i = 1; i + 1 < argc; ++i)
        if (std::strcmp(argv[i], "--plugins") == 0) plugins = std::max(kPerApp, std::atoi(argv[i + 1]));
    bool busy = axbench::hasFlag(argc, argv, "--busy");
    char tmpl[] = "/tmp/axbench-registry.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);  // bundles without executables: no log line per plug-in

    // Each extension point name is served by exactly 10 plug-ins.
    int points = plugins / 10;
    std::vector<std::string> apps;
    for (int a = 0; a * kPerApp < plugins; ++a) {
        std::string app = root + "/Apps/App" + std::to_string(a) + ".app";
        std::filesystem::create_directories(app + "/PlugIns");
        (void)plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.app" + std::to_string(a)},
                                                             {"KFBundleExecutable", "app"}}));
        for (int p = 0; p < kPerApp && a * kPerApp + p < plugins; ++p) {
            int n = a * kPerApp + p;
            std::string dir = app + "/PlugIns/P" + std::to_string(p) + ".appex";
            std::filesystem::create_directories(dir);
            Value attrs = dict({{"KSExtensionPointName", "point" + std::to_string(n % points)},
                                {"KSExtensionVersion", "1.0"}});
            (void)plist::writeXMLFile(dir + "/Info.plist",
                                dict({{"KFBundleIdentifier", "com.bench.plugin" + std::to_string(n)},
                                      {"KFBundleExecutable", "plugin"},
                                      {"KFBundleVersion", "1"},
                                      {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                            {"KSExtensionAttributes", attrs}})}}));
        }
        apps.push_back(app);
    }

    // Every sync of the registration, the writer's closing checkpoint included, per transaction
    // (one registerBundle is one).
    bool counting = axbench::countSqliteSyncs();
    auto opened = vantry::Registry::open(vantry::Registry::defaultPath());
    if (!opened) {
        std::fprintf(stderr, "axbench registry: %s\n", opened.error().description().c_str());
        return 1;
    }
    axbench::pinTo(0);
    axbench::BusyCore load(busy);
    auto syncsBefore = axbench::sqliteSyncs();
    auto start = std::chrono::steady_clock::now();
    for (const auto& app : apps) {
        if (corvane::Status registered = (*opened)->registerBundle(app); !registered.ok()) {
            std::fprintf(stderr, "axbench registry: %s\n", registered.error().description().c_str());
            return 1;
        }
    }
    double registerSeconds = axbench::microsSince(start) / 1e6;
    auto megabytes = [](const std::string& path) {
        std::error_code error;
        auto size = std::filesystem::file_size(path, error);
        return error ? 0.0 : static_cast<double>(size) / 1e6;
    };
    // The write-ahead log as the writer leaves it while open, then what stays on disk once the
    // writer is gone (its last connection puts the log into the database and removes it).
    double walMB = megabytes(vantry::Registry::defaultPath() + "-wal");
    opened->reset();
    auto syncsAfter = axbench::sqliteSyncs();
    auto perTransaction = [&](uint64_t after, uint64_t before) {
        return counting ? static_cast<double>(after - before) / static_cast<double>(apps.size()) : -1.0;
    };
    double syncsPerTransaction = perTransaction(syncsAfter.total(), syncsBefore.total());
    double logSyncsPerTransaction = perTransaction(syncsAfter.log, syncsBefore.log);
    opened = vantry::Registry::open(vantry::Registry::defaultPath());
    if (!opened) return 1;
    auto& registry = **opened;
    std::string database = vantry::Registry::defaultPath();
    double databaseMB = megabytes(database) + megabytes(database + "-wal");

    auto all = registry.installedPlugIns();
    registry.dropCaches();
    // Lookups of distinct plug-ins, so that every answer comes from the database.
    std::vector<double> byUUID;
    std::vector<double> byPath;
    size_t step = std::max<size_t>(1, all.size() / 1000);
    for (size_t i = 0; i < all.size(); i += step) {
        auto t = std::chrono::steady_clock::now();
        auto r = registry.plugInForUUID(all[i]->uuid());
        byUUID.push_back(axbench::microsSince(t));
        if (!r) return 1;
    }
    registry.dropCaches();
    for (size_t i = 0; i < all.size(); i += step) {
        auto t = std::chrono::steady_clock::now();
        auto r = registry.plugInForPath(all[i]->bundlePath());
        byPath.push_back(axbench::microsSince(t));
        if (!r) return 1;
    }
    registry.dropCaches();
    std::vector<double> query10;
    for (int q = 0; q < std::min(points, 200); ++q) {
        auto t = std::chrono::steady_clock::now();
        auto found = registry.query(dict({{"KSExtensionPointName", "point" + std::to_string(q)}}), nullptr);
        query10.push_back(axbench::microsSince(t));
        if (found.size() != 10) {
            std::fprintf(stderr, "axbench registry: query found %zu\n", found.size());
            return 1;
        }
    }
    std::filesystem::remove_all(root);

    double uuidP50 = axbench::percentile(byUUID, 50);
    double pathP50 = axbench::percentile(byPath, 50);
    double queryP50 = axbench::percentile(query10, 50);
    std::printf("registered %zu plug-ins in %zu applications: %.2f s\n", all.size(), apps.size(), registerSeconds);
    std::printf("database on disk: %.1f MB (the write-ahead log, while the writer was open: %.1f MB)\n", databaseMB,
                walMB);
    std::printf(
        "syncs per transaction (%zu transactions, the writer's closing checkpoint included): %.2f, of "
        "which of the write-ahead log %.2f\n",
        apps.size(), syncsPerTransaction, logSyncsPerTransaction);
    std::printf("lookup by UUID (uncached): p50 %.1f us; by path: p50 %.1f us\n", uuidP50, pathP50);
    std::printf("query for one extension point (10 answers, uncached): p50 %.1f us\n", queryP50);
    std::printf("RESULT registry n=%zu busy=%d register_s=%.2f db_mb=%.1f wal_mb=%.1f uuid_us=%.1f path_us=%.1f "
                "query10_us=%.1f fsyncs_per_txn=%.2f\n",
                all.size(), busy ? 1 : 0, registerSeconds, databaseMB, walMB, uuidP50, pathP50, queryP50,
                syncsPerTransaction);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("registry", "registration and lookups of N generated plug-ins (--plugins N)", runRegistry);
