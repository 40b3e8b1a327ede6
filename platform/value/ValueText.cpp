// The text notation of values (docs/rpx-wire.md): what descriptions print and `axctl send` reads.

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "platform/value/Value.h"

namespace corvane {

void appendJsonString(std::string& out, std::string_view s) {
    out.push_back('"');
    for (unsigned char c : s) {
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\r': out += "\\r"; break;
            case '\t': out += "\\t"; break;
            case '\b': out += "\\b"; break;
            case '\f': out += "\\f"; break;
            default:
                if (c < 0x20 || c == 0x7f) {
                    char buf[8];
                    std::snprintf(buf, sizeof buf, "\\u%04x", c);
                    out += buf;
                } else {
                    out.push_back(static_cast<char>(c));
                }
        }
    }
    out.push_back('"');
}

namespace {

// Shortest text that reads back as the same double, always with a '.', an exponent or a word, so
// that it cannot be mistaken for an integer.
void appendDouble(std::string& out, double d) {
    if (std::isnan(d)) {
        out += "nan";
        return;
    }
    if (std::isinf(d)) {
        out += d < 0 ? "-1e999" : "1e999";
        return;
    }
    char buf[40];
    for (int precision = 15; precision <= 17; ++precision) {
        std::snprintf(buf, sizeof buf, "%.*g", precision, d);
        if (std::strtod(buf, nullptr) == d) break;
    }
    out += buf;
    if (!std::strpbrk(buf, ".eE")) out += ".0";
}

// The date of a day count since 1970-01-01, the inverse of daysFromCivil (Howard Hinnant's
// algorithms).
void civilFromDays(int64_t z, int64_t& y, unsigned& m, unsigned& d) {
    z += 719468;
    const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
    const auto doe = static_cast<unsigned>(z - era * 146097);
    const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    y = static_cast<int64_t>(yoe) + era * 400;
    const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const unsigned mp = (5 * doy + 2) / 153;
    d = doy - (153 * mp + 2) / 5 + 1;
    m = mp < 10 ? mp + 3 : mp - 9;
    y += m <= 2;
}

void appendDate(std::string& out, Date date) {
    int64_t secs = date.micros / 1000000;
    int64_t frac = date.micros % 1000000;
    if (frac < 0) {
        frac += 1000000;
        secs -= 1;
    }
    int64_t days = secs / 86400;
    int64_t rem = secs % 86400;
    if (rem < 0) {
        rem += 86400;
        days -= 1;
    }
    int64_t y;
    unsigned m;
    unsigned d;
    civilFromDays(days, y, m, d);
    char buf[64];
    std::snprintf(buf, sizeof buf, "@%04" PRId64 "-%02u-%02uT%02d:%02d:%02d", y, m, d,
                  static_cast<int>(rem / 3600), static_cast<int>(rem / 60 % 60),
                  static_cast<int>(rem % 60));
    out += buf;
    if (frac) {
        std::snprintf(buf, sizeof buf, ".%06" PRId64, frac);
        std::string f = buf;
        while (f.back() == '0') f.pop_back();
        out += f;
    }
    out.push_back('Z');
}

// The text notation, or JSON: the same walk. JSON has no literal for a UUID, data, a date, a
// descriptor, a non-finite double or an integer beyond 2^53 (where JSON readers start rounding), so
// each is an object of one tagged key, {"$uuid": "..."}; a dictionary that itself has a single key
// starting with "$" is escaped as {"$dictionary": {...}} so that it never reads as a tag.
enum class Notation { Text, Json };

constexpr uint64_t kJsonExactIntegers = uint64_t{1} << 53;

void appendTagged(std::string& out, std::string_view tag, std::string_view text) {
    out += "{\"";
    out += tag;
    out += "\":";
    appendJsonString(out, text);
    out.push_back('}');
}

bool looksLikeTag(const Dictionary& d) { return d.size() == 1 && !d.begin()->first.empty() && d.begin()->first[0] == '$'; }

void write(std::string& out, const Value& v, Notation notation) {
    using K = Value::Kind;
    const bool json = notation == Notation::Json;
    char buf[48];
    switch (v.kind()) {
        case K::Null: out += "null"; break;
        case K::Bool: out += *v.boolValue() ? "true" : "false"; break;
        case K::Int64: {
            int64_t n = *v.int64Value();
            std::snprintf(buf, sizeof buf, "%" PRId64, n);
            uint64_t magnitude = n < 0 ? 0 - static_cast<uint64_t>(n) : static_cast<uint64_t>(n);
            if (json && magnitude > kJsonExactIntegers) return appendTagged(out, "$int64", buf);
            out += buf;
            break;
        }
        case K::UInt64: {
            uint64_t n = *v.uint64Value();
            std::snprintf(buf, sizeof buf, "%" PRIu64, n);
            if (json && n > kJsonExactIntegers) return appendTagged(out, "$uint64", buf);
            out += buf;
            if (!json) out.push_back('u');
            break;
        }
        case K::Double: {
            double d = *v.doubleValue();
            if (json && !std::isfinite(d)) return appendTagged(out, "$double", std::isnan(d) ? "nan" : d > 0 ? "inf" : "-inf");
            appendDouble(out, d);
            break;
        }
        case K::String: appendJsonString(out, *v.asString()); break;
        case K::Data: {
            if (json) {
                std::string text;
                appendBase64(text, *v.asData());
                return appendTagged(out, "$data", text);
            }
            static const char* hex = "0123456789abcdef";
            out.push_back('<');
            for (uint8_t b : *v.asData()) {
                out.push_back(hex[b >> 4]);
                out.push_back(hex[b & 0xf]);
            }
            out.push_back('>');
            break;
        }
        case K::Date: {
            std::string text;
            appendDate(text, *v.asDate());
            if (json) return appendTagged(out, "$date", std::string_view(text).substr(1));
            out += text;
            break;
        }
        case K::UUID:
            if (json) return appendTagged(out, "$uuid", v.asUUID()->string());
            out += "uuid(" + v.asUUID()->string() + ")";
            break;
        case K::Fd:
            if (json) {
                out += "{\"$fd\":" + std::to_string((*v.asFd())->get()) + "}";
            } else {
                out += "fd(" + std::to_string((*v.asFd())->get()) + ")";
            }
            break;
        case K::Array: {
            out.push_back('[');
            bool first = true;
            for (const Value& e : *v.asArray()) {
                if (!first) out += json ? "," : ", ";
                first = false;
                write(out, e, notation);
            }
            out.push_back(']');
            break;
        }
        case K::Dictionary: {
            const Dictionary& d = *v.asDictionary();
            const bool escaped = json && looksLikeTag(d);
            if (escaped) out += "{\"$dictionary\":";
            out.push_back('{');
            bool first = true;
            for (const auto& [key, e] : d) {
                if (!first) out += json ? "," : ", ";
                first = false;
                appendJsonString(out, key);
                out += json ? ":" : ": ";
                write(out, e, notation);
            }
            out.push_back('}');
            if (escaped) out.push_back('}');
            break;
        }
    }
}

}  // namespace

bool isValidUtf8(std::string_view s) {
    size_t i = 0;
    while (i < s.size()) {
        // Most text is ASCII: eight bytes at a time while no byte has its high bit set.
        while (i + 8 <= s.size()) {
            uint64_t word;
            std::memcpy(&word, s.data() + i, 8);
            if (word & 0x8080808080808080ull) break;
            i += 8;
        }
        if (i >= s.size()) break;
        auto c = static_cast<unsigned char>(s[i]);
        size_t len;
        uint32_t cp;
        if (c < 0x80) {
            ++i;
            continue;
        } else if ((c & 0xe0) == 0xc0) {
            len = 2;
            cp = c & 0x1f;
        } else if ((c & 0xf0) == 0xe0) {
            len = 3;
            cp = c & 0x0f;
        } else if ((c & 0xf8) == 0xf0) {
            len = 4;
            cp = c & 0x07;
        } else {
            return false;
        }
        if (i + len > s.size()) return false;
        for (size_t k = 1; k < len; ++k) {
            auto cc = static_cast<unsigned char>(s[i + k]);
            if ((cc & 0xc0) != 0x80) return false;
            cp = cp << 6 | (cc & 0x3f);
        }
        static const uint32_t minimum[] = {0, 0, 0x80, 0x800, 0x10000};
        if (cp < minimum[len] || cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff)) return false;
        i += len;
    }
    return true;
}

namespace {

class Parser {
public:
    // In JSON mode only JSON's own tokens are read; the tagged objects are decoded afterwards.
    Parser(std::string_view text, bool json) : s_(text), json_(json) {}

    std::optional<Value> parseAll() {
        auto v = parseValue(0);
        if (!v) return std::nullopt;
        skipSpace();
        if (pos_ != s_.size()) return fail("the end of the text");
        return v;
    }

    // Where the first failure was found, and what would have been accepted there.
    size_t errorOffset() const { return errorAt_; }
    const char* expected() const { return expected_; }

private:
    // Deep enough for any real message, shallow enough that a hostile text cannot exhaust the
    // stack.
    static constexpr int kMaxDepth = 256;

    std::string_view s_;
    const bool json_;
    size_t pos_ = 0;
    size_t errorAt_ = 0;
    const char* expected_ = nullptr;

    // Records the innermost failure (the first one found) and fails.
    std::nullopt_t fail(const char* expected) {
        if (!expected_) {
            expected_ = expected;
            errorAt_ = std::min(pos_, s_.size());
        }
        return std::nullopt;
    }

    void skipSpace() {
        while (pos_ < s_.size() &&
               (s_[pos_] == ' ' || s_[pos_] == '\t' || s_[pos_] == '\n' || s_[pos_] == '\r'))
            ++pos_;
    }
    bool eat(char c) {
        skipSpace();
        if (pos_ < s_.size() && s_[pos_] == c) {
            ++pos_;
            return true;
        }
        return false;
    }
    bool eatWord(std::string_view w) {
        if (s_.substr(pos_, w.size()) == w) {
            pos_ += w.size();
            return true;
        }
        return false;
    }

    std::optional<Value> parseValue(int depth) {
        if (depth > kMaxDepth) return fail("less nesting");
        skipSpace();
        if (pos_ >= s_.size()) return fail("a value");
        char c = s_[pos_];
        switch (c) {
            case '{': return parseDictionary(depth);
            case '[': return parseArray(depth);
            case '"': {
                auto s = parseString();
                if (!s) return fail("a string");
                return Value(std::move(*s));
            }
            default: break;
        }
        if (eatWord("true")) return Value(true);
        if (eatWord("false")) return Value(false);
        if (eatWord("null")) return Value();
        if (c == '-' || (c >= '0' && c <= '9')) return parseNumber();
        if (json_) return fail("a JSON value");
        if (c == '<') return parseData();
        if (c == '@') return parseDate();
        if (eatWord("nan")) return Value(std::nan(""));
        if (eatWord("uuid(")) {
            auto u = UUID::parse(s_.substr(pos_, 36));
            if (!u) return fail("a UUID of 36 characters (8-4-4-4-12 hexadecimal digits)");
            pos_ += 36;
            if (!eat(')')) return fail("\")\"");
            return Value(*u);
        }
        if (eatWord("fd(")) return parseFd();
        return fail("a value");
    }

    std::optional<Value> parseDictionary(int depth) {
        ++pos_;
        Dictionary d;
        if (eat('}')) return Value(std::move(d));
        for (;;) {
            skipSpace();
            if (pos_ >= s_.size() || s_[pos_] != '"') return fail("a key in double quotes");
            auto key = parseString();
            if (!key) return fail("a key in double quotes");
            if (!eat(':')) return fail("\":\"");
            auto v = parseValue(depth + 1);
            if (!v) return std::nullopt;
            d.insert_or_assign(std::move(*key), std::move(*v));
            if (eat('}')) return Value(std::move(d));
            if (!eat(',')) return fail("\",\" or \"}\"");
        }
    }

    std::optional<Value> parseArray(int depth) {
        ++pos_;
        Array a;
        if (eat(']')) return Value(std::move(a));
        for (;;) {
            auto v = parseValue(depth + 1);
            if (!v) return std::nullopt;
            a.push_back(std::move(*v));
            if (eat(']')) return Value(std::move(a));
            if (!eat(',')) return fail("\",\" or \"]\"");
        }
    }

    std::optional<uint32_t> hex4() {
        if (pos_ + 4 > s_.size()) return std::nullopt;
        uint32_t v = 0;
        for (int i = 0; i < 4; ++i) {
            int d = hexDigit(s_[pos_++]);
            if (d < 0) return std::nullopt;
            v = v << 4 | static_cast<uint32_t>(d);
        }
        return v;
    }

    static int hexDigit(char c) {
        if (c >= '0' && c <= '9') return c - '0';
        if (c >= 'a' && c <= 'f') return c - 'a' + 10;
        if (c >= 'A' && c <= 'F') return c - 'A' + 10;
        return -1;
    }

    std::optional<std::string> parseString() {
        ++pos_;  // opening quote
        std::string out;
        while (pos_ < s_.size()) {
            auto c = static_cast<unsigned char>(s_[pos_++]);
            if (c == '"') {
                if (!isValidUtf8(out)) return fail("well-formed UTF-8");
                return out;
            }
            if (c < 0x20) return fail("no control character in a string (write it as \\u00XX)");
            if (c != '\\') {
                out.push_back(static_cast<char>(c));
                continue;
            }
            if (pos_ >= s_.size()) return std::nullopt;
            char e = s_[pos_++];
            switch (e) {
                case '"': out.push_back('"'); break;
                case '\\': out.push_back('\\'); break;
                case '/': out.push_back('/'); break;
                case 'b': out.push_back('\b'); break;
                case 'f': out.push_back('\f'); break;
                case 'n': out.push_back('\n'); break;
                case 'r': out.push_back('\r'); break;
                case 't': out.push_back('\t'); break;
                case 'u': {
                    auto cp = hex4();
                    if (!cp) return std::nullopt;
                    if (*cp >= 0xd800 && *cp <= 0xdbff) {
                        if (!eatWord("\\u")) return std::nullopt;
                        auto lo = hex4();
                        if (!lo || *lo < 0xdc00 || *lo > 0xdfff) return std::nullopt;
                        *cp = 0x10000 + ((*cp - 0xd800) << 10) + (*lo - 0xdc00);
                    } else if (*cp >= 0xdc00 && *cp <= 0xdfff) {
                        return std::nullopt;
                    }
                    if (!appendUtf8(out, *cp)) return std::nullopt;
                    break;
                }
                default: return fail("an escape: \\\" \\\\ \\/ \\b \\f \\n \\r \\t or \\uXXXX");
            }
        }
        return fail("the closing double quote");
    }

    std::optional<Value> parseData() {
        ++pos_;
        Bytes bytes;
        for (;;) {
            if (pos_ >= s_.size()) return fail("\">\" closing the data");
            if (s_[pos_] == '>') {
                ++pos_;
                return Value::data(std::move(bytes));
            }
            if (pos_ + 1 >= s_.size()) return fail("two hexadecimal digits per byte");
            int hi = hexDigit(s_[pos_]);
            int lo = hexDigit(s_[pos_ + 1]);
            if (hi < 0 || lo < 0) return fail("two hexadecimal digits per byte");
            bytes.push_back(static_cast<uint8_t>(hi << 4 | lo));
            pos_ += 2;
        }
    }

    std::optional<int64_t> digits(size_t count) {
        if (pos_ + count > s_.size()) return std::nullopt;
        int64_t v = 0;
        for (size_t i = 0; i < count; ++i) {
            char c = s_[pos_++];
            if (c < '0' || c > '9') return std::nullopt;
            v = v * 10 + (c - '0');
        }
        return v;
    }

    std::optional<Value> parseDate() {
        ++pos_;
        auto y = digits(4);
        if (!y || !eatWord("-")) return std::nullopt;
        auto mo = digits(2);
        if (!mo || !eatWord("-")) return std::nullopt;
        auto d = digits(2);
        if (!d || !eatWord("T")) return std::nullopt;
        auto h = digits(2);
        if (!h || !eatWord(":")) return std::nullopt;
        auto mi = digits(2);
        if (!mi || !eatWord(":")) return std::nullopt;
        auto se = digits(2);
        if (!se) return std::nullopt;
        int64_t micros = 0;
        if (eatWord(".")) {
            int64_t scale = 100000;
            size_t start = pos_;
            while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') {
                micros += (s_[pos_] - '0') * scale;  // digits past the sixth are dropped
                scale /= 10;
                ++pos_;
            }
            if (pos_ == start) return std::nullopt;
        }
        if (!eatWord("Z")) return fail("a date written @YYYY-MM-DDThh:mm:ss[.ffffff]Z");
        static const unsigned monthDays[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
        if (*mo < 1 || *mo > 12 || *d < 1 || *d > monthDays[*mo - 1] || *h > 23 || *mi > 59 ||
            *se > 59)
            return fail("a date that exists");
        bool leap = (*y % 4 == 0 && *y % 100 != 0) || *y % 400 == 0;
        if (*mo == 2 && *d == 29 && !leap) return fail("a date that exists");
        int64_t days =
            daysFromCivil(*y, static_cast<unsigned>(*mo), static_cast<unsigned>(*d));
        int64_t secs = days * 86400 + *h * 3600 + *mi * 60 + *se;
        return Value(Date{secs * 1000000 + micros});
    }

    std::optional<Value> parseFd() {
        size_t start = pos_;
        while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') ++pos_;
        if (pos_ == start || pos_ - start > 9) return std::nullopt;
        int n = std::atoi(std::string(s_.substr(start, pos_ - start)).c_str());
        if (!eat(')')) return std::nullopt;
        // The text names a descriptor of this process; the value owns a duplicate of it.
        int fd = fcntl(n, F_DUPFD_CLOEXEC, 0);
        if (fd < 0) return std::nullopt;
        return Value(std::make_shared<FileDescriptor>(fd));
    }

    std::optional<Value> parseNumber() {
        size_t start = pos_;
        if (s_[pos_] == '-') ++pos_;
        size_t digitsStart = pos_;
        while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') ++pos_;
        if (pos_ == digitsStart) return fail("a digit");
        bool isDouble = false;
        if (pos_ < s_.size() && s_[pos_] == '.') {
            isDouble = true;
            ++pos_;
            size_t f = pos_;
            while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') ++pos_;
            if (pos_ == f) return std::nullopt;
        }
        if (pos_ < s_.size() && (s_[pos_] == 'e' || s_[pos_] == 'E')) {
            isDouble = true;
            ++pos_;
            if (pos_ < s_.size() && (s_[pos_] == '+' || s_[pos_] == '-')) ++pos_;
            size_t e = pos_;
            while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') ++pos_;
            if (pos_ == e) return std::nullopt;
        }
        std::string text(s_.substr(start, pos_ - start));
        if (isDouble) return Value(std::strtod(text.c_str(), nullptr));
        errno = 0;
        if (json_) {
            // JSON has one kind of integer: signed where it fits, unsigned above that.
            long long i = std::strtoll(text.c_str(), nullptr, 10);
            if (errno != ERANGE) return Value(static_cast<int64_t>(i));
            errno = 0;
            unsigned long long u = text[0] == '-' ? 0 : std::strtoull(text.c_str(), nullptr, 10);
            if (text[0] == '-' || errno == ERANGE) return fail("an integer within 64 bits");
            return Value(static_cast<uint64_t>(u));
        }
        if (pos_ < s_.size() && s_[pos_] == 'u') {
            ++pos_;
            if (text[0] == '-') return fail("an unsigned integer without a sign");
            unsigned long long u = std::strtoull(text.c_str(), nullptr, 10);
            if (errno == ERANGE) return fail("an unsigned integer below 2^64");
            return Value(static_cast<uint64_t>(u));
        }
        long long i = std::strtoll(text.c_str(), nullptr, 10);
        if (errno == ERANGE) return fail("an integer within 64 bits (or a \"u\" for an unsigned one)");
        return Value(static_cast<int64_t>(i));
    }
};

}  // namespace

std::string Value::description() const {
    std::string out;
    write(out, *this, Notation::Text);
    return out;
}

std::string Value::json() const {
    std::string out;
    write(out, *this, Notation::Json);
    return out;
}

std::optional<Value> Value::parse(std::string_view text) { return Parser(text, false).parseAll(); }

namespace {

Error parseError(const Parser& parser, const char* fallback) {
    std::string at = "at offset " + std::to_string(parser.errorOffset());
    return Error{"com.corvane.value", 1, at + ": expected " + (parser.expected() ? parser.expected() : fallback)};
}

Error tagError(std::string_view tag, std::string_view expected) {
    return Error{"com.corvane.value", 1, "in a \"" + std::string(tag) + "\" object: expected " + std::string(expected)};
}

// The value one tagged object stands for.
Result<Value> decodeTag(const std::string& tag, const Value& body) {
    const std::string* text = body.asString();
    if (tag == "$fd") {
        std::optional<int64_t> n = body.kind() == Value::Kind::Int64 ? body.int64Value() : std::nullopt;
        if (!n || *n < 0 || *n > INT32_MAX) return tagError(tag, "a descriptor number");
        // Like the text notation's fd(N): a duplicate of this process's descriptor N.
        int fd = fcntl(static_cast<int>(*n), F_DUPFD_CLOEXEC, 0);
        if (fd < 0) return tagError(tag, "a descriptor open in this process");
        return Value(std::make_shared<FileDescriptor>(fd));
    }
    if (!text) return tagError(tag, "a string");
    if (tag == "$uuid") {
        auto uuid = UUID::parse(*text);
        if (!uuid) return tagError(tag, "a UUID of 36 characters (8-4-4-4-12 hexadecimal digits)");
        return Value(*uuid);
    }
    if (tag == "$data") {
        auto bytes = decodeBase64(*text);
        if (!bytes) return tagError(tag, "base64");
        return Value::data(std::move(*bytes));
    }
    if (tag == "$date") {
        auto date = Value::parse("@" + *text);
        if (!date || date->kind() != Value::Kind::Date) return tagError(tag, "a date written YYYY-MM-DDThh:mm:ss[.ffffff]Z");
        return std::move(*date);
    }
    if (tag == "$double") {
        if (*text == "nan") return Value(std::nan(""));
        if (*text == "inf") return Value(HUGE_VAL);
        if (*text == "-inf") return Value(-HUGE_VAL);
        return tagError(tag, "\"nan\", \"inf\" or \"-inf\"");
    }
    if (tag == "$int64" || tag == "$uint64") {
        const bool isSigned = tag == "$int64";
        auto n = Value::parse(*text + (isSigned ? "" : "u"));
        bool digitsOnly = !text->empty() && text->find_first_not_of("-0123456789") == std::string::npos;
        if (!n || !digitsOnly || n->kind() != (isSigned ? Value::Kind::Int64 : Value::Kind::UInt64))
            return tagError(tag, isSigned ? "a signed 64-bit integer in a string" : "an unsigned 64-bit integer in a string");
        return std::move(*n);
    }
    return Error{"com.corvane.value", 1,
                 "unknown tag \"" + tag + "\" (a dictionary of one key starting with \"$\" is written {\"$dictionary\": {...}})"};
}

Result<Value> decodeJson(Value&& v);

Result<Value> decodeEntries(Dictionary&& d) {
    for (auto& [key, e] : d) {
        auto decoded = decodeJson(std::move(e));
        if (!decoded) return decoded.error();
        e = std::move(*decoded);
    }
    return Value(std::move(d));
}

// Replaces the tagged objects of parsed JSON by the values they stand for.
Result<Value> decodeJson(Value&& v) {
    if (const Array* a = v.asArray()) {
        Array out = *a;
        for (Value& e : out) {
            auto decoded = decodeJson(std::move(e));
            if (!decoded) return decoded.error();
            e = std::move(*decoded);
        }
        return Value(std::move(out));
    }
    const Dictionary* d = v.asDictionary();
    if (!d) return std::move(v);
    if (!looksLikeTag(*d)) return decodeEntries(Dictionary(*d));
    const auto& [tag, body] = *d->begin();
    if (tag != "$dictionary") return decodeTag(tag, body);
    const Dictionary* inner = body.asDictionary();
    if (!inner) return tagError(tag, "an object");
    return decodeEntries(Dictionary(*inner));
}

}  // namespace

Result<Value> Value::parseReporting(std::string_view text) {
    Parser parser(text, false);
    if (auto v = parser.parseAll()) return std::move(*v);
    return parseError(parser, "a value in the text notation");
}

Result<Value> Value::parseJson(std::string_view text) {
    Parser parser(text, true);
    auto v = parser.parseAll();
    if (!v) return parseError(parser, "JSON");
    return decodeJson(std::move(*v));
}

bool appendUtf8(std::string& out, uint32_t cp) {
    if (cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff)) return false;
    if (cp < 0x80) {
        out.push_back(static_cast<char>(cp));
    } else if (cp < 0x800) {
        out.push_back(static_cast<char>(0xc0 | cp >> 6));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3f)));
    } else if (cp < 0x10000) {
        out.push_back(static_cast<char>(0xe0 | cp >> 12));
        out.push_back(static_cast<char>(0x80 | (cp >> 6 & 0x3f)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3f)));
    } else {
        out.push_back(static_cast<char>(0xf0 | cp >> 18));
        out.push_back(static_cast<char>(0x80 | (cp >> 12 & 0x3f)));
        out.push_back(static_cast<char>(0x80 | (cp >> 6 & 0x3f)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3f)));
    }
    return true;
}

int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
    y -= m <= 2;
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const auto yoe = static_cast<unsigned>(y - era * 400);
    const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

}  // namespace corvane
