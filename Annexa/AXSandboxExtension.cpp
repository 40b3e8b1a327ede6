#include "Annexa/AXSandboxExtension.h"

#include "platform/sandbox/Sandbox.h"

namespace annexa {

Result<std::string> issueReadExtensionForURL(const std::string& path) {
    return corvane::sandbox::issueFileReadExtension(corvane::sandbox::kReadOnlyClass, path,
                                                    corvane::sandbox::kCanonicalPath);
}

void AXSandboxExtension::consume() {
    if (handle_.load() != 0) return;
    handle_.store(corvane::sandbox::consumeExtension(token()));
}

void AXSandboxExtension::expel() {
    int64_t h = handle_.load();
    if (h == 0) return;
    corvane::sandbox::releaseExtension(h);
    handle_.store(0);
}

std::string AXSandboxExtension::token() const {
    corvane::MutexLock lock(mutex_);
    return token_;
}

void AXSandboxExtension::setToken(std::string token) {
    corvane::MutexLock lock(mutex_);
    token_ = std::move(token);
}

}  // namespace annexa
