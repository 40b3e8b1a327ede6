// Hosts the sandbox token broker in a process of its own, for tests: prints "ready", then serves
// until killed.
#include <unistd.h>

#include <cstdio>

#include "platform/sandbox/Sandbox.h"

int main() {
    auto broker = corvane::sandbox::Broker::start(corvane::dispatch::Queue::create("broker"));
    if (!broker) {
        std::fprintf(stderr, "%s\n", broker.error().description().c_str());
        return 1;
    }
    std::printf("ready\n");
    std::fflush(stdout);
    for (;;) pause();
}
