// axbench launch: a host's connect to a plug-in that is not running yet, through spawnd, until the
// plug-in's first reply; beside a plain posix_spawn of the same executable, handed a socketpair the
// same way, until its first reply, in the same run.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "Annexa/AXPlugInRuntime.h"
#include "bench/Bench.h"
#include "platform/codesign/CodeSign.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/spawn/Spawn.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

std::string besideMe(const std::string& relative) {
    return (fs::read_symlink("/proc/self/exe").parent_path() / relative).lexically_normal().string();
}

int runQuiet(std::vector<std::string> argv) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    pid_t pid = axbench::startProgram(std::move(argv), &actions);
    posix_spawn_file_actions_destroy(&actions);
    int status = 0;
    if (pid <= 0 || waitpid(pid, &status, 0) != pid) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// A bundle with a copy of the sample executable; the executable's path.
std::string makePlugIn(const std::string& root, const std::string& identifier, const std::string& sample) {
    std::string bundle = root + "/apps/Bench.app/PlugIns/" + identifier + ".appex";
    fs::create_directories(bundle);
    auto written = plist::writeXMLFile(bundle + "/Info.plist",
                                       dict({{"KFBundleIdentifier", identifier}, {"KFBundleExecutable", "Sample"},
                                             {"KFBundleVersion", "1"}, {"KFBundlePackageType", "RPX!"}}));
    (void)written;
    fs::copy_file(sample, bundle + "/Sample", fs::copy_options::overwrite_existing);
    return bundle + "/Sample";
}

// The baseline: posix_spawn of the sample with its control socket as descriptor 3, one host
// socket handed over it, and one exchange on that socket.
double plainSpawnMillis(const std::string& executable, const dispatch::QueuePtr& queue) {
    auto started = std::chrono::steady_clock::now();
    int control[2], host[2];
    socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, control);
    socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, host);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, control[1], 3);
    std::string variable = std::string(spawn::kControlDescriptorVariable) + "=3";
    char* environment[] = {variable.data(), nullptr};
    pid_t pid = axbench::startProgram({executable}, &actions, environment);
    posix_spawn_file_actions_destroy(&actions);
    ::close(control[1]);
    auto controlConnection = rpx::Connection::adopt(std::make_shared<FileDescriptor>(control[0]), queue);
    controlConnection->setEventHandler([](const rpx::Event&) {});
    controlConnection->resume();
    auto instanceEnd = std::make_shared<FileDescriptor>(host[1]);
    controlConnection->sendWithReplySync(dict({{"connection", Value(instanceEnd)}}));
    auto hostConnection = rpx::Connection::adopt(std::make_shared<FileDescriptor>(host[0]), queue);
    hostConnection->setEventHandler([](const rpx::Event&) {});
    hostConnection->resume();
    rpx::Reply reply = hostConnection->sendWithReplySync(Value(Dictionary{}));
    double millis = axbench::microsSince(started) / 1000.0;
    hostConnection->cancel();
    controlConnection->cancel();
    int status;
    waitpid(pid, &status, 0);
    return reply.ok() ? millis : -1;
}

int launchBench(int argc, char** argv) {
    int launches = 100;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (std::string(argv[i]) == "--launches") launches = std::atoi(argv[i + 1]);
    }
    char tmpl[] = "/tmp/axbench-launch.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);
    std::string sample = besideMe("../samples/bin/ax_sample");

    // A registrar with the entitlement, signed with a key trusted in this root.
    auto key = codesign::generateKey();
    if (!codesign::writeKeyPair(root + "/key", key).ok() || !codesign::trustKey(root + "/key.pub").ok()) return 1;
    std::string registrar = root + "/registrar";
    fs::copy_file(besideMe("spawn_peer"), registrar);
    if (!codesign::sign(registrar, key, std::nullopt, dict({{spawn::kDomainExtensionProxyEntitlement, true}})).ok()) return 1;

    pid_t spawnd = axbench::startProgram({besideMe("spawnd"), "--idle-ms", "20", "--grace-ms", "200"});
    axbench::waitForSocket(rpx::endpointPath(spawn::kEndpoint));
    std::string overlay = dict({{"RPXService", dict({{"_SandboxProfile", "plugin"}})}, {"KFBundlePackageType", "RPX!"}}).description();
    std::vector<std::string> identifiers;
    for (int i = 0; i < launches; ++i) {
        std::string identifier = "com.example.bench" + std::to_string(i);
        if (runQuiet({registrar, "add", std::to_string(getpid()), makePlugIn(root, identifier, sample), overlay}) != 0) {
            std::fprintf(stderr, "axbench launch: registration failed\n");
            return 1;
        }
        identifiers.push_back(identifier);
    }

    auto queue = dispatch::Queue::create("axbench.launch");
    std::vector<double> connect, plain;
    for (int i = 0; i < launches; ++i) {
        // Alternate, so that both see the same state of the machine.
        plain.push_back(plainSpawnMillis(sample, queue));
        auto started = std::chrono::steady_clock::now();
        auto connection = annexa::connectToPlugIn(identifiers[static_cast<size_t>(i)], queue, [](const rpx::Event&) {});
        if (!connection) {
            std::fprintf(stderr, "axbench launch: %s\n", connection.error().description().c_str());
            break;
        }
        rpx::Reply reply = (*connection)->sendWithReplySync(Value(Dictionary{}));
        if (reply.ok()) connect.push_back(axbench::microsSince(started) / 1000.0);
        (*connection)->cancel();
    }
    kill(spawnd, SIGTERM);
    int status;
    waitpid(spawnd, &status, 0);
    fs::remove_all(root);

    double connectP50 = axbench::percentile(connect, 50), connectP99 = axbench::percentile(connect, 99);
    double spawnP50 = axbench::percentile(plain, 50);
    std::printf("%zu launches through spawnd (Landlock and seccomp, profile \"plugin\") and %zu plain posix_spawns\n",
                connect.size(), plain.size());
    std::printf("RESULT launch connect_p50_ms=%.2f connect_p99_ms=%.2f spawn_p50_ms=%.2f ratio=%.2f\n", connectP50,
                connectP99, spawnP50, spawnP50 > 0 ? connectP50 / spawnP50 : 0);
    return connect.size() == static_cast<size_t>(launches) ? 0 : 1;
}

}  // namespace

AX_BENCH_SUBCOMMAND("launch", "connect to a plug-in not yet running, through spawnd, vs posix_spawn", launchBench);
