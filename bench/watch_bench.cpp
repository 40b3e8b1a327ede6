// axbench watch: how long a change takes to reach a watcher. A real axd, one watcher connection
// ("watch"), and a client that changes a plug-in's annotation; the time from sending the change
// to the watcher's receiving its event.
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "bench/Bench.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/vantry/Vantry.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

Value request(const char* name, Dictionary extra = {}) {
    extra["request"] = Value(name);
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

int watchBench(int argc, char** argv) {
    int changes = 300;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (std::strcmp(argv[i], "--changes") == 0) changes = std::atoi(argv[i + 1]);
    }
    char tmpl[] = "/tmp/axbench-watch.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);
    std::string bin = fs::read_symlink("/proc/self/exe").parent_path();
    std::string app = root + "/Watched.app";
    fs::create_directories(app + "/PlugIns/One.appex");
    (void)plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.watched"}}));
    (void)plist::writeXMLFile(app + "/PlugIns/One.appex/Info.plist",
                              dict({{"KFBundleIdentifier", "com.bench.watched.one"},
                                    {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                          {"KSExtensionAttributes", dict({})}})}}));
    pid_t axd = axbench::startProgram({bin + "/axd"});
    if (axd == 0) return 1;
    axbench::waitForSocket(rpx::endpointPath(annexa::kDefaultServiceName));

    annexa::AXDaemonClient client;
    auto send = [&](const Value& message) { return client.wait([&](auto done) { client.send(message, done); }); };
    send(request("add", {{"paths", Value(Array{Value(app)})}}));
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    auto record = registry ? (*registry)->plugInForPath(app + "/PlugIns/One.appex") : nullptr;
    if (!record) return 1;

    std::mutex mutex;
    std::condition_variable arrived;
    int64_t lastElection = 0;
    auto watcher = rpx::Connection::connect(annexa::kDefaultServiceName, dispatch::Queue::create("axbench.watcher"));
    watcher->setEventHandler([&](const rpx::Event& ev) {
        if (ev.isError() || ev.message["event"] != Value("annotation")) return;
        std::lock_guard lock(mutex);
        lastElection = ev.message["new"]["election"].int64Value().value_or(0);
        arrived.notify_all();
    });
    watcher->resume();
    watcher->sendWithReplySync(request("watch"));

    std::vector<double> latencies;
    for (int i = 0; i < changes + 20; ++i) {
        int64_t election = i % 2 + 1;
        auto start = std::chrono::steady_clock::now();
        client.send(request("annotate", {{"uuids", Value(Array{Value(record->uuid())})},
                                         {"annotations", dict({{"election", election}})}}),
                    [](const rpx::Reply&) {});
        std::unique_lock lock(mutex);
        if (!arrived.wait_for(lock, std::chrono::seconds(5), [&] { return lastElection == election; })) {
            std::fprintf(stderr, "axbench watch: no event for change %d\n", i);
            break;
        }
        if (i >= 20) latencies.push_back(axbench::microsSince(start) / 1000.0);
    }
    watcher->cancel();
    kill(axd, SIGTERM);
    waitpid(axd, nullptr, 0);
    fs::remove_all(root);
    std::printf("%zu annotation changes, each until its event reached a watcher\n", latencies.size());
    std::printf("RESULT watch p50_ms=%.3f p99_ms=%.3f\n", axbench::percentile(latencies, 50),
                axbench::percentile(latencies, 99));
    return latencies.size() == static_cast<size_t>(changes) ? 0 : 1;
}

}  // namespace

AX_BENCH_SUBCOMMAND("watch", "how long a change takes to reach a watcher", watchBench);
