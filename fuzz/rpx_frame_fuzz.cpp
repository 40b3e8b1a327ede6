// The frame reader on an arbitrary byte stream fed in uneven pieces: no crash, no hang, and every
// frame it accepts encodes again to the same bytes' value.
#include <cstdint>
#include <cstdlib>

#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"

using namespace corvane::rpx;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    wire::FrameReader reader(1 << 20, kMaxDepth);
    size_t at = 0;
    size_t step = size ? (data[0] % 7) + 1 : 1;
    while (at < size) {
        size_t n = std::min(step, size - at);
        reader.append(reinterpret_cast<const char*>(data + at), n);
        at += n;
        for (;;) {
            wire::Frame frame;
            std::string error;
            auto status = reader.next(frame, error);
            if (status != wire::FrameReader::Status::Frame) {
                if (status == wire::FrameReader::Status::Error) return 0;
                break;
            }
            std::vector<int> fds;
            auto again = wire::encodeFrame(frame, fds, kMaxDepth);
            if (!again || !fds.empty()) std::abort();  // no descriptors arrived, none may appear
        }
    }
    return 0;
}
