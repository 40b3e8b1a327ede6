// A bundle on disk: its location, executable, Info.plist, identifier and directories, read
// through the platform's bundle reader. Every reader answers null when the bundle could not be
// opened or has no such thing.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "Annexa/AXUtilities.h"
#include "platform/bundle/Bundle.h"

namespace annexa {

// Thread-safe: the opened bundle is set once; the support path is cached under a lock.
class AXBundle {
public:
    static std::shared_ptr<AXBundle> initForMainBundle();
    // URLs are file paths here; the URL forms exist for callers that think in URLs.
    static std::shared_ptr<AXBundle> initWithURL(const std::string& url);
    static std::shared_ptr<AXBundle> initWithPath(const std::string& path);
    static std::shared_ptr<AXBundle> initWithExecutableURL(const std::string& url);
    // Opens the executable's bundle; when none is found around it, opens the path itself as a
    // bundle directory.
    static std::shared_ptr<AXBundle> initWithExecutablePath(const std::string& path);
    static std::shared_ptr<AXBundle> initWithRPXBundle(std::shared_ptr<corvane::bundle::Bundle> bundle);

    std::optional<std::string> stringProperty(int number) const;
    std::optional<std::string> path() const;
    std::optional<std::string> url() const { return path(); }
    std::optional<std::string> executablePath() const;
    std::optional<std::string> supportPath() const;
    std::optional<std::string> bundleDirectory(const std::string& name) const;
    std::optional<std::string> plugInsPath() const { return bundleDirectory("PlugIns"); }
    Value infoDictionary() const;
    std::optional<std::string> bundleIdentifier() const;
    std::optional<std::string> receiptPath() const;
    void flushBundleCaches() const;

    const std::shared_ptr<corvane::bundle::Bundle>& rpxBundle() const { return bundle_; }
    std::string description() const;

private:
    explicit AXBundle(std::shared_ptr<corvane::bundle::Bundle> bundle) : bundle_(std::move(bundle)) {}

    const std::shared_ptr<corvane::bundle::Bundle> bundle_;
    mutable corvane::Mutex mutex_;
    mutable std::optional<std::string> supportPath_ GUARDED_BY(mutex_);
};

}  // namespace annexa
