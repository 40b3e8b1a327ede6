// Typed values: the in-memory form of messages, property lists, bundle metadata, plug-in forms and
// stored annotations.
//
// A Value is one of: null, boolean, signed or unsigned 64-bit integer, double, string, data, date,
// UUID, array, dictionary (string keys) or an open file descriptor (only messages carry those).
// Values are immutable and cheap to copy: containers and byte strings are shared, never edited in
// place. To change a dictionary, copy it out (`Dictionary d = *v.asDictionary();`), change the copy
// and make a new Value from it.
//
// Equality is by content. Numbers compare by numeric value across their kinds, and a boolean
// equals the number 1 (true) or 0 (false); strings, data, dates, arrays and dictionaries never
// equal a boolean.
//
// Thread-safety: a Value may be read from any number of threads at once.
#pragma once

#include <array>
#include <compare>
#include <concepts>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace corvane {

// 16 bytes naming one thing; text form is 36 upper-case hexadecimal digits in groups 8-4-4-4-12.
struct UUID {
    std::array<uint8_t, 16> bytes{};

    static UUID random();
    // Accepts upper- or lower-case digits; anything but the 36-character grouped form fails.
    static std::optional<UUID> parse(std::string_view text);
    std::string string() const;

    auto operator<=>(const UUID&) const = default;
};

struct UUIDHash {
    size_t operator()(const UUID& uuid) const noexcept;
};

// A moment in time: microseconds since 1970-01-01 00:00:00 UTC.
struct Date {
    int64_t micros = 0;

    static Date now();
    static Date fromSeconds(double seconds);
    double seconds() const { return static_cast<double>(micros) / 1e6; }
    // Whole seconds, truncated toward zero.
    int64_t wholeSeconds() const { return micros / 1000000; }

    auto operator<=>(const Date&) const = default;
};

// Sole owner of an open file descriptor; closes it when the last Value holding it goes.
class FileDescriptor {
public:
    explicit FileDescriptor(int fd) noexcept : fd_(fd) {}
    ~FileDescriptor();
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;

    int get() const noexcept { return fd_; }
    // Gives up ownership; the caller closes the descriptor.
    int release() noexcept;

private:
    int fd_;
};

class Value;
class EncodedContainer;
template <class T>
class Result;
using Dictionary = std::map<std::string, Value, std::less<>>;
using Array = std::vector<Value>;
using Bytes = std::vector<uint8_t>;

class Value {
public:
    enum class Kind : uint8_t {
        Null,
        Bool,
        Int64,
        UInt64,
        Double,
        String,
        Data,
        Date,
        UUID,
        Array,
        Dictionary,
        Fd,
    };

    Value() = default;
    Value(std::nullptr_t) {}  // NOLINT(google-explicit-constructor)
    template <class T>
        requires std::same_as<T, bool>
    Value(T b) : v_(b) {}  // NOLINT(google-explicit-constructor)
    template <std::signed_integral T>
    Value(T i) : v_(static_cast<int64_t>(i)) {}  // NOLINT(google-explicit-constructor)
    template <std::unsigned_integral T>
        requires(!std::same_as<T, bool>)
    Value(T u) : v_(static_cast<uint64_t>(u)) {}  // NOLINT(google-explicit-constructor)
    Value(double d) : v_(d) {}                      // NOLINT(google-explicit-constructor)
    Value(std::string s) : v_(std::move(s)) {}      // NOLINT(google-explicit-constructor)
    Value(std::string_view s) : v_(std::string(s)) {}  // NOLINT(google-explicit-constructor)
    Value(const char* s) : v_(std::string(s)) {}    // NOLINT(google-explicit-constructor)
    Value(Date d) : v_(d) {}                        // NOLINT(google-explicit-constructor)
    Value(corvane::UUID u) : v_(u) {}               // NOLINT(google-explicit-constructor)
    Value(Array a);                                 // NOLINT(google-explicit-constructor)
    Value(Dictionary d);                            // NOLINT(google-explicit-constructor)
    Value(std::shared_ptr<FileDescriptor> fd);      // NOLINT(google-explicit-constructor)
    static Value data(Bytes bytes);
    static Value data(const void* bytes, size_t size);

    Kind kind() const {
        size_t i = v_.index();
        return i < kEncodedIndex ? static_cast<Kind>(i) : encodedKind();
    }
    static const char* kindName(Kind kind);

    bool isNull() const { return kind() == Kind::Null; }
    bool isBool() const { return kind() == Kind::Bool; }
    bool isString() const { return kind() == Kind::String; }
    bool isArray() const { return kind() == Kind::Array; }
    bool isDictionary() const { return kind() == Kind::Dictionary; }
    bool isData() const { return kind() == Kind::Data; }
    bool isDate() const { return kind() == Kind::Date; }
    bool isUUID() const { return kind() == Kind::UUID; }
    bool isFd() const { return kind() == Kind::Fd; }
    // A number in the wide sense: boolean, integer or double.
    bool isNumber() const;
    bool isInteger() const { return kind() == Kind::Int64 || kind() == Kind::UInt64; }

    // Typed access: null when the value is of another kind. The pointers point into this value,
    // so they are only offered on values that outlive the expression (not on temporaries, where
    // they would dangle at once).
    const std::string* asString() const& { return std::get_if<std::string>(&v_); }
    const Dictionary* asDictionary() const&;
    const Array* asArray() const&;
    const Bytes* asData() const&;
    const Date* asDate() const& { return std::get_if<Date>(&v_); }
    const corvane::UUID* asUUID() const& { return std::get_if<corvane::UUID>(&v_); }
    const std::shared_ptr<FileDescriptor>* asFd() const&;
    const std::string* asString() const&& = delete;
    const Dictionary* asDictionary() const&& = delete;
    const Array* asArray() const&& = delete;
    const Bytes* asData() const&& = delete;
    const Date* asDate() const&& = delete;
    const corvane::UUID* asUUID() const&& = delete;
    const std::shared_ptr<FileDescriptor>* asFd() const&& = delete;

    // Numeric readings of a number (see isNumber); nullopt for anything else. Doubles truncate
    // toward zero (and saturate); integers of the other signedness wrap like a C cast.
    std::optional<int64_t> int64Value() const;
    std::optional<uint64_t> uint64Value() const;
    std::optional<double> doubleValue() const;
    // The boolean itself, or a number compared with zero; nullopt for anything else.
    std::optional<bool> boolValue() const;

    // Dictionary lookup. `find` distinguishes an absent key (nullptr) from a stored value;
    // operator[] answers a shared null for an absent key or a value that is no dictionary.
    const Value* find(std::string_view key) const&;
    const Value* find(std::string_view key) const&& = delete;
    const Value& operator[](std::string_view key) const&;
    // On a temporary, the entry is returned by value (a cheap copy) so that it outlives it.
    Value operator[](std::string_view key) &&;
    bool has(std::string_view key) const { return find(key) != nullptr; }

    // True when this value equals the boolean true / false by the number-boolean rule.
    bool isTrue() const { return *this == Value(true); }
    bool isFalse() const { return *this == Value(false); }

    // The text notation (docs/rpx-wire.md): round-trips through parse().
    std::string description() const;
    // JSON (docs/rpx-wire.md, "JSON"): JSON's own literals where they say the same, and an object
    // of one tagged key for the rest ({"$uuid": "..."}, {"$data": "<base64>"}, {"$date": "..."},
    // {"$fd": N}, {"$double": "nan"}, {"$int64": "..."} and {"$uint64": "..."} beyond 2^53);
    // round-trips through parseJson(), integers up to 2^53 reading back as signed ones.
    std::string json() const;
    // Reads one value in the text notation; nullopt on anything malformed or trailing text.
    static std::optional<Value> parse(std::string_view text);
    // The same, saying where the text went wrong: "at offset N: expected X".
    static Result<Value> parseReporting(std::string_view text);
    // Reads one JSON text, tagged objects decoded; an error says where the text went wrong or
    // which tagged object is malformed.
    static Result<Value> parseJson(std::string_view text);

    friend bool operator==(const Value& a, const Value& b);

    static const Value& null();

    // ---- containers known by their wire encoding (docs/rpx-wire.md)
    // A dictionary or array may be held as its encoding alone: it is decoded by `decode` on the
    // first look inside it (from any thread, once), and an encoder copies its bytes as they are. A
    // receiver of a large message decodes the parts it reads; a sender keeps parts it sends often
    // encoded once.
    struct Encoding {
        Kind kind = Kind::Null;           // Array or Dictionary
        std::shared_ptr<const std::string> buffer;  // owns the bytes
        std::string_view bytes;           // the value's whole encoding, inside `buffer`
        size_t nesting = 0;               // levels of containers, the value itself included
        uint32_t kindsInside = 0;         // bit (1 << Kind) for every kind inside, the value's own too
        Value (*decode)(const Encoding& self) = nullptr;  // never fails on these bytes
        // A large encoding may instead be put together from pieces that others own too (the forms
        // of a match reply, each kept by its plug-in): then `bytes` is empty and the encoding is
        // the pieces one after the other. An encoder copies them, or hands them to the socket.
        struct Pieces {
            std::vector<std::string_view> bytes;
            std::vector<std::shared_ptr<const void>> owners;  // keep the pieces alive
            size_t size = 0;                                   // of all pieces together
        };
        std::shared_ptr<const Pieces> pieces;
    };
    static Value encoded(Encoding encoding);
    // The encoding of a value made by `encoded`; null for any other value.
    const Encoding* encoding() const;
    // Bit (1 << Kind) for every kind in this value and inside it, at any depth. Does not decode an
    // encoded container.
    uint32_t kindsInside() const;

private:
    std::variant<std::monostate, bool, int64_t, uint64_t, double, std::string,
                 std::shared_ptr<const Bytes>, Date, corvane::UUID, std::shared_ptr<const Array>,
                 std::shared_ptr<const Dictionary>, std::shared_ptr<FileDescriptor>,
                 std::shared_ptr<const EncodedContainer>>
        v_;
    static constexpr size_t kEncodedIndex = 12;
    Kind encodedKind() const;
};

// Shorthand for building small dictionaries in code: dict({{"a", 1}, {"b", "x"}}).
inline Value dict(std::initializer_list<Dictionary::value_type> entries) {
    return Value(Dictionary(entries));
}

// True when the bytes are well-formed UTF-8 (no overlong forms, surrogates or values past U+10FFFF).
bool isValidUtf8(std::string_view text);

// An error value: a domain, an integer code and an optional description text.
struct Error {
    Error() = default;
    Error(std::string domain, int64_t code, std::optional<std::string> text = std::nullopt)
        : domain(std::move(domain)), code(code), text(std::move(text)) {}

    std::string domain;
    int64_t code = 0;
    std::optional<std::string> text;
    // What the layer below said (the registry's reason, the service manager's), for the person who
    // reads the error; the text stays what the protocol says.
    std::optional<std::string> cause;

    // The text, or "Error Domain=<domain> Code=<code>" when there is none.
    std::string description() const;

    // Domain "POSIX" with the errno value and its strerror text, optionally prefixed by context.
    static Error posix(int err, std::string_view context = {});
    // The file error of a failed read or write of `path` with errno `err` (domain kFileDomain).
    static Error file(int err, std::string_view path, bool writing);
};

inline constexpr const char* kPosixErrorDomain = "POSIX";
// File errors: kFileNoSuchFile for a missing file, kFileNoPermission, kFileReadUnknown for any
// other read failure; kFileWriteNoPermission for a write refused by permissions (or a read-only file
// system) and kFileWriteUnknown for any other failed write.
inline constexpr const char* kFileErrorDomain = "com.corvane.file";
inline constexpr int64_t kFileReadUnknown = 256;
inline constexpr int64_t kFileNoPermission = 257;
inline constexpr int64_t kFileNoSuchFile = 260;
inline constexpr int64_t kFileWriteUnknown = 512;
inline constexpr int64_t kFileWriteNoPermission = 513;

// The outcome of an operation that gives nothing back: ok, or the error that stopped it. Failures
// are values throughout: nothing is thrown.
class [[nodiscard]] Status {
public:
    Status() = default;  // ok
    Status(Error error) : error_(std::move(error)) {}  // NOLINT(google-explicit-constructor)

    bool ok() const { return !error_.has_value(); }
    // Only on a failed status.
    const Error& error() const { return *error_; }

private:
    std::optional<Error> error_;
};

// A value or the error that kept it from being made; true (ok()) when it holds the value.
template <class T>
class [[nodiscard]] Result {
public:
    Result(T value) : v_(std::move(value)) {}   // NOLINT(google-explicit-constructor)
    Result(Error error) : v_(std::move(error)) {}  // NOLINT(google-explicit-constructor)

    bool ok() const { return v_.index() == 0; }
    explicit operator bool() const { return ok(); }
    // The status alone, for callers that pass a failure on.
    Status status() const { return ok() ? Status() : Status(error()); }
    T& value() & { return std::get<0>(v_); }
    const T& value() const& { return std::get<0>(v_); }
    T&& value() && { return std::get<0>(std::move(v_)); }
    const Error& error() const { return std::get<1>(v_); }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }

private:
    std::variant<T, Error> v_;
};

// Appends the UTF-8 form of a Unicode scalar value; false (and nothing appended) for a surrogate or
// a value past U+10FFFF. The readers of the text notation and of property lists share it.
bool appendUtf8(std::string& out, uint32_t codePoint);

// Days since 1970-01-01 of a date of the proleptic Gregorian calendar (month 1 to 12), for the
// readers of dates in text.
int64_t daysFromCivil(int64_t year, unsigned month, unsigned day);

// Base64 (RFC 4648, with padding), as property lists and JSON carry data. The reader skips white
// space and refuses any other character, and data after the padding.
void appendBase64(std::string& out, const Bytes& bytes);
std::optional<Bytes> decodeBase64(std::string_view text);

// Appends `s` as a JSON string, quotes included, control characters escaped; the text notation
// writes its strings so, and tools that print JSON use it too.
void appendJsonString(std::string& out, std::string_view s);

}  // namespace corvane
