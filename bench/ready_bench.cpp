// axbench ready: a warm "ready" of one plug-in through a real axd (signed with the service
// manager's entitlement) and spawnd, beside a plain Unix-socket ping-pong between two processes
// pinned to different cores, in the same run.
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "bench/Bench.h"
#include "platform/codesign/CodeSign.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/spawn/Spawn.h"
#include "platform/vantry/Vantry.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

constexpr size_t kPingBytes = 160;

int readyBench(int argc, char** argv) {
    int requests = 300;
    for (int i = 1; i + 1 < argc; ++i) {
        if (std::strcmp(argv[i], "--requests") == 0) requests = std::atoi(argv[i + 1]);
    }
    bool busy = axbench::hasFlag(argc, argv, "--busy");
    // The ping-pong's far end, forked before this process has any thread.
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return 1;
    pid_t echoPid = fork();
    if (echoPid == 0) {
        close(pair[0]);
        axbench::echo(pair[1], kPingBytes, kPingBytes);
    }
    close(pair[1]);

    char tmpl[] = "/tmp/axbench-ready.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);
    std::string bin = fs::read_symlink("/proc/self/exe").parent_path();
    auto key = codesign::generateKey();
    std::string axd = root + "/axd";
    fs::copy_file(bin + "/axd", axd);
    if (!codesign::writeKeyPair(root + "/key", key).ok() || !codesign::trustKey(root + "/key.pub").ok() ||
        !codesign::sign(axd, key, std::nullopt, dict({{spawn::kDomainExtensionProxyEntitlement, true}})).ok()) {
        return 1;
    }
    std::string app = root + "/Bench.app";
    fs::create_directories(app + "/PlugIns/One.appex");
    (void)plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.app"}}));
    (void)plist::writeXMLFile(app + "/PlugIns/One.appex/Info.plist",
                              dict({{"KFBundleIdentifier", "com.bench.one"}, {"KFBundleExecutable", "One"},
                                    {"KFBundleVersion", "1"},
                                    {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                          {"KSExtensionAttributes", dict({})}})}}));
    fs::copy_file(bin + "/../samples/bin/ax_sample", app + "/PlugIns/One.appex/One");
    pid_t spawnd = axbench::startProgram({bin + "/spawnd"});
    pid_t daemon = axbench::startProgram({axd});
    axbench::waitForSocket(rpx::endpointPath(spawn::kEndpoint));
    axbench::waitForSocket(rpx::endpointPath(annexa::kDefaultServiceName));

    axbench::pinTo(0);
    annexa::AXDaemonClient client;
    (void)client.wait([&](auto done) { client.addPlugIns({app}, done); });
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    auto record = registry ? (*registry)->plugInForPath(app + "/PlugIns/One.appex") : nullptr;
    if (!record) {
        std::fprintf(stderr, "axbench ready: the plug-in was not registered\n");
        return 1;
    }
    UUID uuid = record->uuid();
    axbench::BusyCore load(busy);
    std::vector<double> ready;
    for (int i = 0; i < requests + 20; ++i) {
        auto start = std::chrono::steady_clock::now();
        auto reply = client.wait([&](auto done) { client.readyPlugIns({uuid}, 0, done); });
        if (!reply.ok() || reply.value.has("errorcode")) {
            std::fprintf(stderr, "axbench ready: %s\n", reply.value.description().c_str());
            return 1;
        }
        if (i >= 20) ready.push_back(axbench::microsSince(start));
    }

    std::vector<char> out(kPingBytes, 'r'), in(kPingBytes);
    std::vector<double> ping;
    for (int i = 0; i < requests + 200; ++i) {
        auto start = std::chrono::steady_clock::now();
        (void)!::write(pair[0], out.data(), out.size());
        axbench::readFull(pair[0], in.data(), in.size());
        if (i >= 200) ping.push_back(axbench::microsSince(start));
    }
    close(pair[0]);
    waitpid(echoPid, nullptr, 0);
    for (pid_t pid : {daemon, spawnd}) {
        kill(pid, SIGTERM);
        waitpid(pid, nullptr, 0);
    }
    fs::remove_all(root);
    std::printf("%d warm readies of one plug-in (axd -> spawnd registration each time), ping-pong of %zu bytes\n",
                requests, kPingBytes);
    double readyP50 = axbench::percentile(ready, 50), pingP50 = axbench::percentile(ping, 50);
    std::printf("RESULT ready busy=%d p50_us=%.0f p99_us=%.0f pingpong_p50_us=%.0f ratio=%.2f\n", busy ? 1 : 0, readyP50,
                axbench::percentile(ready, 99), pingP50, readyP50 / pingP50);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("ready", "a warm ready of one plug-in through axd and spawnd vs a pinned ping-pong", readyBench);
