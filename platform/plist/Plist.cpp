#include "platform/plist/Plist.h"

#include "platform/plist/PlistRead.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
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

// ---- the file system

int FileSystem::openFile(const std::string& path, int flags, mode_t mode, int& fd) {
    fd = ::open(path.c_str(), flags | O_CLOEXEC, mode);
    return fd < 0 ? errno : 0;
}

int FileSystem::writeSome(int fd, const char* data, size_t size, size_t& written) {
    for (;;) {
        ssize_t n = ::write(fd, data, size);
        if (n >= 0) {
            written = static_cast<size_t>(n);
            return 0;
        }
        if (errno != EINTR) return errno;
    }
}

int FileSystem::readSome(int fd, char* data, size_t size, size_t& got) {
    for (;;) {
        ssize_t n = ::read(fd, data, size);
        if (n >= 0) {
            got = static_cast<size_t>(n);
            return 0;
        }
        if (errno != EINTR) return errno;
    }
}

int FileSystem::syncFile(int fd) { return ::fsync(fd) == 0 ? 0 : errno; }

int FileSystem::closeFile(int fd) { return ::close(fd) == 0 ? 0 : errno; }

int FileSystem::linkOpenFile(int fd, const std::string& path) {
    std::string self = "/proc/self/fd/" + std::to_string(fd);
    return ::linkat(AT_FDCWD, self.c_str(), AT_FDCWD, path.c_str(), AT_SYMLINK_FOLLOW) == 0 ? 0 : errno;
}

int FileSystem::linkFile(const std::string& from, const std::string& to) {
    return ::link(from.c_str(), to.c_str()) == 0 ? 0 : errno;
}

int FileSystem::renameFile(const std::string& from, const std::string& to) {
    return ::rename(from.c_str(), to.c_str()) == 0 ? 0 : errno;
}

int FileSystem::removeFile(const std::string& path) { return ::unlink(path.c_str()) == 0 ? 0 : errno; }

int FileSystem::syncDirectory(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return errno;
    int err = ::fsync(fd) == 0 ? 0 : errno;
    ::close(fd);
    return err;
}

namespace {

FileSystem gRealFileSystem;
std::atomic<FileSystem*> gFileSystem{&gRealFileSystem};

}  // namespace

FileSystem& fileSystem() { return *gFileSystem.load(); }

void setFileSystem(FileSystem* replacement) { gFileSystem.store(replacement ? replacement : &gRealFileSystem); }

Result<std::string> readWholeFile(const std::string& path) {
    FileSystem& fs = fileSystem();
    int fd = -1;
    if (int err = fs.openFile(path, O_RDONLY, 0, fd)) return Error::file(err, path, false);
    std::string out;
    char buf[65536];
    for (;;) {
        size_t got = 0;
        if (int err = fs.readSome(fd, buf, sizeof buf, got)) {
            fs.closeFile(fd);
            return Error::file(err, path, false);
        }
        if (got == 0) break;
        out.append(buf, got);
    }
    fs.closeFile(fd);
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

namespace {

// The temporary names of one write beside `path`: ".<name>.<pid>-<write>.<suffix>", which
// removeStaleTemporaries clears; writes of the same file by two threads use names of their own.
std::string besideTarget(const std::string& dir, const std::string& base, uint64_t write, const char* suffix) {
    return dir + "/." + base + "." + std::to_string(::getpid()) + "-" + std::to_string(write) + "." + suffix;
}

std::atomic<uint64_t> gWrites{0};

// Writes all of `bytes` to `fd`; 0 or the errno.
int writeAll(FileSystem& fs, int fd, std::string_view bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        size_t written = 0;
        if (int err = fs.writeSome(fd, bytes.data() + done, bytes.size() - done, written)) return err;
        if (written == 0) return EIO;
        done += written;
    }
    return 0;
}

}  // namespace

Status writeFileAtomically(const std::string& path, std::string_view bytes, mode_t mode, Durability durability) {
    bool synced = durability == Durability::Synced;
    FileSystem& fs = fileSystem();
    std::string dir = directoryOf(path);
    std::string base = baseOf(path);
    uint64_t write = ++gWrites;
    mode_t mask = umask(0);
    umask(mask);
    // The new contents are written to an unnamed file, which gets a name only for the instant
    // between linking it in and renaming it over the old file: a process killed while writing
    // leaves nothing behind. File systems without unnamed files get a named temporary instead.
    std::string tmp;
    int fd = -1;
    int err = fs.openFile(dir, O_TMPFILE | O_WRONLY, 0600, fd);
    bool unnamed = err == 0;
    if (err == EOPNOTSUPP || err == EISDIR) {
        tmp = besideTarget(dir, base, write, "new");
        (void)fs.removeFile(tmp);
        err = fs.openFile(tmp, O_WRONLY | O_CREAT | O_EXCL, 0600, fd);
        if (err) tmp.clear();
    }
    if (err) return Error::file(err, path, true);
    auto failWith = [&](int e) {
        if (fd >= 0) (void)fs.closeFile(fd);
        if (!tmp.empty()) (void)fs.removeFile(tmp);
        return Error::file(e, path, true);
    };
    if (fchmod(fd, mode & ~mask) != 0) return failWith(errno);
    if ((err = writeAll(fs, fd, bytes)) || (synced && (err = fs.syncFile(fd)))) return failWith(err);
    if (unnamed) {
        std::string name = besideTarget(dir, base, write, "new");
        (void)fs.removeFile(name);
        if ((err = fs.linkOpenFile(fd, name))) return failWith(err);
        tmp = name;
    }
    err = fs.closeFile(fd);
    fd = -1;
    if (err) return failWith(err);
    if (!synced) {
        if ((err = fs.renameFile(tmp, path))) return failWith(err);
        return {};
    }
    // The old file stays reachable until the directory holds the new name for good, so that a
    // failed directory sync can put it back.
    std::string old = besideTarget(dir, base, write, "old");
    (void)fs.removeFile(old);
    err = fs.linkFile(path, old);
    bool hadOld = err == 0;
    if (err && err != ENOENT) return failWith(err);
    if ((err = fs.renameFile(tmp, path))) {
        if (hadOld) (void)fs.removeFile(old);
        return failWith(err);
    }
    tmp.clear();
    if ((err = fs.syncDirectory(dir))) {
        if (hadOld) {
            (void)fs.renameFile(old, path);
        } else {
            (void)fs.removeFile(path);
        }
        (void)fs.syncDirectory(dir);
        return Error::file(err, path, true);
    }
    if (hadOld) (void)fs.removeFile(old);
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
