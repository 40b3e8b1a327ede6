// spawnd: the per-user service manager that runs plug-ins for their hosts in sandboxes, with the
// process-assertion service, the sandbox token broker and privacy consent (docs/spawnd.md).
#include <signal.h>
#include <systemd/sd-daemon.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "platform/rpx/Rpx.h"
#include "platform/spawn/Daemon.h"
#include "tools/cli/Cli.h"

using namespace corvane;

namespace {

constexpr const char* kTool = "spawnd";
constexpr const char* kUsage =
    "usage: spawnd [--grace-ms MS] [--idle-ms MS] [--accept-timeout-ms MS] [--memory-mib MIB]\n"
    "              [--instances-per-host N] [--instances N]\n"
    "Serves com.corvane.spawnd, com.corvane.vigild, com.corvane.sandbox and com.corvane.pcx until\n"
    "SIGTERM or SIGINT, then ends the plug-in instances it runs.\n";

bool readMilliseconds(const cli::Parsed& parsed, const char* option, std::chrono::milliseconds& out) {
    auto text = parsed.value(option);
    if (!text) return true;
    char* end = nullptr;
    long long value = std::strtoll(text->c_str(), &end, 10);
    if (text->empty() || *end != '\0' || value < 0 || value > 86'400'000) return false;
    out = std::chrono::milliseconds(value);
    return true;
}

// A whole number from 0 (or 1) to `max`, left as it is when the option is absent.
template <class T>
bool readCount(const cli::Parsed& parsed, const char* option, long long min, long long max, T& out) {
    auto text = parsed.value(option);
    if (!text) return true;
    char* end = nullptr;
    long long value = std::strtoll(text->c_str(), &end, 10);
    if (text->empty() || *end != '\0' || value < min || value > max) return false;
    out = static_cast<T>(value);
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    const cli::Syntax syntax{"[--grace-ms MS] [--idle-ms MS] [--accept-timeout-ms MS] [--memory-mib MIB] "
                             "[--instances-per-host N] [--instances N]",
                             {},
                             {"--grace-ms", "--idle-ms", "--accept-timeout-ms", "--memory-mib", "--instances-per-host",
                              "--instances"},
                             0,
                             0};
    std::vector<std::string> args(argv + 1, argv + argc);
    for (const std::string& arg : args) {
        if (arg == "--help") {
            std::fputs(kUsage, stdout);
            return cli::kSuccess;
        }
    }
    auto outcome = cli::parse(kTool, syntax, args);
    if (!outcome.parsed) return outcome.exitStatus;
    spawn::Options options;
    if (!readMilliseconds(*outcome.parsed, "--grace-ms", options.grace) ||
        !readMilliseconds(*outcome.parsed, "--idle-ms", options.idle) ||
        !readMilliseconds(*outcome.parsed, "--accept-timeout-ms", options.acceptTimeout)) {
        return cli::usageError(kTool, "a time must be a whole number of milliseconds", syntax.usage);
    }
    uint64_t memoryMib = options.memoryPerInstance >> 20;
    if (!readCount(*outcome.parsed, "--memory-mib", 0, 1 << 20, memoryMib) ||
        !readCount(*outcome.parsed, "--instances-per-host", 1, 100000, options.instancesPerHost) ||
        !readCount(*outcome.parsed, "--instances", 1, 100000, options.instances)) {
        return cli::usageError(kTool, "a count must be a whole number (MiB, instances)", syntax.usage);
    }
    options.memoryPerInstance = memoryMib << 20;
    if (int status = cli::checkPlaces(kTool); status != cli::kSuccess) return status;

    // Before any thread starts, so that the signals reach only the wait below, and SIGCHLD only
    // the daemon's signalfd (it reaps every child, instances and what they leave behind).
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    sigset_t blocked = stopSignals;
    sigaddset(&blocked, SIGCHLD);
    pthread_sigmask(SIG_BLOCK, &blocked, nullptr);
    signal(SIGPIPE, SIG_IGN);

    auto daemon = spawn::Daemon::start(options);
    if (!daemon) return cli::fail(kTool, daemon.error().description(), cli::kUnavailable);
    corvane::rpx::closeUnclaimedSockets();
    log::info(log::defaultLog(), "spawnd is serving");
    sd_notify(0, "READY=1\nSTATUS=serving com.corvane.spawnd, com.corvane.vigild, com.corvane.sandbox, com.corvane.pcx");
    int received = 0;
    sigwait(&stopSignals, &received);
    log::info(log::defaultLog(), "spawnd is stopping");
    sd_notify(0, "STOPPING=1\nSTATUS=ending the plug-ins it runs");
    daemon->reset();
    return cli::kSuccess;
}
