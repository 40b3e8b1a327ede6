#include "platform/spawn/Confinement.h"

#include <fcntl.h>
#include <linux/seccomp.h>
#include <sched.h>
#include <seccomp.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>

namespace corvane::spawn {

namespace {

// Landlock's interface as of ABI 6; the system's headers may be older than the kernel.
struct RulesetAttr {
    uint64_t handledAccessFs;
    uint64_t handledAccessNet;
    uint64_t scoped;
};
struct __attribute__((packed)) PathBeneathAttr {
    uint64_t allowedAccess;
    int32_t parentFd;
};
constexpr int kRulePathBeneath = 1;
constexpr unsigned kCreateRulesetVersion = 1;

constexpr uint64_t kExecute = 1ull << 0;
constexpr uint64_t kWriteFile = 1ull << 1;
constexpr uint64_t kReadFile = 1ull << 2;
constexpr uint64_t kReadDir = 1ull << 3;
constexpr uint64_t kRefer = 1ull << 13;     // ABI 2
constexpr uint64_t kTruncate = 1ull << 14;  // ABI 3
constexpr uint64_t kIoctlDev = 1ull << 15;  // ABI 5
constexpr uint64_t kNetBindTcp = 1ull << 0;     // ABI 4
constexpr uint64_t kNetConnectTcp = 1ull << 1;  // ABI 4
constexpr uint64_t kScopeAbstractUnixSocket = 1ull << 0;  // ABI 6
constexpr uint64_t kScopeSignal = 1ull << 1;              // ABI 6

// Every file-system right the kernel of this ABI knows: the ruleset handles them all, so that
// what no rule grants is denied.
uint64_t fileSystemRights(int abi) {
    uint64_t rights = (1ull << 13) - 1;  // ABI 1: execute .. make_sym
    if (abi >= 2) rights |= kRefer;
    if (abi >= 3) rights |= kTruncate;
    if (abi >= 5) rights |= kIoctlDev;
    return rights;
}

struct Profile {
    const char* name;
    bool tcp;           // may bind and connect TCP ports
    bool inetSockets;   // may make IPv4 and IPv6 sockets at all
    bool homeWritable;  // may write in its data container, not only in TMPDIR
};

constexpr Profile kProfiles[] = {
    {"plugin", false, true, true},
    {"keyboard", false, false, true},
    {"network-filter", true, true, true},
    {"glancerd", false, true, false},
    {"sandpit-devtools", true, true, true},
};

const Profile* findProfile(const std::string& name) {
    for (const Profile& profile : kProfiles) {
        if (name == profile.name) return &profile;
    }
    return nullptr;
}

// What every profile denies, with EPERM: debugging other processes, changing what the file system
// or the namespaces look like, kernel modules and images, keyrings, and leaving the instance's
// process group (spawnd ends an instance by its group, children included).
constexpr int kDeniedCalls[] = {
    SCMP_SYS(ptrace), SCMP_SYS(process_vm_readv), SCMP_SYS(process_vm_writev),
    SCMP_SYS(mount), SCMP_SYS(umount2), SCMP_SYS(pivot_root), SCMP_SYS(chroot),
    SCMP_SYS(move_mount), SCMP_SYS(open_tree), SCMP_SYS(fsopen), SCMP_SYS(fsmount),
    SCMP_SYS(fsconfig), SCMP_SYS(fspick), SCMP_SYS(mount_setattr),
    SCMP_SYS(init_module), SCMP_SYS(finit_module), SCMP_SYS(delete_module),
    SCMP_SYS(kexec_load), SCMP_SYS(kexec_file_load), SCMP_SYS(reboot),
    SCMP_SYS(unshare), SCMP_SYS(setns),
    SCMP_SYS(add_key), SCMP_SYS(request_key), SCMP_SYS(keyctl),
    SCMP_SYS(bpf), SCMP_SYS(swapon), SCMP_SYS(swapoff), SCMP_SYS(acct),
    SCMP_SYS(setsid), SCMP_SYS(setpgid),
};
// (CLONE_NEWTIME only exists for clone3 and unshare: in clone's flags its bit is the exit signal's.)
constexpr uint64_t kNamespaceFlags = CLONE_NEWNS | CLONE_NEWUTS | CLONE_NEWIPC | CLONE_NEWUSER | CLONE_NEWPID |
                                     CLONE_NEWNET | CLONE_NEWCGROUP;

Result<std::vector<sock_filter>> compileFilter(const Profile& profile) {
    scmp_filter_ctx ctx = seccomp_init(SCMP_ACT_ALLOW);
    if (!ctx) return Error::posix(ENOMEM, "seccomp filter");
    int rc = 0;
    for (int call : kDeniedCalls) {
        if (rc == 0) rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(EPERM), call, 0);
    }
    // clone3 passes its flags in memory, out of the filter's sight: refuse it as unknown, and C
    // libraries fall back to clone, whose flags the filter sees.
    if (rc == 0) rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(clone3), 0);
    if (rc == 0) {
        // Any namespace flag: the masked flags are not zero.
        for (uint64_t flag = 1; flag != 0; flag <<= 1) {
            if (!(kNamespaceFlags & flag) || rc != 0) continue;
            scmp_arg_cmp withFlag{0, SCMP_CMP_MASKED_EQ, flag, flag};
            rc = seccomp_rule_add_array(ctx, SCMP_ACT_ERRNO(EPERM), SCMP_SYS(clone), 1, &withFlag);
        }
    }
    if (!profile.inetSockets) {
        for (int family : {AF_INET, AF_INET6}) {
            if (rc == 0) {
                scmp_arg_cmp ofFamily{0, SCMP_CMP_EQ, static_cast<scmp_datum_t>(family), 0};
                rc = seccomp_rule_add_array(ctx, SCMP_ACT_ERRNO(EACCES), SCMP_SYS(socket), 1, &ofFamily);
            }
        }
    }
    std::vector<sock_filter> program;
    if (rc == 0) {
        int memory = ::memfd_create("seccomp", MFD_CLOEXEC);
        rc = memory < 0 ? -errno : seccomp_export_bpf(ctx, memory);
        off_t size = rc == 0 ? ::lseek(memory, 0, SEEK_END) : -1;
        if (size > 0 && size % sizeof(sock_filter) == 0) {
            program.resize(static_cast<size_t>(size) / sizeof(sock_filter));
            if (::pread(memory, program.data(), static_cast<size_t>(size), 0) != size) rc = -EIO;
        } else if (rc == 0) {
            rc = -EIO;
        }
        if (memory >= 0) ::close(memory);
    }
    seccomp_release(ctx);
    if (rc != 0) return Error::posix(-rc, "seccomp filter");
    return program;
}

// The filters depend only on the profile: compiled once each.
Result<std::shared_ptr<const std::vector<sock_filter>>> filterFor(const Profile& profile) {
    static std::mutex mutex;
    static std::map<std::string, std::shared_ptr<const std::vector<sock_filter>>> filters;
    std::lock_guard lock(mutex);
    auto& filter = filters[profile.name];
    if (!filter) {
        auto compiled = compileFilter(profile);
        if (!compiled) return compiled.error();
        filter = std::make_shared<const std::vector<sock_filter>>(std::move(*compiled));
    }
    return filter;
}

Status addRule(int ruleset, const std::string& path, uint64_t rights) {
    int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
    if (fd < 0) return Error::posix(errno, "sandbox path " + path);
    PathBeneathAttr rule{rights, fd};
    long rc = ::syscall(SYS_landlock_add_rule, ruleset, kRulePathBeneath, &rule, 0);
    int err = errno;
    ::close(fd);
    if (rc != 0) return Error::posix(err, "sandbox rule for " + path);
    return {};
}

bool isDirectory(const char* path) {
    struct stat st {};
    return ::stat(path, &st) == 0 && S_ISDIR(st.st_mode);
}

}  // namespace

const std::vector<std::string>& knownProfiles() {
    static const std::vector<std::string> names = [] {
        std::vector<std::string> list;
        for (const Profile& profile : kProfiles) list.emplace_back(profile.name);
        return list;
    }();
    return names;
}

int landlockAbi() {
    long abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, kCreateRulesetVersion);
    return abi < 0 ? 0 : static_cast<int>(abi);
}

Result<Confinement> prepareConfinement(const std::string& name, const ConfinementPaths& paths) {
    const Profile* profile = findProfile(name);
    if (!profile) return Error::posix(EINVAL, "unknown sandbox profile \"" + name + "\"");
    int abi = landlockAbi();
    if (abi < 1) return Error::posix(ENOSYS, "the kernel has no Landlock: plug-ins cannot be confined");
    if (!profile->tcp && abi < 4) {
        return Error::posix(ENOSYS, "the kernel's Landlock (ABI " + std::to_string(abi) +
                                        ") cannot restrict TCP, which the \"" + name + "\" profile needs");
    }
    auto filter = filterFor(*profile);
    if (!filter) return filter.error();

    uint64_t all = fileSystemRights(abi);
    RulesetAttr attributes{all, profile->tcp ? 0 : (kNetBindTcp | kNetConnectTcp),
                           abi >= 6 ? (kScopeAbstractUnixSocket | kScopeSignal) : 0};
    size_t size = abi >= 6 ? sizeof attributes : abi >= 4 ? 2 * sizeof(uint64_t) : sizeof(uint64_t);
    long fd = ::syscall(SYS_landlock_create_ruleset, &attributes, size, 0);
    if (fd < 0) return Error::posix(errno, "Landlock ruleset");
    auto ruleset = std::make_shared<FileDescriptor>(static_cast<int>(fd));

    const uint64_t read = kReadFile | kReadDir;
    const uint64_t readExecute = read | kExecute;
    // The system's programs, libraries and configuration, and what the C library reads at run time.
    for (const char* dir : {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32", "/etc", "/opt", "/proc", "/sys"}) {
        if (!isDirectory(dir)) continue;
        if (auto added = addRule(ruleset->get(), dir, readExecute); !added.ok()) return added.error();
    }
    uint64_t device = kReadFile | kWriteFile | (abi >= 3 ? kTruncate : 0);
    for (const char* node : {"/dev/null", "/dev/zero", "/dev/full", "/dev/random", "/dev/urandom"}) {
        if (::access(node, F_OK) != 0) continue;
        if (auto added = addRule(ruleset->get(), node, device); !added.ok()) return added.error();
    }
    if (auto added = addRule(ruleset->get(), paths.bundle, readExecute); !added.ok()) return added.error();
    if (!paths.home.empty()) {
        auto added = addRule(ruleset->get(), paths.home, profile->homeWritable ? all : read);
        if (!added.ok()) return added.error();
    }
    if (!paths.tmpdir.empty()) {
        if (auto added = addRule(ruleset->get(), paths.tmpdir, all); !added.ok()) return added.error();
    }
    return Confinement{name, std::move(ruleset), std::move(*filter)};
}

int applyConfinement(const Confinement& confinement, const char** stage) {
    *stage = "no_new_privs";
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return errno;
    *stage = "landlock";
    if (!confinement.ruleset || ::syscall(SYS_landlock_restrict_self, confinement.ruleset->get(), 0) != 0) {
        return confinement.ruleset ? errno : EINVAL;
    }
    *stage = "seccomp";
    if (!confinement.filter) return EINVAL;
    sock_fprog program{static_cast<unsigned short>(confinement.filter->size()),
                       const_cast<sock_filter*>(confinement.filter->data())};
    if (::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, &program) != 0) return errno;
    return 0;
}

}  // namespace corvane::spawn
