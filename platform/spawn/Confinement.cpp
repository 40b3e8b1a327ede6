#include "platform/spawn/Confinement.h"

#include <fcntl.h>
#include <linux/audit.h>
#include <netinet/in.h>
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
#include <cstddef>
#include <cstdlib>
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

// What a profile's processes may do with IPv4 and IPv6.
enum class Network {
    None,    // no IPv4 or IPv6 socket at all
    Client,  // TCP and UDP sockets, TCP connections out; no TCP port bound
    Full,    // TCP and UDP, bound and connected
};

struct Profile {
    const char* name;
    Network network;
    bool homeWritable;  // may write in its data container, not only in TMPDIR
};

constexpr Profile kProfiles[] = {
    {"plugin", Network::Client, true},
    {"keyboard", Network::None, true},
    {"network-filter", Network::Full, true},
    {"glancerd", Network::None, false},
    {"sandpit-devtools", Network::Full, true},
};

const Profile* findProfile(const std::string& name) {
    for (const Profile& profile : kProfiles) {
        if (name == profile.name) return &profile;
    }
    return nullptr;
}

// What every profile denies, with EPERM: debugging other processes and reaching into them,
// changing what the file system or the namespaces look like, kernel modules and images, keyrings,
// leaving the instance's process group (spawnd ends an instance by its group, children included),
// and the kernel interfaces that have served sandbox escapes and that no plug-in needs: io_uring
// (whose operations, socket creation among them, no seccomp filter sees), userfaultfd, perf events,
// BPF, file handles, other processes' descriptors and the kernel's log.
constexpr int kDeniedCalls[] = {
    SCMP_SYS(ptrace), SCMP_SYS(process_vm_readv), SCMP_SYS(process_vm_writev), SCMP_SYS(pidfd_getfd),
    SCMP_SYS(kcmp),
    SCMP_SYS(mount), SCMP_SYS(umount2), SCMP_SYS(pivot_root), SCMP_SYS(chroot),
    SCMP_SYS(move_mount), SCMP_SYS(open_tree), SCMP_SYS(fsopen), SCMP_SYS(fsmount),
    SCMP_SYS(fsconfig), SCMP_SYS(fspick), SCMP_SYS(mount_setattr),
    SCMP_SYS(init_module), SCMP_SYS(finit_module), SCMP_SYS(delete_module),
    SCMP_SYS(kexec_load), SCMP_SYS(kexec_file_load), SCMP_SYS(reboot),
    SCMP_SYS(unshare), SCMP_SYS(setns),
    SCMP_SYS(add_key), SCMP_SYS(request_key), SCMP_SYS(keyctl),
    SCMP_SYS(bpf), SCMP_SYS(swapon), SCMP_SYS(swapoff), SCMP_SYS(acct),
    SCMP_SYS(setsid), SCMP_SYS(setpgid),
    SCMP_SYS(io_uring_setup), SCMP_SYS(io_uring_enter), SCMP_SYS(io_uring_register),
    SCMP_SYS(userfaultfd), SCMP_SYS(perf_event_open),
    SCMP_SYS(open_by_handle_at), SCMP_SYS(name_to_handle_at), SCMP_SYS(lookup_dcookie),
    SCMP_SYS(fanotify_init), SCMP_SYS(quotactl), SCMP_SYS(syslog), SCMP_SYS(vhangup),
    SCMP_SYS(iopl), SCMP_SYS(ioperm),
};
// (CLONE_NEWTIME only exists for clone3 and unshare: in clone's flags its bit is the exit signal's.)
constexpr uint64_t kNamespaceFlags = CLONE_NEWNS | CLONE_NEWUTS | CLONE_NEWIPC | CLONE_NEWUSER | CLONE_NEWPID |
                                     CLONE_NEWNET | CLONE_NEWCGROUP;

// The system calls every profile refuses. The same for every profile: compiled once.
Result<std::vector<sock_filter>> compileFilter() {
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

Status addRuleFor(int ruleset, int fd, uint64_t rights, const std::string& what) {
    PathBeneathAttr rule{rights, fd};
    if (::syscall(SYS_landlock_add_rule, ruleset, kRulePathBeneath, &rule, 0) != 0)
        return Error::posix(errno, "sandbox rule for " + what);
    return {};
}

bool isDirectory(const char* path) {
    struct stat st {};
    return ::stat(path, &st) == 0 && S_ISDIR(st.st_mode);
}

// What every profile may reach of the system (the plug-in cannot change what these are): opened
// once, as they are, and kept for every ruleset.
struct SystemRule {
    const char* path;
    std::shared_ptr<FileDescriptor> fd;
    uint64_t rights;
};

const std::vector<SystemRule>& systemRules(int abi) {
    static const std::vector<SystemRule> rules = [abi] {
        std::vector<SystemRule> list;
        auto add = [&](const char* path, uint64_t rights) {
            int fd = ::open(path, O_PATH | O_CLOEXEC);
            if (fd >= 0) list.push_back(SystemRule{path, std::make_shared<FileDescriptor>(fd), rights});
        };
        const uint64_t read = kReadFile | kReadDir;
        // The system's programs, libraries and configuration, and what the C library reads at run time.
        for (const char* dir : {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32", "/etc", "/opt", "/sys"}) {
            if (isDirectory(dir)) add(dir, read | kExecute);
        }
        // Of /proc only what describes the machine; the instance's own /proc/<pid> is added by the
        // child itself (applyConfinement), and no other process's is readable.
        for (const char* entry : {"/proc/cpuinfo", "/proc/meminfo", "/proc/stat", "/proc/loadavg", "/proc/uptime",
                                  "/proc/version", "/proc/filesystems", "/proc/sys"}) {
            add(entry, isDirectory(entry) ? read : kReadFile);
        }
        uint64_t device = kReadFile | kWriteFile | (abi >= 3 ? kTruncate : 0);
        for (const char* node : {"/dev/null", "/dev/zero", "/dev/full", "/dev/random", "/dev/urandom"}) add(node, device);
        return list;
    }();
    return rules;
}

// ---- the socket allowlist, assembled by hand: libseccomp cannot say "anything but these".

// Where a system call's argument lies in struct seccomp_data, its low and its high half.
constexpr uint32_t argumentLow(int n) {
#if __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
    return offsetof(seccomp_data, args) + 8 * n;
#else
    return offsetof(seccomp_data, args) + 8 * n + 4;
#endif
}
constexpr uint32_t argumentHigh(int n) { return argumentLow(n) ^ 4; }

#if defined(__x86_64__)
constexpr uint32_t kNativeArch = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr uint32_t kNativeArch = AUDIT_ARCH_AARCH64;
#else
#error "the socket allowlist knows no audit architecture for this machine"
#endif

// A program with named targets: each jump names the labels it goes to, resolved at the end.
class Assembler {
public:
    void label(const std::string& name) { labels_[name] = program_.size(); }
    void op(uint16_t code, uint32_t k) { add(BPF_STMT(code, k), "", ""); }
    // Compares the accumulator with k; to `yes` or `no` ("" goes on with the next instruction).
    void jumpIfEqual(uint32_t k, const std::string& yes, const std::string& no) {
        add(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, k, 0, 0), yes, no);
    }
    void load(uint32_t offset) { op(BPF_LD | BPF_W | BPF_ABS, offset); }
    void answer(uint32_t action) { op(BPF_RET | BPF_K, action); }
    std::vector<sock_filter> finish() {
        for (size_t i = 0; i < program_.size(); ++i) {
            auto target = [&](const std::string& name) -> uint8_t {
                if (name.empty()) return 0;
                size_t to = labels_.at(name);
                if (to <= i || to - i - 1 > 255) std::abort();  // only short jumps forward
                return static_cast<uint8_t>(to - i - 1);
            };
            program_[i].jt = target(targets_[i].first);
            program_[i].jf = target(targets_[i].second);
        }
        return program_;
    }

    void add(sock_filter instruction, const std::string& yes, const std::string& no) {
        program_.push_back(instruction);
        targets_.emplace_back(yes, no);
    }

private:
    std::vector<sock_filter> program_;
    std::vector<std::pair<std::string, std::string>> targets_;
    std::map<std::string, size_t> labels_;
};

}  // namespace

namespace {

// The socket checks, ending where a call they allow goes on: at the label "allow", which the caller
// puts after them.
void socketChecks(bool inet, Assembler& a) {
    const uint32_t noFamily = SECCOMP_RET_ERRNO | EAFNOSUPPORT;
    const uint32_t noProtocol = SECCOMP_RET_ERRNO | EPROTONOSUPPORT;
    // Another architecture's calls are the system-call filter's to refuse (it kills them).
    a.load(offsetof(seccomp_data, arch));
    a.jumpIfEqual(kNativeArch, "", "allow");
    a.load(offsetof(seccomp_data, nr));
#if defined(__x86_64__)
    // x32 calls share the architecture and carry a bit of their own in the number: none is allowed.
    a.add(BPF_JUMP(BPF_JMP | BPF_JGE | BPF_K, 0x40000000, 0, 0), "x32", "");
#endif
    a.jumpIfEqual(__NR_socket, "socket", "");
    a.jumpIfEqual(__NR_socketpair, "", "allow");
    // socketpair: AF_UNIX only.
    a.load(argumentHigh(0));
    a.jumpIfEqual(0, "", "no family");
    a.load(argumentLow(0));
    a.jumpIfEqual(AF_UNIX, "allow", "no family");
    a.label("socket");
    a.load(argumentHigh(0));
    a.jumpIfEqual(0, "", "no family");
    a.load(argumentLow(0));
    if (!inet) {
        a.jumpIfEqual(AF_UNIX, "allow", "no family");
    } else {
        a.jumpIfEqual(AF_UNIX, "allow", "");
        a.jumpIfEqual(AF_INET, "inet", "");
        a.jumpIfEqual(AF_INET6, "inet", "no family");
        a.label("inet");
        // The type without SOCK_NONBLOCK and SOCK_CLOEXEC, and the protocol, kept in scratch memory.
        a.load(argumentHigh(1));
        a.jumpIfEqual(0, "", "no protocol");
        a.load(argumentLow(1));
        a.op(BPF_ALU | BPF_AND | BPF_K, 0xf);
        a.op(BPF_ST, 0);
        a.load(argumentHigh(2));
        a.jumpIfEqual(0, "", "no protocol");
        a.load(argumentLow(2));
        a.op(BPF_ST, 1);
        a.op(BPF_LD | BPF_MEM, 0);
        a.jumpIfEqual(SOCK_STREAM, "stream", "");
        a.jumpIfEqual(SOCK_DGRAM, "datagram", "no protocol");
        a.label("stream");
        a.op(BPF_LD | BPF_MEM, 1);
        a.jumpIfEqual(0, "allow", "");
        a.jumpIfEqual(IPPROTO_TCP, "allow", "no protocol");
        a.label("datagram");
        a.op(BPF_LD | BPF_MEM, 1);
        a.jumpIfEqual(0, "allow", "");
        a.jumpIfEqual(IPPROTO_UDP, "allow", "no protocol");
    }
    a.label("x32");
    a.answer(SECCOMP_RET_ERRNO | ENOSYS);
    a.label("no protocol");
    a.answer(noProtocol);
    a.label("no family");
    a.answer(noFamily);
    a.label("allow");
}

Result<std::shared_ptr<const std::vector<sock_filter>>> filterFor(const Profile& profile) {
    static std::mutex mutex;
    static std::shared_ptr<const std::vector<sock_filter>> programs[2];
    bool inet = profile.network != Network::None;
    std::lock_guard lock(mutex);
    auto& program = programs[inet ? 1 : 0];
    if (!program) {
        auto calls = compileFilter();
        if (!calls) return calls.error();
        Assembler a;
        socketChecks(inet, a);
        std::vector<sock_filter> combined = a.finish();
        if (combined.size() + calls->size() > BPF_MAXINSNS) return Error::posix(E2BIG, "seccomp filter");
        combined.insert(combined.end(), calls->begin(), calls->end());
        program = std::make_shared<const std::vector<sock_filter>>(std::move(combined));
    }
    return program;
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

Result<Confinement> prepareConfinement(const std::string& name, const ConfinementTargets& targets) {
    const Profile* profile = findProfile(name);
    if (!profile) return Error::posix(EINVAL, "unknown sandbox profile \"" + name + "\"");
    if (!targets.bundle) return Error::posix(EINVAL, "no bundle to confine to");
    int abi = landlockAbi();
    if (abi < 1) return Error::posix(ENOSYS, "the kernel has no Landlock: plug-ins cannot be confined");
    // Without IPv4 and IPv6 sockets the socket filter holds alone; a client may connect but must not
    // bind a TCP port, which only Landlock can say.
    if (profile->network == Network::Client && abi < 4) {
        return Error::posix(ENOSYS, "the kernel's Landlock (ABI " + std::to_string(abi) +
                                        ") cannot restrict TCP, which the \"" + name + "\" profile needs");
    }
    // One program per kind of profile: the socket allowlist first, falling through to the system
    // calls every profile refuses, so that each system call of the plug-in runs one filter.
    auto filter = filterFor(*profile);
    if (!filter) return filter.error();

    uint64_t all = fileSystemRights(abi);
    uint64_t net = profile->network == Network::Full     ? 0
                   : profile->network == Network::Client ? kNetBindTcp
                                                         : (kNetBindTcp | kNetConnectTcp);
    RulesetAttr attributes{all, abi >= 4 ? net : 0, abi >= 6 ? (kScopeAbstractUnixSocket | kScopeSignal) : 0};
    size_t size = abi >= 6 ? sizeof attributes : abi >= 4 ? 2 * sizeof(uint64_t) : sizeof(uint64_t);
    long fd = ::syscall(SYS_landlock_create_ruleset, &attributes, size, 0);
    if (fd < 0) return Error::posix(errno, "Landlock ruleset");
    auto ruleset = std::make_shared<FileDescriptor>(static_cast<int>(fd));

    const uint64_t read = kReadFile | kReadDir;
    const uint64_t readExecute = read | kExecute;
    for (const SystemRule& rule : systemRules(abi)) {
        if (auto added = addRuleFor(ruleset->get(), rule.fd->get(), rule.rights, rule.path); !added.ok())
            return added.error();
    }
    if (auto added = addRuleFor(ruleset->get(), targets.bundle->get(), readExecute, "the bundle"); !added.ok())
        return added.error();
    if (targets.home) {
        auto added = addRuleFor(ruleset->get(), targets.home->get(), profile->homeWritable ? all : read, "HOME");
        if (!added.ok()) return added.error();
    }
    if (targets.tmpdir) {
        if (auto added = addRuleFor(ruleset->get(), targets.tmpdir->get(), all, "TMPDIR"); !added.ok())
            return added.error();
    }
    return Confinement{name, std::move(ruleset), std::move(*filter)};
}

namespace {

int installFilter(const std::vector<sock_filter>& filter) {
    sock_fprog program{static_cast<unsigned short>(filter.size()), const_cast<sock_filter*>(filter.data())};
    return ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, &program) == 0 ? 0 : errno;
}

}  // namespace

int applyConfinement(const Confinement& confinement, int ruleset, const char** stage) {
    *stage = "no_new_privs";
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return errno;
    *stage = "landlock";
    if (ruleset < 0) return EINVAL;
    // The instance reads its own /proc/<pid> (and its threads beneath it): /proc/self names it now.
    int self = ::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC);
    if (self < 0) return errno;
    PathBeneathAttr own{kReadFile | kReadDir, self};
    long added = ::syscall(SYS_landlock_add_rule, ruleset, kRulePathBeneath, &own, 0);
    int err = errno;
    ::close(self);
    if (added != 0) return err;
    if (::syscall(SYS_landlock_restrict_self, ruleset, 0) != 0) return errno;
    *stage = "seccomp";
    if (!confinement.filter) return EINVAL;
    return installFilter(*confinement.filter);
}

}  // namespace corvane::spawn
