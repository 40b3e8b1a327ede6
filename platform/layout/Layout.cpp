#include "platform/layout/Layout.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace corvane::layout {

namespace {

std::string env(const char* name) {
    const char* v = std::getenv(name);
    return v ? std::string(v) : std::string();
}

}  // namespace

std::string root() {
    std::string r = env("CORVANE_ROOT");
    while (r.size() > 1 && r.back() == '/') r.pop_back();
    if (r == "/") r.clear();
    return r;
}

std::string underRoot(const std::string& absolutePath) { return root() + absolutePath; }

std::string runtimeDir() {
    std::string uid = std::to_string(getuid());
    std::string r = root();
    if (!r.empty()) return r + "/run/user/" + uid;
    std::string xdg = env("XDG_RUNTIME_DIR");
    return xdg.empty() ? "/run/user/" + uid : xdg;
}

namespace {

Error placeError(int err, std::string text) { return Error{kPosixErrorDomain, err, std::move(text)}; }

}  // namespace

Status checkPlaces(bool runtime) {
    if (const char* given = std::getenv("CORVANE_ROOT"); given && *given) {
        std::string named = std::string("CORVANE_ROOT=") + given;
        if (given[0] != '/') return placeError(EINVAL, named + " is not an absolute path");
        struct stat st {};
        if (::stat(given, &st) != 0) return placeError(errno, named + ": " + std::strerror(errno));
        if (!S_ISDIR(st.st_mode)) return placeError(ENOTDIR, named + " is not a directory");
        return {};
    }
    if (!runtime || !env("XDG_RUNTIME_DIR").empty()) return {};
    std::string fallback = "/run/user/" + std::to_string(getuid());
    const std::string advice = " (run it in a user session, under systemd --user, or set XDG_RUNTIME_DIR to a directory "
                               "of your own, mode 0700)";
    struct stat st {};
    if (::stat(fallback.c_str(), &st) != 0) {
        int err = errno;
        return placeError(err, "XDG_RUNTIME_DIR is not set, and " + fallback + ": " + std::strerror(err) + advice);
    }
    if (!S_ISDIR(st.st_mode) || st.st_uid != getuid())
        return placeError(EACCES, "XDG_RUNTIME_DIR is not set, and " + fallback + " is not this user's" + advice);
    return {};
}

std::string homeDir() {
    std::string r = root();
    if (!r.empty()) return r + "/home";
    std::string home = env("HOME");
    return home.empty() ? "/" : home;
}

std::string userDataDir() {
    if (root().empty()) {
        std::string xdg = env("XDG_DATA_HOME");
        if (!xdg.empty()) return xdg + "/corvane";
    }
    return homeDir() + "/.local/share/corvane";
}

std::string userConfigDir() {
    if (root().empty()) {
        std::string xdg = env("XDG_CONFIG_HOME");
        if (!xdg.empty()) return xdg + "/corvane";
    }
    return homeDir() + "/.config/corvane";
}

std::string userStateDir() {
    if (root().empty()) {
        std::string xdg = env("XDG_STATE_HOME");
        if (!xdg.empty()) return xdg + "/corvane";
    }
    return homeDir() + "/.local/state/corvane";
}

std::string stateDir() { return underRoot("/var/lib/corvane"); }
std::string configDir() { return underRoot("/etc/corvane"); }
std::string sharedDataDir() { return underRoot("/usr/share/corvane"); }
std::string systemRoot() { return underRoot("/usr"); }
std::string systemApplicationsDir() { return underRoot("/usr/lib/corvane/Applications"); }
std::string userApplicationsDir() { return userDataDir() + "/Applications"; }

bool isBeneath(const std::string& path, const std::string& directory) {
    return path.size() >= directory.size() && path.compare(0, directory.size(), directory) == 0 &&
           (path.size() == directory.size() || path[directory.size()] == '/');
}

Status makeDirectories(const std::string& path, mode_t mode) {
    if (path.empty()) return Error::posix(ENOENT, path);
    std::string partial;
    size_t pos = 0;
    while (pos != std::string::npos) {
        size_t slash = path.find('/', pos + 1);
        partial = path.substr(0, slash);
        pos = slash;
        if (partial.empty() || partial == "/") continue;
        if (::mkdir(partial.c_str(), mode) != 0 && errno != EEXIST)
            return Error::posix(errno, partial);
    }
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return Error::posix(errno, path);
    if (!S_ISDIR(st.st_mode)) return Error::posix(ENOTDIR, path);
    return {};
}

std::optional<std::string> canonicalPath(const std::string& path) {
    // The kernel resolves the whole path once and names what it found: three system calls where
    // realpath(3) reads every component's link. O_PATH opens nothing (a FIFO or device is not
    // touched). Where /proc cannot say (not mounted, or the file went away), realpath decides.
    int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    char link[32];
    std::snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
    char buf[PATH_MAX];
    ssize_t n = ::readlink(link, buf, sizeof buf);
    struct stat st {};
    bool named = n > 0 && static_cast<size_t>(n) < sizeof buf && buf[0] == '/' && ::fstat(fd, &st) == 0 &&
                 st.st_nlink > 0;
    ::close(fd);
    if (named) return std::string(buf, static_cast<size_t>(n));
    if (!realpath(path.c_str(), buf)) return std::nullopt;
    return std::string(buf);
}

}  // namespace corvane::layout
