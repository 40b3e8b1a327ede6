// The token parser on arbitrary text: no crash, and nothing it accepts verifies without the key
// (the fuzzer's tokens are never made with it).
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/sandbox/Sandbox.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto token = corvane::sandbox::parseToken(std::string_view(reinterpret_cast<const char*>(data), size));
    if (token && token->path.empty()) std::abort();
    return 0;
}
