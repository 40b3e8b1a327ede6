// axd: the per-user daemon that keeps the registry of application plug-ins.
#include <getopt.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "axd/AXDServer.h"

namespace log = corvane::log;

namespace {

[[noreturn]] void usage() {
    std::fputs("Usage: axd [-S servicename] [-v]\n", stderr);
    std::exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    // A reply of every plug-in is megabytes, made and freed in a moment. With the C library's
    // sliding threshold such buffers come from the heap after the first one and stay with the
    // process (20 MiB at 10,000 plug-ins); a fixed threshold maps and unmaps each of them.
    mallopt(M_MMAP_THRESHOLD, 512 * 1024);
    // Before any thread starts: SIGTERM becomes "termination imminent" for every client.
    corvane::rpx::handleTermination();
    log::info(annexa::logOps(), "axd is launching");

    std::string serviceName = annexa::kDefaultServiceName;
    uint32_t cacheLimit = 1000000;
    const char* database = nullptr;
    uint32_t verbose = 0;
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

    auto registry = corvane::vantry::Registry::open(corvane::vantry::Registry::defaultPath());
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
