// The spawnd daemon's parts, for its short main (tools/spawnd.cpp) and the tests that host it:
// the service manager and the process-assertion service on one queue, the token broker and the
// privacy-consent service beside them.
//
// Thread-safe.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>

#include "platform/value/Value.h"

namespace corvane::spawn {

struct Options {
    // Between SIGTERM and SIGKILL when an instance is ended.
    std::chrono::milliseconds grace{2000};
    // An instance that serves no connection this long is ended.
    std::chrono::milliseconds idle{30000};
    // An instance that has not taken the connection it was handed by then is ended.
    std::chrono::milliseconds acceptTimeout{10000};
    // Connections handed to one instance and not yet taken.
    size_t waitingPerInstance = 32;
    // Busy assertions one instance may hold.
    size_t assertionsPerInstance = 64;
    // Instances running for one host, and in all (fewer when the descriptor limit cannot serve
    // that many: each instance needs a few, and a reserve stays for new connections).
    size_t instancesPerHost = 32;
    size_t instances = 512;
    // Tasks (processes and threads) of one instance, where a cgroup bounds them.
    uint64_t tasksPerInstance = 256;
    // The memory of an instance whose extension point says nothing (RLIMIT_DATA, and its cgroup's).
    // 0: no data limit at all (for programs that reserve their address space up front, such as
    // sanitizer builds); the cgroup bounds memory by the extension point's value when it gives one.
    uint64_t memoryPerInstance = uint64_t{1} << 30;
};

class Daemon {
public:
    // Serves every endpoint; fails when one of them cannot be served (another spawnd runs). The
    // process becomes the subreaper of everything it starts and reaps every child; the caller blocks
    // SIGCHLD in every thread first (the daemon reads it from a signalfd).
    static Result<std::unique_ptr<Daemon>> start(const Options& options);
    // Ends every instance (SIGTERM, SIGKILL after the grace period) and stops serving.
    ~Daemon();

    struct Parts;

private:
    explicit Daemon(std::unique_ptr<Parts> parts);
    std::unique_ptr<Parts> parts_;
};

}  // namespace corvane::spawn
