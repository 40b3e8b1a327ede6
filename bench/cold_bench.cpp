// axbench cold: from starting axd to the first answer with every plug-in, read completely by a
// client (every form decoded), beside a host's own warm scan of the same Info.plists, at 1,000
// plug-ins and at N; the cost per plug-in at N against that at 1,000 says whether the cold start
// grows faster than the registry.
#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXProtocol.h"
#include "bench/Bench.h"
#include "bench/Corpus.h"
#include "platform/rpx/Rpx.h"

using namespace corvane;

namespace {

struct ColdFigures {
    double coldMs = 0, scanMs = 0;
    // Parts of coldMs: until the reply had arrived whole, the client's decoding of it, and the
    // client's freeing of what it decoded.
    double replyMs = 0, decodeMs = 0, freeMs = 0;
    size_t forms = 0, scanned = 0;
};

// Three cold starts and three warm scans of one corpus of `plugins`; medians. With `busy`, the
// other core spins throughout the measurements (not while the corpus is made).
bool measure(int plugins, const std::string& bin, bool busy, ColdFigures& out) {
    char tmpl[] = "/tmp/axbench-cold.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    axbench::Corpus corpus;
    if (!axbench::makeCorpus(root, plugins, corpus)) return false;
    std::string annotationFile = root + "/Annotations";
    (void)plist::writeXMLFile(annotationFile, dict({{"version", 16}, {"data", Value(corpus.annotations)}}));
    std::string endpoint = rpx::endpointPath(annexa::kDefaultServiceName);

    std::vector<double> cold, scan, replied, decoded, freed;
    axbench::BusyCore load(busy);
    for (int run = 0; run < 3; ++run) {
        auto start = std::chrono::steady_clock::now();
        axbench::pinTo(1);  // the daemon on the other core
        pid_t axd = axbench::startProgram({bin + "/axd", "-d", annotationFile});
        axbench::pinTo(0);
        if (!axd) return false;
        axbench::waitForSocket(endpoint);
        {
            annexa::AXDaemonClient client;
            auto reply = client.wait([&](auto done) { client.matchPlugIns(Value(), 0, done); });
            auto arrived = std::chrono::steady_clock::now();
            replied.push_back(axbench::microsSince(start) / 1000);
            const Array* forms = reply.value[annexa::message::kMatches].asArray();
            if (!reply.ok() || !forms) {
                kill(axd, SIGKILL);
                return false;
            }
            // Read completely: every form decoded, as a host that lists them does.
            for (const Value& form : *forms) (void)form["identifier"].asString(), (void)form["version"];
            out.forms = forms->size();
            decoded.push_back(axbench::microsSince(arrived) / 1000);
            auto read = std::chrono::steady_clock::now();
            reply = {};
            freed.push_back(axbench::microsSince(read) / 1000);
        }
        cold.push_back(axbench::microsSince(start) / 1000);
        kill(axd, SIGTERM);
        waitpid(axd, nullptr, 0);
        std::filesystem::remove(endpoint);
    }
    (void)axbench::hostScan(corpus);  // the page cache warm, as for the daemon's database
    for (int run = 0; run < 3; ++run) {
        auto start = std::chrono::steady_clock::now();
        out.scanned = axbench::hostScan(corpus);
        scan.push_back(axbench::microsSince(start) / 1000);
    }
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
    out.coldMs = axbench::percentile(cold, 50);
    out.scanMs = axbench::percentile(scan, 50);
    out.replyMs = axbench::percentile(replied, 50);
    out.decodeMs = axbench::percentile(decoded, 50);
    out.freeMs = axbench::percentile(freed, 50);
    return true;
}

int runCold(int argc, char** argv) {
    int plugins = 10000;
    for (int i = 1; i + 1 < argc; ++i)
        if (std::strcmp(argv[i], "--plugins") == 0) plugins = std::max(1000, std::atoi(argv[i + 1]));
    bool busy = axbench::hasFlag(argc, argv, "--busy");
    setenv("CORVANE_LOG", "error", 1);
    axbench::pinTo(0);
    std::string self = std::filesystem::read_symlink("/proc/self/exe");
    std::string bin = self.substr(0, self.rfind('/'));
    ColdFigures small, large;
    if (!measure(1000, bin, busy, small) || !measure(plugins, bin, busy, large)) {
        std::fprintf(stderr, "axbench cold: axd gave no answer with every plug-in\n");
        return 1;
    }
    double perSmall = small.coldMs * 1000 / 1000, perLarge = large.coldMs * 1000 / plugins;
    std::printf("at 1000: cold %.1f ms (%zu forms), host scan %.1f ms\n", small.coldMs, small.forms, small.scanMs);
    std::printf("at %d: cold %.1f ms (%zu forms): the reply whole after %.1f ms, the client's decoding %.1f ms, its "
                "freeing %.1f ms; host scan %.1f ms%s\n",
                plugins, large.coldMs, large.forms, large.replyMs, large.decodeMs, large.freeMs, large.scanMs,
                busy ? " (the other core busy)" : "");
    std::printf("RESULT cold n=%d busy=%d cold_ms=%.1f scan_ms=%.1f ratio=%.2f per_plugin_us=%.1f "
                "per_plugin_1000_us=%.1f growth=%.2f reply_ms=%.1f decode_ms=%.1f free_ms=%.1f\n",
                plugins, busy ? 1 : 0, large.coldMs, large.scanMs, large.coldMs / large.scanMs, perLarge, perSmall,
                perLarge / perSmall, large.replyMs, large.decodeMs, large.freeMs);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("cold", "axd's start to a complete first answer of every plug-in, against a host's own scan",
                    runCold);
