// The bundle reader: bundles as they lie on disk (docs/bundle-format.md).
//
// A bundle is a directory holding Info.plist, the executable named by its "KFBundleExecutable"
// beside it, plug-ins under PlugIns/, its signature in Signature.plist and, for an application, its
// receipt in Receipt, both at the bundle's root. Its support directory (the one that holds PlugIns/)
// is the bundle directory itself.
//
// Thread-safe: a Bundle caches its Info.plist under a lock until flush().
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/value/Value.h"

namespace corvane::bundle {

// Numbered properties, as text.
inline constexpr int kPropertyBundlePath = 2;
inline constexpr int kPropertyExecutablePath = 3;
inline constexpr int kPropertySupportPath = 9;

// Files at a bundle's root, beside Info.plist.
inline constexpr const char* kSignatureFileName = "Signature.plist";
inline constexpr const char* kReceiptFileName = "Receipt";

class Bundle {
public:
    // Mode 1: `path` is the bundle directory. Null when there is no directory there.
    static std::shared_ptr<Bundle> openPath(const std::string& path);
    // Mode 2: `path` names an executable; the bundle is the nearest enclosing directory whose
    // Info.plist's "KFBundleExecutable" names that very file. When there is none, the result has no
    // bundle path (property 2 is absent).
    static std::shared_ptr<Bundle> openExecutable(const std::string& path);
    // The running program's own bundle (mode 2 on /proc/self/exe).
    static std::shared_ptr<Bundle> mainBundle();

    // Property 2, 3 or 9 as text; nullopt when the bundle has none (or another number is asked).
    std::optional<std::string> property(int number) const;
    // The Info.plist as a Value; null when there is none or it is no dictionary.
    Value infoDictionary() const;
    // <bundle>/Receipt when that file exists.
    std::optional<std::string> receiptPath() const;
    // Forgets cached data, so the next read looks at the disk again.
    void flush();

    std::string description() const;

private:
    explicit Bundle(std::string path) : path_(std::move(path)) {}

    const std::string path_;  // canonical; empty for a mode-2 open that found nothing
    mutable Mutex mutex_;
    mutable std::optional<Value> info_ GUARDED_BY(mutex_);
};

// The executable that the Info.plist `info` names in the bundle at `bundlePath`: its
// "KFBundleExecutable", which must be a plain file name; nullopt when it names none.
std::optional<std::string> executablePathIn(const std::string& bundlePath, const Value& info);

// Reads the Info.plist of the bundle directory `path` without caching anything (null when it
// cannot be read; readPropertyListOfBundle says why).
Value readInfoPlist(const std::string& path);

// ---- reading what a bundle holds, or a file a client named: the one way every daemon does it

// The most a property list of a bundle (Info.plist, Names/*.plist, Signature.plist, an SDK
// definition) and a receipt may weigh; larger ones are refused, never read.
inline constexpr size_t kMaxPropertyListSize = size_t{1} << 20;
inline constexpr size_t kMaxReceiptSize = size_t{1} << 20;
// The most an executable may weigh to be hashed for its signature.
inline constexpr uint64_t kMaxExecutableSize = uint64_t{512} << 20;

// Opens the file for reading without blocking (a FIFO is refused, never waited on), without
// following a symbolic link in its last component unless `followLinks` (kernel links such as
// /proc/<pid>/exe need it), and only when it is a regular file. The descriptor (close-on-exec), or an
// error that names the path and the reason; a missing file is Error::file's kFileNoSuchFile.
Result<std::shared_ptr<FileDescriptor>> openFileOfBundle(const std::string& path, bool followLinks = false);
// The whole file when it is at most `limit` bytes; a larger one is an error.
Result<std::string> readFileOfBundle(const std::string& path, size_t limit, bool followLinks = false);
// The same for a file openFileOfBundle opened (`path` names it in errors).
Result<std::string> readOpenedFile(int fd, const std::string& path, size_t limit);
// The property list in the file (at most kMaxPropertyListSize bytes).
Result<Value> readPropertyListOfBundle(const std::string& path, bool followLinks = false);

}  // namespace corvane::bundle
