// axbench match: discovery over N generated plug-ins through a real axd, beside what a host would
// spend finding the same plug-ins by reading their bundles itself, and beside a plain Unix-socket
// ping-pong of the same sizes between two processes pinned to different cores. With --busy, the
// daemon's core is kept busy by a spinning process during every measurement.
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXUtilities.h"
#include "bench/Bench.h"
#include "bench/Corpus.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"
#include "platform/vantry/Vantry.h"

extern char** environ;

using namespace corvane;

namespace {

int runMatch(int argc, char** argv) {
    int plugins = 10000;
    int requests = 500;
    int allRepeats = 5;  // more keeps axd busy with "all" long enough to profile it
    for (int i = 1; i + 1 < argc; ++i) {
        if (std::strcmp(argv[i], "--all-repeats") == 0) allRepeats = std::max(1, std::atoi(argv[i + 1]));
        if (std::strcmp(argv[i], "--plugins") == 0) plugins = std::max(100, std::atoi(argv[i + 1]));
        if (std::strcmp(argv[i], "--requests") == 0) requests = std::atoi(argv[i + 1]);
    }
    // The ping-pong's far end is forked first, before this process has any thread. Its sizes are
    // those of a "ten" request and reply, measured below; it is told them through the socket.
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return 1;
    int sizes[2];
    if (pipe(sizes) != 0) return 1;
    pid_t echoPid = fork();
    if (echoPid == 0) {
        close(pair[0]);
        uint64_t n[2];
        if (!axbench::readFull(sizes[0], reinterpret_cast<char*>(n), sizeof n)) _exit(1);
        axbench::echo(pair[1], n[0], n[1]);
    }
    close(pair[1]);
    axbench::pinTo(0);

    char tmpl[] = "/tmp/axbench-match.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);
    std::string self = std::filesystem::read_symlink("/proc/self/exe");
    std::string bin = self.substr(0, self.rfind('/'));

    axbench::Corpus corpus;
    if (!axbench::makeCorpus(root, plugins, corpus)) return 1;
    int points = corpus.points;
    std::string annotationFile = root + "/Annotations";
    (void)plist::writeXMLFile(annotationFile, dict({{"version", 16}, {"data", Value(corpus.annotations)}}));

    pid_t axd = -1;
    std::string axdPath = bin + "/axd";
    std::vector<char*> args{axdPath.data(), const_cast<char*>("-d"), annotationFile.data(), nullptr};
    // axd runs on the other core, as the ping-pong's far end does (it would inherit this
    // process's pinning otherwise).
    axbench::pinTo(1);
    int spawned = posix_spawn(&axd, axdPath.c_str(), nullptr, nullptr, args.data(), environ);
    axbench::pinTo(0);
    if (spawned != 0) return 1;
    std::string endpoint = rpx::endpointPath(annexa::kDefaultServiceName);
    for (int i = 0; i < 1000 && !std::filesystem::exists(endpoint); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(5));
    bool busy = axbench::hasFlag(argc, argv, "--busy");
    axbench::BusyCore load(busy);

    annexa::AXDaemonClient client;
    auto match = [&](const Value& rules) {
        return client.wait([&](auto done) { client.matchPlugIns(rules, 0, done); });
    };
    Value ten = dict({{"KSExtensionPointName", "point7"}});
    auto coldStart = std::chrono::steady_clock::now();
    auto first = match(ten);
    double coldMs = axbench::microsSince(coldStart) / 1000;
    const Array* firstForms = first.value["matches"].asArray();
    if (!first.ok() || !firstForms) {
        std::fprintf(stderr, "axbench match: no answer from axd\n");
        kill(axd, SIGKILL);
        return 1;
    }
    for (int i = 0; i < 50; ++i) (void)match(dict({{"KSExtensionPointName", "point" + std::to_string(i % points)}}));
    std::vector<double> tenSamples;
    for (int i = 0; i < requests; ++i) {
        auto start = std::chrono::steady_clock::now();
        (void)match(ten);
        tenSamples.push_back(axbench::microsSince(start));
    }

    // "ten" as a walk: a different extension point each time, more than axd keeps answers for, so
    // every request walks its candidates (the registry's records are warm from a first round).
    auto pointOf = [&](int i) { return dict({{"KSExtensionPointName", "point" + std::to_string((50 + i % 100) % points)}}); };
    for (int i = 0; i < 100; ++i) (void)match(pointOf(i));
    std::vector<double> tenWalkSamples;
    for (int i = 0; i < requests; ++i) {
        Value rules = pointOf(i);
        auto start = std::chrono::steady_clock::now();
        (void)match(rules);
        tenWalkSamples.push_back(axbench::microsSince(start));
    }

    // The same, with the host looking into every form it got (forms are decoded when first looked
    // at, so "ten" alone does not include that).
    std::vector<double> tenReadSamples;
    for (int i = 0; i < requests; ++i) {
        auto start = std::chrono::steady_clock::now();
        auto reply = match(ten);
        if (const Array* forms = reply.value["matches"].asArray())
            for (const Value& form : *forms) (void)form["identifier"];
        tenReadSamples.push_back(axbench::microsSince(start));
    }

    // The same sizes, plain: the request message and the reply as the wire carries them.
    size_t requestSize = rpx::wire::kHeaderSize + 200;
    size_t replySize = rpx::wire::kHeaderSize + first.value.description().size();
    uint64_t told[2] = {requestSize, replySize};
    (void)!::write(sizes[1], told, sizeof told);
    std::vector<char> out(requestSize, 'r'), in(replySize);
    for (int i = 0; i < 200; ++i) {
        (void)!::write(pair[0], out.data(), out.size());
        axbench::readFull(pair[0], in.data(), in.size());
    }
    std::vector<double> pingSamples;
    for (int i = 0; i < requests; ++i) {
        auto start = std::chrono::steady_clock::now();
        (void)!::write(pair[0], out.data(), out.size());
        axbench::readFull(pair[0], in.data(), in.size());
        pingSamples.push_back(axbench::microsSince(start));
    }
    close(pair[0]);
    waitpid(echoPid, nullptr, 0);

    // Every plug-in, through the daemon, warm; then as a host would find them itself. The first
    // answer builds every plug-in's record; the second walks again, since building them changed
    // the registry's records and the annotations (auto-elections); both are timed apart.
    std::vector<double> allFirstSamples;
    for (int i = 0; i < 2; ++i) {
        auto start = std::chrono::steady_clock::now();
        (void)match(Value());
        allFirstSamples.push_back(axbench::microsSince(start) / 1000);
    }
    std::vector<double> allSamples;
    size_t allCount = 0;
    for (int i = 0; i < allRepeats; ++i) {
        auto start = std::chrono::steady_clock::now();
        auto all = match(Value());
        allSamples.push_back(axbench::microsSince(start) / 1000);
        if (const Array* forms = all.value["matches"].asArray()) allCount = forms->size();
    }
    long rss = axbench::residentKiB(axd);
    // Every plug-in for a host process of its own, which reads every form: from its start to its
    // end (a new connection has no kept answer, so axd walks for it).
    std::vector<double> allProcessSamples;
    for (int i = 0; i < 3; ++i) {
        auto start = std::chrono::steady_clock::now();
        pid_t host = axbench::startProgram({self, "all-client"});
        int status = 1;
        if (host) waitpid(host, &status, 0);
        if (!host || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
            std::fprintf(stderr, "axbench match: the host process got no answer with every plug-in\n");
            kill(axd, SIGKILL);
            return 1;
        }
        allProcessSamples.push_back(axbench::microsSince(start) / 1000);
    }
    std::vector<double> scanSamples;
    size_t scanCount = 0;
    for (int i = 0; i < 3; ++i) {
        auto start = std::chrono::steady_clock::now();
        scanCount = axbench::hostScan(corpus);
        scanSamples.push_back(axbench::microsSince(start) / 1000);
    }
    kill(axd, SIGTERM);
    waitpid(axd, nullptr, 0);
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);

    double tenP50 = axbench::percentile(tenSamples, 50), tenP99 = axbench::percentile(tenSamples, 99);
    double pingP50 = axbench::percentile(pingSamples, 50);
    double allMs = axbench::percentile(allSamples, 50), scanMs = axbench::percentile(scanSamples, 50);
    std::printf("ten: %zu plug-ins, reply %zu bytes; all: %zu through axd, %zu by scanning\n", firstForms->size(),
                replySize, allCount, scanCount);
    double allProcessMs = axbench::percentile(allProcessSamples, 50);
    std::printf("RESULT match n=%d busy=%d ten_p50_us=%.1f ten_p99_us=%.1f pingpong_p50_us=%.1f ratio_ten=%.2f "
                "all_ms=%.1f scan_ms=%.1f speedup_all=%.1f cold_ms=%.1f rss_mb=%.1f ten_read_p50_us=%.1f "
                "ten_walk_p50_us=%.1f all_first_ms=%.1f all_second_ms=%.1f all_process_ms=%.1f "
                "ratio_all_process=%.2f\n",
                plugins, busy ? 1 : 0, tenP50, tenP99, pingP50, tenP50 / pingP50, allMs, scanMs, scanMs / allMs,
                coldMs, static_cast<double>(rss) / 1024, axbench::percentile(tenReadSamples, 50),
                axbench::percentile(tenWalkSamples, 50), allFirstSamples[0], allFirstSamples[1], allProcessMs,
                allProcessMs / scanMs);
    return 0;
}

// The host process of `all_process_ms`: asks axd for every plug-in and reads every form; exits 0
// when it got them.
int runAllClient(int, char**) {
    annexa::AXDaemonClient client;
    auto reply = client.wait([&](auto done) { client.matchPlugIns(Value(), 0, done); });
    const Array* forms = reply.value["matches"].asArray();
    if (!reply.ok() || !forms || forms->empty()) return 1;
    for (const Value& form : *forms) (void)form["identifier"].asString(), (void)form["version"];
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("all-client", "(for match) one host process that asks for every plug-in and reads every form",
                    runAllClient);
AX_BENCH_SUBCOMMAND("match", "discovery over N plug-ins through axd, against a host scanning bundles itself", runMatch);
