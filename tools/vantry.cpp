// vantry: registers and unregisters bundles with the application registry, lists and shows its
// records, watches its events and rebuilds a damaged database. See docs/registry.md and
// docs/tools.md.
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/vantry/Vantry.h"
#include "tools/cli/Cli.h"

using namespace corvane;
using vantry::PlugInRecordPtr;
namespace cli = corvane::cli;

namespace {

constexpr const char* kTool = "vantry";

const cli::Syntax kRegister{"register [--placeholder] PATH...", {"--placeholder"}, {}, 1};
const cli::Syntax kUnregister{"unregister PATH...", {}, {}, 1};
const cli::Syntax kList{"list [--json]", {"--json"}, {}, 0, 0};
const cli::Syntax kShow{"show [--json] UUID|PATH", {"--json"}, {}, 1, 1};
const cli::Syntax kWatch{"watch", {}, {}, 0, 0};
const cli::Syntax kRebuild{"rebuild", {}, {}, 0, 0};
const cli::Syntax kSync{"sync [DIRECTORY]", {}, {}, 0, 1};

const char* kUsage =
    "usage: vantry [--system] register [--placeholder] PATH...   register application or plug-in bundles\n"
    "       vantry [--system] unregister PATH...                 unregister them\n"
    "       vantry [--system] sync [DIRECTORY]                   register what is in a directory of bundles,\n"
    "                                                            unregister what left it\n"
    "       vantry [--system] list [--json]                      applications and plug-ins with their UUIDs\n"
    "       vantry [--system] show [--json] UUID|PATH            one plug-in's record\n"
    "       vantry [--system] watch                              print install and uninstall events\n"
    "       vantry [--system] rebuild                            move a damaged database aside and register again\n"
    "Without --system, the user's registry and the system registry are read as one, and what is\n"
    "registered goes to the user's (a bundle of the system applications directory to the system\n"
    "registry, which only root writes). With --system, only the system registry; sync then reads the\n"
    "system applications directory, else the user's. COMMAND --help shows one command's usage.\n"
    "See docs/registry.md.\n";

// Set by --system before the command.
bool systemOnly = false;

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

std::unique_ptr<vantry::Registry> openRegistry() {
    auto r = systemOnly ? vantry::Registry::openSystem() : vantry::Registry::openDefault();
    if (!r) {
        std::fprintf(stderr, "vantry: %s\n", r.error().description().c_str());
        return nullptr;
    }
    return std::move(*r);
}

int registration(bool registering, const cli::Parsed& p) {
    auto registry = openRegistry();
    if (!registry) return cli::kFailure;
    int status = cli::kSuccess;
    for (const auto& path : p.operands) {
        Status done = registering ? registry->registerBundle(path, p.has("--placeholder"))
                                  : registry->unregisterBundle(path);
        if (!done.ok()) {
            // A bundle that cannot be read, or a path that is not registered, is bad input.
            status = cli::fail(kTool, done.error().description(), cli::kDataError);
        } else {
            std::printf("%s %s\n", registering ? "registered" : "unregistered", path.c_str());
        }
    }
    return status;
}

void printPlugIn(const PlugInRecordPtr& r) {
    std::printf("  %s  %s  %s\n", r->uuid().string().c_str(), r->identifier().c_str(), r->bundlePath().c_str());
}

// Applications (each with its plug-ins, none for some) and then stand-alone plug-ins.
int list(const cli::Parsed& p) {
    auto registry = openRegistry();
    if (!registry) return cli::kFailure;
    auto applications = registry->installedApplications();
    std::vector<PlugInRecordPtr> standalone;
    for (const auto& r : registry->installedPlugIns())
        if (!r->containingApplication()) standalone.push_back(r);
    if (p.has("--json")) {
        Array apps;
        for (const auto& app : applications) {
            Value serialized = app->serialize();
            Dictionary entry = *serialized.asDictionary();
            Array plugIns;
            for (const auto& r : app->plugIns()) plugIns.push_back(r->serialize());
            entry["plugins"] = Value(std::move(plugIns));
            apps.push_back(Value(std::move(entry)));
        }
        Array alone;
        for (const auto& r : standalone) alone.push_back(r->serialize());
        Value document = dict({{"applications", Value(std::move(apps))}, {"plugins", Value(std::move(alone))}});
        std::printf("%s\n", document.json().c_str());
        return cli::kSuccess;
    }
    for (const auto& app : applications) {
        auto plugIns = app->plugIns();
        std::printf("%s%s\n", app->bundlePath().c_str(), plugIns.empty() ? "  (no plug-ins)" : "");
        for (const auto& r : plugIns) printPlugIn(r);
    }
    if (!standalone.empty()) std::printf("(stand-alone plug-ins)\n");
    for (const auto& r : standalone) printPlugIn(r);
    return cli::kSuccess;
}

int show(const cli::Parsed& p) {
    auto registry = openRegistry();
    if (!registry) return cli::kFailure;
    const std::string& which = p.operands[0];
    auto uuid = UUID::parse(which);
    PlugInRecordPtr r = uuid ? registry->plugInForUUID(*uuid) : registry->plugInForPath(which);
    if (!r) return cli::fail(kTool, "no plug-in " + which, cli::kDataError);
    Value record = r->serialize();
    std::printf("%s\n", (p.has("--json") ? record.json() : record.description()).c_str());
    return cli::kSuccess;
}

int watch(const cli::Parsed&) {
    auto registry = openRegistry();
    if (!registry) return cli::kFailure;
    Printer printer;
    auto subscription = registry->subscribe(printer);
    std::printf("watching %s\n", registry->path().c_str());
    std::fflush(stdout);
    for (;;) pause();
}

int rebuild(const cli::Parsed&) {
    std::string path = systemOnly ? vantry::Registry::systemPath() : vantry::Registry::defaultPath();
    auto failed = vantry::Registry::rebuild(path);
    if (!failed) return cli::fail(kTool, failed.error().description());
    for (const auto& p : *failed) std::fprintf(stderr, "vantry: could not register %s again\n", p.c_str());
    std::printf("rebuilt %s\n", path.c_str());
    return failed->empty() ? cli::kSuccess : cli::kFailure;
}

// One line per bundle that changed; a bundle that cannot be read is reported and does not stop
// the others.
int syncDirectory(const cli::Parsed& p) {
    auto registry = openRegistry();
    if (!registry) return cli::kFailure;
    std::string directory = !p.operands.empty() ? p.operands[0]
                            : systemOnly        ? layout::systemApplicationsDir()
                                                : layout::userApplicationsDir();
    auto report = registry->sync(directory);
    if (!report) return cli::fail(kTool, report.error().description(), cli::kDataError);
    for (const auto& path : report->registered) std::printf("registered %s\n", path.c_str());
    for (const auto& path : report->updated) std::printf("registered again %s\n", path.c_str());
    for (const auto& path : report->unregistered) std::printf("unregistered %s\n", path.c_str());
    for (const auto& [path, reason] : report->refused) std::fprintf(stderr, "vantry: %s\n", reason.c_str());
    return report->refused.empty() ? cli::kSuccess : cli::kDataError;
}

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    const std::vector<cli::Command> commands = {
        {"register", kRegister, [](const cli::Parsed& p) { return registration(true, p); }},
        {"unregister", kUnregister, [](const cli::Parsed& p) { return registration(false, p); }},
        {"list", kList, list},
        {"show", kShow, show},
        {"watch", kWatch, watch},
        {"rebuild", kRebuild, rebuild},
        {"sync", kSync, syncDirectory},
    };
    std::vector<std::string> args(argv + 1, argv + argc);
    if (!args.empty() && args[0] == "--system") {
        systemOnly = true;
        args.erase(args.begin());
    }
    // The registry needs no daemon, so no runtime directory either (the package system runs it as
    // root, outside any session).
    return cli::runCommand(kTool, kUsage, commands, std::move(args), /*runtime=*/false);
}
