#include "platform/spawn/Launch.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
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

// Everything the child needs, ready before the clone: it may only make system calls.
struct ChildPlan {
    const char* executable;
    std::vector<char*> argv;
    std::vector<char*> envp;
    const char* workingDirectory;
    int null;
    int output;
    int control;
    int report;  // the write end of the failure pipe
    const Confinement* confinement;
};

[[noreturn]] void failInChild(const ChildPlan& plan, const char* stage, int error) {
    ChildFailure failure{};
    failure.error = error;
    std::strncpy(failure.stage, stage, sizeof failure.stage - 1);
    [[maybe_unused]] ssize_t written = ::write(plan.report, &failure, sizeof failure);
    ::_exit(127);
}

[[noreturn]] void runChild(const ChildPlan& plan) {
    // Its own process group, so that ending the instance ends whatever it started.
    if (::setpgid(0, 0) != 0) failInChild(plan, "setpgid", errno);
    if (::dup2(plan.null, 0) < 0 || ::dup2(plan.output, 1) < 0 || ::dup2(plan.output, 2) < 0 ||
        ::dup2(plan.control, kControlDescriptor) < 0) {
        failInChild(plan, "descriptors", errno);
    }
    // Nothing else of spawnd's crosses the exec.
    ::syscall(SYS_close_range, kControlDescriptor + 1, ~0u, CLOSE_RANGE_CLOEXEC);
    if (::chdir(plan.workingDirectory) != 0) failInChild(plan, "chdir", errno);
    sigset_t none;
    sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
    const char* stage = "";
    if (int error = applyConfinement(*plan.confinement, &stage)) failInChild(plan, stage, error);
    ::execve(plan.executable, plan.argv.data(), plan.envp.data());
    failInChild(plan, "exec", errno);
}

int highCopy(int fd) { return ::fcntl(fd, F_DUPFD_CLOEXEC, kHighDescriptor); }

}  // namespace

Result<Launched> launch(const LaunchSettings& settings) {
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

    ChildPlan plan{settings.executable.c_str(), {}, {}, settings.workingDirectory.c_str(),
                   null.get(), output.get(), control.get(), report->get(), &settings.confinement};
    plan.argv = {const_cast<char*>(settings.executable.c_str()), nullptr};
    for (std::string& entry : environment) plan.envp.push_back(entry.data());
    plan.envp.push_back(nullptr);

    // Like posix_spawn: the child shares our memory and we wait until it has exec'd (or failed), so
    // no page table is copied. It runs on a stack of its own and makes only system calls.
    constexpr size_t kStackSize = 256 * 1024;
    void* stack = ::mmap(nullptr, kStackSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
    if (stack == MAP_FAILED) return Error::posix(errno, "launch stack");
    int pidfd = -1;
    int pid = ::clone(
        [](void* argument) -> int { runChild(*static_cast<const ChildPlan*>(argument)); },
        static_cast<char*>(stack) + kStackSize, CLONE_VM | CLONE_VFORK | CLONE_PIDFD | SIGCHLD, &plan, &pidfd);
    int cloneError = errno;
    ::munmap(stack, kStackSize);
    if (pid < 0) return Error::posix(cloneError, "clone");

    Launched launched{static_cast<pid_t>(pid), std::make_shared<FileDescriptor>(pidfd)};
    report.reset();  // our copy of the write end: the read below ends at exec
    ChildFailure failure{};
    ssize_t n;
    while ((n = ::read(readEnd.get(), &failure, sizeof failure)) < 0 && errno == EINTR) {
    }
    if (n <= 0) return launched;
    siginfo_t info{};
    ::waitid(P_PIDFD, static_cast<id_t>(pidfd), &info, WEXITED);
    failure.stage[sizeof failure.stage - 1] = '\0';
    return Error::posix(failure.error, failure.stage);
}

}  // namespace corvane::spawn
