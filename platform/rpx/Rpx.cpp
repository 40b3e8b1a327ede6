#include "platform/rpx/Rpx.h"

#include <atomic>

#include "platform/layout/Layout.h"
#include "platform/rpx/Internal.h"

namespace corvane::rpx {

namespace {
std::atomic<uint64_t> gOutstandingWork{0};
}  // namespace

const log::Handle& internal::rpxLog() {
    static const log::Handle h("com.corvane.rpx", "rpx");
    return h;
}

const char* errorDescription(ErrorKind kind) {
    switch (kind) {
        case ErrorKind::ConnectionInvalid: return "Connection invalid";
        case ErrorKind::TerminationImminent: return "Termination imminent";
    }
    return "?";
}

std::string Event::description() const {
    return error ? errorDescription(*error) : message.description();
}

std::string Reply::description() const { return error ? errorDescription(*error) : value.description(); }

std::string endpointPath(const std::string& name) { return layout::runtimeDir() + "/rpx/" + name; }

void beginWork() { gOutstandingWork.fetch_add(1); }
void endWork() { gOutstandingWork.fetch_sub(1); }
uint64_t outstandingWork() { return gOutstandingWork.load(); }

}  // namespace corvane::rpx
