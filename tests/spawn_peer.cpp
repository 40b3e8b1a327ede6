// A registrar and host of spawnd for the tests, signed by them with the entitlements under test.
//   spawn_peer add HOSTPID EXECUTABLE OVERLAY    prints "result N" (addExternalService)
//   spawn_peer remove IDENTIFIER VERSION         prints "result N" (removeExternalService)
//   spawn_peer consent BUNDLE                    prints the bundle's consent records as JSON, or
//                                                "refused"
//   spawn_peer host EXECUTABLE IDENTIFIER OVERLAY
//       registers the plug-in for itself, connects, sends {}, prints "reply <text notation>" (or
//       "refused <errno> <text>") and waits to be killed
#include <unistd.h>

#include <cstdio>
#include <string>

#include "Annexa/AXPlugInRuntime.h"
#include "platform/pcx/Pcx.h"
#include "platform/spawn/Spawn.h"

using namespace corvane;

namespace {

Value overlayFrom(const char* text) {
    auto overlay = Value::parse(text);
    if (!overlay) {
        std::fprintf(stderr, "spawn_peer: bad overlay %s\n", text);
        std::exit(2);
    }
    return *overlay;
}

int host(const std::string& executable, const std::string& identifier, const Value& overlay) {
    int added = spawn::addExternalService(::getpid(), executable, overlay);
    if (added != 0) {
        std::printf("result %d\n", added);
        return 1;
    }
    auto queue = dispatch::Queue::create("spawn_peer");
    auto connection = annexa::connectToPlugIn(identifier, queue, [](const rpx::Event& ev) {
        if (ev.isError()) {
            std::printf("plug-in gone\n");
            std::fflush(stdout);
        }
    });
    if (!connection) {
        std::printf("refused %lld %s\n", static_cast<long long>(connection.error().code),
                    connection.error().description().c_str());
        return 1;
    }
    rpx::Reply reply = (*connection)->sendWithReplySync(Value(Dictionary{}));
    std::printf("reply %s\n", reply.ok() ? reply.value.description().c_str() : reply.description().c_str());
    std::fflush(stdout);
    for (;;) ::pause();
}

}  // namespace

int main(int argc, char** argv) {
    std::string mode = argc > 1 ? argv[1] : "";
    int result;
    if (mode == "add" && argc == 5) {
        result = spawn::addExternalService(std::stoi(argv[2]), argv[3], overlayFrom(argv[4]));
    } else if (mode == "remove" && argc == 4) {
        result = spawn::removeExternalService(argv[2], argv[3]);
    } else if (mode == "consent" && argc == 3) {
        auto records = pcx::consentInformationForBundle(argv[2]);
        std::printf("%s\n", records ? Value(*records).json().c_str() : "refused");
        return 0;
    } else if (mode == "host" && argc == 5) {
        return host(argv[2], argv[3], overlayFrom(argv[4]));
    } else {
        std::fprintf(stderr, "usage: spawn_peer add|remove|host ...\n");
        return 2;
    }
    std::printf("result %d\n", result);
    return 0;
}
