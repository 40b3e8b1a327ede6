// Property-list readers for the XML and the binary form.
//
// Our own rather than libplist's: libplist 2.2 aborts the process on strings and keys that hold a
// NUL byte, and a file that any user can write must never end the daemon. Both readers check every
// bound, limit nesting, refuse cycles, and answer malformed input with nullopt.

#include <cmath>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/PlistRead.h"

namespace corvane::plist::detail {

namespace {

constexpr int kMaxDepth = 512;
// Seconds between 1970-01-01 and 2001-01-01, the epoch of property-list dates.
constexpr double kPlistEpoch = 978307200.0;

// Property lists carry no NUL characters (strings that hold one are refused).
bool appendPlistCharacter(std::string& out, uint32_t cp) { return cp != 0 && appendUtf8(out, cp); }

// ---- XML

class XmlReader {
public:
    explicit XmlReader(std::string_view text) : s_(text) {}

    std::optional<Value> read() {
        if (!skipProlog()) return std::nullopt;
        if (!openTag("plist")) return std::nullopt;
        std::optional<Value> v;
        if (!selfClosed_) {
            v = readValue(0);
            if (!v || !closeTag("plist")) return std::nullopt;
        } else {
            return std::nullopt;
        }
        skipMisc();
        if (pos_ != s_.size()) return std::nullopt;
        return v;
    }

private:
    std::string_view s_;
    size_t pos_ = 0;
    bool selfClosed_ = false;

    bool startsWith(std::string_view w) const { return s_.substr(pos_, w.size()) == w; }
    void skipSpace() {
        while (pos_ < s_.size() && (s_[pos_] == ' ' || s_[pos_] == '\t' || s_[pos_] == '\n' ||
                                    s_[pos_] == '\r'))
            ++pos_;
    }
    bool skipPast(std::string_view end) {
        size_t at = s_.find(end, pos_);
        if (at == std::string_view::npos) return false;
        pos_ = at + end.size();
        return true;
    }
    // White space, comments and processing instructions between elements.
    bool skipMisc() {
        for (;;) {
            skipSpace();
            if (startsWith("<!--")) {
                if (!skipPast("-->")) return false;
            } else if (startsWith("<?")) {
                if (!skipPast("?>")) return false;
            } else {
                return true;
            }
        }
    }
    bool skipProlog() {
        if (startsWith("\xEF\xBB\xBF")) pos_ += 3;
        for (;;) {
            if (!skipMisc()) return false;
            if (startsWith("<!DOCTYPE")) {
                if (!skipPast(">")) return false;
                continue;
            }
            return true;
        }
    }

    // Reads "<name ...>" or "<name .../>"; attributes are skipped.
    bool openTag(std::string_view name) {
        if (!skipMisc() || !startsWith("<")) return false;
        size_t p = pos_ + 1;
        if (s_.substr(p, name.size()) != name) return false;
        p += name.size();
        if (p >= s_.size()) return false;
        char c = s_[p];
        if (c != '>' && c != '/' && c != ' ' && c != '\t' && c != '\n' && c != '\r') return false;
        size_t close = s_.find('>', p);
        if (close == std::string_view::npos) return false;
        selfClosed_ = close > p && s_[close - 1] == '/';
        pos_ = close + 1;
        return true;
    }
    bool closeTag(std::string_view name) {
        if (!skipMisc()) return false;
        std::string tag = "</" + std::string(name);
        if (!startsWith(tag)) return false;
        pos_ += tag.size();
        skipSpace();
        if (pos_ >= s_.size() || s_[pos_] != '>') return false;
        ++pos_;
        return true;
    }
    // The element name at the cursor ("<name"), without moving.
    std::string_view peekName() const {
        if (pos_ >= s_.size() || s_[pos_] != '<') return {};
        size_t p = pos_ + 1;
        size_t end = p;
        while (end < s_.size() && (std::isalnum(static_cast<unsigned char>(s_[end])))) ++end;
        return s_.substr(p, end - p);
    }

    // Character data up to the closing tag of `name`, with entities and CDATA decoded.
    std::optional<std::string> text(std::string_view name) {
        std::string out;
        if (selfClosed_) return out;
        for (;;) {
            if (pos_ >= s_.size()) return std::nullopt;
            if (startsWith("<![CDATA[")) {
                size_t end = s_.find("]]>", pos_ + 9);
                if (end == std::string_view::npos) return std::nullopt;
                out.append(s_.substr(pos_ + 9, end - pos_ - 9));
                pos_ = end + 3;
                continue;
            }
            if (startsWith("<!--")) {
                if (!skipPast("-->")) return std::nullopt;
                continue;
            }
            char c = s_[pos_];
            if (c == '<') break;
            if (c == '&') {
                size_t semi = s_.find(';', pos_);
                if (semi == std::string_view::npos || semi - pos_ > 12) return std::nullopt;
                std::string_view ent = s_.substr(pos_ + 1, semi - pos_ - 1);
                pos_ = semi + 1;
                if (ent == "amp") {
                    out.push_back('&');
                } else if (ent == "lt") {
                    out.push_back('<');
                } else if (ent == "gt") {
                    out.push_back('>');
                } else if (ent == "quot") {
                    out.push_back('"');
                } else if (ent == "apos") {
                    out.push_back('\'');
                } else if (ent.size() > 1 && ent[0] == '#') {
                    bool hex = ent[1] == 'x' || ent[1] == 'X';
                    std::string digits(ent.substr(hex ? 2 : 1));
                    if (digits.empty()) return std::nullopt;
                    char* end = nullptr;
                    unsigned long cp = std::strtoul(digits.c_str(), &end, hex ? 16 : 10);
                    if (*end || cp > 0x10ffff || !appendPlistCharacter(out, static_cast<uint32_t>(cp)))
                        return std::nullopt;
                } else {
                    return std::nullopt;
                }
                continue;
            }
            if (c == '\0') return std::nullopt;
            out.push_back(c);
            ++pos_;
        }
        if (!closeTag(name)) return std::nullopt;
        if (!isValidUtf8(out)) return std::nullopt;
        return out;
    }

    std::optional<Value> readValue(int depth) {
        if (depth > kMaxDepth || !skipMisc()) return std::nullopt;
        std::string name(peekName());
        if (name.empty() || !openTag(name)) return std::nullopt;
        if (name == "dict") return readDict(depth);
        if (name == "array") return readArray(depth);
        if (name == "true" || name == "false") {
            if (!selfClosed_ && !closeTag(name)) return std::nullopt;
            return Value(name == "true");
        }
        auto body = text(name);
        if (!body) return std::nullopt;
        if (name == "string") return Value(std::move(*body));
        if (name == "integer") return integer(*body);
        if (name == "real") return real(*body);
        if (name == "date") return date(*body);
        if (name == "data") return data(*body);
        return std::nullopt;
    }

    std::optional<Value> readDict(int depth) {
        Dictionary d;
        if (selfClosed_) return Value(std::move(d));
        for (;;) {
            if (!skipMisc()) return std::nullopt;
            if (startsWith("</")) {
                if (!closeTag("dict")) return std::nullopt;
                return Value(std::move(d));
            }
            if (!openTag("key")) return std::nullopt;
            auto key = text("key");
            if (!key) return std::nullopt;
            auto v = readValue(depth + 1);
            if (!v) return std::nullopt;
            d.insert_or_assign(std::move(*key), std::move(*v));
        }
    }

    std::optional<Value> readArray(int depth) {
        Array a;
        if (selfClosed_) return Value(std::move(a));
        for (;;) {
            if (!skipMisc()) return std::nullopt;
            if (startsWith("</")) {
                if (!closeTag("array")) return std::nullopt;
                return Value(std::move(a));
            }
            auto v = readValue(depth + 1);
            if (!v) return std::nullopt;
            a.push_back(std::move(*v));
        }
    }

    static std::string trimmed(const std::string& s) {
        size_t b = s.find_first_not_of(" \t\r\n");
        if (b == std::string::npos) return {};
        size_t e = s.find_last_not_of(" \t\r\n");
        return s.substr(b, e - b + 1);
    }

    static std::optional<Value> integer(const std::string& body) {
        std::string t = trimmed(body);
        if (t.empty()) return std::nullopt;
        bool negative = t[0] == '-';
        size_t start = (t[0] == '-' || t[0] == '+') ? 1 : 0;
        int base = 10;
        if (t.size() > start + 1 && t[start] == '0' && (t[start + 1] == 'x' || t[start + 1] == 'X')) {
            base = 16;
            start += 2;
        }
        if (start >= t.size()) return std::nullopt;
        uint64_t v = 0;
        for (size_t i = start; i < t.size(); ++i) {
            char c = t[i];
            int d = c >= '0' && c <= '9'   ? c - '0'
                    : base == 16 && c >= 'a' && c <= 'f' ? c - 'a' + 10
                    : base == 16 && c >= 'A' && c <= 'F' ? c - 'A' + 10
                                                         : -1;
            if (d < 0) return std::nullopt;
            if (v > (UINT64_MAX - static_cast<uint64_t>(d)) / static_cast<uint64_t>(base))
                return std::nullopt;
            v = v * static_cast<uint64_t>(base) + static_cast<uint64_t>(d);
        }
        if (negative) {
            if (v > static_cast<uint64_t>(INT64_MAX) + 1) return std::nullopt;
            return Value(static_cast<int64_t>(0 - v));
        }
        // Past the signed range only an unsigned value can carry it.
        if (v > static_cast<uint64_t>(INT64_MAX)) return Value(v);
        return Value(static_cast<int64_t>(v));
    }

    static std::optional<Value> real(const std::string& body) {
        std::string t = trimmed(body);
        if (t == "nan") return Value(std::nan(""));
        if (t == "+infinity" || t == "inf" || t == "+inf") return Value(HUGE_VAL);
        if (t == "-infinity" || t == "-inf") return Value(-HUGE_VAL);
        if (t.empty()) return std::nullopt;
        char* end = nullptr;
        double d = std::strtod(t.c_str(), &end);
        if (*end) return std::nullopt;
        return Value(d);
    }

    static std::optional<Value> date(const std::string& body) {
        std::string t = trimmed(body);
        int y, mo, d, h, mi, se;
        char z = 0;
        if (t.size() != 20 ||
            std::sscanf(t.c_str(), "%4d-%2d-%2dT%2d:%2d:%2d%c", &y, &mo, &d, &h, &mi, &se, &z) != 7 ||
            z != 'Z')
            return std::nullopt;
        if (mo < 1 || mo > 12 || d < 1 || d > 31 || h > 23 || mi > 59 || se > 60 || y < 0)
            return std::nullopt;
        int64_t days = daysFromCivil(y, static_cast<unsigned>(mo), static_cast<unsigned>(d));
        int64_t secs = days * 86400 + h * 3600 + mi * 60 + se;
        return Value(Date{secs * 1000000});
    }

    static std::optional<Value> data(const std::string& body) {
        auto bytes = decodeBase64(body);
        if (!bytes) return std::nullopt;
        return Value::data(std::move(*bytes));
    }
};

// ---- binary

class BinaryReader {
public:
    explicit BinaryReader(std::string_view bytes) : b_(bytes) {}

    std::optional<Value> read() {
        if (b_.size() < 8 + 32 || b_.substr(0, 6) != "bplist") return std::nullopt;
        size_t t = b_.size() - 32;
        offsetSize_ = byte(t + 6);
        refSize_ = byte(t + 7);
        uint64_t count = be(t + 8, 8);
        uint64_t top = be(t + 16, 8);
        uint64_t tableOffset = be(t + 24, 8);
        if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) return std::nullopt;
        if (count == 0 || top >= count || tableOffset < 8 || tableOffset >= t) return std::nullopt;
        if (count > (t - tableOffset) / offsetSize_) return std::nullopt;
        count_ = count;
        tableOffset_ = tableOffset;
        active_.assign(count, false);
        return object(top, 0);
    }

private:
    std::string_view b_;
    unsigned offsetSize_ = 0;
    unsigned refSize_ = 0;
    uint64_t count_ = 0;
    uint64_t tableOffset_ = 0;
    std::vector<bool> active_;  // objects on the current path, to refuse cycles
    // Objects may be shared (keys usually are), so a small file can describe a huge tree; the
    // number of nodes built is bounded.
    uint64_t built_ = 0;
    static constexpr uint64_t kMaxNodes = uint64_t{1} << 21;

    uint8_t byte(size_t at) const { return static_cast<uint8_t>(b_[at]); }
    uint64_t be(size_t at, unsigned n) const {
        uint64_t v = 0;
        for (unsigned i = 0; i < n; ++i) v = v << 8 | byte(at + i);
        return v;
    }
    // The bytes [at, at+n) lie before the offset table.
    bool within(uint64_t at, uint64_t n) const { return at <= tableOffset_ && n <= tableOffset_ - at; }

    // The count of a container or string: the low nibble, or a following integer object.
    std::optional<uint64_t> length(uint64_t& at, uint8_t marker) const {
        uint64_t n = marker & 0x0f;
        if (n != 0x0f) return n;
        if (!within(at, 1)) return std::nullopt;
        uint8_t m = byte(at);
        if ((m & 0xf0) != 0x10) return std::nullopt;
        unsigned size = 1u << (m & 0x0f);
        if (size > 8 || !within(at + 1, size)) return std::nullopt;
        n = be(at + 1, size);
        at += 1 + size;
        return n;
    }

    std::optional<Value> object(uint64_t ref, int depth) {
        if (ref >= count_ || depth > kMaxDepth || active_[ref] || ++built_ > kMaxNodes)
            return std::nullopt;
        uint64_t at = be(tableOffset_ + ref * offsetSize_, offsetSize_);
        if (at < 8 || !within(at, 1)) return std::nullopt;
        uint8_t marker = byte(at++);
        switch (marker >> 4) {
            case 0x0:
                if (marker == 0x08) return Value(false);
                if (marker == 0x09) return Value(true);
                return std::nullopt;
            case 0x1: {
                unsigned size = 1u << (marker & 0x0f);
                if (size > 16 || !within(at, size)) return std::nullopt;
                // Eight-byte integers are signed; sixteen-byte ones carry an unsigned value in
                // their low half.
                if (size == 16) return Value(be(at + 8, 8));
                // Shorter ones are unsigned and fit; an eight-byte one is the signed value.
                return Value(static_cast<int64_t>(be(at, size)));
            }
            case 0x2: {
                unsigned size = 1u << (marker & 0x0f);
                if (!within(at, size)) return std::nullopt;
                if (size == 4) {
                    uint32_t bits = static_cast<uint32_t>(be(at, 4));
                    float f;
                    std::memcpy(&f, &bits, 4);
                    return Value(static_cast<double>(f));
                }
                if (size == 8) {
                    uint64_t bits = be(at, 8);
                    double d;
                    std::memcpy(&d, &bits, 8);
                    return Value(d);
                }
                return std::nullopt;
            }
            case 0x3: {
                if (marker != 0x33 || !within(at, 8)) return std::nullopt;
                uint64_t bits = be(at, 8);
                double d;
                std::memcpy(&d, &bits, 8);
                if (!std::isfinite(d) || std::fabs(d) > 1e12) return std::nullopt;
                return Value(Date::fromSeconds(d + kPlistEpoch));
            }
            case 0x4: {
                auto n = length(at, marker);
                if (!n || !within(at, *n)) return std::nullopt;
                return Value::data(b_.data() + at, *n);
            }
            case 0x5: {
                auto n = length(at, marker);
                if (!n || !within(at, *n)) return std::nullopt;
                std::string s(b_.substr(at, *n));
                for (unsigned char c : s)
                    if (c == 0 || c > 0x7f) return std::nullopt;
                return Value(std::move(s));
            }
            case 0x6: {
                auto n = length(at, marker);
                if (!n || *n > tableOffset_ / 2 || !within(at, *n * 2)) return std::nullopt;
                std::string s;
                for (uint64_t i = 0; i < *n; ++i) {
                    auto cp = static_cast<uint32_t>(be(at + i * 2, 2));
                    if (cp >= 0xd800 && cp <= 0xdbff && i + 1 < *n) {
                        auto lo = static_cast<uint32_t>(be(at + (i + 1) * 2, 2));
                        if (lo < 0xdc00 || lo > 0xdfff) return std::nullopt;
                        cp = 0x10000 + ((cp - 0xd800) << 10) + (lo - 0xdc00);
                        ++i;
                    }
                    if (!appendPlistCharacter(s, cp)) return std::nullopt;
                }
                return Value(std::move(s));
            }
            case 0x8: {
                unsigned size = (marker & 0x0f) + 1u;
                if (size > 8 || !within(at, size)) return std::nullopt;
                return Value(be(at, size));
            }
            case 0xA:
            case 0xD: {
                bool isDict = (marker >> 4) == 0xD;
                auto n = length(at, marker);
                if (!n) return std::nullopt;
                uint64_t refs = isDict ? *n * 2 : *n;
                if (*n > tableOffset_ || !within(at, refs * refSize_)) return std::nullopt;
                active_[ref] = true;
                std::optional<Value> result;
                if (isDict) {
                    Dictionary d;
                    bool ok = true;
                    for (uint64_t i = 0; i < *n && ok; ++i) {
                        auto k = object(be(at + i * refSize_, refSize_), depth + 1);
                        auto v = object(be(at + (*n + i) * refSize_, refSize_), depth + 1);
                        if (!k || !v || !k->isString()) {
                            ok = false;
                        } else {
                            d.insert_or_assign(*k->asString(), std::move(*v));
                        }
                    }
                    if (ok) result = Value(std::move(d));
                } else {
                    Array a;
                    bool ok = true;
                    for (uint64_t i = 0; i < *n && ok; ++i) {
                        auto v = object(be(at + i * refSize_, refSize_), depth + 1);
                        if (!v) {
                            ok = false;
                        } else {
                            a.push_back(std::move(*v));
                        }
                    }
                    if (ok) result = Value(std::move(a));
                }
                active_[ref] = false;
                return result;
            }
            default: return std::nullopt;
        }
    }
};

}  // namespace

std::optional<Value> readXml(std::string_view text) { return XmlReader(text).read(); }
std::optional<Value> readBinary(std::string_view bytes) { return BinaryReader(bytes).read(); }

}  // namespace corvane::plist::detail
