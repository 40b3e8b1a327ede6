#include "Annexa/AXUtilities.h"

#include <cstdlib>
#include <memory>
#include <mutex>

namespace annexa {

namespace log = corvane::log;

Error makeError(AXErrorCode code, const char* text) {
    Error e{kAnnexaErrorDomain, errorCodeValue(code), std::nullopt};
    if (text) e.text = text;
    return e;
}

int64_t integerValueOf(const Value& value) {
    if (value.isNumber()) return *value.int64Value();
    if (const std::string* text = value.asString()) return std::strtoll(text->c_str(), nullptr, 10);
    return 0;
}

Dictionary dictionaryChanging(const Dictionary& dictionary, const std::string& key,
                              const Value& value) {
    Dictionary copy = dictionary;
    if (value.isNull()) {
        copy.erase(key);
    } else {
        copy.insert_or_assign(key, value);
    }
    return copy;
}

Dictionary dictionaryChanging(const Value& dictionary, const std::string& key, const Value& value) {
    static const Dictionary kEmpty;
    const Dictionary* d = dictionary.asDictionary();
    return dictionaryChanging(d ? *d : kEmpty, key, value);
}

namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

}  // namespace

Ordering compareVersionString(std::string_view a, std::string_view b) {
    size_t i = 0;
    size_t j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            size_t ai = i;
            size_t bj = j;
            while (ai < a.size() && a[ai] == '0') ++ai;
            while (bj < b.size() && b[bj] == '0') ++bj;
            size_t aEnd = ai;
            size_t bEnd = bj;
            while (aEnd < a.size() && isDigit(a[aEnd])) ++aEnd;
            while (bEnd < b.size() && isDigit(b[bEnd])) ++bEnd;
            // Without leading zeros, a longer run of digits is the larger number; runs of equal
            // length compare digit by digit. No overflow for runs of any length.
            size_t aLen = aEnd - ai;
            size_t bLen = bEnd - bj;
            if (aLen != bLen) return aLen < bLen ? Ordering::Ascending : Ordering::Descending;
            int c = a.substr(ai, aLen).compare(b.substr(bj, bLen));
            if (c != 0) return c < 0 ? Ordering::Ascending : Ordering::Descending;
            i = aEnd;
            j = bEnd;
            continue;
        }
        auto ca = static_cast<unsigned char>(a[i]);
        auto cb = static_cast<unsigned char>(b[j]);
        if (ca != cb) return ca < cb ? Ordering::Ascending : Ordering::Descending;
        ++i;
        ++j;
    }
    if (i < a.size()) return Ordering::Descending;
    if (j < b.size()) return Ordering::Ascending;
    return Ordering::Same;
}

namespace {

constexpr const char* kSubsystem = "com.corvane.Annexa";

struct Handles {
    const log::Handle* ops;
    const log::Handle* traffic;
    const log::Handle* extension;
    const log::Handle* vt;
};

// A handle that cannot be made falls back to the platform's default log, after saying so there.
const log::Handle* makeLog(const char* category) {
    std::unique_ptr<log::Handle> h = log::makeHandle(kSubsystem, category);
    if (!h) {
        log::error(log::defaultLog(), "unable to create log handle for category %{public}s",
                   category);
        return &log::defaultLog();
    }
    return h.release();  // lives for the process's life
}

const Handles& handles() {
    static std::once_flag once;
    static Handles h{};
    std::call_once(once, [] {
        h.ops = makeLog("ops");
        h.traffic = makeLog("traffic");
        h.extension = makeLog("extension");
        h.vt = makeLog("vt");
    });
    return h;
}

}  // namespace

const log::Handle& logOps() { return *handles().ops; }
const log::Handle& logTraffic() { return *handles().traffic; }
const log::Handle& logExtension() { return *handles().extension; }
const log::Handle& logVt() { return *handles().vt; }

}  // namespace annexa
