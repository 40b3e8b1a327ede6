// Small pieces the whole system shares: error values of the domain "Annexa", dictionary change,
// version-string comparison and the log handles.
#pragma once

#include <string>
#include <string_view>

#include "Annexa/AXProtocol.h"
#include "platform/log/Log.h"
#include "platform/value/Value.h"

namespace annexa {

using corvane::Array;
using corvane::Date;
using corvane::Dictionary;
using corvane::Error;
using corvane::Result;
using corvane::Status;
using corvane::UUID;
using corvane::Value;

inline constexpr const char* kAnnexaErrorDomain = "Annexa";

// An error of the domain "Annexa" with the code and, when given, the text as its description.
Error makeError(AXErrorCode code, const char* text);
inline Error makeError(AXErrorCode code, const std::string& text) { return makeError(code, text.c_str()); }

// Formats the text with the log formatter's directives ("%@", "%d", "%s", ...), unredacted; a null
// format gives an error without description.
template <class... A>
Error makeErrorWithFormat(AXErrorCode code, const char* format, const A&... args) {
    if (!format) return makeError(code, nullptr);
    return makeError(code, corvane::log::formatText(format, args...));
}

// A copy of `dictionary` in which `key` maps to `value`; a null value removes the key. A value that
// is not a dictionary is taken as an empty one.
Dictionary dictionaryChanging(const Value& dictionary, const std::string& key, const Value& value);
Dictionary dictionaryChanging(const Dictionary& dictionary, const std::string& key,
                              const Value& value);

// Whether an entitlement's value grants it: present and not false (by the number-boolean rule).
inline bool entitlementGranted(const Value& value) { return !value.isNull() && !value.isFalse(); }

// The integer value of a stored value: a number's (doubles truncated), a text's leading decimal
// digits as strtoll reads them (0 without any), and 0 for anything else.
int64_t integerValueOf(const Value& value);

enum class Ordering { Ascending = -1, Same = 0, Descending = 1 };

// Compares version strings: runs of decimal digits compare by numeric value (10 after 9, 1.10
// after 1.9), every other character compares by its code, case-sensitively; when one string is a
// prefix of the other the shorter orders first. Ascending: `a` orders first. Digit runs that differ
// only in leading zeros ("01" and "1") compare equal.
Ordering compareVersionString(std::string_view a, std::string_view b);

// The log handles of the subsystem "com.corvane.Annexa", made once for the process's life.
const corvane::log::Handle& logOps();
const corvane::log::Handle& logTraffic();
const corvane::log::Handle& logExtension();
const corvane::log::Handle& logVt();

}  // namespace annexa
