// Activation rules and offers of every shape, in the text notation: "RULE\nOFFER". Whatever they
// are, the answer is a boolean and nothing crashes.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/types/Types.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    size_t newline = text.find('\n');
    if (newline == std::string_view::npos) return 0;
    auto rule = corvane::Value::parse(text.substr(0, newline));
    auto offer = corvane::Value::parse(text.substr(newline + 1));
    if (!rule || !offer) return 0;
    static const auto db = corvane::types::TypeDatabase::read("/usr/share/mime");
    (void)corvane::types::activationRuleMatches(*db, *rule, *offer);
    return 0;
}
