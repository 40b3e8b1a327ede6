#include "tests/support/TestSupport.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

extern char** environ;

namespace axtest {

TempDir::TempDir() {
    char tmpl[] = "/tmp/axtest.XXXXXX";
    if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
    path_ = tmpl;
}

TempDir::~TempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
}

PlatformRoot::PlatformRoot() {
    if (const char* prev = std::getenv("CORVANE_ROOT")) previous_ = prev;
    setenv("CORVANE_ROOT", dir_.path().c_str(), 1);
}

PlatformRoot::~PlatformRoot() {
    if (previous_) {
        setenv("CORVANE_ROOT", previous_->c_str(), 1);
    } else {
        unsetenv("CORVANE_ROOT");
    }
}

bool processGone(pid_t pid) {
    return eventually([pid] { return ::kill(pid, 0) != 0 && errno == ESRCH; }, std::chrono::seconds(5));
}

std::string binary(const std::string& name) {
    const char* bin = std::getenv("AX_BUILD_BIN");
    if (bin) return std::string(bin) + "/" + name;
    // Tests run from build/tests or build/bin; fall back to the directory of this program.
    char self[4096];
    ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
    if (n <= 0) return name;
    self[n] = 0;
    return std::filesystem::path(self).parent_path().string() + "/" + name;
}

std::string sourceDir() {
    const char* src = std::getenv("AX_SOURCE_DIR");
    return src ? src : ".";
}

void writeFile(const std::string& path, const std::string& contents, int mode) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream f(path, std::ios::binary | std::ios::trunc);
    f << contents;
    f.close();
    chmod(path.c_str(), static_cast<mode_t>(mode));
}

std::string readFile(const std::string& path) {
    std::ifstream f(path, std::ios::binary);
    std::stringstream ss;
    ss << f.rdbuf();
    return ss.str();
}

bool exists(const std::string& path) {
    struct stat st {};
    return lstat(path.c_str(), &st) == 0;
}

bool endpointAnswers(const std::string& path) {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return false;
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof addr.sun_path) {
        ::close(fd);
        return false;
    }
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    bool answered = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    ::close(fd);
    return answered;
}

namespace {

// Starts argv[0] with the environment changed by `env`, standard input from `inPath` and standard
// output and error into `outPath` and `errPath`; 0 or the error number of posix_spawn.
// Standard input is the file `inPath`, or the descriptor `inFd` when that is not negative.
int spawn(std::vector<std::string> argv, const std::map<std::string, std::string>& env,
          const std::string& inPath, const std::string& outPath, const std::string& errPath, pid_t* pid,
          int inFd = -1) {
    std::vector<std::string> envStrings;
    for (char** e = environ; *e; ++e) {
        std::string entry = *e;
        if (!env.count(entry.substr(0, entry.find('=')))) envStrings.push_back(entry);
    }
    for (const auto& [k, v] : env) envStrings.push_back(k + "=" + v);
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(a.data());
    args.push_back(nullptr);
    std::vector<char*> envp;
    for (auto& e : envStrings) envp.push_back(e.data());
    envp.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (inFd >= 0) {
        posix_spawn_file_actions_adddup2(&actions, inFd, 0);
    } else {
        posix_spawn_file_actions_addopen(&actions, 0, inPath.c_str(), O_RDONLY, 0);
    }
    posix_spawn_file_actions_addopen(&actions, 1, outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    int rc = posix_spawn(pid, args[0], &actions, nullptr, args.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    return rc;
}

}  // namespace

Process::Process(std::vector<std::string> argv, std::map<std::string, std::string> env, Input input) {
    int ends[2] = {-1, -1};
    if (input == Input::OpenPipe && ::pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe");
    int rc = spawn(argv, env, "/dev/null", files_ / "out", files_ / "err", &pid_, ends[0]);
    if (ends[0] >= 0) ::close(ends[0]);
    input_ = ends[1];
    if (rc != 0) throw std::runtime_error("cannot start " + argv[0] + ": " + std::strerror(rc));
}

void Process::closeInput() {
    if (input_ >= 0) ::close(input_);
    input_ = -1;
}

Process::~Process() {
    closeInput();
    if (!reaped_ && pid_ > 0) {
        kill(pid_, SIGKILL);
        int status = 0;
        waitpid(pid_, &status, 0);
    }
}

std::optional<int> Process::wait(std::chrono::milliseconds timeout) {
    if (reaped_) return std::nullopt;
    auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        int status = 0;
        pid_t r = waitpid(pid_, &status, WNOHANG);
        if (r == pid_) {
            reaped_ = true;
            if (WIFEXITED(status)) return WEXITSTATUS(status);
            return 128 + WTERMSIG(status);
        }
        if (std::chrono::steady_clock::now() > deadline) return std::nullopt;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
}

void Process::signal(int sig) {
    if (!reaped_) kill(pid_, sig);
}

std::string Process::out() const { return readFile(files_ / "out"); }
std::string Process::err() const { return readFile(files_ / "err"); }

bool eventually(const std::function<bool()>& predicate, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!predicate()) {
        if (std::chrono::steady_clock::now() >= deadline) return predicate();
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

bool Process::waitForErr(const std::string& text, std::chrono::milliseconds timeout) const {
    return eventually([&] { return err().find(text) != std::string::npos; }, timeout);
}

bool Process::waitForOut(const std::string& text, std::chrono::milliseconds timeout) const {
    return eventually([&] { return out().find(text) != std::string::npos; }, timeout);
}

RunResult run(std::vector<std::string> argv, std::map<std::string, std::string> env,
              const std::string& input) {
    TempDir dir;
    std::string inPath = dir / "in";
    std::string outPath = dir / "out";
    std::string errPath = dir / "err";
    writeFile(inPath, input);
    pid_t pid = -1;
    int rc = spawn(std::move(argv), env, inPath, outPath, errPath, &pid);
    if (rc != 0) return {127, "", std::string("cannot start: ") + std::strerror(rc)};
    int status = 0;
    waitpid(pid, &status, 0);
    int code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return {code, readFile(outPath), readFile(errPath)};
}

}  // namespace axtest
