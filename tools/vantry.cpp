// vantry: registers and unregisters bundles with the application registry, lists and shows its
// records, watches its events and rebuilds a damaged database. See docs/registry.md.
#include <unistd.h>

#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "platform/vantry/Vantry.h"

using namespace corvane;
using vantry::PlugInRecordPtr;

namespace {

const char* kUsage =
    "usage: vantry register [--placeholder] PATH...   register application or plug-in bundles\n"
    "       vantry unregister PATH...                 unregister them\n"
    "       vantry list [--json]                      applications and plug-ins with their UUIDs\n"
    "       vantry show UUID|PATH [--json]            one plug-in's record\n"
    "       vantry watch                              print install and uninstall events as they happen\n"
    "       vantry rebuild                            move a damaged database aside and register again\n"
    "The registry lives under the platform root (CORVANE_ROOT).\n";

Value recordValue(const PlugInRecordPtr& r) {
    Value v = r->serialize();
    return v;
}

std::unique_ptr<vantry::Registry> openRegistry() {
    auto r = vantry::Registry::open(vantry::Registry::defaultPath());
    if (!r) {
        std::fprintf(stderr, "vantry: %s\n", r.error().description().c_str());
        std::exit(1);
    }
    return std::move(*r);
}

struct Printer : vantry::Observer {
    // One line per event, then one line per record.
    void print(const char* what, const std::vector<PlugInRecordPtr>& records) {
        std::printf("%s event: %zu plug-in(s)\n", what, records.size());
        for (const auto& r : records)
            std::printf("  %s %s %s\n", r->uuid().string().c_str(), r->identifier().c_str(),
                        r->bundlePath().c_str());
        std::fflush(stdout);
    }
    void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) override { print("install", records); }
    void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) override {
        print("uninstall", records);
    }
};

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string> args(argv + 1, argv + argc);
    if (args.empty()) {
        std::fputs(kUsage, stderr);
        return 64;
    }
    for (const auto& a : args) {
        if (a == "--help" || a == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        }
    }
    std::string command = args[0];
    args.erase(args.begin());
    bool asJson = false;
    bool placeholder = false;
    std::vector<std::string> operands;
    for (const auto& a : args) {
        if (a == "--json") {
            asJson = true;
        } else if (a == "--placeholder") {
            placeholder = true;
        } else {
            operands.push_back(a);
        }
    }

    if (command == "rebuild") {
        auto failed = vantry::Registry::rebuild(vantry::Registry::defaultPath());
        if (!failed) {
            std::fprintf(stderr, "vantry: %s\n", failed.error().description().c_str());
            return 1;
        }
        for (const auto& p : *failed) std::fprintf(stderr, "vantry: could not register %s again\n", p.c_str());
        std::printf("rebuilt %s\n", vantry::Registry::defaultPath().c_str());
        return failed->empty() ? 0 : 1;
    }

    auto registry = openRegistry();
    if (command == "register" || command == "unregister") {
        if (operands.empty()) {
            std::fprintf(stderr, "vantry: %s needs at least one PATH\n", command.c_str());
            return 64;
        }
        int status = 0;
        for (const auto& path : operands) {
            Status done = command == "register" ? registry->registerBundle(path, placeholder)
                                                : registry->unregisterBundle(path);
            if (!done.ok()) {
                std::fprintf(stderr, "vantry: %s\n", done.error().description().c_str());
                status = 1;
            } else {
                std::printf("%sed %s\n", command.c_str(), path.c_str());
            }
        }
        return status;
    }
    if (command == "list") {
        auto plugins = registry->installedPlugIns();
        if (asJson) {
            Array list;
            for (const auto& r : plugins) list.push_back(recordValue(r));
            std::printf("%s\n", Value(std::move(list)).json().c_str());
            return 0;
        }
        std::string lastApp = "-";
        for (const auto& r : plugins) {
            std::string app = r->containingApplication() ? r->containingApplication()->bundlePath() : "";
            if (app != lastApp) {
                std::printf("%s\n", app.empty() ? "(stand-alone plug-ins)" : app.c_str());
                lastApp = app;
            }
            std::printf("  %s  %s  %s\n", r->uuid().string().c_str(), r->identifier().c_str(),
                        r->bundlePath().c_str());
        }
        return 0;
    }
    if (command == "show") {
        if (operands.size() != 1) {
            std::fprintf(stderr, "vantry: show needs one UUID or PATH\n");
            return 64;
        }
        auto uuid = UUID::parse(operands[0]);
        PlugInRecordPtr r = uuid ? registry->plugInForUUID(*uuid) : registry->plugInForPath(operands[0]);
        if (!r) {
            std::fprintf(stderr, "vantry: no plug-in %s\n", operands[0].c_str());
            return 1;
        }
        std::string out = asJson ? recordValue(r).json() : recordValue(r).description();
        std::printf("%s\n", out.c_str());
        return 0;
    }
    if (command == "watch") {
        Printer printer;
        auto subscription = registry->subscribe(printer);
        std::printf("watching %s\n", registry->path().c_str());
        std::fflush(stdout);
        for (;;) pause();
    }
    std::fprintf(stderr, "vantry: unknown command %s\n%s", command.c_str(), kUsage);
    return 64;
}
