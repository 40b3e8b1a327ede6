#include "platform/bundle/Bundle.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>

#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"

namespace corvane::bundle {

namespace {

bool isDirectory(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::string parentOf(const std::string& path) {
    size_t slash = path.rfind('/');
    return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

}  // namespace

Value readInfoPlist(const std::string& path) {
    auto v = readPropertyListOfBundle(path + "/Info.plist");
    if (!v || !v->isDictionary()) return Value();
    return std::move(*v);
}

namespace {

std::string sizeText(uint64_t bytes) {
    return bytes >= (uint64_t{1} << 20) ? std::to_string(bytes >> 20) + " MiB" : std::to_string(bytes) + " bytes";
}

const char* kindOf(mode_t mode) {
    if (S_ISDIR(mode)) return "a directory";
    if (S_ISFIFO(mode)) return "a FIFO";
    if (S_ISCHR(mode) || S_ISBLK(mode)) return "a device";
    if (S_ISSOCK(mode)) return "a socket";
    return "no regular file";
}

}  // namespace

Result<std::shared_ptr<FileDescriptor>> openFileOfBundle(const std::string& path, bool followLinks) {
    int fd = ::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY | (followLinks ? 0 : O_NOFOLLOW));
    if (fd < 0) {
        if (errno == ELOOP) return Error{kFileErrorDomain, kFileReadUnknown, path + ": a symbolic link, which is not followed"};
        return Error::file(errno, path, false);
    }
    auto file = std::make_shared<FileDescriptor>(fd);
    struct stat st {};
    if (::fstat(fd, &st) != 0) return Error::file(errno, path, false);
    if (!S_ISREG(st.st_mode)) return Error{kFileErrorDomain, kFileReadUnknown, path + ": " + kindOf(st.st_mode) + ", not a regular file"};
    return file;
}

Result<std::string> readFileOfBundle(const std::string& path, size_t limit, bool followLinks) {
    auto file = openFileOfBundle(path, followLinks);
    if (!file) return file.error();
    return readOpenedFile((*file)->get(), path, limit);
}

Result<std::string> readOpenedFile(int fd, const std::string& path, size_t limit) {
    struct stat st {};
    ::fstat(fd, &st);
    if (static_cast<uint64_t>(st.st_size) > limit)
        return Error{kFileErrorDomain, kFileReadUnknown, path + ": " + sizeText(static_cast<uint64_t>(st.st_size)) +
                                                             ", larger than the " + sizeText(limit) + " it may be"};
    // Read no more than the limit (and one byte to see a file that grew meanwhile).
    std::string bytes(static_cast<size_t>(st.st_size) + 1, '\0');
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd, bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return Error::file(errno, path, false);
        if (n == 0) break;
        got += static_cast<size_t>(n);
        if (got > limit) {
            return Error{kFileErrorDomain, kFileReadUnknown,
                         path + ": grew past the " + sizeText(limit) + " it may be while it was read"};
        }
        if (got == bytes.size()) bytes.resize(std::min(bytes.size() * 2, limit + 1));
    }
    bytes.resize(got);
    return bytes;
}

Result<Value> readPropertyListOfBundle(const std::string& path, bool followLinks) {
    auto bytes = readFileOfBundle(path, kMaxPropertyListSize, followLinks);
    if (!bytes) return bytes.error();
    auto value = plist::parse(*bytes);
    if (!value) return Error{value.error().domain, value.error().code, path + ": " + value.error().description()};
    return value;
}

std::shared_ptr<Bundle> Bundle::openPath(const std::string& path) {
    auto real = layout::canonicalPath(path);
    if (!real || !isDirectory(*real)) return nullptr;
    return std::shared_ptr<Bundle>(new Bundle(*real));
}

std::shared_ptr<Bundle> Bundle::openExecutable(const std::string& path) {
    auto real = layout::canonicalPath(path);
    if (real) {
        // Walk up from the executable's directory; the first bundle whose executable is this file
        // is its bundle.
        std::string exeName = real->substr(real->rfind('/') + 1);
        std::string dir = parentOf(*real);
        for (;;) {
            Value info = readInfoPlist(dir);
            const std::string* named = info["KFBundleExecutable"].asString();
            if (named && dir + "/" + *named == *real) return std::shared_ptr<Bundle>(new Bundle(dir));
            if (dir == "/") break;
            dir = parentOf(dir);
        }
    }
    return std::shared_ptr<Bundle>(new Bundle(std::string()));
}

std::shared_ptr<Bundle> Bundle::mainBundle() { return openExecutable("/proc/self/exe"); }

std::optional<std::string> Bundle::property(int number) const {
    if (path_.empty()) return std::nullopt;
    switch (number) {
        case kPropertyBundlePath:
        case kPropertySupportPath: return path_;
        case kPropertyExecutablePath: return executablePathIn(path_, infoDictionary());
        default: return std::nullopt;
    }
}

std::optional<std::string> executablePathIn(const std::string& bundlePath, const Value& info) {
    const std::string* named = info["KFBundleExecutable"].asString();
    if (!named || named->empty() || named->find('/') != std::string::npos) return std::nullopt;
    return bundlePath + "/" + *named;
}

Value Bundle::infoDictionary() const {
    if (path_.empty()) return Value();
    MutexLock lock(mutex_);
    if (!info_) info_ = readInfoPlist(path_);
    return *info_;
}

std::optional<std::string> Bundle::receiptPath() const {
    if (path_.empty()) return std::nullopt;
    std::string receipt = path_ + "/" + kReceiptFileName;
    struct stat st {};
    if (::lstat(receipt.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;
    return receipt;
}

void Bundle::flush() {
    MutexLock lock(mutex_);
    info_.reset();
}

std::string Bundle::description() const {
    return "<bundle " + (path_.empty() ? std::string("(none)") : path_) + ">";
}

}  // namespace corvane::bundle
