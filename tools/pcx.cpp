// pcx: the user's privacy-consent records: which platform services an application may use.
// See docs/pcx.md and docs/tools.md.
#include <cstdio>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "platform/pcx/Pcx.h"
#include "tools/cli/Cli.h"

using namespace corvane;

namespace {

constexpr const char* kTool = "pcx";
constexpr const char* kUsage =
    "usage: pcx grant APP-PATH SERVICE\n"
    "       pcx revoke APP-PATH SERVICE\n"
    "       pcx list [--json] [APP-PATH]\n"
    "Services: com.corvane.pcx.keyboard-network (a keyboard's network access), or any other.\n";

const cli::Syntax kGrant{"grant APP-PATH SERVICE", {}, {}, 2, 2};
const cli::Syntax kRevoke{"revoke APP-PATH SERVICE", {}, {}, 2, 2};
const cli::Syntax kList{"list [--json] [APP-PATH]", {"--json"}, {}, 0, 1};

int change(const cli::Parsed& parsed, bool granted) {
    auto changed = pcx::setConsent(parsed.operands[0], parsed.operands[1], granted);
    if (!changed.ok()) return cli::fail(kTool, changed.error().description(), cli::kDataError);
    std::printf("%s %s %s\n", granted ? "granted" : "revoked", parsed.operands[1].c_str(), parsed.operands[0].c_str());
    return cli::kSuccess;
}

int list(const cli::Parsed& parsed) {
    Dictionary shown;
    if (parsed.operands.empty()) {
        auto all = pcx::allRecords();
        if (!all) return cli::fail(kTool, all.error().description(), cli::kDataError);
        shown = *all->asDictionary();
    } else {
        auto identifier = pcx::bundleIdentifierAt(parsed.operands[0]);
        if (!identifier) return cli::fail(kTool, identifier.error().description(), cli::kDataError);
        auto records = pcx::recordsForBundle(parsed.operands[0]);
        if (!records) return cli::fail(kTool, records.error().description(), cli::kDataError);
        Dictionary services;
        for (const pcx::Record& record : *records) services[record.service] = Value(record.granted);
        shown[*identifier] = Value(std::move(services));
    }
    if (parsed.has("--json")) {
        std::printf("%s\n", Value(shown).json().c_str());
        return cli::kSuccess;
    }
    for (const auto& [application, services] : shown) {
        for (const auto& [service, granted] : *services.asDictionary()) {
            std::printf("%s\t%s\t%s\n", application.c_str(), service.c_str(), granted.isTrue() ? "granted" : "revoked");
        }
    }
    return cli::kSuccess;
}

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    const std::vector<cli::Command> commands = {
        {"grant", kGrant, [](const cli::Parsed& p) { return change(p, true); }},
        {"revoke", kRevoke, [](const cli::Parsed& p) { return change(p, false); }},
        {"list", kList, list},
    };
    return cli::runCommand(kTool, kUsage, commands, std::vector<std::string>(argv + 1, argv + argc));
}
