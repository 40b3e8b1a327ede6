// Helpers for tests: private platform roots, the build's binaries, child processes.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace axtest {

// Whether this build runs under AddressSanitizer, whose programs reserve terabytes of address space
// at their start (so no data limit fits them).
#if defined(__has_feature)
#if __has_feature(address_sanitizer)
inline constexpr bool kAddressSanitizer = true;
#else
inline constexpr bool kAddressSanitizer = false;
#endif
#else
inline constexpr bool kAddressSanitizer = false;
#endif

// spawnd's options for this build: under the sanitizers its instances get no data limit.
inline std::vector<std::string> spawndOptions() {
    return kAddressSanitizer ? std::vector<std::string>{"--memory-mib", "0"} : std::vector<std::string>{};
}

// A fresh directory under /tmp, removed with everything in it on destruction.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;
    const std::string& path() const { return path_; }
    std::string operator/(const std::string& name) const { return path_ + "/" + name; }

private:
    std::string path_;
};

// A private platform root: a TempDir that CORVANE_ROOT points at while the object lives.
class PlatformRoot {
public:
    PlatformRoot();
    ~PlatformRoot();
    const std::string& path() const { return dir_.path(); }
    std::string operator/(const std::string& name) const { return dir_ / name; }

private:
    TempDir dir_;
    std::optional<std::string> previous_;
};

// Polls `predicate` every few milliseconds until it holds or `timeout` passes; its last answer.
bool eventually(const std::function<bool()>& predicate,
                std::chrono::milliseconds timeout = std::chrono::seconds(10));

// Polls until no process has the pid (up to five seconds); whether that happened.
bool processGone(pid_t pid);

// Path of a program of this build (build/bin/NAME).
std::string binary(const std::string& name);
// The source tree's root.
std::string sourceDir();

void writeFile(const std::string& path, const std::string& contents, int mode = 0644);
std::string readFile(const std::string& path);
bool exists(const std::string& path);
// Whether a listening Unix socket at `path` accepts a connection.
bool endpointAnswers(const std::string& path);

// A child process with its standard output and error collected in files.
class Process {
public:
    // Standard input: /dev/null, or a pipe that stays open until closeInput() or destruction.
    enum class Input { Null, OpenPipe };
    // Starts argv[0] (a path) with the current environment plus `env`.
    Process(std::vector<std::string> argv, std::map<std::string, std::string> env = {}, Input input = Input::Null);
    ~Process();  // kills (SIGKILL) and reaps the child if it still runs
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    pid_t pid() const { return pid_; }
    // Ends the standard input of an Input::OpenPipe process.
    void closeInput();
    // Waits for the exit; returns the exit status, 128+signal for a signal, or nullopt on timeout.
    std::optional<int> wait(std::chrono::milliseconds timeout = std::chrono::seconds(30));
    void signal(int sig);
    std::string out() const;
    std::string err() const;
    // Polls until the standard error contains `text`.
    bool waitForErr(const std::string& text,
                    std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
    // Polls until the standard output contains `text`.
    bool waitForOut(const std::string& text,
                    std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

private:
    pid_t pid_ = -1;
    int input_ = -1;
    bool reaped_ = false;
    TempDir files_;
};

// Runs a program to its end and returns (status, stdout, stderr).
struct RunResult {
    int status;
    std::string out;
    std::string err;
};
RunResult run(std::vector<std::string> argv, std::map<std::string, std::string> env = {},
              const std::string& input = {});

}  // namespace axtest

namespace corvane {
// A failed expectation on values shows them in the text notation.
inline void PrintTo(const Value& value, std::ostream* out) { *out << value.description(); }
}  // namespace corvane
