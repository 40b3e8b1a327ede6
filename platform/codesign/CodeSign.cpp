#include "platform/codesign/CodeSign.h"

#include <dirent.h>
#include <fcntl.h>
#include <sodium.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <csignal>
#include <cstring>
#include <map>
#include <mutex>
#include <tuple>
#include <vector>

#include "platform/bundle/Bundle.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"

namespace corvane::codesign {

namespace {

constexpr int64_t kFormat = 1;
constexpr const char* kDomain = "com.corvane.codesign";
constexpr size_t kCacheLimit = 4096;

const log::Handle& signLog() {
    static const log::Handle h(kDomain, "codesign");
    return h;
}

bool sodiumReady() {
    static const bool ready = sodium_init() >= 0;
    return ready;
}

std::string hex(const Bytes& bytes) {
    static const char* digits = "0123456789abcdef";
    std::string s;
    for (uint8_t b : bytes) {
        s.push_back(digits[b >> 4]);
        s.push_back(digits[b & 15]);
    }
    return s;
}

std::optional<Bytes> unhex(std::string_view text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == ' ' || text.back() == '\r'))
        text.remove_suffix(1);
    if (text.size() % 2) return std::nullopt;
    Bytes out;
    for (size_t i = 0; i < text.size(); i += 2) {
        auto digit = [](char c) {
            return c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
        };
        int hi = digit(text[i]);
        int lo = digit(text[i + 1]);
        if (hi < 0 || lo < 0) return std::nullopt;
        out.push_back(static_cast<uint8_t>(hi << 4 | lo));
    }
    return out;
}

Error signError(std::string text) { return Error{kDomain, 1, std::move(text)}; }

// The bytes a signature covers. The prefix names what the hash covers, so an executable's signature
// can never pass for a contents signature or the other way round.
Bytes signedMessage(const std::string& identifier, SignatureFile::Covers covers, const Bytes& hash,
                    const Bytes& entitlements) {
    Bytes entHash(crypto_hash_sha256_BYTES);
    crypto_hash_sha256(entHash.data(), entitlements.data(), entitlements.size());
    std::string prefix = std::string(covers == SignatureFile::Covers::Executable ? "corvane code signature 1\n"
                                                                                 : "corvane contents signature 1\n") +
                         identifier + "\n";
    Bytes m(prefix.begin(), prefix.end());
    m.insert(m.end(), hash.begin(), hash.end());
    m.insert(m.end(), entHash.begin(), entHash.end());
    return m;
}

std::optional<Bytes> hashFd(int fd) {
    // A file too large to be a program is not hashed (it would hold whoever asks for seconds).
    struct stat st {};
    if (::fstat(fd, &st) != 0 || static_cast<uint64_t>(st.st_size) > bundle::kMaxExecutableSize) return std::nullopt;
    crypto_hash_sha256_state state;
    crypto_hash_sha256_init(&state);
    unsigned char buf[65536];
    off_t offset = 0;
    for (;;) {
        ssize_t n = pread(fd, buf, sizeof buf, offset);
        if (n < 0) {
            if (errno == EINTR) continue;
            return std::nullopt;
        }
        if (n == 0) break;
        crypto_hash_sha256_update(&state, buf, static_cast<unsigned long long>(n));
        offset += n;
    }
    Bytes out(crypto_hash_sha256_BYTES);
    crypto_hash_sha256_final(&state, out.data());
    return out;
}

// The SHA-256 of a bundle's contents: every entry under it in byte order of its relative path, a
// file as its path and the SHA-256 of its bytes, a link as its path and target, a directory as its
// path; the signature file at the root is left out.
std::optional<Bytes> contentsHash(const std::string& bundlePath) {
    std::vector<std::string> entries;
    std::vector<std::string> pending{""};
    while (!pending.empty()) {
        std::string rel = pending.back();
        pending.pop_back();
        DIR* d = opendir((bundlePath + "/" + rel).c_str());
        if (!d) return std::nullopt;
        while (struct dirent* e = readdir(d)) {
            std::string name = e->d_name;
            if (name == "." || name == "..") continue;
            std::string child = rel.empty() ? name : rel + "/" + name;
            if (child == bundle::kSignatureFileName) continue;
            entries.push_back(child);
            struct stat st {};
            if (::lstat((bundlePath + "/" + child).c_str(), &st) == 0 && S_ISDIR(st.st_mode)) pending.push_back(child);
        }
        closedir(d);
    }
    std::sort(entries.begin(), entries.end());
    crypto_hash_sha256_state state;
    crypto_hash_sha256_init(&state);
    auto feed = [&](char kind, const std::string& text) {
        std::string record = std::string(1, kind) + text + '\0';
        crypto_hash_sha256_update(&state, reinterpret_cast<const unsigned char*>(record.data()), record.size());
    };
    for (const auto& rel : entries) {
        std::string full = bundlePath + "/" + rel;
        struct stat st {};
        if (::lstat(full.c_str(), &st) != 0) return std::nullopt;
        if (S_ISDIR(st.st_mode)) {
            feed('D', rel);
        } else if (S_ISLNK(st.st_mode)) {
            char target[4096];
            ssize_t n = readlink(full.c_str(), target, sizeof target);
            if (n < 0) return std::nullopt;
            feed('L', rel + '\0' + std::string(target, static_cast<size_t>(n)));
        } else if (S_ISREG(st.st_mode)) {
            auto file = bundle::openFileOfBundle(full);  // what it is now, not what lstat saw
            if (!file) return std::nullopt;
            auto fileHash = hashFd((*file)->get());
            if (!fileHash) return std::nullopt;
            feed('F', rel + '\0' + hex(*fileHash));
        }
    }
    Bytes out(crypto_hash_sha256_BYTES);
    crypto_hash_sha256_final(&state, out.data());
    return out;
}

bool trusted(const Bytes& signer) {
    DIR* d = opendir(trustDirectory().c_str());
    if (!d) return false;
    bool found = false;
    while (struct dirent* e = readdir(d)) {
        std::string name = e->d_name;
        if (name.size() < 5 || name.substr(name.size() - 4) != ".pub") continue;
        auto key = readPublicKey(trustDirectory() + "/" + name);
        if (key && *key == signer) {
            found = true;
            break;
        }
    }
    closedir(d);
    return found;
}

using FileId = std::tuple<dev_t, ino_t, off_t, int64_t>;
FileId idOf(const struct stat& st) {
    return {st.st_dev, st.st_ino, st.st_size, int64_t{st.st_mtim.tv_sec} * 1000000000 + st.st_mtim.tv_nsec};
}

Mutex gCacheMutex;
std::map<std::pair<FileId, FileId>, Verification>& cache() REQUIRES(gCacheMutex) {
    static auto* c = new std::map<std::pair<FileId, FileId>, Verification>();
    return *c;
}

// Unsigned code is common and says nothing is wrong, so it is logged at info level; a signature
// that fails is worth the default level.
Verification invalid(const std::string& path, std::string reason, bool unsignedCode = false) {
    if (unsignedCode) {
        log::info(signLog(), "no entitlements for %{public}s: %{public}s", path, reason);
    } else {
        log::notice(signLog(), "no entitlements for %{public}s: %{public}s", path, reason);
    }
    Verification v;
    v.entitlements = Value(Dictionary{});
    v.reason = std::move(reason);
    return v;
}

// The verification of a file without a signature, logged once for each identity of the file.
Verification unsignedFile(const struct stat& st, const std::string& path) {
    auto key = std::make_pair(idOf(st), FileId{});
    {
        MutexLock lock(gCacheMutex);
        auto it = cache().find(key);
        if (it != cache().end()) return it->second;
    }
    Verification v = invalid(path, "unsigned", true);
    MutexLock lock(gCacheMutex);
    if (cache().size() >= kCacheLimit) cache().clear();
    cache().emplace(key, v);
    return v;
}

// Verifies the open executable `exeFd` (named `path`) against its signature file.
Verification verifyOpened(int exeFd, const std::string& path) {
    if (!sodiumReady()) return invalid(path, "no crypto library");
    struct stat exeStat {};
    if (fstat(exeFd, &exeStat) != 0 || !S_ISREG(exeStat.st_mode)) return invalid(path, "not a file");
    std::string sigPath = signaturePath(path);
    auto sig = bundle::openFileOfBundle(sigPath);
    if (!sig) {
        const Error& e = sig.error();
        if (e.domain == kFileErrorDomain && e.code == kFileNoSuchFile) return unsignedFile(exeStat, path);
        return invalid(path, "signature unreadable: " + e.description());
    }
    struct stat sigStat {};
    fstat((*sig)->get(), &sigStat);
    auto key = std::make_pair(idOf(exeStat), idOf(sigStat));
    {
        MutexLock lock(gCacheMutex);
        auto it = cache().find(key);
        if (it != cache().end()) return it->second;
    }
    auto read = bundle::readOpenedFile((*sig)->get(), sigPath, bundle::kMaxPropertyListSize);
    if (!read) return invalid(path, "signature unreadable: " + read.error().description());
    const std::string& bytes = *read;

    Verification v;
    auto file = parseSignature(bytes);
    if (!file) {
        v = invalid(path, "signature unreadable");
    } else if (file->covers != SignatureFile::Covers::Executable) {
        v = invalid(path, "the signature covers a bundle's contents, not an executable");
    } else if (!signatureVerifies(*file)) {
        v = invalid(path, "signature does not verify");
    } else if (!trusted(file->signer)) {
        v = invalid(path, "signed by an untrusted key " + hex(file->signer));
    } else if (auto h = hashFd(exeFd); !h || *h != file->hash) {
        v = invalid(path, "executable changed since it was signed");
    } else {
        auto ents = plist::parse(std::string_view(reinterpret_cast<const char*>(file->entitlementsBytes.data()),
                                                  file->entitlementsBytes.size()));
        if (!ents || !ents->isDictionary()) {
            v = invalid(path, "entitlements unreadable");
        } else {
            v.valid = true;
            v.identifier = file->identifier;
            v.signer = hex(file->signer);
            v.entitlements = *ents;
        }
    }
    MutexLock lock(gCacheMutex);
    if (cache().size() >= kCacheLimit) cache().clear();
    cache().emplace(key, v);
    return v;
}

// A bundle without executable: its signature covers its contents. Not cached, since any file of the
// bundle may change; such bundles are small.
Verification verifyContents(const std::string& bundlePath) {
    if (!sodiumReady()) return invalid(bundlePath, "no crypto library");
    auto bytes = bundle::readFileOfBundle(bundlePath + "/" + bundle::kSignatureFileName, bundle::kMaxPropertyListSize);
    if (!bytes) {
        struct stat st {};
        std::string info = bundlePath + "/Info.plist";
        if (::stat(info.c_str(), &st) != 0) return invalid(bundlePath, "unsigned", true);
        return unsignedFile(st, bundlePath);
    }
    auto file = parseSignature(*bytes);
    if (!file) return invalid(bundlePath, "signature unreadable");
    if (file->covers != SignatureFile::Covers::Contents) return invalid(bundlePath, "bundle without executable");
    if (!signatureVerifies(*file)) return invalid(bundlePath, "signature does not verify");
    if (!trusted(file->signer)) return invalid(bundlePath, "signed by an untrusted key " + hex(file->signer));
    auto h = contentsHash(bundlePath);
    if (!h || *h != file->hash) return invalid(bundlePath, "bundle changed since it was signed");
    auto ents = plist::parse(std::string_view(reinterpret_cast<const char*>(file->entitlementsBytes.data()),
                                              file->entitlementsBytes.size()));
    if (!ents || !ents->isDictionary()) return invalid(bundlePath, "entitlements unreadable");
    Verification v;
    v.valid = true;
    v.identifier = file->identifier;
    v.signer = hex(file->signer);
    v.entitlements = *ents;
    return v;
}

}  // namespace

std::string machineSignatureDirectory() { return layout::stateDir() + "/signatures"; }

std::string machineSignaturePath(const std::string& executable) {
    std::string escaped;
    for (char c : layout::canonicalPath(executable).value_or(executable)) {
        if (c == '/') {
            escaped += "%2F";
        } else if (c == '%') {
            escaped += "%25";
        } else {
            escaped += c;
        }
    }
    return machineSignatureDirectory() + "/" + escaped + ".axsig";
}

std::string signaturePath(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return path + "/" + bundle::kSignatureFileName;
    auto b = bundle::Bundle::openExecutable(path);
    if (auto dir = b->property(bundle::kPropertyBundlePath)) return *dir + "/" + bundle::kSignatureFileName;
    // Beside the executable, else in the machine's store (programs a package installed, whose
    // directory is the package's).
    std::string beside = path + ".axsig";
    if (::lstat(beside.c_str(), &st) == 0) return beside;
    std::string machine = machineSignaturePath(path);
    if (::lstat(machine.c_str(), &st) == 0) return machine;
    return beside;
}

Verification verifyExecutable(const std::string& path) {
    auto file = bundle::openFileOfBundle(path, true);
    if (!file) return invalid(path, "cannot open: " + file.error().description());
    return verifyOpened((*file)->get(), path);
}

Verification verifyBundle(const std::string& bundlePath) {
    auto b = bundle::Bundle::openPath(bundlePath);
    if (!b) return invalid(bundlePath, "not a bundle");
    return verifyBundle(*b->property(bundle::kPropertyBundlePath), b->infoDictionary());
}

Verification verifyBundle(const std::string& canonicalPath, const Value& info) {
    if (auto exe = bundle::executablePathIn(canonicalPath, info)) return verifyExecutable(*exe);
    return verifyContents(canonicalPath);
}

Value entitlementsOfExecutable(const std::string& path) { return verifyExecutable(path).entitlements; }
Value entitlementsOfBundle(const std::string& bundlePath) { return verifyBundle(bundlePath).entitlements; }
Value entitlementsOfBundle(const std::string& canonicalPath, const Value& info) {
    return verifyBundle(canonicalPath, info).entitlements;
}

namespace {

// Whether a mapped file is code this machine's administrator put in place: owned by root, in a
// directory owned by root, neither writable by anyone else.
bool installedByRoot(const std::string& path, const struct stat& file) {
    if (file.st_uid != 0 || (file.st_mode & (S_IWGRP | S_IWOTH))) return false;
    std::string dir = path.substr(0, path.rfind('/'));
    struct stat st {};
    if (::stat(dir.empty() ? "/" : dir.c_str(), &st) != 0) return false;
    return st.st_uid == 0 && !(st.st_mode & (S_IWGRP | S_IWOTH));
}

// A file of /proc, whole; nothing when it cannot be read or is larger than `limit` (a process
// decides how large its own environment and its list of mappings are).
std::optional<std::string> readProcFile(const std::string& path, size_t limit) {
    std::string text;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    char buf[16384];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0 || text.size() + static_cast<size_t>(n) > limit) {
            ::close(fd);
            if (n != 0) return std::nullopt;
            return text;
        }
        text.append(buf, static_cast<size_t>(n));
    }
}

// The most executable mappings a process may have and still be looked at: a program and its
// libraries have tens; a process that makes thousands only costs whoever checks it.
constexpr size_t kMaxExecutableMappings = 4096;

// The code found installed by root, by path and the file it was then: a later look at the same
// path and file needs no stat. Only root can change what such a path names or who owns it, and a
// file at another path is never taken for it.
Mutex gInstalledMutex;
std::map<std::string, std::pair<dev_t, ino_t>>& installedCode() REQUIRES(gInstalledMutex) {
    static auto* known = new std::map<std::string, std::pair<dev_t, ino_t>>;
    return *known;
}

bool knownInstalled(const std::string& path, dev_t device, ino_t inode) {
    MutexLock lock(gInstalledMutex);
    auto it = installedCode().find(path);
    return it != installedCode().end() && it->second == std::make_pair(device, inode);
}

void rememberInstalled(const std::string& path, dev_t device, ino_t inode) {
    MutexLock lock(gInstalledMutex);
    if (installedCode().size() >= 4096) installedCode().clear();
    installedCode()[path] = {device, inode};
}

// One executable mapping of a process: its start address, what it maps (a path, "[vdso]" and the
// like, or "" when it is anonymous) and the file's identity.
struct ExecutableMapping {
    unsigned long long start = 0;
    std::string path;
    dev_t device = 0;
    ino_t inode = 0;
};

// The kernel's query of one mapping at a time (Linux 6.11): only the executable ones are asked
// for, which costs a few microseconds where reading /proc/<pid>/maps costs some eighty.
struct ProcmapQuery {
    uint64_t size;
    uint64_t queryFlags;
    uint64_t queryAddress;
    uint64_t start;
    uint64_t end;
    uint64_t flags;
    uint64_t pageSize;
    uint64_t offset;
    uint64_t inode;
    uint32_t deviceMajor;
    uint32_t deviceMinor;
    uint32_t nameSize;
    uint32_t buildIdSize;
    uint64_t nameAddress;
    uint64_t buildIdAddress;
};
static_assert(sizeof(ProcmapQuery) == 104);
constexpr unsigned long kProcmapQuery = _IOWR('f', 17, ProcmapQuery);
constexpr uint64_t kQueryExecutable = 0x04;
constexpr uint64_t kQueryCoveringOrNext = 0x10;

// The executable mappings, through the query; nullopt when the kernel has none.
std::optional<std::vector<ExecutableMapping>> queryExecutableMappings(int maps) {
    std::vector<ExecutableMapping> found;
    char name[PATH_MAX];
    for (uint64_t address = 0;;) {
        ProcmapQuery q{};
        q.size = sizeof q;
        q.queryFlags = kQueryExecutable | kQueryCoveringOrNext;
        q.queryAddress = address;
        q.nameSize = sizeof name;
        q.nameAddress = reinterpret_cast<uint64_t>(name);
        if (::ioctl(maps, kProcmapQuery, &q) != 0) {
            if (errno == ENOENT) return found;
            if (errno == ENOTTY || errno == EINVAL) return std::nullopt;
            return found.empty() ? std::nullopt : std::optional(std::move(found));
        }
        found.push_back(ExecutableMapping{q.start, q.nameSize > 0 ? std::string(name, strnlen(name, q.nameSize)) : "",
                                          makedev(q.deviceMajor, q.deviceMinor), static_cast<ino_t>(q.inode)});
        if (found.size() > kMaxExecutableMappings) return found;
        if (q.end <= address) break;
        address = q.end;
    }
    return found;
}

// The same from the text of /proc/<pid>/maps.
std::vector<ExecutableMapping> parseExecutableMappings(const std::string& maps) {
    std::vector<ExecutableMapping> found;
    size_t at = 0;
    while (at < maps.size()) {
        size_t newline = maps.find('\n', at);
        std::string line = maps.substr(at, newline == std::string::npos ? std::string::npos : newline - at);
        at = newline == std::string::npos ? maps.size() : newline + 1;
        // address perms offset major:minor inode [path]
        char perms[5] = {};
        unsigned long long start = 0, inode = 0;
        unsigned major = 0, minor = 0;
        int pathAt = 0;
        if (std::sscanf(line.c_str(), "%llx-%*x %4s %*s %x:%x %llu %n", &start, perms, &major, &minor, &inode, &pathAt) < 5)
            continue;
        if (perms[2] != 'x') continue;
        found.push_back(ExecutableMapping{start, line.substr(static_cast<size_t>(pathAt)), makedev(major, minor),
                                          static_cast<ino_t>(inode)});
    }
    return found;
}

}  // namespace

std::optional<std::string> untrustedCodeIn(pid_t pid, const struct stat& exe) {
    std::string proc = "/proc/" + std::to_string(pid);
    auto readEnvironment = readProcFile(proc + "/environ", size_t{1} << 20);
    if (!readEnvironment) return std::string("its environment cannot be read, or is larger than 1 MiB");
    const std::string& environment = *readEnvironment;
    for (size_t at = 0; at < environment.size();) {
        size_t end = environment.find('\0', at);
        std::string_view entry(environment.data() + at, (end == std::string::npos ? environment.size() : end) - at);
        for (std::string_view prefix : {"LD_PRELOAD=", "LD_LIBRARY_PATH=", "LD_AUDIT="}) {
            if (entry.size() > prefix.size() && entry.substr(0, prefix.size()) == prefix)
                return "it was started with " + std::string(prefix.substr(0, prefix.size() - 1));
        }
        at = end == std::string::npos ? environment.size() : end + 1;
    }
    int maps = ::open((proc + "/maps").c_str(), O_RDONLY | O_CLOEXEC);
    if (maps < 0) return std::string("its mappings cannot be read");
    auto queried = queryExecutableMappings(maps);
    ::close(maps);
    std::vector<ExecutableMapping> mappings;
    if (queried) {
        mappings = std::move(*queried);
    } else if (auto text = readProcFile(proc + "/maps", size_t{16} << 20)) {
        mappings = parseExecutableMappings(*text);
    }
    if (mappings.empty()) return std::string("its mappings cannot be read");
    if (mappings.size() > kMaxExecutableMappings)
        return "it has more than " + std::to_string(kMaxExecutableMappings) + " executable mappings";
    std::string previous;
    for (const ExecutableMapping& m : mappings) {
        const std::string& path = m.path;
        if (path == "[vdso]" || path == "[vsyscall]" || path == "[uprobes]") continue;
        if (path.empty() || path[0] != '/') {
            char address[32];
            std::snprintf(address, sizeof address, "%llx", m.start);
            return std::string("an anonymous executable mapping at ") + address;
        }
        if (path == previous) continue;
        previous = path;
        if (path.size() > 10 && path.compare(path.size() - 10, 10, " (deleted)") == 0) return "it maps " + path;
        if (m.device == exe.st_dev && m.inode == exe.st_ino) continue;  // the signed executable itself
        if (knownInstalled(path, m.device, m.inode)) continue;
        struct stat st {};
        if (::stat(path.c_str(), &st) != 0 || st.st_dev != m.device || st.st_ino != m.inode)
            return "it maps " + path + ", which changed since";
        if (installedByRoot(path, st)) {
            rememberInstalled(path, m.device, m.inode);
            continue;
        }
        if (verifyExecutable(path).valid) continue;
        return "it maps " + path + ", which is neither installed by root nor signed";
    }
    return std::nullopt;
}

std::shared_ptr<Handle> Handle::fromAuditToken(const rpx::AuditToken& token) {
    std::string proc = "/proc/" + std::to_string(token.pid);
    auto refuse = [&](const std::string& why) {
        return std::shared_ptr<Handle>(new Handle(invalid(proc + "/exe", why)));
    };
    // The pid must still name the process the token was taken from.
    if (token.pidfd && syscall(SYS_pidfd_send_signal, token.pidfd->get(), 0, nullptr, 0) != 0)
        return refuse("the process is gone");
    auto exe = bundle::openFileOfBundle(proc + "/exe", true);
    if (!exe) {
        int err = errno;  // of the open that failed, when that was the failure
        return refuse(err == EMFILE || err == ENFILE ? "out of file descriptors" : "the process is gone");
    }
    int fd = (*exe)->get();
    struct stat st {};
    fstat(fd, &st);
    rpx::PeerIdentity now = rpx::identityOfProcess(token.pid, token.uid, token.gid, nullptr);
    if (now.auditToken.startTime != token.startTime || st.st_dev != token.exeDevice ||
        st.st_ino != token.exeInode) {
        return refuse("the process is not the one that connected");
    }
    std::string path = now.executablePath.empty() ? proc + "/exe" : now.executablePath;
    Verification v = verifyOpened(fd, path);
    // A signature speaks for the code it covers: a process that runs other code as well (a library
    // preloaded into a signed program, say) has none of its entitlements.
    if (v.valid) {
        if (auto untrusted = untrustedCodeIn(token.pid, st)) v = invalid(path + " (pid " + std::to_string(token.pid) + ")", *untrusted);
    }
    return std::shared_ptr<Handle>(new Handle(std::move(v)));
}

Value Handle::valueForEntitlement(const std::string& name) const {
    return verification_.entitlements[name];
}

// ---- keys and signing

KeyPair generateKey() {
    sodiumReady();
    KeyPair k{Bytes(crypto_sign_PUBLICKEYBYTES), Bytes(crypto_sign_SECRETKEYBYTES)};
    crypto_sign_keypair(k.publicKey.data(), k.secretKey.data());
    return k;
}

Status writeKeyPair(const std::string& path, const KeyPair& keys) {
    if (Status written = plist::writeFileAtomically(path, hex(keys.secretKey) + "\n", 0600); !written.ok())
        return written;
    return plist::writeFileAtomically(path + ".pub", hex(keys.publicKey) + "\n", 0644);
}

Result<KeyPair> readSecretKey(const std::string& path) {
    auto text = plist::readWholeFile(path);
    if (!text) return text.error();
    auto secret = unhex(*text);
    if (!secret || secret->size() != crypto_sign_SECRETKEYBYTES) return signError(path + " is not a secret key");
    KeyPair k{Bytes(crypto_sign_PUBLICKEYBYTES), *secret};
    crypto_sign_ed25519_sk_to_pk(k.publicKey.data(), k.secretKey.data());
    return k;
}

Result<Bytes> readPublicKey(const std::string& path) {
    auto text = plist::readWholeFile(path);
    if (!text) return text.error();
    auto key = unhex(*text);
    if (!key || key->size() != crypto_sign_PUBLICKEYBYTES) return signError(path + " is not a public key");
    return *key;
}

std::string trustDirectory() { return layout::configDir() + "/trust.d"; }

namespace {
std::string trustFileOf(const Bytes& key) { return trustDirectory() + "/" + hex(key).substr(0, 16) + ".pub"; }
}  // namespace

Result<bool> untrustKey(const std::string& publicKeyPath) {
    auto key = readPublicKey(publicKeyPath);
    if (!key) return key.error();
    if (::unlink(trustFileOf(*key).c_str()) == 0) return true;
    if (errno == ENOENT) return false;
    return Error::posix(errno, trustFileOf(*key));
}

Status trustKey(const std::string& publicKeyPath) {
    auto key = readPublicKey(publicKeyPath);
    if (!key) return key.error();
    if (Status made = layout::makeDirectories(trustDirectory(), 0755); !made.ok()) return made;
    return plist::writeFileAtomically(trustFileOf(*key), hex(*key) + "\n", 0644);
}

Status sign(const std::string& path, const KeyPair& keys, std::optional<std::string> identifier,
                const Value& entitlements, Placement placement) {
    if (!sodiumReady()) return signError("no crypto library");
    std::string exe = path;
    auto covers = SignatureFile::Covers::Executable;
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return Error::posix(errno, path);
    if (S_ISDIR(st.st_mode) && placement == Placement::Machine)
        return signError(path + ": a bundle keeps its signature in itself, not in the machine's store");
    if (S_ISDIR(st.st_mode)) {
        auto b = bundle::Bundle::openPath(path);
        if (!b) return signError(path + ": not a bundle");
        auto named = b->property(bundle::kPropertyExecutablePath);
        if (named) {
            exe = *named;
        } else {
            covers = SignatureFile::Covers::Contents;
        }
        if (!identifier) {
            Value info = b->infoDictionary();
            if (const std::string* id = info["KFBundleIdentifier"].asString()) identifier = *id;
        }
    }
    if (!identifier) identifier = exe.substr(exe.rfind('/') + 1);
    if (!entitlements.isDictionary()) return signError("entitlements must be a dictionary");
    std::optional<Bytes> hash;
    if (covers == SignatureFile::Covers::Contents) {
        hash = contentsHash(path);
        if (!hash) return Error::posix(EIO, path);
    } else {
        int fd = ::open(exe.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) return Error::posix(errno, exe);
        hash = hashFd(fd);
        ::close(fd);
        if (!hash) return Error::posix(EIO, exe);
    }
    auto xml = plist::toXML(entitlements);
    if (!xml) return xml.error();
    Bytes entBytes(xml->begin(), xml->end());
    Bytes message = signedMessage(*identifier, covers, *hash, entBytes);
    Bytes signature(crypto_sign_BYTES);
    crypto_sign_detached(signature.data(), nullptr, message.data(), message.size(), keys.secretKey.data());
    Value file = dict({{"format", kFormat},
                       {"identifier", *identifier},
                       {covers == SignatureFile::Covers::Executable ? "executable-sha256" : "contents-sha256",
                        Value::data(*hash)},
                       {"entitlements", Value::data(entBytes)},
                       {"signer", Value::data(keys.publicKey)},
                       {"signature", Value::data(signature)}});
    std::string target = placement == Placement::Machine ? machineSignaturePath(path) : signaturePath(path);
    if (Status made = layout::makeDirectories(target.substr(0, target.rfind('/')), 0755); !made.ok()) return made;
    return plist::writeXMLFile(target, file, 0644);
}

std::optional<SignatureFile> parseSignature(std::string_view bytes) {
    auto v = plist::parse(bytes);
    if (!v || !v->isDictionary() || !((*v)["format"] == Value(kFormat))) return std::nullopt;
    const std::string* identifier = (*v)["identifier"].asString();
    const Bytes* executableHash = (*v)["executable-sha256"].asData();
    const Bytes* contentsHashBytes = (*v)["contents-sha256"].asData();
    // Exactly one of the two.
    if ((executableHash != nullptr) == (contentsHashBytes != nullptr)) return std::nullopt;
    const Bytes* hash = executableHash ? executableHash : contentsHashBytes;
    const Bytes* ents = (*v)["entitlements"].asData();
    const Bytes* signer = (*v)["signer"].asData();
    const Bytes* signature = (*v)["signature"].asData();
    if (!identifier || !hash || !ents || !signer || !signature) return std::nullopt;
    if (hash->size() != crypto_hash_sha256_BYTES || signer->size() != crypto_sign_PUBLICKEYBYTES ||
        signature->size() != crypto_sign_BYTES)
        return std::nullopt;
    return SignatureFile{*identifier,
                         executableHash ? SignatureFile::Covers::Executable : SignatureFile::Covers::Contents,
                         *hash, *ents, *signer, *signature};
}

bool signatureVerifies(const SignatureFile& file) {
    if (!sodiumReady()) return false;
    Bytes message = signedMessage(file.identifier, file.covers, file.hash, file.entitlementsBytes);
    return crypto_sign_verify_detached(file.signature.data(), message.data(), message.size(),
                                       file.signer.data()) == 0;
}

}  // namespace corvane::codesign
