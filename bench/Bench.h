// axbench: one program, one subcommand per measurement. A subcommand registers itself from its own
// file with AX_BENCH_SUBCOMMAND(name, "one line of help", function). Every subcommand prints its
// figures and, as its last line, "RESULT <name> key=value ...".
#pragma once

#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

extern char** environ;

namespace axbench {

using Run = int (*)(int argc, char** argv);
bool registerSubcommand(const char* name, const char* help, Run run);

// Percentile (0..100) of a list of samples; sorts them.
inline double percentile(std::vector<double>& samples, double p) {
    if (samples.empty()) return 0;
    std::sort(samples.begin(), samples.end());
    size_t i = static_cast<size_t>(p / 100.0 * static_cast<double>(samples.size() - 1) + 0.5);
    return samples[std::min(i, samples.size() - 1)];
}

// A process's resident memory in KiB, from /proc; 0 when it cannot be read.
inline long residentKiB(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line))
        if (line.rfind("VmRSS:", 0) == 0) return std::atol(line.c_str() + 6);
    return 0;
}

inline double microsSince(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count();
}

// Starts a program (argv[0] a path) without waiting for it; 0 when it cannot be started.
inline pid_t startProgram(std::vector<std::string> argv, const posix_spawn_file_actions_t* actions = nullptr,
                          char* const* environment = environ) {
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(a.data());
    args.push_back(nullptr);
    pid_t pid = 0;
    return posix_spawn(&pid, args[0], actions, nullptr, args.data(), environment) == 0 ? pid : 0;
}

// Waits (up to five seconds) until a daemon's socket exists.
inline void waitForSocket(const std::string& path) {
    for (int i = 0; i < 1000 && ::access(path.c_str(), F_OK) != 0; ++i) ::usleep(5000);
}

// Pins the calling thread (and the children it forks from now on) to one CPU.
inline void pinTo(int cpu) {
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    sched_setaffinity(0, sizeof set, &set);
}

inline bool readFull(int fd, char* p, size_t n) {
    while (n) {
        ssize_t r = ::read(fd, p, n);
        if (r <= 0) return false;
        p += r;
        n -= static_cast<size_t>(r);
    }
    return true;
}

// The far end of a ping-pong, pinned to CPU 1: reads `request` bytes and answers `reply` bytes
// until the socket closes, then exits. For a child forked before the caller starts any thread.
[[noreturn]] inline void echo(int fd, size_t request, size_t reply) {
    pinTo(1);
    std::vector<char> in(request), out(reply, 'x');
    while (readFull(fd, in.data(), in.size()))
        if (::write(fd, out.data(), out.size()) != static_cast<ssize_t>(out.size())) break;
    _exit(0);
}

// Whether the arguments hold `flag` (a flag without a value).
inline bool hasFlag(int argc, char** argv, const char* flag) {
    for (int i = 1; i < argc; ++i)
        if (std::strcmp(argv[i], flag) == 0) return true;
    return false;
}

// "--busy": the figures under load. While it lives, a process spins on CPU 1, the core the daemons
// and the far ends of ping-pongs are pinned to, at the same priority as they are.
class BusyCore {
public:
    explicit BusyCore(bool busy) {
        if (!busy) return;
        pid_ = fork();
        if (pid_ == 0) {
            // Holding no descriptor of the caller's: a socket it closes must reach its end.
            ::close_range(3, ~0U, 0);
            pinTo(1);
            for (;;) __asm__ volatile("");
        }
        if (pid_ < 0) pid_ = 0;
    }
    ~BusyCore() {
        if (pid_ <= 0) return;
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    BusyCore(const BusyCore&) = delete;
    BusyCore& operator=(const BusyCore&) = delete;

private:
    pid_t pid_ = 0;
};

}  // namespace axbench

#define AX_BENCH_SUBCOMMAND(name, help, fn) \
    static const bool axbench_registered_##fn = axbench::registerSubcommand(name, help, fn)
