// axbench identity: what knowing a client costs a daemon, once per connection: the identity of
// the process and its verified signature (Handle::fromAuditToken, its signature's hash cached as
// after the first connection), and within it the look at every code mapping (untrustedCodeIn), for
// a running axd signed on a private platform root.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "bench/Bench.h"
#include "platform/codesign/CodeSign.h"
#include "platform/rpx/Rpx.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

int identityBench(int argc, char** argv) {
    int rounds = argc > 1 ? std::atoi(argv[1]) : 2000;
    std::string root = fs::temp_directory_path() / ("axbench-identity." + std::to_string(getpid()));
    fs::create_directories(root);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    auto key = codesign::generateKey();
    if (!codesign::writeKeyPair(root + "/key", key).ok() || !codesign::trustKey(root + "/key.pub").ok()) return 1;
    std::string axd = root + "/axd";
    fs::copy_file((fs::read_symlink("/proc/self/exe").parent_path() / "axd").string(), axd);
    if (!codesign::sign(axd, key, std::nullopt, dict({{"com.corvane.private.pcx.manager", true}})).ok()) return 1;
    pid_t pid = axbench::startProgram({axd});
    axbench::waitForSocket(rpx::endpointPath("com.corvane.annexa.axd"));

    rpx::PeerIdentity identity = rpx::identityOfProcess(pid, getuid(), getgid(), nullptr);
    struct stat exe {};
    ::stat(("/proc/" + std::to_string(pid) + "/exe").c_str(), &exe);
    std::vector<double> handle, mappings;
    bool entitled = true;
    for (int i = 0; i < rounds; ++i) {
        auto started = std::chrono::steady_clock::now();
        auto h = codesign::Handle::fromAuditToken(identity.auditToken);
        handle.push_back(axbench::microsSince(started));
        entitled = entitled && h->verification().valid;
        started = std::chrono::steady_clock::now();
        (void)codesign::untrustedCodeIn(pid, exe);
        mappings.push_back(axbench::microsSince(started));
    }
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
    fs::remove_all(root);
    std::printf("%d identities of a signed axd (pid %d)%s\n", rounds, pid, entitled ? "" : ": NOT entitled");
    std::printf("RESULT identity handle_p50_us=%.1f handle_p99_us=%.1f mappings_p50_us=%.1f\n",
                axbench::percentile(handle, 50), axbench::percentile(handle, 99), axbench::percentile(mappings, 50));
    return entitled ? 0 : 1;
}

}  // namespace

AX_BENCH_SUBCOMMAND("identity", "a daemon's cost of knowing a signed client, per connection", identityBench);
