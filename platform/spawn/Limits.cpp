#include "platform/spawn/Limits.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <set>
#include <sstream>

#include "platform/layout/Layout.h"
#include "platform/rpx/Rpx.h"

namespace corvane::spawn {

namespace {

std::string readSmallFile(const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

bool writeSmallFile(const std::string& path, const std::string& text) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) return false;
    bool written = ::write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    ::close(fd);
    return written;
}

std::vector<std::string> words(const std::string& text, char separator) {
    std::vector<std::string> out;
    std::stringstream in(text);
    std::string word;
    while (std::getline(in, word, separator))
        if (!word.empty()) out.push_back(word);
    return out;
}

// This process's place in a hierarchy (/proc/self/cgroup): for v2 the "0::" line, for v1 the line
// whose controllers include `controller`.
std::string ownCgroup(const std::string& controller) {
    std::istringstream lines(readSmallFile("/proc/self/cgroup"));
    std::string line;
    while (std::getline(lines, line)) {
        size_t first = line.find(':');
        size_t second = first == std::string::npos ? first : line.find(':', first + 1);
        if (second == std::string::npos) continue;
        std::string controllers = line.substr(first + 1, second - first - 1);
        std::string path = line.substr(second + 1);
        if (controller.empty() ? line.rfind("0::", 0) == 0 : [&] {
                auto list = words(controllers, ',');
                return std::find(list.begin(), list.end(), controller) != list.end();
            }())
            return path;
    }
    return {};
}

// The mount point of a cgroup file system: v2 ("cgroup2"), or the v1 hierarchy with `controller`
// among its options. Its root within the hierarchy goes to *root.
std::string mountOf(const std::string& controller, std::string* root) {
    std::istringstream lines(readSmallFile("/proc/self/mountinfo"));
    std::string line;
    while (std::getline(lines, line)) {
        size_t dash = line.find(" - ");
        if (dash == std::string::npos) continue;
        auto before = words(line.substr(0, dash), ' ');
        auto after = words(line.substr(dash + 3), ' ');
        if (before.size() < 5 || after.size() < 3) continue;
        bool wanted = controller.empty() ? after[0] == "cgroup2" : after[0] == "cgroup" && [&] {
            auto options = words(after[2], ',');
            return std::find(options.begin(), options.end(), controller) != options.end();
        }();
        if (!wanted) continue;
        *root = before[3];
        return before[4];
    }
    return {};
}

std::string placeOf(const std::string& controller) {
    std::string root;
    std::string mount = mountOf(controller, &root);
    std::string path = ownCgroup(controller);
    if (mount.empty() || path.empty()) return {};
    if (root != "/" && path.rfind(root, 0) == 0) path = path.substr(root.size());
    if (path == "/") path.clear();
    return mount + path;
}

// This spawnd's name among the groups of its cgroup: its user and its runtime directory.
std::string groupsName() {
    uint64_t hash = 1469598103934665603ull;  // FNV-1a
    for (unsigned char c : layout::runtimeDir()) hash = (hash ^ c) * 1099511628211ull;
    char text[64];
    std::snprintf(text, sizeof text, "corvane.%u.%016llx", static_cast<unsigned>(::getuid()),
                  static_cast<unsigned long long>(hash));
    return text;
}

bool makeDirectory(const std::string& path) { return ::mkdir(path.c_str(), 0755) == 0 || errno == EEXIST; }

std::set<pid_t> membersOf(const std::string& directory) {
    std::set<pid_t> pids;
    std::istringstream lines(readSmallFile(directory + "/cgroup.procs"));
    pid_t pid;
    while (lines >> pid) pids.insert(pid);
    return pids;
}

std::vector<std::string> entriesOf(const std::string& directory) {
    std::vector<std::string> names;
    DIR* d = ::opendir(directory.c_str());
    if (!d) return names;
    while (struct dirent* e = ::readdir(d)) {
        if (e->d_name[0] != '.') names.emplace_back(e->d_name);
    }
    ::closedir(d);
    return names;
}

}  // namespace

InstanceLimits::InstanceLimits(uint64_t tasks) : tasks_(tasks), records_(layout::runtimeDir() + "/spawnd/instances") {
    findV2();
    if (hierarchies_.empty()) findV1();
}

void InstanceLimits::findV2() {
    std::string own = placeOf("");
    if (own.empty() || ::access(own.c_str(), W_OK) != 0) return;
    auto available = words(readSmallFile(own + "/cgroup.controllers"), ' ');
    auto has = [&](const char* c) { return std::find(available.begin(), available.end(), c) != available.end(); };
    if (!has("pids") || !has("memory")) return;
    // A cgroup that hands controllers to its children holds no process itself: spawnd moves into a
    // leaf of its own first.
    std::string leaf = own + "/spawnd";
    if (!makeDirectory(leaf) || !writeSmallFile(leaf + "/cgroup.procs", "0")) return;
    std::string base = own + "/" + groupsName();
    if (!writeSmallFile(own + "/cgroup.subtree_control", "+pids +memory") || !makeDirectory(base) ||
        !writeSmallFile(base + "/cgroup.subtree_control", "+pids +memory"))
        return;
    hierarchies_.push_back(Hierarchy{base, true, "memory.max", true});
}

void InstanceLimits::findV1() {
    for (const char* controller : {"pids", "memory"}) {
        std::string own = placeOf(controller);
        if (own.empty() || ::access(own.c_str(), W_OK) != 0) continue;
        std::string base = own + "/" + groupsName();
        if (!makeDirectory(base)) continue;
        bool pids = std::strcmp(controller, "pids") == 0;
        hierarchies_.push_back(Hierarchy{base, false, pids ? "" : "memory.limit_in_bytes", pids});
    }
    // Memory alone bounds no tasks.
    if (std::none_of(hierarchies_.begin(), hierarchies_.end(), [](const Hierarchy& h) { return h.pids; }))
        hierarchies_.clear();
}

std::string InstanceLimits::description() const {
    if (hierarchies_.empty()) return "none";
    std::string text = hierarchies_.front().v2 ? "cgroup v2 at" : "cgroup v1 at";
    for (const Hierarchy& h : hierarchies_) text += " " + h.base;
    return text;
}

Result<InstanceLimits::Group> InstanceLimits::makeGroup() {
    Group group;
    std::string name = "i" + std::to_string(::getpid()) + "." + std::to_string(nextGroup_++);
    for (const Hierarchy& h : hierarchies_) {
        std::string directory = h.base + "/" + name;
        if (::mkdir(directory.c_str(), 0755) != 0) {
            int err = errno;
            endGroup(group);
            return Error::posix(err, "cgroup " + directory);
        }
        group.directories.push_back(directory);
        bool limited = !h.pids || writeSmallFile(directory + "/pids.max", std::to_string(tasks_));
        // A v1 hierarchy is joined through "tasks": the child is one thread, and moving one thread
        // does not wait for an RCU grace period as moving a thread group does (about 10 ms against
        // 0.05 ms here). A v2 cgroup has only cgroup.procs.
        int join = ::open((directory + (h.v2 ? "/cgroup.procs" : "/tasks")).c_str(), O_WRONLY | O_CLOEXEC);
        if (!limited || join < 0) {
            int err = errno;
            if (join >= 0) ::close(join);
            endGroup(group);
            return Error::posix(err, "cgroup " + directory);
        }
        group.joins.push_back(std::make_shared<FileDescriptor>(join));
    }
    return group;
}

void InstanceLimits::setMemory(const Group& group, uint64_t bytes) {
    for (size_t i = 0; i < group.directories.size() && i < hierarchies_.size(); ++i) {
        if (!hierarchies_[i].memoryFile.empty())
            (void)writeSmallFile(group.directories[i] + "/" + hierarchies_[i].memoryFile, std::to_string(bytes));
    }
}

void InstanceLimits::endGroupDirectory(const std::string& directory, bool v2) {
    if (v2 && writeSmallFile(directory + "/cgroup.kill", "1")) {
        // The kernel kills every member at once.
    } else {
        // Each member is held by a pidfd before it is killed, and killed only when it is still a
        // member then: a pid reused meanwhile is another process's.
        for (int round = 0; round < 3; ++round) {
            std::set<pid_t> members = membersOf(directory);
            if (members.empty()) break;
            std::vector<std::pair<pid_t, int>> held;
            for (pid_t pid : members) {
                long fd = ::syscall(SYS_pidfd_open, pid, 0);
                if (fd >= 0) held.emplace_back(pid, static_cast<int>(fd));
            }
            std::set<pid_t> still = membersOf(directory);
            for (auto [pid, fd] : held) {
                if (still.count(pid)) ::syscall(SYS_pidfd_send_signal, fd, SIGKILL, nullptr, 0);
                ::close(fd);
            }
        }
    }
    if (::rmdir(directory.c_str()) != 0 && errno != ENOENT) unremoved_.emplace_back(directory, v2);
}

void InstanceLimits::endGroup(const Group& group) {
    for (size_t i = 0; i < group.directories.size(); ++i)
        endGroupDirectory(group.directories[i], i < hierarchies_.size() && hierarchies_[i].v2);
}

void InstanceLimits::sweep() {
    std::vector<std::pair<std::string, bool>> pending;
    pending.swap(unremoved_);
    for (const auto& [directory, v2] : pending) endGroupDirectory(directory, v2);
}

void InstanceLimits::record(pid_t pid, uint64_t startTime) {
    if (!recordsMade_) recordsMade_ = layout::makeDirectories(records_, 0700).ok();
    std::string text = std::to_string(pid) + " " + std::to_string(startTime) + "\n";
    int fd = ::open((records_ + "/" + std::to_string(pid)).c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) return;
    (void)!::write(fd, text.data(), text.size());
    ::close(fd);
}

void InstanceLimits::forget(pid_t pid) { ::unlink((records_ + "/" + std::to_string(pid)).c_str()); }

void InstanceLimits::endLeftovers() {
    for (const Hierarchy& h : hierarchies_) {
        for (const std::string& name : entriesOf(h.base)) {
            if (name[0] == 'i') endGroupDirectory(h.base + "/" + name, h.v2);
        }
    }
    for (const std::string& name : entriesOf(records_)) {
        std::istringstream text(readSmallFile(records_ + "/" + name));
        pid_t pid = 0;
        uint64_t startTime = 0;
        ::unlink((records_ + "/" + name).c_str());
        if (!(text >> pid >> startTime) || pid <= 1) continue;
        // The instance, and the process group it leads (nothing in a sandbox leaves its group), only
        // while its pid still names it: a reused pid names another process, and a group whose leader
        // is gone cannot be told from another's. (Its cgroup, where there is one, ends the rest.)
        long fd = ::syscall(SYS_pidfd_open, pid, 0);
        if (fd < 0) continue;
        auto held = std::make_shared<FileDescriptor>(static_cast<int>(fd));
        if (rpx::processStartTime(pid) != startTime) continue;
        ::kill(-pid, SIGKILL);
        ::syscall(SYS_pidfd_send_signal, held->get(), SIGKILL, nullptr, 0);
    }
}

void InstanceLimits::removeAll() {
    sweep();
    for (const Hierarchy& h : hierarchies_) ::rmdir(h.base.c_str());
}

}  // namespace corvane::spawn
