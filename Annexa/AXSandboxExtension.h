// Sandbox extension tokens from the holder's side: issue a read token for a path, and hold a
// token's access (consume once, release on expel or destruction).
#pragma once

#include <atomic>
#include <mutex>
#include <optional>
#include <string>

#include "Annexa/AXUtilities.h"

namespace annexa {

// A read-only token for the path (resolved to its canonical form), or the POSIX error that refused it.
Result<std::string> issueReadExtensionForURL(const std::string& path);

// Thread-safe fields; consume and expel are meant for one queue at a time.
class AXSandboxExtension {
public:
    explicit AXSandboxExtension(std::string token) : token_(std::move(token)) {}
    ~AXSandboxExtension() { expel(); }
    AXSandboxExtension(const AXSandboxExtension&) = delete;
    AXSandboxExtension& operator=(const AXSandboxExtension&) = delete;

    // Consumes the token unless it already is; the handle is stored as the facility gives it.
    void consume();
    // Releases a consumed token.
    void expel();

    std::string token() const;
    void setToken(std::string token);
    int64_t handle() const { return handle_.load(); }
    void setHandle(int64_t handle) { handle_.store(handle); }

private:
    mutable corvane::Mutex mutex_;
    std::string token_ GUARDED_BY(mutex_);
    std::atomic<int64_t> handle_{0};
};

}  // namespace annexa
