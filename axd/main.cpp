// axd: the per-user daemon that keeps the registry of application plug-ins.
#include <getopt.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "axd/AXDServer.h"
#include "platform/layout/Layout.h"

namespace log = corvane::log;

namespace {

[[noreturn]] void usage() {
    std::fputs("Usage: axd [-S servicename] [-v]\n", stderr);
    std::exit(2);
}

constexpr const char* kHelp =
    "Usage: axd [-c LIMIT] [-d DATABASE] [-S SERVICENAME] [-v]\n"
    "The per-user daemon of the plug-in registry; a service manager starts it (axd.socket).\n"
    "  -c LIMIT        the most plug-in records kept in memory (default 1000000)\n"
    "  -d DATABASE     the annotation file (default: in the daemon's data container)\n"
    "  -S SERVICENAME  the endpoint to serve (default com.corvane.annexa.axd)\n"
    "  -v              ineffective: logging is configured with CORVANE_LOG (see axd(8))\n";

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    // A reply of every plug-in is megabytes, made and freed in a moment. With the C library's
    // sliding threshold such buffers come from the heap after the first one and stay with the
    // process (20 MiB at 10,000 plug-ins); a fixed threshold maps and unmaps each of them.
    mallopt(M_MMAP_THRESHOLD, 512 * 1024);
    // One heap for every thread. A thread's own heap grows by the pages each allocation needs, one
    // mprotect at a time: a fifth of building every plug-in's record and form went there. The
    // main heap grows in steps of its top pad, and the daemon's threads seldom allocate at once.
    mallopt(M_ARENA_MAX, 1);
    // Before any thread starts: SIGTERM becomes "termination imminent" for every client.
    corvane::rpx::handleTermination();
    log::info(annexa::logOps(), "axd is launching");

    std::string serviceName = annexa::kDefaultServiceName;
    uint32_t cacheLimit = 1000000;
    const char* database = nullptr;
    uint32_t verbose = 0;
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--help") == 0) {
            std::fputs(kHelp, stdout);
            return 0;
        }
    }
    int opt;
    while ((opt = getopt(argc, argv, "c:d:S:v")) != -1) {
        switch (opt) {
            case 'c':
                cacheLimit = annexa::AXDatabase::cacheLimitFromText(optarg);
                break;
            case 'd': database = optarg; break;
            case 'S': serviceName = optarg; break;
            case 'v':
                ++verbose;
                log::error(log::defaultLog(),
                           "verbose option -v is ineffective; use log config --subsystem com.corvane.annexa");
                break;
            default: usage();
        }
    }
    if (optind < argc) usage();
    if (corvane::Status places = corvane::layout::checkPlaces(); !places.ok()) {
        log::error(annexa::logOps(), "%{public}s", places.error().description());
        return 78;
    }

    auto registry = corvane::vantry::Registry::openDefault();
    if (!registry) {
        log::error(annexa::logOps(), "cannot open the application registry: %{public}@", registry.error().description());
        log::error(annexa::logOps(), "unable to construct server");
        return 1;
    }
    auto server = annexa::AXDServer::initForService(serviceName, database, std::move(*registry));
    if (!server) {
        log::error(annexa::logOps(), "unable to construct server");
        return 1;
    }
    server->setVerbose(verbose);
    server->setCacheLimit(cacheLimit);
    server->run();
}
