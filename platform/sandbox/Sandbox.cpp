#include "platform/sandbox/Sandbox.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sodium.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <fstream>
#include <mutex>
#include <sstream>

#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"

namespace corvane::sandbox {

namespace {

const log::Handle& sandboxLog() {
    static const log::Handle h("com.corvane.sandbox", "sandbox");
    return h;
}

std::string keyPath() { return layout::userDataDir() + "/sandbox/token.key"; }

std::optional<Bytes> readOrMakeKey(const std::string& path);

// The key of the current platform root, read once per process (a daemon issues a read token for
// nearly every plug-in of a discovery reply) and kept as the MAC's state after the key: each
// token's MAC then hashes only its own message.
using TokenKey = crypto_auth_hmacsha512256_state;

const TokenKey* secretKey() {
    static Mutex mutex;
    static auto* known = new std::map<std::string, TokenKey>();  // for the process's life
    if (sodium_init() < 0) return nullptr;
    std::string path = keyPath();
    MutexLock lock(mutex);
    auto it = known->find(path);
    if (it != known->end()) return &it->second;
    auto key = readOrMakeKey(path);
    if (!key) return nullptr;
    TokenKey keyed;
    crypto_auth_hmacsha512256_init(&keyed, key->data(), key->size());
    sodium_memzero(key->data(), key->size());
    return &known->emplace(path, keyed).first->second;
}

// The user's secret key, made on first use. Two processes making it at once agree: the file is
// created exclusively and the loser reads the winner's.
std::optional<Bytes> readOrMakeKey(const std::string& path) {
    for (int attempt = 0; attempt < 2; ++attempt) {
        int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd >= 0) {
            Bytes key(crypto_auth_KEYBYTES);
            ssize_t n = ::read(fd, key.data(), key.size());
            ::close(fd);
            if (n == static_cast<ssize_t>(key.size())) return key;
            return std::nullopt;
        }
        if (!layout::makeDirectories(path.substr(0, path.rfind('/')), 0700).ok()) return std::nullopt;
        Bytes key(crypto_auth_KEYBYTES);
        crypto_auth_keygen(key.data());
        std::string tmp = path + ".new." + std::to_string(getpid());
        fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
        if (fd < 0) return std::nullopt;
        bool ok = ::write(fd, key.data(), key.size()) == static_cast<ssize_t>(key.size()) && fsync(fd) == 0;
        ::close(fd);
        // link() fails if another process got there first; then its key is the key.
        if (ok && ::link(tmp.c_str(), path.c_str()) == 0) {
            ::unlink(tmp.c_str());
            return key;
        }
        ::unlink(tmp.c_str());
    }
    return std::nullopt;
}

void appendHex(std::string& out, const void* data, size_t size) {
    static const char* digits = "0123456789abcdef";
    const auto* p = static_cast<const uint8_t*>(data);
    size_t at = out.size();
    out.resize(at + 2 * size);
    for (size_t i = 0; i < size; ++i) {
        out[at++] = digits[p[i] >> 4];
        out[at++] = digits[p[i] & 15];
    }
}

std::optional<std::string> unhex(std::string_view text) {
    if (text.size() % 2) return std::nullopt;
    std::string out;
    for (size_t i = 0; i < text.size(); i += 2) {
        auto digit = [](char c) { return c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : -1; };
        int hi = digit(text[i]);
        int lo = digit(text[i + 1]);
        if (hi < 0 || lo < 0) return std::nullopt;
        out.push_back(static_cast<char>(hi << 4 | lo));
    }
    return out;
}

// The MAC of "<class>;<path>" under the key.
std::array<unsigned char, crypto_auth_BYTES> macOf(const TokenKey& key, std::string_view extensionClass,
                                                   std::string_view path) {
    crypto_auth_hmacsha512256_state state = key;
    auto update = [&](std::string_view part) {
        crypto_auth_hmacsha512256_update(&state, reinterpret_cast<const unsigned char*>(part.data()), part.size());
    };
    update(extensionClass);
    update(";");
    update(path);
    std::array<unsigned char, crypto_auth_BYTES> mac{};
    crypto_auth_hmacsha512256_final(&state, mac.data());
    return mac;
}

std::string nsLink(const std::string& proc, const char* ns) {
    char buf[128];
    ssize_t n = readlink((proc + "/ns/" + ns).c_str(), buf, sizeof buf - 1);
    if (n <= 0) return {};
    return std::string(buf, static_cast<size_t>(n));
}

// Absolute, with no empty, "." or ".." component: a path as a resolution gives it.
bool isPlainAbsolutePath(const std::string& path) {
    if (path.empty() || path[0] != '/' || path.find('\0') != std::string::npos) return false;
    if (path == "/") return true;
    size_t at = 1;
    for (;;) {
        size_t end = path.find('/', at);
        std::string_view part(path.data() + at, (end == std::string::npos ? path.size() : end) - at);
        if (part.empty() || part == "." || part == "..") return false;
        if (end == std::string::npos) return true;
        at = end + 1;
    }
}

// Opens the token's path read-only, refusing a symbolic link anywhere on it: the path was canonical
// when the token was issued, so a link there now was put in place since. Kernels without openat2
// check the last component only.
int openGrantedPath(const std::string& path) {
    open_how how{};
    how.flags = O_RDONLY | O_CLOEXEC | O_NOFOLLOW;
    how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    long fd = ::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how);
    if (fd < 0 && errno == ENOSYS) return ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    return static_cast<int>(fd);
}

}  // namespace

Result<std::string> issueFileReadExtension(const char* extensionClass, const std::string& path, unsigned flags) {
    if (!extensionClass || std::strcmp(extensionClass, kReadOnlyClass) != 0) return Error::posix(EINVAL);
    std::string target = path;
    if (flags & kResolvedPath) {
        if (!isPlainAbsolutePath(path)) return Error::posix(EINVAL);
    } else if (flags & kCanonicalPath) {
        auto canonical = layout::canonicalPath(path);
        if (!canonical) return Error::posix(errno);
        target = *canonical;
    } else {
        struct stat st {};
        if (::stat(path.c_str(), &st) != 0) return Error::posix(errno);
    }
    const TokenKey* key = secretKey();
    if (!key) return Error::posix(EACCES);
    auto mac = macOf(*key, extensionClass, target);
    std::string token;
    token.reserve(std::strlen(extensionClass) + 2 * target.size() + 2 * mac.size() + 2);
    token.append(extensionClass).push_back(';');
    appendHex(token, target.data(), target.size());
    token.push_back(';');
    appendHex(token, mac.data(), mac.size());
    return token;
}

std::optional<Token> parseToken(std::string_view text) {
    size_t a = text.find(';');
    if (a == std::string_view::npos) return std::nullopt;
    size_t b = text.find(';', a + 1);
    if (b == std::string_view::npos || text.find(';', b + 1) != std::string_view::npos) return std::nullopt;
    auto path = unhex(text.substr(a + 1, b - a - 1));
    auto mac = unhex(text.substr(b + 1));
    if (!path || !mac || path->empty() || (*path)[0] != '/' || path->find('\0') != std::string::npos ||
        mac->size() != crypto_auth_BYTES)
        return std::nullopt;
    return Token{std::string(text.substr(0, a)), *path, Bytes(mac->begin(), mac->end())};
}

bool verifyToken(const Token& token) {
    if (token.extensionClass != kReadOnlyClass) return false;
    const TokenKey* key = secretKey();
    if (!key || token.mac.size() != crypto_auth_BYTES) return false;
    auto mac = macOf(*key, token.extensionClass, token.path);
    static_assert(crypto_auth_BYTES == crypto_verify_32_BYTES);
    return crypto_verify_32(token.mac.data(), mac.data()) == 0;
}

int64_t consumeExtension(const std::string& token) {
    static dispatch::QueuePtr queue = dispatch::Queue::create("sandbox.consume");
    auto broker = rpx::Connection::connect(kBrokerEndpoint, queue);
    broker->setEventHandler([](const rpx::Event&) {});
    broker->resume();
    rpx::Reply reply = broker->sendWithReplySync(dict({{"token", token}}));
    broker->cancel();
    const auto* fd = reply.ok() ? reply.value["fd"].asFd() : nullptr;
    if (!fd) return -1;
    return (*fd)->release();
}

int releaseExtension(int64_t handle) {
    if (handle < 0 || handle > INT_MAX) return -1;
    return ::close(static_cast<int>(handle));
}

bool isSandboxed(pid_t pid) {
    std::string proc = "/proc/" + std::to_string(pid);
    std::ifstream status(proc + "/status");
    if (!status) return true;
    std::string line;
    bool seen = false;
    while (std::getline(status, line)) {
        if (line.rfind("Seccomp:", 0) == 0) {
            seen = true;
            if (std::atoi(line.c_str() + 8) != 0) return true;
        }
    }
    if (!seen) return true;
    for (const char* ns : {"mnt", "user"}) {
        std::string theirs = nsLink(proc, ns);
        if (theirs.empty() || theirs != nsLink("/proc/self", ns)) return true;
    }
    struct stat st {};
    if (::lstat((proc + "/root/.corvane-sandbox").c_str(), &st) == 0) return true;
    return errno != ENOENT;
}

Result<std::unique_ptr<Broker>> Broker::start(dispatch::QueuePtr queue) {
    auto listener = rpx::serveRequests(kBrokerEndpoint, std::move(queue), [](const rpx::Connection& connection,
                                                                             const Value& request) {
        const std::string* text = request["token"].asString();
        auto token = text ? parseToken(*text) : std::nullopt;
        if (!token || !verifyToken(*token)) {
            log::notice(sandboxLog(), "refused a sandbox token from pid %d", connection.pid());
            return dict({{"error", "invalid token"}});
        }
        int fd = openGrantedPath(token->path);
        if (fd < 0) return dict({{"error", std::string(std::strerror(errno))}});
        return dict({{"fd", Value(std::make_shared<FileDescriptor>(fd))}});
    });
    if (!listener) return listener.error();
    return std::unique_ptr<Broker>(new Broker(*listener));
}

Broker::~Broker() { listener_->cancel(); }

}  // namespace corvane::sandbox
