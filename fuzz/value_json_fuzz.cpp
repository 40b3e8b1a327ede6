// The JSON reader on arbitrary text: no crash, and whatever it accepts writes back to JSON that
// reads as the same value, written the same way.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/value/Value.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    auto v = corvane::Value::parseJson(text);
    if (!v) return 0;
    std::string json = v->json();
    auto again = corvane::Value::parseJson(json);
    if (!again) std::abort();
    // NaN is the one value unequal to itself; a descriptor reads back under another number.
    bool comparable = json.find("\"nan\"") == std::string::npos && json.find("$fd") == std::string::npos;
    if (comparable && (!(*again == *v) || again->json() != json)) std::abort();
    return 0;
}
