// The text notation reader on arbitrary text: no crash, and whatever it accepts writes back to a
// text that reads as the same value.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/value/Value.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    auto v = corvane::Value::parse(text);
    if (!v) return 0;
    auto again = corvane::Value::parse(v->description());
    if (!again || !(*again == *v)) {
        // NaN is the one value unequal to itself.
        if (v->description().find("nan") == std::string::npos) std::abort();
    }
    return 0;
}
