#include "platform/spawn/Launch.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <linux/capability.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <vector>

#include "platform/spawn/Spawn.h"

namespace corvane::spawn {

namespace {

constexpr int kControlDescriptor = 3;
// Descriptors the child arranges are first moved at or above this, out of the way of 0 to 3.
constexpr int kHighDescriptor = 10;

struct ChildFailure {
    int error;
    char stage[48];
};

// The descriptors the child puts in place: standard input, output and error, the control
// connection, and the write end of the failure pipe.
struct ChildDescriptors {
    int null;
    int output;
    int control;
    int report;
    int ruleset;  // the confinement's Landlock ruleset
};

// Everything the child needs, ready before the clone: it may only make system calls.
struct ChildPlan {
    const char* executable;
    std::vector<char*> argv;
    std::vector<char*> envp;
    const char* workingDirectory;
    const Confinement* confinement;
    std::vector<int> joins;
    uint64_t memoryBytes;
    uint64_t descriptorLimit;
    pid_t parent;
    int lastCapability;
};

// The highest capability the running kernel knows.
int lastCapability() {
    static const int last = [] {
        FILE* f = std::fopen("/proc/sys/kernel/cap_last_cap", "re");
        int value = 63;
        if (f) {
            if (std::fscanf(f, "%d", &value) != 1) value = 63;
            std::fclose(f);
        }
        return value;
    }();
    return last;
}

// A system call that leaves errno alone: a prepared child runs beside the thread that made it, on
// that thread's errno, until its plan comes. The result, or -errno.
long rawSyscall(long number, long a = 0, long b = 0, long c = 0, long d = 0, long e = 0) {
#if defined(__x86_64__)
    long result;
    register long r10 __asm__("r10") = d;
    register long r8 __asm__("r8") = e;
    __asm__ volatile("syscall"
                     : "=a"(result)
                     : "a"(number), "D"(a), "S"(b), "d"(c), "r"(r10), "r"(r8)
                     : "rcx", "r11", "memory");
    return result;
#elif defined(__aarch64__)
    register long x8 __asm__("x8") = number;
    register long x0 __asm__("x0") = a;
    register long x1 __asm__("x1") = b;
    register long x2 __asm__("x2") = c;
    register long x3 __asm__("x3") = d;
    register long x4 __asm__("x4") = e;
    __asm__ volatile("svc 0" : "+r"(x0) : "r"(x8), "r"(x1), "r"(x2), "r"(x3), "r"(x4) : "memory");
    return x0;
#else
#error "no raw system call for this machine"
#endif
}

// Empties every capability set: bounding (which is what exec gives a root process), ambient,
// inheritable, permitted and effective. A process without CAP_SETPCAP cannot empty its bounding
// set, but then it holds no capability that exec could give back: no_new_privs keeps set-user-ID
// and file capabilities from adding any.
int dropCapabilities(int lastCapability) {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct held[2]{};
    if (::syscall(SYS_capget, &header, held) != 0) return errno;
    // CAP_SETPCAP empties the bounding set; a process without it (but a root one) holds nothing
    // that exec could give back.
    bool setpcap = held[0].effective & (1u << CAP_SETPCAP);
    if (!setpcap && ::geteuid() == 0) return EPERM;
    if (setpcap) {
        for (int cap = 0; cap <= lastCapability; ++cap) {
            if (::prctl(PR_CAPBSET_DROP, cap, 0, 0, 0) != 0 && errno != EINVAL) return errno;
        }
    }
    if (::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0) != 0 && errno != EINVAL) return errno;
    __user_cap_data_struct none[2]{};
    if (::syscall(SYS_capset, &header, none) != 0) return errno;
    return 0;
}

[[noreturn]] void failInChild(int report, const char* stage, int error) {
    ChildFailure failure{};
    failure.error = error;
    std::strncpy(failure.stage, stage, sizeof failure.stage - 1);
    [[maybe_unused]] ssize_t written = ::write(report, &failure, sizeof failure);
    ::_exit(127);
}

[[noreturn]] void runChild(const ChildPlan& plan, const ChildDescriptors& fds, bool joined) {
    // Its own process group, so that ending the instance ends whatever it started.
    if (::setpgid(0, 0) != 0) failInChild(fds.report, "setpgid", errno);
    if (::dup2(fds.null, 0) < 0 || ::dup2(fds.output, 1) < 0 || ::dup2(fds.output, 2) < 0 ||
        ::dup2(fds.control, kControlDescriptor) < 0) {
        failInChild(fds.report, "descriptors", errno);
    }
    // Ended with spawnd's launching thread; a spawnd already gone leaves nothing to wait for.
    if (::prctl(PR_SET_PDEATHSIG, SIGKILL, 0, 0, 0) != 0) failInChild(fds.report, "parent-death signal", errno);
    if (::getppid() != plan.parent) failInChild(fds.report, "parent-death signal", ESRCH);
    for (int join : plan.joins) {
        if (!joined && ::write(join, "0", 1) != 1) failInChild(fds.report, "cgroup", errno);
    }
    if (plan.memoryBytes) {
        rlimit memory{plan.memoryBytes, plan.memoryBytes};
        if (::setrlimit(RLIMIT_DATA, &memory) != 0) failInChild(fds.report, "memory limit", errno);
    }
    if (plan.descriptorLimit) {
        rlimit descriptors{};
        ::getrlimit(RLIMIT_NOFILE, &descriptors);
        descriptors.rlim_cur = std::min<rlim_t>(plan.descriptorLimit, descriptors.rlim_max);
        if (::setrlimit(RLIMIT_NOFILE, &descriptors) != 0) failInChild(fds.report, "descriptor limit", errno);
    }
    rlimit noCore{0, 0};
    ::setrlimit(RLIMIT_CORE, &noCore);
    if (int error = dropCapabilities(plan.lastCapability)) failInChild(fds.report, "capabilities", error);
    // Nothing else of spawnd's crosses the exec.
    ::syscall(SYS_close_range, kControlDescriptor + 1, ~0u, CLOSE_RANGE_CLOEXEC);
    if (::chdir(plan.workingDirectory) != 0) failInChild(fds.report, "chdir", errno);
    sigset_t none;
    sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
    const char* stage = "";
    if (int error = applyConfinement(*plan.confinement, fds.ruleset, &stage)) failInChild(fds.report, stage, error);
    ::execve(plan.executable, plan.argv.data(), plan.envp.data());
    failInChild(fds.report, "exec", errno);
}

int highCopy(int fd) { return ::fcntl(fd, F_DUPFD_CLOEXEC, kHighDescriptor); }

constexpr size_t kStackSize = 256 * 1024;
constexpr size_t kMaxJoins = 4;

// What a prepared child reads at its start (plain values: it shares the memory of spawnd).
struct Start {
    int channel;
    int joins[kMaxJoins];
    size_t joinCount;
    pid_t parent;
};

// The plan comes as a pointer into spawnd's memory, which the child shares; the descriptors come
// beside it.
struct Handover {
    const ChildPlan* plan;
};

[[noreturn]] void rawExit(int status) {
    rawSyscall(SYS_exit, status);
    __builtin_unreachable();
}

// A prepared child until its plan comes: raw system calls only, nothing of spawnd's kept.
int preparedMain(void* argument) {
    const Start start = *static_cast<const Start*>(argument);
    if (rawSyscall(SYS_prctl, PR_SET_PDEATHSIG, SIGKILL) != 0 || rawSyscall(SYS_getppid) != start.parent) rawExit(1);
    for (size_t i = 0; i < start.joinCount; ++i) {
        if (rawSyscall(SYS_write, start.joins[i], reinterpret_cast<long>("0"), 1) != 1) rawExit(1);
    }
    if (start.channel > 0) rawSyscall(SYS_close_range, 0, start.channel - 1, 0);
    rawSyscall(SYS_close_range, start.channel + 1, ~0u, 0);
    Handover handover{};
    iovec part{&handover, sizeof handover};
    alignas(cmsghdr) char space[CMSG_SPACE(sizeof(ChildDescriptors))] = {};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = space;
    message.msg_controllen = sizeof space;
    if (rawSyscall(SYS_recvmsg, start.channel, reinterpret_cast<long>(&message), MSG_CMSG_CLOEXEC) !=
        static_cast<long>(sizeof handover))
        rawExit(0);  // spawnd is done with it
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    if (!header || header->cmsg_type != SCM_RIGHTS || header->cmsg_len != CMSG_LEN(sizeof(ChildDescriptors))) rawExit(1);
    // From here the thread that made the child waits for its exec: errno is the child's alone.
    ChildDescriptors received{};
    std::memcpy(&received, CMSG_DATA(header), sizeof received);
    ChildDescriptors fds{highCopy(received.null), highCopy(received.output), highCopy(received.control),
                         highCopy(received.report), highCopy(received.ruleset)};
    for (int fd : {received.null, received.output, received.control, received.report, received.ruleset, start.channel})
        ::close(fd);
    if (fds.report < 0) rawExit(1);
    if (fds.null < 0 || fds.output < 0 || fds.control < 0 || fds.ruleset < 0) failInChild(fds.report, "descriptors", EMFILE);
    runChild(*handover.plan, fds, true);
}

}  // namespace

struct PreparedChild::Start : spawn::Start {};

Result<std::unique_ptr<PreparedChild>> PreparedChild::make(const std::vector<std::shared_ptr<FileDescriptor>>& joins) {
    if (joins.size() > kMaxJoins) return Error::posix(EINVAL, "prepared child");
    std::unique_ptr<PreparedChild> prepared(new PreparedChild);
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) return Error::posix(errno, "prepared child");
    prepared->channel_ = std::make_unique<FileDescriptor>(ends[0]);
    FileDescriptor theirs(ends[1]);
    prepared->start_ = std::make_unique<Start>();
    Start& start = *prepared->start_;
    start.channel = theirs.get();
    start.joinCount = joins.size();
    for (size_t i = 0; i < joins.size(); ++i) start.joins[i] = joins[i]->get();
    start.parent = ::getpid();
    prepared->stack_ = ::mmap(nullptr, kStackSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
    if (prepared->stack_ == MAP_FAILED) {
        prepared->stack_ = nullptr;
        return Error::posix(errno, "prepared child's stack");
    }
    int pidfd = -1;
    int pid = ::clone(preparedMain, static_cast<char*>(prepared->stack_) + kStackSize, CLONE_VM | CLONE_PIDFD | SIGCHLD,
                      &start, &pidfd);
    if (pid < 0) return Error::posix(errno, "clone");
    prepared->pid_ = pid;
    prepared->pidfd_ = std::make_shared<FileDescriptor>(pidfd);
    return prepared;
}

PreparedChild::~PreparedChild() {
    if (pidfd_) {
        // Its stack is ours: it goes only once the child is gone (spawnd's reaper reaps it).
        ::syscall(SYS_pidfd_send_signal, pidfd_->get(), SIGKILL, nullptr, 0);
        siginfo_t info{};
        ::waitid(P_PIDFD, static_cast<id_t>(pidfd_->get()), &info, WEXITED | WNOWAIT);
    }
    if (stack_) ::munmap(stack_, kStackSize);
}

Result<Launched> launch(const LaunchSettings& settings, std::unique_ptr<PreparedChild> prepared) {
    std::vector<std::string> environment;
    for (const auto& [name, value] : settings.environment) environment.push_back(name + "=" + value);
    environment.push_back(std::string(kControlDescriptorVariable) + "=" + std::to_string(kControlDescriptor));

    int pipeEnds[2];
    if (::pipe2(pipeEnds, O_CLOEXEC) != 0) return Error::posix(errno, "launch");
    FileDescriptor readEnd(pipeEnds[0]);
    auto report = std::make_unique<FileDescriptor>(highCopy(pipeEnds[1]));
    ::close(pipeEnds[1]);
    FileDescriptor null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    FileDescriptor output(highCopy(settings.output ? settings.output->get() : 2));
    FileDescriptor control(highCopy(settings.control ? settings.control->get() : -1));
    if (report->get() < 0 || null.get() < 0 || output.get() < 0 || control.get() < 0) {
        return Error::posix(errno ? errno : EBADF, "launch");
    }
    if (!settings.confinement.ruleset) return Error::posix(EINVAL, "launch without a confinement");
    ChildDescriptors fds{null.get(), output.get(), control.get(), report->get(), settings.confinement.ruleset->get()};

    ChildPlan plan{settings.executable.c_str(), {}, {}, settings.workingDirectory.c_str(), &settings.confinement,
                   {}, settings.memoryBytes, settings.descriptorLimit, ::getpid(), lastCapability()};
    // Above descriptor 3, like the others, so that the child's dup2s leave them alone.
    std::vector<std::unique_ptr<FileDescriptor>> joins;
    for (const auto& join : settings.joins) {
        joins.push_back(std::make_unique<FileDescriptor>(highCopy(join->get())));
        if (joins.back()->get() < 0) return Error::posix(errno, "launch");
        plan.joins.push_back(joins.back()->get());
    }
    plan.argv = {const_cast<char*>(settings.executable.c_str()), nullptr};
    for (std::string& entry : environment) plan.envp.push_back(entry.data());
    plan.envp.push_back(nullptr);

    Launched launched;
    void* stack = nullptr;
    bool handedOver = false;
    if (prepared) {
        // The plan and the descriptors go to the prepared child, which takes it from there.
        Handover handover{&plan};
        iovec part{&handover, sizeof handover};
        alignas(cmsghdr) char space[CMSG_SPACE(sizeof fds)] = {};
        msghdr message{};
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = space;
        message.msg_controllen = sizeof space;
        cmsghdr* header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof fds);
        std::memcpy(CMSG_DATA(header), &fds, sizeof fds);
        handedOver = ::sendmsg(prepared->channel_->get(), &message, MSG_NOSIGNAL) == static_cast<ssize_t>(sizeof handover);
        if (handedOver) {
            launched = Launched{prepared->pid_, prepared->pidfd_};
            stack = prepared->stack_;
            prepared->stack_ = nullptr;
            prepared->pidfd_ = nullptr;
        }
        prepared.reset();  // one that could not be reached is killed
    }
    if (!handedOver) {
        // Like posix_spawn: the child shares our memory and we wait until it has exec'd (or
        // failed), so no page table is copied. It runs on a stack of its own and makes only system
        // calls.
        stack = ::mmap(nullptr, kStackSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
        if (stack == MAP_FAILED) return Error::posix(errno, "launch stack");
        struct Direct {
            const ChildPlan* plan;
            const ChildDescriptors* fds;
        } direct{&plan, &fds};
        int pidfd = -1;
        int pid = ::clone(
            [](void* argument) -> int {
                auto* d = static_cast<Direct*>(argument);
                runChild(*d->plan, *d->fds, false);
            },
            static_cast<char*>(stack) + kStackSize, CLONE_VM | CLONE_VFORK | CLONE_PIDFD | SIGCHLD, &direct, &pidfd);
        int cloneError = errno;
        if (pid < 0) {
            ::munmap(stack, kStackSize);
            return Error::posix(cloneError, "clone");
        }
        launched = Launched{static_cast<pid_t>(pid), std::make_shared<FileDescriptor>(pidfd)};
    }

    report.reset();  // our copy of the write end: the read below ends at exec
    ChildFailure failure{};
    ssize_t n;
    while ((n = ::read(readEnd.get(), &failure, sizeof failure)) < 0 && errno == EINTR) {
    }
    if (n <= 0) {
        // Exec'd: its stack, if it ran on ours, is free.
        ::munmap(stack, kStackSize);
        return launched;
    }
    siginfo_t info{};
    ::waitid(P_PIDFD, static_cast<id_t>(launched.pidfd->get()), &info, WEXITED);
    ::munmap(stack, kStackSize);
    failure.stage[sizeof failure.stage - 1] = '\0';
    return Error::posix(failure.error, failure.stage);
}

}  // namespace corvane::spawn
