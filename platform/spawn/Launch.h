// Starting one instance: clone with a pidfd, set the child up, confine it, exec.
#pragma once

#include <sys/types.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/spawn/Confinement.h"
#include "platform/value/Value.h"

namespace corvane::spawn {

struct LaunchSettings {
    std::string executable;
    std::map<std::string, std::string> environment;
    std::string workingDirectory;
    Confinement confinement;
    std::shared_ptr<FileDescriptor> control;  // becomes descriptor 3, named in the environment
    std::shared_ptr<FileDescriptor> output;   // standard output and error
    // The cgroup.procs files of the instance's cgroups, which the child joins before exec (a
    // prepared child has joined them already).
    std::vector<std::shared_ptr<FileDescriptor>> joins;
    uint64_t memoryBytes = 0;        // RLIMIT_DATA; 0 leaves it
    uint64_t descriptorLimit = 0;    // the soft RLIMIT_NOFILE the instance starts with; 0 leaves it
};

struct Launched {
    pid_t pid = 0;
    std::shared_ptr<FileDescriptor> pidfd;
};

// A child made ahead of a launch, already in the cgroups its instance will have: moving a process
// into a cgroup waits for an RCU grace period (about ten milliseconds on a quiet machine, measured
// with cgroup v1), which a launch should not wait for. It closes everything of spawnd's but its
// channel, and waits there for its plan and descriptors; it is killed with the thread that made it.
// Lives on: the thread that made it.
class PreparedChild {
public:
    static Result<std::unique_ptr<PreparedChild>> make(const std::vector<std::shared_ptr<FileDescriptor>>& joins);
    // One never used is killed (and reaped by spawnd's reaper).
    ~PreparedChild();
    PreparedChild(const PreparedChild&) = delete;
    PreparedChild& operator=(const PreparedChild&) = delete;

private:
    PreparedChild() = default;
    friend Result<Launched> launch(const LaunchSettings&, std::unique_ptr<PreparedChild>);
    struct Start;
    pid_t pid_ = 0;
    std::shared_ptr<FileDescriptor> pidfd_;
    std::unique_ptr<FileDescriptor> channel_;
    void* stack_ = nullptr;
    std::unique_ptr<Start> start_;
};

// Starts the executable in a new process group of its own, standard input /dev/null, in its cgroups,
// with no capability in any set (whoever runs spawnd), killed when the thread that launched it ends
// (PR_SET_PDEATHSIG), its resource limits set; in `prepared` when one is given (a prepared child that
// can no longer be reached is passed over for a new one). The result is known once the child has
// exec'd: a failure on the way (a refused confinement, an exec error) comes back as the error, with
// the step that failed, and leaves no child behind.
Result<Launched> launch(const LaunchSettings& settings, std::unique_ptr<PreparedChild> prepared = nullptr);

}  // namespace corvane::spawn
