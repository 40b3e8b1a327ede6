#include "platform/rpx/Rpx.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "platform/layout/Layout.h"
#include "platform/rpx/Internal.h"

namespace corvane::rpx {

namespace {

std::atomic<uint64_t> gOutstandingWork{0};

Limits readLimits() {
    Limits l;
    const char* spec = std::getenv("CORVANE_RPX_LIMITS");
    std::string_view rest = spec ? spec : "";
    while (!rest.empty()) {
        size_t comma = rest.find(',');
        std::string_view item = rest.substr(0, comma);
        rest = comma == std::string_view::npos ? std::string_view() : rest.substr(comma + 1);
        size_t eq = item.find('=');
        if (eq == std::string_view::npos) continue;
        std::string_view name = item.substr(0, eq);
        unsigned long long n = std::strtoull(std::string(item.substr(eq + 1)).c_str(), nullptr, 10);
        if (n == 0) continue;  // a limit of 0 would refuse everything; keep the default
        if (name == "connections-per-process") l.connectionsPerProcess = n;
        if (name == "queued-reply-mib") l.queuedReplyMiB = n;
        if (name == "partial-frame-seconds") l.partialFrameSeconds = static_cast<unsigned>(n);
        if (name == "violations-per-second") l.violationsPerSecond = static_cast<unsigned>(n);
        if (name == "read-mib-per-second") l.readMiBPerSecond = n;
    }
    return l;
}

}  // namespace

std::atomic<size_t> internal::gQueuedReplyBytes{0};
std::atomic<size_t> internal::gClosedSinceTrim{0};

const Limits& limits() {
    static const Limits l = readLimits();
    return l;
}

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

namespace {

// Whether something accepts connections on the socket now.
bool answers(const std::string& path) {
    struct sockaddr_un addr {};
    if (path.size() >= sizeof addr.sun_path) return false;
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) return false;
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    bool connected = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0 || errno == EAGAIN;
    ::close(fd);
    return connected;
}

}  // namespace

std::string unreachableText(const std::string& name, const char* socketUnit) {
    if (Status places = layout::checkPlaces(); !places.ok()) return places.error().description();
    std::string path = endpointPath(name);
    if (answers(path)) return "the connection to " + path + " ended before the reply";
    std::string text = "nothing answers on " + path;
    if (socketUnit) text += std::string(" (start it with: systemctl --user start ") + socketUnit + ")";
    return text;
}

void beginWork() { gOutstandingWork.fetch_add(1); }
void endWork() { gOutstandingWork.fetch_sub(1); }
uint64_t outstandingWork() { return gOutstandingWork.load(); }

}  // namespace corvane::rpx
