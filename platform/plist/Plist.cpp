#include "platform/plist/Plist.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

namespace corvane::plist {

namespace {

// Seconds between 1970-01-01 and 2001-01-01, the epoch of property-list dates.
constexpr int64_t kPlistEpoch = 978307200;
// Deeper nesting than any real property list; bounds the recursion of the conversion.
constexpr int kMaxDepth = 512;

Error plistError(int64_t code, std::string text) {
    return Error{kPlistErrorDomain, code, std::move(text)};
}

struct PlistFree {
    void operator()(plist_t p) const { plist_free(p); }
};

std::optional<Value> convert(plist_t node, int depth) {
    if (depth > kMaxDepth) return std::nullopt;
    switch (plist_get_node_type(node)) {
        case PLIST_BOOLEAN: {
            uint8_t b = 0;
            plist_get_bool_val(node, &b);
            return Value(b != 0);
        }
        case PLIST_UINT: {
            uint64_t u = 0;
            plist_get_uint_val(node, &u);
            return Value(static_cast<int64_t>(u));
        }
        case PLIST_UID: {
            uint64_t u = 0;
            plist_get_uid_val(node, &u);
            return Value(u);
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(node, &d);
            return Value(d);
        }
        case PLIST_STRING:
        case PLIST_KEY: {
            char* s = nullptr;
            if (plist_get_node_type(node) == PLIST_STRING) {
                plist_get_string_val(node, &s);
            } else {
                plist_get_key_val(node, &s);
            }
            std::string str = s ? s : "";
            std::free(s);
            if (!isValidUtf8(str)) return std::nullopt;
            return Value(std::move(str));
        }
        case PLIST_DATA: {
            char* bytes = nullptr;
            uint64_t len = 0;
            plist_get_data_val(node, &bytes, &len);
            Value v = Value::data(bytes, bytes ? len : 0);
            std::free(bytes);
            return v;
        }
        case PLIST_DATE: {
            int32_t sec = 0;
            int32_t usec = 0;
            plist_get_date_val(node, &sec, &usec);
            return Value(Date{(kPlistEpoch + sec) * 1000000 + usec});
        }
        case PLIST_ARRAY: {
            Array a;
            uint32_t n = plist_array_get_size(node);
            a.reserve(n);
            for (uint32_t i = 0; i < n; ++i) {
                auto v = convert(plist_array_get_item(node, i), depth + 1);
                if (!v) return std::nullopt;
                a.push_back(std::move(*v));
            }
            return Value(std::move(a));
        }
        case PLIST_DICT: {
            Dictionary d;
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(node, &it);
            for (;;) {
                char* key = nullptr;
                plist_t item = nullptr;
                plist_dict_next_item(node, it, &key, &item);
                if (!item) {
                    std::free(key);
                    break;
                }
                std::string k = key ? key : "";
                std::free(key);
                auto v = convert(item, depth + 1);
                if (!v || !isValidUtf8(k)) {
                    std::free(it);
                    return std::nullopt;
                }
                d.insert_or_assign(std::move(k), std::move(*v));
            }
            std::free(it);
            return Value(std::move(d));
        }
        default: return std::nullopt;
    }
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

MaybeError writeNode(std::string& out, const Value& v, int depth) {
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
            time_t secs = static_cast<time_t>(v.asDate()->micros >= 0
                                                  ? v.asDate()->micros / 1000000
                                                  : (v.asDate()->micros - 999999) / 1000000);
            struct tm tm {};
            gmtime_r(&secs, &tm);
            std::strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%SZ", &tm);
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
                if (auto err = writeNode(out, e, depth + 1)) return err;
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
                if (auto err = writeNode(out, e, depth + 1)) return err;
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
    return std::nullopt;
}

std::string directoryOf(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos) return ".";
    if (slash == 0) return "/";
    return path.substr(0, slash);
}

}  // namespace

Result<Value> parse(std::string_view bytes) {
    if (bytes.size() < 8 || bytes.size() > UINT32_MAX)
        return plistError(kPlistReadCorrupt, "not a property list");
    plist_t root = nullptr;
    plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
    if (!root) return plistError(kPlistReadCorrupt, "not a property list");
    std::unique_ptr<void, PlistFree> owner(root);
    auto v = convert(root, 0);
    if (!v) return plistError(kPlistReadCorrupt, "property list with unreadable contents");
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
    if (auto err = writeNode(out, value, 0)) return *err;
    out += "</plist>\n";
    return out;
}

MaybeError writeFileAtomically(const std::string& path, std::string_view bytes, mode_t mode) {
    std::string dir = directoryOf(path);
    std::string base = path.substr(path.rfind('/') == std::string::npos ? 0 : path.rfind('/') + 1);
    std::string tmp = dir + "/." + base + ".XXXXXX";
    int fd = mkostemp(tmp.data(), O_CLOEXEC);
    if (fd < 0) return Error::file(errno, path, true);
    auto failWith = [&](int err) {
        ::close(fd);
        ::unlink(tmp.c_str());
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
    return std::nullopt;
}

MaybeError writeXMLFile(const std::string& path, const Value& value, mode_t mode) {
    auto xml = toXML(value);
    if (!xml) return xml.error();
    return writeFileAtomically(path, *xml, mode);
}

}  // namespace corvane::plist
