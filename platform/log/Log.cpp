#include "platform/log/Log.h"

#include <systemd/sd-journal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <map>

// The formatter hands the flags and width written in a format text ("%02d") on to snprintf, so
// those formats are built at run time from checked pieces.
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

namespace corvane::log {

namespace {

enum class Sink { Journal, StandardError, Fallback };

struct Config {
    Level defaultMinimum = Level::Default;
    std::map<std::string, Level, std::less<>> perCategory;
    bool showPrivate = false;
    Sink sink = Sink::Fallback;
};

std::atomic<bool> gStandardErrorFallback{false};

std::optional<Level> parseLevel(std::string_view s) {
    if (s == "debug") return Level::Debug;
    if (s == "info") return Level::Info;
    if (s == "default") return Level::Default;
    if (s == "error") return Level::Error;
    return std::nullopt;
}

Config readConfig() {
    Config c;
    if (const char* spec = std::getenv("CORVANE_LOG")) {
        std::string_view rest(spec);
        while (!rest.empty()) {
            size_t comma = rest.find(',');
            std::string_view item = rest.substr(0, comma);
            rest = comma == std::string_view::npos ? std::string_view() : rest.substr(comma + 1);
            size_t eq = item.find('=');
            if (eq == std::string_view::npos) {
                if (auto l = parseLevel(item)) c.defaultMinimum = *l;
            } else if (auto l = parseLevel(item.substr(eq + 1))) {
                c.perCategory.emplace(std::string(item.substr(0, eq)), *l);
            }
        }
    }
    const char* priv = std::getenv("CORVANE_LOG_PRIVATE");
    c.showPrivate = priv && std::strcmp(priv, "0") != 0 && *priv;
    const char* sink = std::getenv("CORVANE_LOG_SINK");
    if (sink && std::strcmp(sink, "stderr") == 0) {
        c.sink = Sink::StandardError;
    } else if (sink && std::strcmp(sink, "journal") == 0) {
        c.sink = Sink::Journal;
    } else {
        struct stat st {};
        c.sink = ::stat("/run/systemd/journal/socket", &st) == 0 ? Sink::Journal : Sink::Fallback;
    }
    return c;
}

const Config& config() {
    static const Config c = readConfig();
    return c;
}

std::atomic<CaptureSink*> gCapture{nullptr};
Mutex gCaptureMutex;  // held while a capture is (un)installed or written to

int journalPriority(Level level) {
    switch (level) {
        case Level::Debug: return 7;
        case Level::Info: return 6;
        case Level::Default: return 5;
        case Level::Error: return 3;
    }
    return 5;
}

void writeStderr(const Handle& h, Level level, const std::string& text) {
    struct timespec ts {};
    clock_gettime(CLOCK_REALTIME, &ts);
    struct tm tm {};
    localtime_r(&ts.tv_sec, &tm);
    char stamp[32];
    std::strftime(stamp, sizeof stamp, "%Y-%m-%d %H:%M:%S", &tm);
    std::string line = std::string(stamp) + "." + std::to_string(ts.tv_nsec / 1000000 + 1000).substr(1) +
                       " " + program_invocation_short_name + "[" + std::to_string(getpid()) + "] <" +
                       levelName(level) + "> " + (h.subsystem().empty() ? "" : h.subsystem() + ":") +
                       h.category() + ": " + text + "\n";
    // One write per line, so that lines of several threads do not interleave.
    (void)!::write(STDERR_FILENO, line.data(), line.size());
}

void writeJournal(const Handle& h, Level level, const std::string& text) {
    int r = sd_journal_send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", journalPriority(level),
                            "SUBSYSTEM=%s", h.subsystem().c_str(), "CATEGORY=%s",
                            h.category().c_str(), nullptr);
    if (r < 0 && gStandardErrorFallback.load(std::memory_order_relaxed)) writeStderr(h, level, text);
}

}  // namespace

const char* levelName(Level level) {
    switch (level) {
        case Level::Debug: return "debug";
        case Level::Info: return "info";
        case Level::Default: return "default";
        case Level::Error: return "error";
    }
    return "?";
}

Handle::Handle(std::string subsystem, std::string category)
    : subsystem_(std::move(subsystem)), category_(std::move(category)) {
    const Config& c = config();
    auto it = c.perCategory.find(category_);
    minimum_ = it != c.perCategory.end() ? it->second : c.defaultMinimum;
}

bool Handle::enabled(Level level) const {
    return gCapture.load(std::memory_order_acquire) != nullptr || level >= minimum_;
}

std::unique_ptr<Handle> makeHandle(std::string subsystem, std::string category) {
    auto usable = [](const std::string& s) {
        for (unsigned char c : s)
            if (c < 0x20 || c == 0x7f) return false;
        return true;
    };
    if (category.empty() || !usable(subsystem) || !usable(category)) return nullptr;
    return std::make_unique<Handle>(std::move(subsystem), std::move(category));
}

const Handle& defaultLog() {
    static const Handle h("", "default");
    return h;
}

// ---- Arg

Arg::Arg(const char* s) : kind_(s ? Kind::Text : Kind::Null) {
    if (s) text_ = s;
}

int64_t Arg::asSigned() const {
    switch (kind_) {
        case Kind::Signed: return i_;
        case Kind::Unsigned: return static_cast<int64_t>(u_);
        case Kind::Double: return static_cast<int64_t>(d_);
        case Kind::Pointer: return static_cast<int64_t>(reinterpret_cast<uintptr_t>(p_));
        default: return 0;
    }
}

uint64_t Arg::asUnsigned() const {
    return kind_ == Kind::Unsigned ? u_ : static_cast<uint64_t>(asSigned());
}

double Arg::asDouble() const {
    switch (kind_) {
        case Kind::Signed: return static_cast<double>(i_);
        case Kind::Unsigned: return static_cast<double>(u_);
        case Kind::Double: return d_;
        default: return 0;
    }
}

std::string Arg::asText() const {
    char buf[64];
    switch (kind_) {
        case Kind::Text: return text_;
        case Kind::Null: return "(null)";
        case Kind::Signed: return std::to_string(i_);
        case Kind::Unsigned: return std::to_string(u_);
        case Kind::Double:
            std::snprintf(buf, sizeof buf, "%g", d_);
            return buf;
        case Kind::Pointer:
            std::snprintf(buf, sizeof buf, "%p", p_);
            return buf;
    }
    return {};
}

// ---- formatter

std::string format(std::string_view fmt, std::span<const Arg> args, bool redact) {
    std::string out;
    out.reserve(fmt.size() + 32);
    size_t next = 0;
    size_t i = 0;
    while (i < fmt.size()) {
        char c = fmt[i];
        if (c != '%') {
            out.push_back(c);
            ++i;
            continue;
        }
        size_t start = i++;
        if (i < fmt.size() && fmt[i] == '%') {
            out.push_back('%');
            ++i;
            continue;
        }
        bool isPublic = false;
        if (i < fmt.size() && fmt[i] == '{') {
            size_t close = fmt.find('}', i);
            if (close == std::string_view::npos) {
                out.append(fmt.substr(start));
                break;
            }
            std::string_view attrs = fmt.substr(i + 1, close - i - 1);
            isPublic = attrs.find("public") != std::string_view::npos;
            i = close + 1;
        }
        // flags and width, kept for numbers ("%02d", "%-5s")
        std::string spec = "%";
        while (i < fmt.size() && std::strchr("-+ #0123456789.", fmt[i])) spec.push_back(fmt[i++]);
        int longs = 0;
        bool half = false;
        while (i < fmt.size() && std::strchr("hlzjtq", fmt[i])) {
            if (fmt[i] == 'h') {
                half = true;
            } else {
                ++longs;
            }
            ++i;
        }
        if (i >= fmt.size()) {
            out.append(fmt.substr(start));
            break;
        }
        char conv = fmt[i++];
        if (!std::strchr("@sdiuxXocpfgeF", conv)) {
            out.append(fmt.substr(start, i - start));
            continue;
        }
        if (next >= args.size()) {
            out += "<missing>";
            continue;
        }
        const Arg& arg = args[next++];
        bool wide = longs > 0;
        char buf[128];
        switch (conv) {
            case '@':
            case 's':
                if (redact && !isPublic && arg.kind() != Arg::Kind::Null) {
                    out += "<private>";
                } else if (spec.size() > 1) {
                    std::snprintf(buf, sizeof buf, (spec + "s").c_str(), arg.asText().c_str());
                    out += buf;
                } else {
                    out += arg.asText();
                }
                break;
            case 'd':
            case 'i': {
                int64_t v = arg.asSigned();
                if (!wide) v = half ? static_cast<int16_t>(v) : static_cast<int32_t>(v);
                std::snprintf(buf, sizeof buf, (spec + PRId64).c_str(), v);
                out += buf;
                break;
            }
            case 'u':
            case 'x':
            case 'X':
            case 'o': {
                uint64_t v = arg.asUnsigned();
                if (!wide) v = half ? static_cast<uint16_t>(v) : static_cast<uint32_t>(v);
                const char* f = conv == 'u' ? PRIu64 : conv == 'x' ? PRIx64 : conv == 'X' ? PRIX64 : PRIo64;
                std::snprintf(buf, sizeof buf, (spec + f).c_str(), v);
                out += buf;
                break;
            }
            case 'c':
                out.push_back(static_cast<char>(arg.asSigned()));
                break;
            case 'p':
                std::snprintf(buf, sizeof buf, "%p", arg.kind() == Arg::Kind::Pointer
                                                         ? arg.asPointer()
                                                         : reinterpret_cast<const void*>(
                                                               static_cast<uintptr_t>(arg.asUnsigned())));
                out += buf;
                break;
            default:  // f g e F
                std::snprintf(buf, sizeof buf, (spec + conv).c_str(), arg.asDouble());
                out += buf;
                break;
        }
    }
    return out;
}

void write(const Handle& handle, Level level, std::string_view fmt, std::span<const Arg> args) {
    if (gCapture.load(std::memory_order_acquire)) {
        MutexLock lock(gCaptureMutex);
        if (CaptureSink* capture = gCapture.load(std::memory_order_relaxed)) {
            capture->add(Record{handle.subsystem(), handle.category(), level,
                                format(fmt, args, !capture->showPrivate())});
            return;
        }
    }
    Sink sink = config().sink;
    if (sink == Sink::Fallback && !gStandardErrorFallback.load(std::memory_order_relaxed)) return;
    std::string text = format(fmt, args, !config().showPrivate);
    if (sink == Sink::Journal) {
        writeJournal(handle, level, text);
    } else {
        writeStderr(handle, level, text);
    }
}

void setStandardErrorFallback(bool enabled) { gStandardErrorFallback.store(enabled, std::memory_order_relaxed); }

// ---- CaptureSink

CaptureSink::CaptureSink(bool showPrivate) : showPrivate_(showPrivate) {
    MutexLock lock(gCaptureMutex);
    CaptureSink* expected = nullptr;
    if (!gCapture.compare_exchange_strong(expected, this)) {
        std::fprintf(stderr, "log: a capture sink is already installed\n");
        std::abort();
    }
}

CaptureSink::~CaptureSink() {
    MutexLock lock(gCaptureMutex);
    gCapture.store(nullptr, std::memory_order_release);
}

void CaptureSink::add(Record record) {
    MutexLock lock(mutex_);
    records_.push_back(std::move(record));
}

std::vector<Record> CaptureSink::records() const {
    MutexLock lock(mutex_);
    return records_;
}

size_t CaptureSink::count(std::string_view text) const {
    MutexLock lock(mutex_);
    size_t n = 0;
    for (const Record& r : records_)
        if (r.message.find(text) != std::string::npos) ++n;
    return n;
}

void CaptureSink::clear() {
    MutexLock lock(mutex_);
    records_.clear();
}

}  // namespace corvane::log
