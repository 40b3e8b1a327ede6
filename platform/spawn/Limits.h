// What bounds an instance beyond its sandbox, and what ends the instances a killed spawnd left.
//
// Tasks and memory: a cgroup per instance, made in a delegated cgroup v2 subtree (spawnd's own
// cgroup, writable, offering the pids and memory controllers: systemd's Delegate=yes) or, where
// only those exist, in the cgroup v1 pids and memory hierarchies at spawnd's own place when it may
// write there. The groups of one spawnd live under "corvane.<uid>.<hash of its runtime directory>",
// so that a spawnd started later for the same user and directory finds them, and no other spawnd's.
// Without any of this tasks are not bounded (logged once); memory is always bounded by RLIMIT_DATA
// as well.
//
// Every instance is also recorded in <runtime dir>/spawnd/instances/<pid> (its pid and start time):
// a spawnd started after a killed one ends the recorded instances that still run, recognised by pid
// and start time, with their process groups, never by name. (An instance dies with the spawnd that
// launched it, by its parent-death signal; what it started is found through its cgroup.)
//
// Lives on: spawnd's queue.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::spawn {

class InstanceLimits {
public:
    // Looks for cgroups this process may use; `tasks` bounds each instance's tasks (processes and
    // threads) where a cgroup can.
    explicit InstanceLimits(uint64_t tasks);

    // Whether instances get a cgroup each (their tasks bounded).
    bool bounded() const { return !hierarchies_.empty(); }
    // "cgroup v2 at DIR", "cgroup v1 (pids, memory) at DIR ..." or "none", for the log.
    std::string description() const;

    // The cgroup of one instance, as its child joins it: the descriptors of the files (cgroup.procs,
    // or "tasks" in v1) to each of which the child writes "0" before exec. Empty without cgroups.
    struct Group {
        std::vector<std::string> directories;
        std::vector<std::shared_ptr<FileDescriptor>> joins;
    };
    Result<Group> makeGroup();
    // The memory the group's processes may use together.
    void setMemory(const Group& group, uint64_t bytes);
    // Kills what is left in the group and removes it; a group whose processes are still dying is
    // removed at a later sweep().
    void endGroup(const Group& group);
    // Removes the groups endGroup could not remove yet.
    void sweep();

    // The record of a running instance, and its end.
    void record(pid_t pid, uint64_t startTime);
    void forget(pid_t pid);
    // Ends whatever an earlier spawnd of this user and runtime directory left running: its groups
    // and its recorded instances. Call once, after this spawnd owns its endpoints.
    void endLeftovers();
    // Removes this spawnd's directories of groups, once its instances have ended.
    void removeAll();

private:
    struct Hierarchy {
        std::string base;       // where this spawnd's groups are made
        bool v2 = false;
        std::string memoryFile;  // "memory.max", "memory.limit_in_bytes", or "" without memory
        bool pids = false;
    };
    void findV2();
    void findV1();
    void endGroupDirectory(const std::string& directory, bool v2);

    const uint64_t tasks_;
    std::vector<Hierarchy> hierarchies_;
    uint64_t nextGroup_ = 1;
    std::vector<std::pair<std::string, bool>> unremoved_;  // directory, v2
    std::string records_;
    bool recordsMade_ = false;
};

}  // namespace corvane::spawn
