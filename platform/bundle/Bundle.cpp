#include "platform/bundle/Bundle.h"

#include <sys/stat.h>
#include <unistd.h>

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
    auto v = plist::readFile(path + "/Info.plist");
    if (!v || !v->isDictionary()) return Value();
    return std::move(*v);
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
        case kPropertyExecutablePath: {
            Value info = infoDictionary();
            const std::string* named = info["KFBundleExecutable"].asString();
            if (!named || named->empty() || named->find('/') != std::string::npos) return std::nullopt;
            return path_ + "/" + *named;
        }
        default: return std::nullopt;
    }
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
    if (::stat(receipt.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;
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
