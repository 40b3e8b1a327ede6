// Pattern dictionaries of every shape (wrong types, deep nesting, "?" operators, empty operands)
// against one daemon plug-in record: the answer is a boolean and nothing crashes.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "axd/AXDPlugIn.h"

namespace {

std::shared_ptr<annexa::AXDPlugIn> plugIn() {
    using corvane::dict;
    using corvane::Value;
    auto record = corvane::vantry::PlugInRecord::deserialize(
        dict({{"uuid", "01234567-89AB-CDEF-0123-456789ABCDEF"},
              {"path", "/usr/lib/corvane/P.appex"},
              {"identifier", "com.example.p"},
              {"bundleIdentifier", "com.example.p"},
              {"originalIdentifier", "com.example.p"},
              {"plugin", dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", "1.2"},
                                                               {"Kinds", Value(corvane::Array{Value("a"), Value(1)})},
                                                               {"Rule", dict({{"image/*", 2}})}})}})},
              {"info", dict({{"KSExtension", dict({})}})},
              {"entitlements", dict({{"com.example.e", true}})},
              {"container", "/c"}}),
        nullptr);
    return annexa::AXDPlugIn::fromRegistryRecord(record);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const auto subject = plugIn();
    if (!subject) __builtin_trap();
    auto patterns = corvane::Value::parse(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!patterns) return 0;
    (void)subject->match(*patterns);
    if (const corvane::Dictionary* tests = patterns->asDictionary())
        for (const auto& [key, pattern] : *tests) (void)subject->matchKeyPattern(key, pattern);
    return 0;
}
