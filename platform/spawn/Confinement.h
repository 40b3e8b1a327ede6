// Sandbox profiles (docs/sandbox.md): a Landlock ruleset and a seccomp filter, made in spawnd
// before the launch and applied by the child between fork and exec.
#pragma once

#include <linux/filter.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::spawn {

struct ConfinementPaths {
    std::string bundle;  // read and executed
    std::string home;    // the data container; "" when there is none
    std::string tmpdir;  // "" when there is none
};

struct Confinement {
    std::string profile;
    std::shared_ptr<FileDescriptor> ruleset;  // Landlock
    std::shared_ptr<const std::vector<sock_filter>> filter;
};

// The names of the profiles spawnd knows.
const std::vector<std::string>& knownProfiles();
// The Landlock ABI version of the running kernel, 0 without Landlock.
int landlockAbi();
// Builds a profile's confinement for one instance; an error says why it cannot be had (unknown
// profile, no Landlock, a kernel too old for the profile's network rules, a path that cannot be
// opened). Never a weaker confinement than the profile asks for.
Result<Confinement> prepareConfinement(const std::string& profile, const ConfinementPaths& paths);
// Confines the calling process (no_new_privs, Landlock, then seccomp): 0, or the errno of the step
// that failed, whose name goes to *stage. Only system calls: safe in a child between fork and exec.
int applyConfinement(const Confinement& confinement, const char** stage);

}  // namespace corvane::spawn
