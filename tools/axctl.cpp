// axctl: talks to axd. `send` is the raw form (any message in the text notation); the other
// commands are friendly forms of the requests. See docs/axctl.md and docs/tools.md.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>
#include <vector>

#include "Annexa/AXMessage.h"
#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXPlugInRuntime.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Vantry.h"
#include "tools/AxctlBundle.h"
#include "tools/cli/Cli.h"

using annexa::AXDaemonClient;
using corvane::Value;
namespace cli = corvane::cli;

namespace {

constexpr const char* kTool = "axctl";

const cli::Syntax kSend{"[-S servicename] send [FILE]", {}, {}, 0, 1};
const cli::Syntax kAdd{"[-S servicename] add PATH...", {}, {}, 1};
const cli::Syntax kRemove{"[-S servicename] remove PATH...", {}, {}, 1};
const cli::Syntax kAnnotate{"[-S servicename] annotate [--election N] [--extension FILE.plist] UUID...", {},
                          {"--election", "--extension"}, 1};
const cli::Syntax kBulkAnnotate{"[-S servicename] bulk-annotate FILE.plist", {}, {}, 1, 1};
const cli::Syntax kMatch{"[-S servicename] match [-r KEY=PATTERN|KEY:=VALUE]... [--rules FILE.plist] [--all-versions] [--duplicates] "
                         "[--system-only] [--all] [--explain [--host APP-PATH]] [--json]",
                         {"--all-versions", "--duplicates", "--system-only", "--all", "--explain", "--json"},
                         {"-r", "--rules", "--host"},
                         0,
                         0};

const cli::Syntax kReady{"[-S servicename] ready [--json] UUID...", {"--json"}, {}, 1};
const cli::Syntax kAccess{"[-S servicename] access [--json] UUID...", {"--json"}, {}, 1};
const cli::Syntax kLock{"[-S servicename] lock --apps|--plugins [--json] PATH...", {"--apps", "--plugins", "--json"}, {}, 0};

// SIGINT and SIGTERM end the commands that stay connected (lock, run --keep) through a wait, so
// they are blocked before any thread starts.
void blockStopSignals() {
    sigset_t stops;
    sigemptyset(&stops);
    sigaddset(&stops, SIGINT);
    sigaddset(&stops, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stops, nullptr);
}
const cli::Syntax kUnlock{"[-S servicename] unlock TOKEN...", {}, {}, 1};
const cli::Syntax kWatch{"[-S servicename] watch [--json]", {"--json"}, {}, 0, 0};
const cli::Syntax kRun{"[-S servicename] run [--keep] UUID [MESSAGE]", {"--keep"}, {}, 1, 2};

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
    "  match [-r KEY=PATTERN|KEY:=VALUE]... [--rules FILE.plist] [--all-versions] [--duplicates]\n"
    "        [--system-only] [--all] [--explain [--host APP-PATH]] [--json]\n"
    "                                               the plug-ins that fit; --explain says why\n"
    "                                               each installed plug-in was left out (to\n"
    "                                               the application at APP-PATH with --host);\n"
    "                                               KEY=PATTERN is a string as written (an array\n"
    "                                               or dictionary in the notation is that value),\n"
    "                                               KEY:=VALUE a value in the notation (2u, true)\n"
    "  ready [--json] UUID...                       get plug-ins ready for this process\n"
    "  access [--json] UUID...                      read tokens for the plug-ins' bundles\n"
    "  lock --apps|--plugins [--json] PATH...       hold plug-ins (of applications, or themselves);\n"
    "                                               prints the hold's token and keeps the hold\n"
    "                                               until standard input ends\n"
    "  unlock TOKEN...                              release holds\n"
    "  run [--keep] UUID [MESSAGE]                  ready a plug-in, connect to it through spawnd,\n"
    "                                               send MESSAGE (default {}) and print the reply;\n"
    "                                               --keep stays connected until standard input ends\n"
    "  watch [--json]                               print plug-ins installed and uninstalled,\n"
    "                                               annotation changes and holds as they happen\n"
    "  bundle new --plugin|--app --identifier ID [--name NAME] [--extension-point POINT]\n"
    "             [--language c|python] DIR         write a bundle skeleton in DIR\n"
    "  bundle check PATH                            what the platform would say about a bundle:\n"
    "                                               Info.plist, signature, extension point,\n"
    "                                               sandbox profile, whether hosts find it\n"
    "The service name defaults to com.corvane.annexa.axd. COMMAND --help shows one command's usage.\n"
    "Exit status: 0 success, 1 the daemon refused (its error text on standard error), 64 usage,\n"
    "65 unreadable input, 69 daemon not reachable, 77 refused for lack of an entitlement.\n"
    "See docs/axctl.md.\n";

std::string absolute(const std::string& path) {
    if (!path.empty() && path[0] == '/') return path;
    char cwd[4096];
    if (!getcwd(cwd, sizeof cwd)) return path;
    return std::string(cwd) + "/" + path;
}

int unreachable(const corvane::rpx::Reply& reply, const std::string& service) {
    const char* unit = service == annexa::kDefaultServiceName ? "axd.socket" : nullptr;
    std::string why = reply.error == corvane::rpx::ErrorKind::ConnectionInvalid ? corvane::rpx::unreachableText(service, unit)
                                                                               : reply.description();
    return cli::fail(kTool, "cannot reach the daemon at " + service + ": " + why, cli::kUnavailable);
}

// Prints the daemon's answer and turns it into an exit status.
int finish(const corvane::rpx::Reply& reply, const std::string& service) {
    if (!reply.ok()) return unreachable(reply, service);
    corvane::Status status = AXDaemonClient::errorInReply(reply);
    if (status.ok()) return cli::kSuccess;
    const corvane::Error& error = status.error();
    int exit = error.code == annexa::errorCodeValue(annexa::AXErrorCode::NotEntitled) ? cli::kNoPermission
                                                                                     : cli::kFailure;
    std::string cause = error.cause ? ": " + *error.cause : std::string();
    return cli::fail(kTool, error.description() + cause + " (error " + std::to_string(error.code) + ")", exit);
}

int send(const std::string& service, const cli::Parsed& p) {
    std::string text;
    if (p.operands.empty() || p.operands[0] == "-") {
        text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    } else {
        auto bytes = corvane::plist::readWholeFile(p.operands[0]);
        if (!bytes) return cli::fail(kTool, bytes.error().description(), cli::kDataError);
        text = *bytes;
    }
    auto message = Value::parseReporting(text);
    if (!message) {
        return cli::fail(kTool, "the input is not one value in the text notation (docs/rpx-wire.md): " +
                                    message.error().description(),
                         cli::kDataError);
    }
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.send(*message, done); });
    if (!reply.ok()) return unreachable(reply, service);
    std::printf("%s\n", reply.value.description().c_str());
    return cli::kSuccess;
}

int addOrRemove(const std::string& service, bool add, const cli::Parsed& p) {
    std::vector<std::string> paths;
    for (const auto& a : p.operands) paths.push_back(absolute(a));
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) {
        if (add) {
            client.addPlugIns(paths, done);
        } else {
            client.removePlugIns(paths, done);
        }
    });
    // The reply's reason says why the registry refused.
    return finish(reply, service);
}

// The UUIDs of the texts; the first text that is no UUID, when there is one.
std::optional<std::string> readUuids(const std::vector<std::string>& texts, std::vector<corvane::UUID>& uuids) {
    for (const auto& text : texts) {
        auto uuid = corvane::UUID::parse(text);
        if (!uuid) return text;
        uuids.push_back(*uuid);
    }
    return std::nullopt;
}

int annotate(const std::string& service, const cli::Parsed& p) {
    annexa::Dictionary annotations;
    if (auto election = p.value("--election")) {
        char* end = nullptr;
        long long n = std::strtoll(election->c_str(), &end, 10);
        if (election->empty() || !end || *end) return cli::usageError(kTool, "--election needs an integer", kAnnotate.usage);
        annotations["election"] = Value(static_cast<int64_t>(n));
    }
    if (auto file = p.value("--extension")) {
        auto ext = corvane::plist::readFile(*file);
        if (!ext || !ext->isDictionary()) return cli::fail(kTool, *file + " is not a property-list dictionary", cli::kDataError);
        annotations["extension"] = *ext;
    }
    std::vector<corvane::UUID> uuids;
    if (auto bad = readUuids(p.operands, uuids)) return cli::usageError(kTool, "not a UUID: " + *bad, kAnnotate.usage);
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.setPlugInAnnotations(uuids, Value(annotations), done); });
    return finish(reply, service);
}

int bulkAnnotate(const std::string& service, const cli::Parsed& p) {
    auto table = corvane::plist::readFile(p.operands[0]);
    if (!table || !table->isDictionary())
        return cli::fail(kTool, p.operands[0] + " is not a property-list dictionary", cli::kDataError);
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.bulkSetPlugInAnnotations(*table, done); });
    return finish(reply, service);
}

// One line per plug-in: UUID, identifier, version, path.
void printForms(const Value& matches) {
    const corvane::Array* forms = matches.asArray();
    if (!forms) return;
    for (const Value& f : *forms) {
        const Value& version = f["version"];
        std::printf("%s  %s  %s  %s\n", f["uuid"].asString() ? f["uuid"].asString()->c_str() : "-",
                    f["identifier"].asString() ? f["identifier"].asString()->c_str() : "-",
                    version.isString() ? version.asString()->c_str() : version.description().c_str(),
                    f["path"].asString() ? f["path"].asString()->c_str() : "-");
    }
}

int match(const std::string& service, const cli::Parsed& p) {
    annexa::Dictionary rules;
    if (auto file = p.value("--rules")) {
        auto read = corvane::plist::readFile(*file);
        if (!read || !read->isDictionary()) return cli::fail(kTool, *file + " is not a property-list dictionary", cli::kDataError);
        rules = *read->asDictionary();
    }
    if (p.has("-r")) {
        for (const auto& rule : p.options.at("-r")) {
            size_t eq = rule.find('=');
            bool notation = eq != std::string::npos && eq > 0 && rule[eq - 1] == ':';
            size_t keyEnd = notation ? eq - 1 : eq;
            if (eq == std::string::npos || keyEnd == 0)
                return cli::usageError(kTool, "-r needs KEY=PATTERN or KEY:=VALUE: " + rule, kMatch.usage);
            std::string text = rule.substr(eq + 1);
            if (notation) {
                // KEY:=VALUE: any value, as the text notation writes it (2, 2u, true, "2").
                auto value = Value::parseReporting(text);
                if (!value) return cli::fail(kTool, "-r " + rule + ": " + value.error().description(), cli::kDataError);
                rules[rule.substr(0, keyEnd)] = *value;
                continue;
            }
            // KEY=PATTERN is the pattern as written, a string ("2" and "1" too), unless it is an
            // array or a dictionary in the text notation (["a", ">2"], {"items": [...]}), which no
            // one means as a string.
            auto value = Value::parse(text);
            bool structured = value && (value->isArray() || value->isDictionary());
            rules[rule.substr(0, keyEnd)] = structured ? *value : Value(text);
        }
    }
    uint64_t flags = 0;
    if (p.has("--all-versions")) flags |= annexa::discovery::kAllVersions;
    if (p.has("--duplicates")) flags |= annexa::discovery::kDuplicates;
    if (p.has("--system-only")) flags |= annexa::discovery::kSystemOnly;
    if (p.has("--all")) flags |= annexa::discovery::kAll;
    if (p.has("--explain")) flags |= annexa::discovery::kExplain;
    auto host = p.value("--host");
    if (host && !p.has("--explain")) return cli::usageError(kTool, "--host explains: give --explain too", kMatch.usage);
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) {
        if (!host) return client.matchPlugIns(rules.empty() ? Value() : Value(rules), flags, done);
        annexa::Dictionary m = client.request(annexa::request::kMatch);
        m[annexa::message::kRules] = annexa::convertValueToMessage(rules.empty() ? Value() : Value(rules));
        m[annexa::message::kFlags] = Value(flags);
        m[annexa::message::kHost] = Value(absolute(*host));
        client.send(Value(std::move(m)), done);
    });
    if (int status = finish(reply, service); status != cli::kSuccess) return status;
    const Value& matches = reply.value[annexa::message::kMatches];
    if (p.has("--json")) {
        std::printf("%s\n", (p.has("--explain") ? reply.value : matches).json().c_str());
        return cli::kSuccess;
    }
    if (p.has("--explain")) {
        if (const corvane::Array* explained = reply.value["explanations"].asArray())
            for (const Value& e : *explained)
                std::printf("%s  %s  %s\n", e["uuid"].asString()->c_str(), e["identifier"].asString()->c_str(),
                            e["outcome"].asString()->c_str());
        return cli::kSuccess;
    }
    printForms(matches);
    return cli::kSuccess;
}

int ready(const std::string& service, const cli::Parsed& p) {
    std::vector<corvane::UUID> uuids;
    if (auto bad = readUuids(p.operands, uuids)) return cli::usageError(kTool, "not a UUID: " + *bad, kReady.usage);
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.readyPlugIns(uuids, 0, done); });
    if (p.has("--json") && reply.ok()) std::printf("%s\n", reply.value.json().c_str());
    return finish(reply, service);
}

int access(const std::string& service, const cli::Parsed& p) {
    std::vector<corvane::UUID> uuids;
    if (auto bad = readUuids(p.operands, uuids)) return cli::usageError(kTool, "not a UUID: " + *bad, kAccess.usage);
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.accessPlugIns(uuids, 0, done); });
    if (int status = finish(reply, service); status != cli::kSuccess) return status;
    const Value& tokens = reply.value[annexa::message::kExtensions];
    if (p.has("--json")) {
        std::printf("%s\n", tokens.json().c_str());
    } else if (const corvane::Array* list = tokens.asArray()) {
        for (const Value& token : *list) std::printf("%s\n", token.asString() ? token.asString()->c_str() : "");
    }
    return cli::kSuccess;
}

// Waits until standard input ends (when asked), a stop signal comes, or `ended` (when a descriptor)
// becomes readable, which is reported with `endedText`; the exit status says which.
int keepConnected(bool untilInputEnds, int ended, const char* endedText) {
    sigset_t stops;
    sigemptyset(&stops);
    sigaddset(&stops, SIGINT);
    sigaddset(&stops, SIGTERM);
    int signals = signalfd(-1, &stops, SFD_CLOEXEC);
    pollfd watched[3] = {{untilInputEnds ? 0 : -1, POLLIN, 0}, {signals, POLLIN, 0}, {ended, POLLIN, 0}};
    for (;;) {
        if (::poll(watched, 3, -1) < 0 && errno != EINTR) return cli::kFailure;
        if (watched[2].revents) return cli::fail(kTool, endedText, cli::kUnavailable);
        if (watched[1].revents) return cli::kSuccess;
        if (watched[0].revents) {
            char buffer[256];
            if (::read(0, buffer, sizeof buffer) <= 0) return cli::kSuccess;
        }
    }
}

int lock(const std::string& service, const cli::Parsed& p) {
    if (p.has("--apps") == p.has("--plugins")) return cli::usageError(kTool, "give one of --apps and --plugins", kLock.usage);
    std::vector<std::string> paths;
    for (const auto& path : p.operands) paths.push_back(absolute(path));
    uint64_t flags = p.has("--apps") ? 1 : 2;
    blockStopSignals();
    AXDaemonClient client(service);
    auto reply = client.wait([&](auto done) { client.holdPlugIns(paths, flags, done); });
    if (p.has("--json")) {
        std::printf("%s\n", reply.value.json().c_str());
    } else if (const corvane::Array* conflicts = reply.value[annexa::message::kConflicts].asArray()) {
        for (const Value& conflict : *conflicts) std::printf("busy: %s\n", conflict.description().c_str());
    }
    if (int status = finish(reply, service); status != cli::kSuccess) return status;
    const corvane::UUID* token = reply.value[annexa::message::kUuids].asUUID();
    if (!p.has("--json")) std::printf("%s\n", token ? token->string().c_str() : "");
    std::fflush(stdout);
    // A hold lasts as long as its client's connection: keep it until told to let go.
    return keepConnected(true, -1, "");
}

int unlock(const std::string& service, const cli::Parsed& p) {
    std::vector<corvane::UUID> tokens;
    if (auto bad = readUuids(p.operands, tokens)) return cli::usageError(kTool, "not a UUID: " + *bad, kUnlock.usage);
    AXDaemonClient client(service);
    for (const corvane::UUID& token : tokens) {
        if (int status = finish(client.wait([&](auto done) { client.releaseHold(token, done); }), service)) return status;
    }
    return cli::kSuccess;
}

int run(const std::string& service, const cli::Parsed& p) {
    auto uuid = corvane::UUID::parse(p.operands[0]);
    if (!uuid) return cli::usageError(kTool, "not a UUID: " + p.operands[0], kRun.usage);
    Value message{annexa::Dictionary{}};
    if (p.operands.size() > 1) {
        auto parsed = Value::parseReporting(p.operands[1]);
        if (!parsed) return cli::fail(kTool, "MESSAGE " + parsed.error().description(), cli::kDataError);
        message = *parsed;
    }
    if (p.has("--keep")) blockStopSignals();
    auto registry = corvane::vantry::Registry::openDefault();
    auto record = registry ? (*registry)->plugInForUUID(*uuid) : nullptr;
    if (!record) return cli::fail(kTool, "no plug-in with the UUID " + uuid->string(), cli::kDataError);
    AXDaemonClient client(service);
    if (int status = finish(client.wait([&](auto done) { client.readyPlugIns({*uuid}, 0, done); }), service)) return status;

    int ended[2];
    if (::pipe2(ended, O_CLOEXEC) != 0) return cli::fail(kTool, "pipe: " + std::string(std::strerror(errno)));
    int endedWrite = ended[1];
    auto connection = annexa::connectToPlugIn(record->bundleIdentifier(), corvane::dispatch::Queue::create("axctl.run"),
                                              [endedWrite](const corvane::rpx::Event& ev) {
        if (ev.isError()) {
            [[maybe_unused]] ssize_t n = ::write(endedWrite, "x", 1);
        }
    });
    if (!connection) return cli::fail(kTool, "cannot connect to the plug-in: " + connection.error().description(), cli::kUnavailable);
    corvane::rpx::Reply reply = (*connection)->sendWithReplySync(message);
    if (!reply.ok()) return cli::fail(kTool, "the plug-in's connection ended before it replied", cli::kUnavailable);
    std::printf("%s\n", reply.value.description().c_str());
    std::fflush(stdout);
    if (!p.has("--keep")) return cli::kSuccess;
    return keepConnected(true, ended[0], "the plug-in's connection ended");
}

// One line per event: what happened, then the plug-in(s).
std::string describeEvent(const Value& event) {
    auto plugIn = [](const Value& p) {
        auto text = [](const Value& v) { return v.asString() ? *v.asString() : v.description(); };
        const corvane::UUID* uuid = p["uuid"].asUUID();
        return text(p["identifier"]) + " " + text(p["version"]) + " " + (uuid ? uuid->string() : "") + " " +
               text(p["path"]);
    };
    const std::string* kind = event["event"].asString();
    std::string what = kind ? *kind : "?";
    if (what == "installed" || what == "uninstalled") return what + " " + plugIn(event["plugin"]);
    if (what == "annotation") {
        return what + " " + plugIn(event["plugin"]) + ": " + event["old"].description() + " -> " + event["new"].description();
    }
    std::string line = what + " " + event["hold"].description() + " by pid " + event["pid"].description();
    if (const corvane::Array* plugIns = event["plugins"].asArray()) {
        for (const Value& p : *plugIns) line += "\n    " + plugIn(p);
    }
    return line;
}

int watch(const std::string& service, const cli::Parsed& p) {
    blockStopSignals();
    bool json = p.has("--json");
    int ended[2];
    if (::pipe2(ended, O_CLOEXEC) != 0) return cli::fail(kTool, "pipe: " + std::string(std::strerror(errno)));
    int endedWrite = ended[1];
    auto connection = corvane::rpx::Connection::connect(service, corvane::dispatch::Queue::create("axctl.watch"));
    connection->setEventHandler([json, endedWrite](const corvane::rpx::Event& ev) {
        if (ev.isError()) {
            [[maybe_unused]] ssize_t n = ::write(endedWrite, "x", 1);
            return;
        }
        std::string line = json ? ev.message.json() : describeEvent(ev.message);
        std::printf("%s\n", line.c_str());
        std::fflush(stdout);
    });
    connection->resume();
    Value request(annexa::Dictionary{{annexa::message::kRequest, Value(annexa::request::kWatch)},
                                     {annexa::message::kVersion, Value(annexa::kCurrentProtocolVersion)}});
    if (int status = finish(connection->sendWithReplySync(request), service)) return status;
    // Until interrupted; the daemon's going away ends the watch with 69.
    return keepConnected(false, ended[0], "the daemon ended the watch");
}

}  // namespace

int main(int argc, char** argv) {
    corvane::log::setStandardErrorFallback(true);
    std::vector<std::string> args(argv + 1, argv + argc);
    std::string service = annexa::kDefaultServiceName;
    if (!args.empty() && args[0] == "-S") {
        if (args.size() < 2) return cli::usageError(kTool, "option -S needs a value", "[-S servicename] COMMAND [ARGS]");
        service = args[1];
        args.erase(args.begin(), args.begin() + 2);
    }
    auto with = [&service](int (*run)(const std::string&, const cli::Parsed&)) {
        return [&service, run](const cli::Parsed& p) { return run(service, p); };
    };
    const std::vector<cli::Command> commands = {
        {"send", kSend, with(send)},
        {"add", kAdd, [&](const cli::Parsed& p) { return addOrRemove(service, true, p); }},
        {"remove", kRemove, [&](const cli::Parsed& p) { return addOrRemove(service, false, p); }},
        {"annotate", kAnnotate, with(annotate)},
        {"bulk-annotate", kBulkAnnotate, with(bulkAnnotate)},
        {"match", kMatch, with(match)},
        {"ready", kReady, with(ready)},
        {"access", kAccess, with(access)},
        {"lock", kLock, with(lock)},
        {"unlock", kUnlock, with(unlock)},
        {"run", kRun, with(run)},
        {"watch", kWatch, with(watch)},
        {"bundle", axctl::kBundle, with(axctl::bundle)},
    };
    return cli::runCommand(kTool, kHelp, commands, std::move(args));
}
