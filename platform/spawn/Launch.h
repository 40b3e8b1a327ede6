// Starting one instance: clone with a pidfd, set the child up, confine it, exec.
#pragma once

#include <sys/types.h>

#include <map>
#include <memory>
#include <string>

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
};

struct Launched {
    pid_t pid = 0;
    std::shared_ptr<FileDescriptor> pidfd;
};

// Starts the executable in a new process group of its own, standard input /dev/null. The result is
// known once the child has exec'd: a failure on the way (a refused confinement, an exec error)
// comes back as the error, with the step that failed, and leaves no child behind.
Result<Launched> launch(const LaunchSettings& settings);

}  // namespace corvane::spawn
