// Sandbox extension tokens: read access to one canonical path for whichever process presents the
// token (docs/sandbox.md).
//
// A token names its class (only the read-only class exists) and a canonical path, and carries a
// keyed MAC under the user's secret key (<per-user data>/sandbox/token.key, mode 0600), so nobody
// without the key can make or change one. Consuming a token means presenting it to the token
// broker (rpx endpoint "com.corvane.sandbox"), which checks it and answers with a read-only
// descriptor of that path; the descriptor is the handle, and releasing closes it. A daemon hosts
// the broker.
//
// Thread-safety: every function here may be called from any thread.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/dispatch/Dispatch.h"
#include "platform/rpx/Rpx.h"
#include "platform/value/Value.h"

namespace corvane::sandbox {

inline constexpr const char* kReadOnlyClass = "com.corvane.sandbox.read-only";
// Resolve the path to its canonical form (symbolic links, "." and "..") before granting.
inline constexpr unsigned kCanonicalPath = 1;
// The path is already canonical: resolved by the caller when it recorded it (the registry resolves
// a bundle's path at registration). Granted as given without a look at the file system; it must be
// absolute with no "." or ".." component. Should a symbolic link stand anywhere on it by the time
// the token is consumed, the broker refuses it.
inline constexpr unsigned kResolvedPath = 2;
inline constexpr const char* kBrokerEndpoint = "com.corvane.sandbox";

// Issues a token. Refused with a POSIX error when the class is unknown (EINVAL), the path cannot be
// resolved or does not exist (the system's error; not looked at with kResolvedPath, where a path
// that is not absolute and plain is EINVAL), or this user has no token key (EACCES).
Result<std::string> issueFileReadExtension(const char* extensionClass, const std::string& path, unsigned flags);

struct Token {
    std::string extensionClass;
    std::string path;
    Bytes mac;
};
// Reads a token's fields; nullopt when it is not shaped like one (nothing is verified).
std::optional<Token> parseToken(std::string_view text);
// Whether the token was made with this user's key.
bool verifyToken(const Token& token);

// Presents a token to the broker; the handle is a read-only descriptor of the token's path, or -1
// when the broker refuses or cannot be reached.
int64_t consumeExtension(const std::string& token);
// Ends the access of a consumed token (closes its descriptor). 0 on success, -1 otherwise.
int releaseExtension(int64_t handle);

// Whether a process runs confined: under seccomp, in a mount or user namespace other than ours,
// or with a marker file "/.corvane-sandbox" in its root. True when it cannot be known.
bool isSandboxed(pid_t pid);

// The token broker on kBrokerEndpoint. Lives until destroyed.
class Broker {
public:
    static Result<std::unique_ptr<Broker>> start(dispatch::QueuePtr queue);
    ~Broker();

private:
    explicit Broker(std::shared_ptr<rpx::Listener> listener) : listener_(std::move(listener)) {}
    std::shared_ptr<rpx::Listener> listener_;
};

}  // namespace corvane::sandbox
