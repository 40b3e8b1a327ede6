// Sandbox profiles (docs/sandbox.md): a Landlock ruleset and a seccomp filter, made in spawnd
// before the launch and applied by the child between fork and exec.
#pragma once

#include <linux/filter.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::spawn {

// What an instance may reach, opened by spawnd without following symbolic links where the plug-in
// could have put them: the rules are made from these descriptors, never from paths.
struct ConfinementTargets {
    std::shared_ptr<FileDescriptor> bundle;  // read and executed
    std::shared_ptr<FileDescriptor> home;    // the data container; null when there is none
    std::shared_ptr<FileDescriptor> tmpdir;  // null when there is none
};

struct Confinement {
    std::string profile;
    std::shared_ptr<FileDescriptor> ruleset;                          // Landlock
    // The seccomp program: the sockets allowed, then the system calls refused.
    std::shared_ptr<const std::vector<sock_filter>> filter;
};

// The names of the profiles spawnd knows.
const std::vector<std::string>& knownProfiles();
// The Landlock ABI version of the running kernel, 0 without Landlock.
int landlockAbi();
// Builds a profile's confinement for one instance; an error says why it cannot be had (unknown
// profile, no Landlock, a kernel too old for the profile's network rules, a path that cannot be
// opened). Never a weaker confinement than the profile asks for.
Result<Confinement> prepareConfinement(const std::string& profile, const ConfinementTargets& targets);
// Confines the calling process (no_new_privs; Landlock, with its own /proc/<pid> readable; then the
// seccomp filter): 0, or the errno of the step that failed, whose name goes to *stage. `ruleset` is
// the descriptor of the confinement's ruleset in the calling process. Only system calls: safe in a
// child between fork and exec.
int applyConfinement(const Confinement& confinement, int ruleset, const char** stage);

}  // namespace corvane::spawn
