// axctl: talks to axd. `send` is the raw form (any message in the text notation); the other
// commands are friendly forms of the requests. See docs/axctl.md.
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <iostream>
#include <iterator>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "platform/plist/Plist.h"

using annexa::AXDaemonClient;
using corvane::Value;

namespace {

constexpr int kUsage = 64;
constexpr int kDataError = 65;
constexpr int kUnavailable = 69;

const char* kHelp =
    "usage: axctl [-S servicename] COMMAND [ARGS]\n"
    "  send [FILE]                                  send one message written in the text notation\n"
    "                                               (FILE or standard input); print the reply\n"
    "  add PATH...                                  register plug-in bundles\n"
    "  remove PATH...                               unregister them (needs the manager entitlement)\n"
    "  annotate [--election N] [--extension FILE.plist] UUID...\n"
    "                                               set the user's choices about plug-ins\n"
    "  bulk-annotate FILE.plist                     set each plug-in's extension dictionary:\n"
    "                                               FILE.plist maps UUID texts to dictionaries\n"
    "The service name defaults to com.corvane.annexa.axd. Exit status: 0 success, 1 the daemon\n"
    "refused (its error text on standard error), 64 usage, 65 unreadable input, 69 daemon not\n"
    "reachable. See docs/axctl.md.\n";

int usageError(const std::string& text) {
    std::fprintf(stderr, "axctl: %s\n%s", text.c_str(), kHelp);
    return kUsage;
}

std::string absolute(const std::string& path) {
    if (!path.empty() && path[0] == '/') return path;
    char cwd[4096];
    if (!getcwd(cwd, sizeof cwd)) return path;
    return std::string(cwd) + "/" + path;
}

// Prints the daemon's answer and turns it into an exit status.
int finish(const corvane::rpx::Reply& reply, const std::string& service) {
    if (!reply.ok()) {
        std::fprintf(stderr, "axctl: cannot reach the daemon at %s: %s\n", service.c_str(), reply.description().c_str());
        return kUnavailable;
    }
    corvane::Status status = AXDaemonClient::errorInReply(reply);
    if (!status.ok()) {
        std::fprintf(stderr, "axctl: %s (error %lld)\n", status.error().description().c_str(),
                     static_cast<long long>(status.error().code));
        return 1;
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string> args(argv + 1, argv + argc);
    std::string service = annexa::kDefaultServiceName;
    if (args.size() >= 2 && args[0] == "-S") {
        service = args[1];
        args.erase(args.begin(), args.begin() + 2);
    }
    if (args.empty()) return usageError("no command");
    for (const auto& a : args) {
        if (a == "--help" || a == "-h") {
            std::fputs(kHelp, stdout);
            return 0;
        }
    }
    std::string command = args[0];
    args.erase(args.begin());

    if (command == "send") {
        if (args.size() > 1) return usageError("send takes at most one FILE");
        std::string text;
        if (args.empty() || args[0] == "-") {
            text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
        } else {
            auto bytes = corvane::plist::readWholeFile(args[0]);
            if (!bytes) {
                std::fprintf(stderr, "axctl: %s\n", bytes.error().description().c_str());
                return kDataError;
            }
            text = *bytes;
        }
        auto message = Value::parse(text);
        if (!message) {
            std::fprintf(stderr, "axctl: the input is not one value in the text notation (docs/rpx-wire.md)\n");
            return kDataError;
        }
        AXDaemonClient client(service);
        auto reply = client.wait([&](auto done) { client.send(*message, done); });
        if (!reply.ok()) {
            std::fprintf(stderr, "axctl: cannot reach the daemon at %s: %s\n", service.c_str(),
                         reply.description().c_str());
            return kUnavailable;
        }
        std::printf("%s\n", reply.value.description().c_str());
        return 0;
    }
    if (command == "add" || command == "remove") {
        if (args.empty()) return usageError(command + " needs at least one PATH");
        std::vector<std::string> paths;
        for (const auto& a : args) paths.push_back(absolute(a));
        AXDaemonClient client(service);
        auto reply = client.wait([&](auto done) {
            if (command == "add") {
                client.addPlugIns(paths, done);
            } else {
                client.removePlugIns(paths, done);
            }
        });
        return finish(reply, service);
    }
    if (command == "annotate") {
        annexa::Dictionary annotations;
        std::vector<corvane::UUID> uuids;
        for (size_t i = 0; i < args.size(); ++i) {
            if (args[i] == "--election" && i + 1 < args.size()) {
                char* end = nullptr;
                long long n = std::strtoll(args[++i].c_str(), &end, 10);
                if (!end || *end) return usageError("--election needs an integer");
                annotations["election"] = Value(static_cast<int64_t>(n));
            } else if (args[i] == "--extension" && i + 1 < args.size()) {
                auto ext = corvane::plist::readFile(args[++i]);
                if (!ext || !ext->isDictionary()) {
                    std::fprintf(stderr, "axctl: %s is not a property-list dictionary\n", args[i].c_str());
                    return kDataError;
                }
                annotations["extension"] = *ext;
            } else if (auto uuid = corvane::UUID::parse(args[i])) {
                uuids.push_back(*uuid);
            } else {
                return usageError("not a UUID: " + args[i]);
            }
        }
        if (uuids.empty()) return usageError("annotate needs at least one UUID");
        AXDaemonClient client(service);
        auto reply =
            client.wait([&](auto done) { client.setPlugInAnnotations(uuids, Value(annotations), done); });
        return finish(reply, service);
    }
    if (command == "bulk-annotate") {
        if (args.size() != 1) return usageError("bulk-annotate needs one FILE.plist");
        auto table = corvane::plist::readFile(args[0]);
        if (!table || !table->isDictionary()) {
            std::fprintf(stderr, "axctl: %s is not a property-list dictionary\n", args[0].c_str());
            return kDataError;
        }
        AXDaemonClient client(service);
        auto reply = client.wait([&](auto done) { client.bulkSetPlugInAnnotations(*table, done); });
        return finish(reply, service);
    }
    return usageError("unknown command " + command);
}
