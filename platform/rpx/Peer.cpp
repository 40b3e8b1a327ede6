// Peer identity: credentials from SO_PEERCRED, a pidfd, the executable and its start time.
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/rpx/Internal.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace corvane::rpx {

namespace {

std::string readLink(const std::string& path, size_t max) {
    std::string buf(max, '\0');
    ssize_t n = readlink(path.c_str(), buf.data(), max);
    if (n <= 0 || static_cast<size_t>(n) >= max) return {};
    buf.resize(static_cast<size_t>(n));
    return buf;
}

uint64_t startTimeOf(pid_t pid) {
    FILE* f = std::fopen(("/proc/" + std::to_string(pid) + "/stat").c_str(), "re");
    if (!f) return 0;
    char buf[1024];
    size_t n = std::fread(buf, 1, sizeof buf - 1, f);
    std::fclose(f);
    buf[n] = 0;
    // Field 22; the command name (field 2) may hold spaces and parentheses, so count from the last
    // ')'.
    char* p = std::strrchr(buf, ')');
    if (!p) return 0;
    int field = 2;
    for (; *p && field < 22; ++p)
        if (*p == ' ') ++field;
    return std::strtoull(p, nullptr, 10);
}

std::shared_ptr<FileDescriptor> peerPidfd(int sock, pid_t pid) {
    int pidfd = -1;
    socklen_t len = sizeof pidfd;
    if (getsockopt(sock, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0 && pidfd >= 0)
        return std::make_shared<FileDescriptor>(pidfd);
    long fd = syscall(SYS_pidfd_open, pid, 0);
    if (fd >= 0) return std::make_shared<FileDescriptor>(static_cast<int>(fd));
    return nullptr;
}

}  // namespace

uint64_t processStartTime(pid_t pid) { return startTimeOf(pid); }

PeerIdentity internal::identityOfSocket(int sock) {
    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (getsockopt(sock, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return {};
    return identityOfProcess(cred.pid, cred.uid, cred.gid, peerPidfd(sock, cred.pid));
}

PeerIdentity identityOfProcess(pid_t pid, uid_t uid, gid_t gid, std::shared_ptr<FileDescriptor> pidfd) {
    PeerIdentity p;
    p.pid = pid;
    p.uid = uid;
    p.gid = gid;
    std::string exe = "/proc/" + std::to_string(pid) + "/exe";
    p.executablePath = readLink(exe, 2048);
    p.auditToken.pid = pid;
    p.auditToken.uid = uid;
    p.auditToken.gid = gid;
    p.auditToken.pidfd = std::move(pidfd);
    struct stat st {};
    if (::stat(exe.c_str(), &st) == 0) {
        p.auditToken.exeDevice = st.st_dev;
        p.auditToken.exeInode = st.st_ino;
    }
    p.auditToken.startTime = startTimeOf(pid);
    return p;
}

}  // namespace corvane::rpx
