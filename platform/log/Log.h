// The platform log.
//
// A Handle names a destination: a subsystem and a category. Messages have one of four levels
// (debug, info, default, error) and are written with format texts exactly as the system's texts
// are written, in the printf family's style plus:
//   %@            an object's description (strings, Values, UUIDs, errors, anything with a
//                 description() member, shared pointers to those; null prints "(null)"); a
//                 Value that holds a text prints the text itself, unquoted
//   %{public}@    the same, shown unredacted
//   %{public}s    a C string shown unredacted
//   %d %i %u %x %s %c %p %f %g %%, with the length modifiers h, l, ll, z, j, t
// Strings and objects (%@, %s) that are not marked {public} are written as "<private>" unless
// private logging is on (CORVANE_LOG_PRIVATE=1); numbers and pointers are always shown.
//
// Where messages go: journald (fields SUBSYSTEM, CATEGORY, PRIORITY by level) when its socket is
// there, else standard error; CORVANE_LOG_SINK=stderr or =journal forces one. Which levels are
// written: CORVANE_LOG holds a default level and per-category ones, e.g. "info" or
// "default,ops=debug,traffic=info"; without it only default and error messages are written.
// Tests install a CaptureSink, which receives every message at every level.
//
// Thread-safety: everything here may be called from any thread.
#pragma once

#include <concepts>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/value/Value.h"

namespace corvane::log {

enum class Level { Debug = 0, Info = 1, Default = 2, Error = 3 };
const char* levelName(Level level);

class Handle {
public:
    Handle(std::string subsystem, std::string category);
    const std::string& subsystem() const { return subsystem_; }
    const std::string& category() const { return category_; }
    // Whether a message of this level would be written anywhere.
    bool enabled(Level level) const;

private:
    std::string subsystem_;
    std::string category_;
    Level minimum_;
};

// Creates a handle; null when the subsystem or category is unusable (empty, or with characters
// that journald fields cannot carry).
std::unique_ptr<Handle> makeHandle(std::string subsystem, std::string category);
// The platform's default log (subsystem "", category "default").
const Handle& defaultLog();

// One formatting argument, converted when the message is about to be written.
class Arg {
public:
    enum class Kind { Signed, Unsigned, Double, Text, Pointer, Null };

    template <class T>
        requires std::same_as<T, bool>
    Arg(T b) : kind_(Kind::Signed), i_(b ? 1 : 0) {}  // NOLINT(google-explicit-constructor)
    template <std::signed_integral T>
    Arg(T v) : kind_(Kind::Signed), i_(v) {}  // NOLINT(google-explicit-constructor)
    template <std::unsigned_integral T>
        requires(!std::same_as<T, bool>)
    Arg(T v) : kind_(Kind::Unsigned), u_(v) {}  // NOLINT(google-explicit-constructor)
    Arg(double d) : kind_(Kind::Double), d_(d) {}  // NOLINT(google-explicit-constructor)
    Arg(const char* s);                            // NOLINT(google-explicit-constructor)
    Arg(std::string_view s) : kind_(Kind::Text), text_(s) {}  // NOLINT(google-explicit-constructor)
    Arg(const std::string& s) : kind_(Kind::Text), text_(s) {}  // NOLINT(google-explicit-constructor)
    Arg(std::nullptr_t) : kind_(Kind::Null) {}  // NOLINT(google-explicit-constructor)
    Arg(const void* p) : kind_(Kind::Pointer), p_(p) {}  // NOLINT(google-explicit-constructor)
    // A text prints as its own characters, as a string argument does; any other value as its
    // description in the text notation.
    Arg(const Value& v) : kind_(Kind::Text), text_(v.isString() ? *v.asString() : v.description()) {}  // NOLINT
    Arg(const UUID& u) : kind_(Kind::Text), text_(u.string()) {}      // NOLINT
    Arg(const Error& e) : kind_(Kind::Text), text_(e.description()) {}  // NOLINT
    template <class T>
        requires requires(const T& t) {
            { t.description() } -> std::convertible_to<std::string>;
        }
    Arg(const T& obj) : kind_(Kind::Text), text_(obj.description()) {}  // NOLINT
    template <class T>
    Arg(const std::shared_ptr<T>& p) : Arg(p ? Arg(*p) : Arg(nullptr)) {}  // NOLINT
    template <class T>
    Arg(const std::optional<T>& o) : Arg(o ? Arg(*o) : Arg(nullptr)) {}  // NOLINT

    Kind kind() const { return kind_; }
    int64_t asSigned() const;
    uint64_t asUnsigned() const;
    double asDouble() const;
    // The text of a Text argument; the number's or pointer's text otherwise; "(null)" for null.
    std::string asText() const;
    const void* asPointer() const { return p_; }

private:
    Kind kind_;
    int64_t i_ = 0;
    uint64_t u_ = 0;
    double d_ = 0;
    const void* p_ = nullptr;
    std::string text_;
};

// Formats the text. With `redact`, strings and objects not marked {public} become "<private>".
// Never fails: a missing argument prints "<missing>", an unknown directive is copied as written.
std::string format(std::string_view fmt, std::span<const Arg> args, bool redact);

// Formats without redaction: the texts of error values and of anything shown to a user.
template <class... A>
std::string formatText(std::string_view fmt, const A&... args) {
    const Arg list[] = {Arg(args)..., Arg(nullptr)};
    return format(fmt, std::span<const Arg>(list, sizeof...(A)), false);
}

// Where messages go when the journal is not there to take them: standard error in this project's
// programs, which turn it on first thing in main; nowhere in a library inside someone else's
// program (the default), whose standard error is not ours to write on. CORVANE_LOG_SINK=stderr
// sends every message to standard error regardless.
void setStandardErrorFallback(bool enabled);

// Writes a message (already checked to be enabled).
void write(const Handle& handle, Level level, std::string_view fmt, std::span<const Arg> args);

template <class... A>
void message(const Handle& handle, Level level, std::string_view fmt, const A&... args) {
    if (!handle.enabled(level)) return;
    const Arg list[] = {Arg(args)..., Arg(nullptr)};
    write(handle, level, fmt, std::span<const Arg>(list, sizeof...(A)));
}
template <class... A>
void debug(const Handle& h, std::string_view fmt, const A&... args) {
    message(h, Level::Debug, fmt, args...);
}
template <class... A>
void info(const Handle& h, std::string_view fmt, const A&... args) {
    message(h, Level::Info, fmt, args...);
}
// The "default" level.
template <class... A>
void notice(const Handle& h, std::string_view fmt, const A&... args) {
    message(h, Level::Default, fmt, args...);
}
template <class... A>
void error(const Handle& h, std::string_view fmt, const A&... args) {
    message(h, Level::Error, fmt, args...);
}

// One written message, as a capture sees it.
struct Record {
    std::string subsystem;
    std::string category;
    Level level;
    std::string message;
};

// While alive, every message of this process at every level is recorded here (and nowhere else).
// Only one capture may be installed at a time.
class CaptureSink {
public:
    explicit CaptureSink(bool showPrivate = true);
    ~CaptureSink();
    CaptureSink(const CaptureSink&) = delete;
    CaptureSink& operator=(const CaptureSink&) = delete;

    std::vector<Record> records() const;
    // Messages (of any category) that contain `text`.
    size_t count(std::string_view text) const;
    bool contains(std::string_view text) const { return count(text) > 0; }
    void clear();

    void add(Record record);
    bool showPrivate() const { return showPrivate_; }

private:
    bool showPrivate_;
    mutable Mutex mutex_;
    std::vector<Record> records_ GUARDED_BY(mutex_);
};

}  // namespace corvane::log
