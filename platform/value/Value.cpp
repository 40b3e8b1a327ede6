#include "platform/value/Value.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <limits>
#include <mutex>

namespace corvane {

// ---- UUID

UUID UUID::random() {
    UUID u;
    size_t got = 0;
    while (got < u.bytes.size()) {
        ssize_t n = getrandom(u.bytes.data() + got, u.bytes.size() - got, 0);
        if (n < 0) {
            if (errno == EINTR) continue;
            abort();  // no entropy source at all: nothing sensible can go on
        }
        got += static_cast<size_t>(n);
    }
    u.bytes[6] = (u.bytes[6] & 0x0f) | 0x40;  // version 4
    u.bytes[8] = (u.bytes[8] & 0x3f) | 0x80;  // RFC 4122 variant
    return u;
}

static int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != 36) return std::nullopt;
    UUID u;
    size_t byte = 0;
    for (size_t i = 0; i < 36;) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-') return std::nullopt;
            ++i;
            continue;
        }
        int hi = hexDigit(text[i]);
        int lo = hexDigit(text[i + 1]);
        if (hi < 0 || lo < 0) return std::nullopt;
        u.bytes[byte++] = static_cast<uint8_t>(hi << 4 | lo);
        i += 2;
    }
    return u;
}

std::string UUID::string() const {
    static const char* digits = "0123456789ABCDEF";
    std::string s;
    s.reserve(36);
    for (size_t i = 0; i < 16; ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10) s.push_back('-');
        s.push_back(digits[bytes[i] >> 4]);
        s.push_back(digits[bytes[i] & 0xf]);
    }
    return s;
}

size_t UUIDHash::operator()(const UUID& uuid) const noexcept {
    uint64_t a = 0;
    uint64_t b = 0;
    std::memcpy(&a, uuid.bytes.data(), 8);
    std::memcpy(&b, uuid.bytes.data() + 8, 8);
    return std::hash<uint64_t>()(a ^ (b * 0x9e3779b97f4a7c15ULL));
}

// ---- Date

Date Date::now() {
    auto since = std::chrono::system_clock::now().time_since_epoch();
    return Date{std::chrono::duration_cast<std::chrono::microseconds>(since).count()};
}

Date Date::fromSeconds(double seconds) {
    // About 292,000 years either way fit in 64 bits of microseconds; beyond that, saturate.
    constexpr double kLimit = 9.2e12;
    if (std::isnan(seconds)) return Date{0};
    if (seconds > kLimit) seconds = kLimit;
    if (seconds < -kLimit) seconds = -kLimit;
    return Date{static_cast<int64_t>(std::llround(seconds * 1e6))};
}

// ---- FileDescriptor

FileDescriptor::~FileDescriptor() {
    if (fd_ >= 0) ::close(fd_);
}

int FileDescriptor::release() noexcept {
    int fd = fd_;
    fd_ = -1;
    return fd;
}

// ---- containers known by their encoding

class EncodedContainer {
public:
    explicit EncodedContainer(Value::Encoding encoding) : encoding_(std::move(encoding)) {}
    const Value::Encoding& encoding() const { return encoding_; }
    const Value& decoded() const {
        std::call_once(once_, [this] { decoded_ = encoding_.decode(encoding_); });
        return decoded_;
    }

private:
    Value::Encoding encoding_;
    mutable std::once_flag once_;
    mutable Value decoded_;
};

Value Value::encoded(Encoding encoding) {
    Value v;
    v.v_ = std::make_shared<const EncodedContainer>(std::move(encoding));
    return v;
}

const Value::Encoding* Value::encoding() const {
    const auto* p = std::get_if<std::shared_ptr<const EncodedContainer>>(&v_);
    return p ? &(*p)->encoding() : nullptr;
}

Value::Kind Value::encodedKind() const { return encoding()->kind; }

uint32_t Value::kindsInside() const {
    if (const Encoding* e = encoding()) return e->kindsInside;
    uint32_t kinds = 1u << static_cast<unsigned>(kind());
    if (const Array* a = asArray()) {
        for (const Value& e : *a) kinds |= e.kindsInside();
    } else if (const Dictionary* d = asDictionary()) {
        for (const auto& [k, e] : *d) kinds |= e.kindsInside();
    }
    return kinds;
}

// ---- Value

Value::Value(Array a) : v_(std::make_shared<const Array>(std::move(a))) {}
Value::Value(Dictionary d) : v_(std::make_shared<const Dictionary>(std::move(d))) {}
Value::Value(std::shared_ptr<FileDescriptor> fd) {
    if (fd) v_ = std::move(fd);
}

Value Value::data(Bytes bytes) {
    Value v;
    v.v_ = std::make_shared<const Bytes>(std::move(bytes));
    return v;
}

Value Value::data(const void* bytes, size_t size) {
    const auto* p = static_cast<const uint8_t*>(bytes);
    return data(Bytes(p, p + size));
}

const char* Value::kindName(Kind kind) {
    switch (kind) {
        case Kind::Null: return "null";
        case Kind::Bool: return "bool";
        case Kind::Int64: return "int64";
        case Kind::UInt64: return "uint64";
        case Kind::Double: return "double";
        case Kind::String: return "string";
        case Kind::Data: return "data";
        case Kind::Date: return "date";
        case Kind::UUID: return "uuid";
        case Kind::Array: return "array";
        case Kind::Dictionary: return "dictionary";
        case Kind::Fd: return "fd";
    }
    return "?";
}

bool Value::isNumber() const {
    switch (kind()) {
        case Kind::Bool:
        case Kind::Int64:
        case Kind::UInt64:
        case Kind::Double: return true;
        default: return false;
    }
}

const Dictionary* Value::asDictionary() const& {
    if (const auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&v_)) return p->get();
    if (const auto* e = std::get_if<std::shared_ptr<const EncodedContainer>>(&v_)) return (*e)->decoded().asDictionary();
    return nullptr;
}

const Array* Value::asArray() const& {
    if (const auto* p = std::get_if<std::shared_ptr<const Array>>(&v_)) return p->get();
    if (const auto* e = std::get_if<std::shared_ptr<const EncodedContainer>>(&v_)) return (*e)->decoded().asArray();
    return nullptr;
}

const Bytes* Value::asData() const& {
    const auto* p = std::get_if<std::shared_ptr<const Bytes>>(&v_);
    return p ? p->get() : nullptr;
}

const std::shared_ptr<FileDescriptor>* Value::asFd() const& {
    return std::get_if<std::shared_ptr<FileDescriptor>>(&v_);
}

std::optional<int64_t> Value::int64Value() const {
    switch (kind()) {
        case Kind::Bool: return std::get<bool>(v_) ? 1 : 0;
        case Kind::Int64: return std::get<int64_t>(v_);
        case Kind::UInt64: return static_cast<int64_t>(std::get<uint64_t>(v_));
        case Kind::Double: {
            double d = std::get<double>(v_);
            if (std::isnan(d)) return 0;
            if (d >= 9.2233720368547758e18) return std::numeric_limits<int64_t>::max();
            if (d <= -9.2233720368547758e18) return std::numeric_limits<int64_t>::min();
            return static_cast<int64_t>(d);
        }
        default: return std::nullopt;
    }
}

std::optional<uint64_t> Value::uint64Value() const {
    switch (kind()) {
        case Kind::UInt64: return std::get<uint64_t>(v_);
        case Kind::Double: {
            double d = std::get<double>(v_);
            if (std::isnan(d) || d <= 0) return d < 0 ? static_cast<uint64_t>(*int64Value()) : 0;
            if (d >= 1.8446744073709552e19) return std::numeric_limits<uint64_t>::max();
            return static_cast<uint64_t>(d);
        }
        default: {
            auto i = int64Value();
            if (!i) return std::nullopt;
            return static_cast<uint64_t>(*i);
        }
    }
}

std::optional<double> Value::doubleValue() const {
    switch (kind()) {
        case Kind::Bool: return std::get<bool>(v_) ? 1.0 : 0.0;
        case Kind::Int64: return static_cast<double>(std::get<int64_t>(v_));
        case Kind::UInt64: return static_cast<double>(std::get<uint64_t>(v_));
        case Kind::Double: return std::get<double>(v_);
        default: return std::nullopt;
    }
}

std::optional<bool> Value::boolValue() const {
    if (kind() == Kind::Bool) return std::get<bool>(v_);
    auto d = doubleValue();
    if (!d) return std::nullopt;
    return *d != 0;
}

const Value* Value::find(std::string_view key) const& {
    const Dictionary* d = asDictionary();
    if (!d) return nullptr;
    auto it = d->find(key);
    return it == d->end() ? nullptr : &it->second;
}

const Value& Value::operator[](std::string_view key) const& {
    const Value* v = find(key);
    return v ? *v : null();
}

Value Value::operator[](std::string_view key) && {
    const Value* v = find(key);
    return v ? *v : Value();
}

const Value& Value::null() {
    static const Value kNull;
    return kNull;
}

// Two descriptors are the same value when they refer to the same file, whatever their numbers: a
// descriptor passed to another process arrives under another number.
static bool sameOpenFile(int a, int b) {
    if (a == b) return true;
    struct stat sa {};
    struct stat sb {};
    if (fstat(a, &sa) != 0 || fstat(b, &sb) != 0) return false;
    return sa.st_dev == sb.st_dev && sa.st_ino == sb.st_ino;
}

// Numbers (booleans included) compare by numeric value. Integers are compared exactly, so that
// two 64-bit values that round to the same double are still told apart.
static bool numbersEqual(const Value& a, const Value& b) {
    using K = Value::Kind;
    if (a.kind() == K::Double || b.kind() == K::Double) return *a.doubleValue() == *b.doubleValue();
    bool aNeg = a.kind() != K::UInt64 && *a.int64Value() < 0;
    bool bNeg = b.kind() != K::UInt64 && *b.int64Value() < 0;
    if (aNeg != bNeg) return false;
    if (aNeg) return *a.int64Value() == *b.int64Value();
    return *a.uint64Value() == *b.uint64Value();
}

bool operator==(const Value& a, const Value& b) {
    if (a.isNumber() && b.isNumber()) return numbersEqual(a, b);
    if (a.kind() != b.kind()) return false;
    using K = Value::Kind;
    switch (a.kind()) {
        case K::Null: return true;
        case K::String: return *a.asString() == *b.asString();
        case K::Data: return *a.asData() == *b.asData();
        case K::Date: return *a.asDate() == *b.asDate();
        case K::UUID: return *a.asUUID() == *b.asUUID();
        case K::Array: return *a.asArray() == *b.asArray();
        case K::Dictionary: return *a.asDictionary() == *b.asDictionary();
        case K::Fd: return sameOpenFile((*a.asFd())->get(), (*b.asFd())->get());
        default: return false;  // numbers were handled above
    }
}

// ---- base64

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

std::optional<Bytes> decodeBase64(std::string_view text) {
    Bytes out;
    uint32_t acc = 0;
    int bits = 0;
    int pad = 0;
    for (char c : text) {
        int v;
        if (c >= 'A' && c <= 'Z') {
            v = c - 'A';
        } else if (c >= 'a' && c <= 'z') {
            v = c - 'a' + 26;
        } else if (c >= '0' && c <= '9') {
            v = c - '0' + 52;
        } else if (c == '+') {
            v = 62;
        } else if (c == '/') {
            v = 63;
        } else if (c == '=') {
            if (++pad > 2) return std::nullopt;
            continue;
        } else if (c == ' ' || c == '\t' || c == '\n' || c == '\r') {
            continue;
        } else {
            return std::nullopt;
        }
        if (pad) return std::nullopt;  // data after padding
        acc = acc << 6 | static_cast<uint32_t>(v);
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            out.push_back(static_cast<uint8_t>(acc >> bits & 0xff));
        }
    }
    return out;
}

// ---- Error

std::string Error::description() const {
    if (text) return *text;
    return "Error Domain=" + domain + " Code=" + std::to_string(code);
}

Error Error::posix(int err, std::string_view context) {
    std::string text = std::strerror(err);
    if (!context.empty()) text = std::string(context) + ": " + text;
    return Error{kPosixErrorDomain, err, std::move(text)};
}

Error Error::file(int err, std::string_view path, bool writing) {
    int64_t code = writing && (err == EACCES || err == EPERM || err == EROFS) ? kFileWriteNoPermission
                   : writing                                                 ? kFileWriteUnknown
                   : err == ENOENT || err == ENOTDIR ? kFileNoSuchFile
                   : err == EACCES || err == EPERM   ? kFileNoPermission
                                                     : kFileReadUnknown;
    std::string text = std::string(writing ? "cannot write " : "cannot read ") + std::string(path) +
                       ": " + std::strerror(err);
    return Error{kFileErrorDomain, code, std::move(text)};
}

}  // namespace corvane
