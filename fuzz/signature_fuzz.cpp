// The signature-file reader on arbitrary bytes: no crash; whatever it accepts can be checked.
#include <cstdint>
#include <string_view>

#include "platform/codesign/CodeSign.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto file = corvane::codesign::parseSignature(std::string_view(reinterpret_cast<const char*>(data), size));
    if (file) (void)corvane::codesign::signatureVerifies(*file);
    return 0;
}
