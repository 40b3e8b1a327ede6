#include "platform/plist/Plist.h"

#include "platform/plist/PlistRead.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <vector>
#include <cstdlib>
#include <cstring>
#include <ctime>

namespace corvane::plist {

namespace {

// Deeper nesting than any real property list; bounds the recursion of the conversion.
constexpr int kMaxDepth = 512;

Error plistError(int64_t code, std::string text) {
    return Error{kPlistErrorDomain, code, std::move(text)};
}

// ---- XML writer

void appendEscaped(std::string& out, std::string_view s) {
    for (char c : s) {
        switch (c) {
            case '&': out += "&amp;"; break;
            case '<': out += "&lt;"; break;
            case '>': out += "&gt;"; break;
            default: out.push_back(c);
        }
    }
}

bool xmlCarries(std::string_view s) {
    for (unsigned char c : s)
        if (c < 0x20 && c != '\t' && c != '\n' && c != '\r') return false;
    return isValidUtf8(s);
}

void appendBase64(std::string& out, const Bytes& bytes) {
    static const char* table = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    size_t i = 0;
    for (; i + 2 < bytes.size(); i += 3) {
        uint32_t n = bytes[i] << 16 | bytes[i + 1] << 8 | bytes[i + 2];
        out += table[n >> 18];
        out += table[n >> 12 & 63];
        out += table[n >> 6 & 63];
        out += table[n & 63];
    }
    if (i + 1 == bytes.size()) {
        uint32_t n = bytes[i] << 16;
        out += table[n >> 18];
        out += table[n >> 12 & 63];
        out += "==";
    } else if (i + 2 == bytes.size()) {
        uint32_t n = bytes[i] << 16 | bytes[i + 1] << 8;
        out += table[n >> 18];
        out += table[n >> 12 & 63];
        out += table[n >> 6 & 63];
        out += '=';
    }
}

Status writeNode(std::string& out, const Value& v, int depth) {
    if (depth > kMaxDepth) return plistError(kPlistWriteInvalid, "value nested too deeply");
    std::string indent(static_cast<size_t>(depth), '\t');
    char buf[64];
    using K = Value::Kind;
    switch (v.kind()) {
        case K::Bool: out += indent + (*v.boolValue() ? "<true/>\n" : "<false/>\n"); break;
        case K::Int64:
            std::snprintf(buf, sizeof buf, "%" PRId64, *v.int64Value());
            out += indent + "<integer>" + buf + "</integer>\n";
            break;
        case K::UInt64:
            std::snprintf(buf, sizeof buf, "%" PRIu64, *v.uint64Value());
            out += indent + "<integer>" + buf + "</integer>\n";
            break;
        case K::Double: {
            double d = *v.doubleValue();
            if (std::isnan(d)) {
                std::snprintf(buf, sizeof buf, "nan");
            } else if (std::isinf(d)) {
                std::snprintf(buf, sizeof buf, d < 0 ? "-inf" : "+inf");
            } else {
                std::snprintf(buf, sizeof buf, "%.17g", d);
            }
            out += indent + "<real>" + buf + "</real>\n";
            break;
        }
        case K::String:
            if (!xmlCarries(*v.asString()))
                return plistError(kPlistWriteInvalid, "string with characters XML cannot carry");
            out += indent + "<string>";
            appendEscaped(out, *v.asString());
            out += "</string>\n";
            break;
        case K::Data:
            out += indent + "<data>";
            appendBase64(out, *v.asData());
            out += "</data>\n";
            break;
        case K::Date: {
            // The XML form writes four-digit years only.
            constexpr int64_t kYear0 = -62167219200;     // 0000-01-01T00:00:00Z
            constexpr int64_t kYear10000 = 253402300800;  // 10000-01-01T00:00:00Z
            int64_t micros = v.asDate()->micros;
            int64_t whole = micros / 1000000 - (micros % 1000000 < 0 ? 1 : 0);
            if (whole < kYear0 || whole >= kYear10000)
                return plistError(kPlistWriteInvalid, "date outside the years 0 to 9999");
            auto secs = static_cast<time_t>(whole);
            struct tm tm {};
            gmtime_r(&secs, &tm);
            std::snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02dZ", tm.tm_year + 1900,
                          tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
            out += indent + "<date>" + buf + "</date>\n";
            break;
        }
        case K::Array:
            if (v.asArray()->empty()) {
                out += indent + "<array/>\n";
                break;
            }
            out += indent + "<array>\n";
            for (const Value& e : *v.asArray())
                if (Status err = writeNode(out, e, depth + 1); !err.ok()) return err;
            out += indent + "</array>\n";
            break;
        case K::Dictionary:
            if (v.asDictionary()->empty()) {
                out += indent + "<dict/>\n";
                break;
            }
            out += indent + "<dict>\n";
            for (const auto& [key, e] : *v.asDictionary()) {
                if (!xmlCarries(key))
                    return plistError(kPlistWriteInvalid, "key with characters XML cannot carry");
                out += indent + "\t<key>";
                appendEscaped(out, key);
                out += "</key>\n";
                if (Status err = writeNode(out, e, depth + 1); !err.ok()) return err;
            }
            out += indent + "</dict>\n";
            break;
        case K::Null:
        case K::UUID:
        case K::Fd:
            return plistError(kPlistWriteInvalid, std::string("a value of kind ") +
                                                      Value::kindName(v.kind()) +
                                                      " has no property-list form");
    }
    return {};
}

std::string directoryOf(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos) return ".";
    if (slash == 0) return "/";
    return path.substr(0, slash);
}

}  // namespace

Result<Value> parse(std::string_view bytes) {
    std::optional<Value> v = bytes.substr(0, 6) == "bplist" ? detail::readBinary(bytes)
                                                            : detail::readXml(bytes);
    if (!v) return plistError(kPlistReadCorrupt, "not a property list");
    return std::move(*v);
}

Result<std::string> readWholeFile(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return Error::file(errno, path, false);
    std::string out;
    char buf[65536];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0) {
            if (errno == EINTR) continue;
            int err = errno;
            ::close(fd);
            return Error::file(err, path, false);
        }
        if (n == 0) break;
        out.append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return out;
}

Result<Value> readFile(const std::string& path) {
    auto bytes = readWholeFile(path);
    if (!bytes) return bytes.error();
    return parse(*bytes);
}

Result<std::string> toXML(const Value& value) {
    std::string out =
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<plist version=\"1.0\">\n";
    if (Status err = writeNode(out, value, 0); !err.ok()) return err.error();
    out += "</plist>\n";
    return out;
}

namespace {

std::string baseOf(const std::string& path) {
    return path.substr(path.rfind('/') == std::string::npos ? 0 : path.rfind('/') + 1);
}

}  // namespace

Status writeFileAtomically(const std::string& path, std::string_view bytes, mode_t mode) {
    std::string dir = directoryOf(path);
    std::string base = baseOf(path);
    // The new contents are written to an unnamed file, which gets a name only for the instant
    // between linking it in and renaming it over the old file: a process killed while writing
    // leaves nothing behind. File systems without unnamed files get a named temporary instead.
    std::string tmp;
    int fd = ::open(dir.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, 0600);
    bool unnamed = fd >= 0;
    if (!unnamed) {
        tmp = dir + "/." + base + ".XXXXXX";
        fd = mkostemp(tmp.data(), O_CLOEXEC);
        if (fd < 0) return Error::file(errno, path, true);
    }
    auto failWith = [&](int err) {
        ::close(fd);
        if (!tmp.empty()) ::unlink(tmp.c_str());
        return Error::file(err, path, true);
    };
    mode_t mask = umask(0);
    umask(mask);
    if (fchmod(fd, mode & ~mask) != 0) return failWith(errno);
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0) {
            if (errno == EINTR) continue;
            return failWith(errno);
        }
        done += static_cast<size_t>(n);
    }
    if (fsync(fd) != 0) return failWith(errno);
    if (unnamed) {
        tmp = dir + "/." + base + "." + std::to_string(::getpid()) + ".new";
        ::unlink(tmp.c_str());
        std::string self = "/proc/self/fd/" + std::to_string(fd);
        if (::linkat(AT_FDCWD, self.c_str(), AT_FDCWD, tmp.c_str(), AT_SYMLINK_FOLLOW) != 0) {
            tmp.clear();
            return failWith(errno);
        }
    }
    if (::close(fd) != 0) {
        int err = errno;
        ::unlink(tmp.c_str());
        return Error::file(err, path, true);
    }
    if (::rename(tmp.c_str(), path.c_str()) != 0) {
        int err = errno;
        ::unlink(tmp.c_str());
        return Error::file(err, path, true);
    }
    int dfd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dfd >= 0) {
        (void)fsync(dfd);  // the rename is done; a failed directory sync cannot be undone
        ::close(dfd);
    }
    return {};
}

void removeStaleTemporaries(const std::string& path) {
    std::string dir = directoryOf(path);
    std::string prefix = "." + baseOf(path) + ".";
    DIR* d = opendir(dir.c_str());
    if (!d) return;
    std::vector<std::string> stale;
    while (struct dirent* e = readdir(d)) {
        std::string name = e->d_name;
        if (name.size() > prefix.size() && name.compare(0, prefix.size(), prefix) == 0) stale.push_back(name);
    }
    closedir(d);
    for (const auto& name : stale) ::unlink((dir + "/" + name).c_str());
}

Status writeXMLFile(const std::string& path, const Value& value, mode_t mode) {
    auto xml = toXML(value);
    if (!xml) return xml.error();
    return writeFileAtomically(path, *xml, mode);
}

}  // namespace corvane::plist
