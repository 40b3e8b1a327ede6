// Activation end to end: a signed axd and spawnd on a private root, an application whose plug-ins
// are the sample executable, and hosts that are real processes (axctl, or this test).
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "Annexa/AXDaemonClient.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/pcx/Pcx.h"
#include "platform/rpx/Rpx.h"
#include "platform/spawn/Spawn.h"
#include "platform/vantry/Vantry.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

const std::map<std::string, std::string> kDebugLog = {
    {"CORVANE_LOG", "debug"}, {"CORVANE_LOG_SINK", "stderr"}, {"CORVANE_LOG_PRIVATE", "1"}};

Value plugIn(const std::string& point, Dictionary attributes = {}) {
    attributes["KSExtensionVersion"] = Value("1");
    return dict({{"KSExtensionPointIdentifier", point}, {"KSExtensionAttributes", Value(std::move(attributes))}});
}


// The platform: spawnd, axd signed with the entitlements it needs (unless told otherwise) and a
// registered application with plug-ins of several extension points.
struct Platform {
    axtest::PlatformRoot root;
    codesign::KeyPair key = codesign::generateKey();
    std::unique_ptr<axtest::Process> spawnd;
    std::unique_ptr<axtest::Process> axd;
    std::string app;
    std::map<std::string, UUID> uuids;  // by bundle identifier

    explicit Platform(bool entitledDaemon = true) {
        EXPECT_TRUE(codesign::writeKeyPair(root / "key", key).ok());
        EXPECT_TRUE(codesign::trustKey(root / "key.pub").ok());
        startSpawnd();
        fs::create_directories(root / "bin");
        std::string daemon = root / "bin/axd";
        fs::copy_file(axtest::binary("axd"), daemon);
        if (entitledDaemon) {
            EXPECT_TRUE(codesign::sign(daemon, key, std::nullopt,
                                       dict({{spawn::kDomainExtensionProxyEntitlement, true},
                                             {pcx::kManagerEntitlement, true}})).ok());
        }
        auto environment = kDebugLog;
        environment["AXTEST_SDK"] = "sdk-under-test";
        axd = std::make_unique<axtest::Process>(std::vector<std::string>{daemon}, environment);
        EXPECT_TRUE(axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath("com.corvane.annexa.axd")); }));

        std::string sample = axtest::binary("../samples/bin/ax_sample");
        fs::create_directories(root / "apps");
        app = axtest::makeBundle(root / "apps", "Sampler.app", axtest::appInfo("com.example.sampler", "Sampler"), sample);
        axtest::writeFile(app + "/Receipt", std::string("receipt\0bytes", 13));
        struct Made {
            const char* identifier;
            Value plugin;
        } made[] = {
            {"com.example.greeter", plugIn("com.example.greeting")},
            {"com.example.keys", plugIn("com.corvane.keyboard-service", {{"RequestsOpenAccess", Value(true)}})},
            {"com.example.filter", plugIn("com.corvane.netshield.filter-data")},
            {"com.example.preview", plugIn("com.corvane.glancer.extension.preview")},
        };
        for (const Made& m : made) {
            Value info = axtest::plugInInfo(m.identifier, m.plugin, "Sample");
            Dictionary withService = *info.asDictionary();
            // The plug-in's own variables; those that name its container are not its to set.
            withService["RPXService"] = dict({{"EnvironmentVariables", dict({{"GREETING", "hello"},
                                                                             {"HOME", Value(root.path())},
                                                                             {"TMPDIR", "/tmp"},
                                                                             {"XDG_DATA_HOME", Value(root.path())}})},
                                              {"JoinExistingSession", true}});
            axtest::makeBundle(app + "/PlugIns", std::string(m.identifier) + ".appex", Value(std::move(withService)), sample);
        }
        auto added = axctl({"add", app});
        EXPECT_EQ(added.status, 0) << added.err;
        auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
        for (const Made& m : made) {
            auto record = (*registry)->plugInForPath(app + "/PlugIns/" + m.identifier + ".appex");
            EXPECT_TRUE(record) << m.identifier;
            if (record) uuids[m.identifier] = record->uuid();
        }
    }
    ~Platform() {
        axd->signal(SIGTERM);
        axd->wait(5s);
        if (spawnd) {
            spawnd->signal(SIGTERM);
            spawnd->wait(5s);
        }
    }

    void startSpawnd() {
        std::vector<std::string> args{axtest::binary("spawnd"), "--grace-ms", "300"};
        for (const auto& o : axtest::spawndOptions()) args.push_back(o);
        spawnd = std::make_unique<axtest::Process>(args, kDebugLog);
        EXPECT_TRUE(axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath(spawn::kEndpoint)); }));
    }

    axtest::RunResult axctl(std::vector<std::string> args, const std::string& program = "") {
        args.insert(args.begin(), program.empty() ? axtest::binary("axctl") : program);
        return axtest::run(args);
    }
    // Runs the plug-in through axctl run and reads the reply.
    Value run(const std::string& identifier, const Value& message = Value(Dictionary{})) {
        auto ran = axctl({"run", uuids.at(identifier).string(), message.description()});
        EXPECT_EQ(ran.status, 0) << identifier << ": " << ran.err;
        auto reply = Value::parse(ran.out.substr(0, ran.out.find_last_not_of('\n') + 1));
        return reply ? *reply : Value();
    }
    std::string plugInPath(const std::string& identifier) const { return app + "/PlugIns/" + identifier + ".appex"; }
};

Value request(const char* name, Dictionary extra = {}) {
    extra["request"] = Value(name);
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

}  // namespace

TEST(Activation, AHostRunsAPlugInUnderTheProfileOfItsExtensionPoint) {
    Platform p;
    Value inside = p.run("com.example.greeter", dict({{"do", "environment"}}));
    const Value& environment = inside["environment"];
    // The data container, the daemon's test SDK and the plug-in's own variables, but for those that
    // name its container: those are the platform's.
    const std::string* home = environment["HOME"].asString();
    ASSERT_TRUE(home) << inside.description();
    EXPECT_EQ(*home, layout::userDataDir() + "/containers/4/com.example.greeter");
    EXPECT_EQ(environment["KFFIXED_USER_HOME"], Value(*home));
    EXPECT_EQ(environment["TMPDIR"], Value(*home + "/tmp"));
    EXPECT_EQ(environment["XDG_DATA_HOME"], Value(*home + "/.local/share"));
    EXPECT_EQ(environment["AXTEST_SDK"], Value("sdk-under-test"));
    EXPECT_EQ(environment["GREETING"], Value("hello"));
    EXPECT_EQ(inside["directory"], Value(*home));

    // The overlay exactly as spawnd received it.
    std::string uuid = p.uuids.at("com.example.greeter").string();
    Value expected = dict({{"RPXService", dict({{"EnvironmentVariables",
                                                 dict({{"AXTEST_SDK", "sdk-under-test"}, {"GREETING", "hello"}, {"HOME", *home},
                                                       {"KFFIXED_USER_HOME", *home}, {"TMPDIR", *home + "/tmp"}})},
                                                {"JoinExistingSession", true},
                                                {"_DataContainer", "com.example.greeter"},
                                                {"_OmitSandboxParameters", true},
                                                {"_SandboxProfile", "plugin"}})},
                           {"KFBundlePackageType", "RPX!"}});
    EXPECT_TRUE(p.spawnd->waitForErr("overlay of com.example.greeter for host ")) << p.spawnd->err();
    EXPECT_NE(p.spawnd->err().find(expected.description()), std::string::npos) << expected.description() << "\n" << p.spawnd->err();
    EXPECT_TRUE(p.axd->waitForErr("assigning plug-in com.example.greeter(1) " + uuid + " to plugin sandbox")) << p.axd->err();

    // What each profile lets the plug-in do; the keyboard's network depends on the user's consent.
    struct Row {
        const char* identifier;
        const char* profile;
        int64_t inetErrno;
    } rows[] = {
        {"com.example.keys", "keyboard", EAFNOSUPPORT},
        {"com.example.filter", "network-filter", 0},
        {"com.example.preview", "glancerd", EAFNOSUPPORT},
    };
    for (const Row& row : rows) {
        EXPECT_EQ(p.run(row.identifier, dict({{"do", "inet"}}))["errno"], Value(row.inetErrno)) << row.identifier;
        EXPECT_TRUE(p.axd->waitForErr(std::string("assigning plug-in ") + row.identifier + "(1) " +
                                      p.uuids.at(row.identifier).string() + " to " + row.profile + " sandbox"))
            << row.identifier;
    }
    EXPECT_EQ(axtest::run({axtest::binary("pcx"), "grant", p.app, pcx::kKeyboardNetworkService}).status, 0);
    EXPECT_EQ(p.run("com.example.keys", dict({{"do", "inet"}}))["errno"], Value(int64_t{0}));
    EXPECT_TRUE(p.axd->waitForErr("assigning plug-in com.example.keys(1) " + p.uuids.at("com.example.keys").string() +
                                  " to plugin sandbox"));
}

TEST(Activation, HoldsBlockReadyAndMatchUntilReleasedAndBusyPlugInsRefuseApplicationHolds) {
    Platform p;
    annexa::AXDaemonClient host;
    auto send = [&](const Value& message) { return host.wait([&](auto done) { host.send(message, done); }).value; };
    UUID greeter = p.uuids.at("com.example.greeter");
    auto ready = [&] { return send(request("ready", {{"uuids", Value(Array{Value(greeter)})}})); };
    auto matched = [&] {
        Value reply = send(request("match", {{"rules", dict({{"KSExtensionIdentifier", "com.example.greeter"}})}}));
        return reply["matches"].asArray() ? reply["matches"].asArray()->size() : 0u;
    };
    ASSERT_EQ(ready(), dict({}));
    ASSERT_EQ(matched(), 1u);

    // A hold by plug-in path, from another client; ready refuses and match leaves it out.
    annexa::AXDaemonClient holder;
    auto held = holder.wait([&](auto done) { holder.holdPlugIns({p.plugInPath("com.example.greeter")}, 2, done); });
    const UUID* token = held.value["uuids"].asUUID();
    ASSERT_TRUE(token) << held.value.description();
    EXPECT_EQ(ready(), dict({{"errorcode", uint64_t{11}},
                             {"error", "access to plugin com.example.greeter denied: the plug-in is on hold"}}));
    EXPECT_EQ(matched(), 0u);
    // Anyone may release a hold by its token; twice is no error.
    EXPECT_EQ(send(request("lock", {{"uuids", Value(Array{Value(*token), Value(*token), Value("not a uuid")})}})), dict({}));
    EXPECT_EQ(ready(), dict({}));
    EXPECT_EQ(matched(), 1u);

    struct Refusal {
        const char* what;
        Value request;
        Value reply;
    } refusals[] = {
        {"unsupported flags", request("lock", {{"paths", Value(Array{Value(p.app)})}, {"flags", uint64_t{3}}}),
         dict({{"errorcode", uint64_t{4}}, {"error", "invalid request format (unsupported hold flags)"}})},
        {"no plug-in there", request("lock", {{"paths", Value(Array{Value(p.app)})}, {"flags", uint64_t{2}}}),
         dict({{"errorcode", uint64_t{9}}, {"error", "no plug-in at path:" + p.app}})},
        {"a path that does not resolve", request("lock", {{"paths", Value(Array{Value("/no/such")})}, {"flags", uint64_t{1}}}),
         dict({{"errorcode", uint64_t{9}}, {"error", "invalid path: /no/such"}})},
        {"receipt from a host that is no plug-in", request("receipt"),
         dict({{"errorcode", uint64_t{2}}, {"error", "caller is not a known plug-in"}})},
    };
    for (const Refusal& r : refusals) EXPECT_EQ(send(r.request), r.reply) << r.what;

    // A plug-in that is busy makes a hold on its application fail, naming it.
    axtest::Process busy({axtest::binary("axctl"), "run", "--keep", greeter.string(),
                          dict({{"do", "busy"}, {"reason", "saving"}}).description()},
                         {}, axtest::Process::Input::OpenPipe);
    ASSERT_TRUE(busy.waitForOut("assertion")) << busy.err();
    Value refused = send(request("lock", {{"paths", Value(Array{Value(p.app)})}, {"flags", uint64_t{1}}}));
    EXPECT_EQ(refused, dict({{"errorcode", uint64_t{14}}, {"error", "plug-ins are busy"},
                             {"conflicts", Value(Array{dict({{"bundleIdentifier", "com.example.greeter"}})})}}))
        << refused.description();
    // A hold lasts as long as its client: axctl lock keeps it until its input ends.
    axtest::Process locker({axtest::binary("axctl"), "lock", "--plugins", p.plugInPath("com.example.filter")}, {},
                           axtest::Process::Input::OpenPipe);
    ASSERT_TRUE(locker.waitForOut("-")) << locker.err();
    UUID filter = p.uuids.at("com.example.filter");
    auto readyFilter = [&] { return send(request("ready", {{"uuids", Value(Array{Value(filter)})}})); };
    EXPECT_EQ(readyFilter()["errorcode"], Value(uint64_t{11}));
    locker.closeInput();
    EXPECT_EQ(locker.wait(5s), 0);
    EXPECT_TRUE(axtest::eventually([&] { return readyFilter() == dict({}); }));
    // Holding the plug-in itself asks nobody whether it is busy.
    Value granted = send(request("lock", {{"paths", Value(Array{Value(p.plugInPath("com.example.greeter"))})}, {"flags", uint64_t{2}}}));
    EXPECT_TRUE(granted["uuids"].isUUID()) << granted.description();
}

TEST(Activation, UninstallingAnApplicationEndsItsRunningPlugIn) {
    Platform p;
    axtest::Process host({axtest::binary("axctl"), "run", "--keep", p.uuids.at("com.example.greeter").string()}, {},
                         axtest::Process::Input::OpenPipe);
    ASSERT_TRUE(host.waitForOut("pid")) << host.err();
    auto reply = Value::parse(host.out().substr(0, host.out().find('\n')));
    ASSERT_TRUE(reply);
    pid_t instance = static_cast<pid_t>((*reply)["pid"].int64Value().value_or(0));
    ASSERT_GT(instance, 0);
    EXPECT_TRUE((*reply)["sandboxed"].isTrue());

    // The receipt, asked by the running plug-in itself.
    EXPECT_EQ(p.run("com.example.greeter", dict({{"do", "receipt"}})), dict({{"data", Value::data("receipt\0bytes", 13)}}));

    std::string manager = p.root / "bin/manager";
    fs::copy_file(axtest::binary("axctl"), manager);
    ASSERT_TRUE(codesign::sign(manager, p.key, std::nullopt, dict({{"com.corvane.private.annexa.manager", true}})).ok());
    auto removed = p.axctl({"remove", p.app}, manager);
    ASSERT_EQ(removed.status, 0) << removed.err;
    EXPECT_TRUE(axtest::processGone(instance));
    EXPECT_TRUE(p.axd->waitForErr("spawnd reported plug-ins have been terminated")) << p.axd->err();
    // The host was told, and said so.
    EXPECT_EQ(host.wait(5s), 69);
    EXPECT_NE(host.err().find("the plug-in's connection ended"), std::string::npos) << host.err();
}

TEST(Activation, ReadyFailsWithTheDocumentedTextWhileSpawndIsAwayOrRefusesAndWorksWhenItIsBack) {
    Platform p;
    std::string uuid = p.uuids.at("com.example.greeter").string();
    std::string unable = "unable to enable plug-in com.example.greeter(" + uuid + "): ";
    p.spawnd->signal(SIGTERM);
    ASSERT_EQ(p.spawnd->wait(5s), 0);
    auto away = p.axctl({"ready", uuid});
    EXPECT_EQ(away.status, 1);
    // The reply's text, and beside it the cause: the socket nobody answers on, and how to start it.
    EXPECT_NE(away.err.find(unable + "spawnd cannot be reached: nothing answers on " + p.root.path() + "/run/user/"),
              std::string::npos)
        << away.err;
    EXPECT_NE(away.err.find("(start it with: systemctl --user start spawnd.socket) (error 4)"), std::string::npos) << away.err;
    EXPECT_TRUE(p.axd->waitForErr("spawnd cannot be reached on com.corvane.spawnd"));
    p.startSpawnd();
    auto back = p.axctl({"ready", uuid});
    EXPECT_EQ(back.status, 0) << back.err;
}

TEST(Activation, AnUnsignedDaemonServesDiscoveryButSaysWhyItCannotActivate) {
    Platform p(false);
    std::string uuid = p.uuids.at("com.example.greeter").string();
    auto matched = p.axctl({"match", "-r", "KSExtensionIdentifier=com.example.greeter"});
    EXPECT_EQ(matched.status, 0);
    EXPECT_NE(matched.out.find(uuid), std::string::npos) << matched.out;
    auto refused = p.axctl({"ready", uuid});
    EXPECT_EQ(refused.status, 1);
    // The host reads spawnd's reason: which program lacks which entitlement, and why.
    EXPECT_NE(refused.err.find("unable to enable plug-in com.example.greeter(" + uuid +
                               "): spawnd accepts plug-ins only from a program with the "
                               "com.corvane.private.rpx.domain-extension.proxy entitlement, and "),
              std::string::npos)
        << refused.err;
    EXPECT_NE(refused.err.find("has none: "), std::string::npos) << refused.err;
    EXPECT_TRUE(p.axd->waitForErr("spawnd refused: this axd's signature lacks the com.corvane.private.rpx.domain-extension.proxy entitlement"));
    EXPECT_TRUE(p.spawnd->waitForErr("with the com.corvane.private.rpx.domain-extension.proxy entitlement, and "));
    // Read tokens need no platform entitlement: one per UUID, in order.
    auto tokens = p.axctl({"access", "--json", uuid, p.uuids.at("com.example.keys").string(), uuid});
    EXPECT_EQ(tokens.status, 0) << tokens.err;
    auto list = Value::parse(tokens.out);
    EXPECT_TRUE(list && list->asArray() && list->asArray()->size() == 3) << tokens.out;
}

// A signature speaks for the code it covers. A library preloaded into a signed program (into axd,
// into a signed axctl) leaves it without its entitlements, whether the environment still shows how
// it came in or the library wiped that: its mapping gives it away.
TEST(Activation, ASignedProgramRunningCodeItsSignatureDoesNotCoverHasNoEntitlements) {
    Platform p;
    std::string writable = p.root / "writable";
    fs::create_directories(writable);
    fs::permissions(writable, fs::perms::all);
    std::string library = writable + "/libpreload.so";
    fs::copy_file(axtest::binary("../lib/libpreload_library.so"), library);
    std::map<std::string, std::string> preloaded = kDebugLog;
    preloaded["LD_PRELOAD"] = library;
    preloaded["ASAN_OPTIONS"] = "verify_asan_link_order=0";
    // axd with the library in it: spawnd refuses its registrations, and says which mapping.
    p.axd->signal(SIGTERM);
    p.axd->wait(5s);
    p.axd = std::make_unique<axtest::Process>(std::vector<std::string>{p.root / "bin/axd"}, preloaded);
    ASSERT_TRUE(axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath("com.corvane.annexa.axd")); }));
    auto refused = p.axctl({"ready", p.uuids.at("com.example.greeter").string()});
    EXPECT_NE(refused.status, 0);
    EXPECT_TRUE(p.spawnd->waitForErr("it maps " + library + ", which is neither installed by root nor signed"))
        << p.spawnd->err();

    // A signed axctl with the manager entitlement, so started: refused what needs the entitlement.
    std::string manager = p.root / "bin/manager";
    fs::copy_file(axtest::binary("axctl"), manager);
    ASSERT_TRUE(codesign::sign(manager, p.key, std::nullopt, dict({{"com.corvane.private.annexa.manager", true}})).ok());
    struct Case {
        const char* name;
        std::map<std::string, std::string> environment;
    };
    std::map<std::string, std::string> large;  // 1.2 MiB, in pieces of what one variable may be
    for (int i = 0; i < 12; ++i) large["PADDING" + std::to_string(i)] = std::string(100 << 10, 'x');
    const Case cases[] = {
        {"a preloaded library", {{"LD_PRELOAD", library}, {"ASAN_OPTIONS", "verify_asan_link_order=0"}}},
        {"a library path", {{"LD_LIBRARY_PATH", writable}}},
        {"an audit library", {{"LD_AUDIT", library}}},
        {"an environment too large to be looked through", large},
    };
    for (const auto& c : cases) {
        auto ran = axtest::run({manager, "remove", p.app}, c.environment);
        EXPECT_EQ(ran.status, 77) << c.name << ": " << ran.err;
    }
    // Without any of that, the same program is entitled.
    auto removed = p.axctl({"remove", p.app}, manager);
    EXPECT_EQ(removed.status, 0) << removed.err;
}

// A plug-in may ask axd what any host may ask, but not what only an unconfined manager may: its
// sandbox is known from the kernel, whatever its signature says.
TEST(Activation, ASandboxedPlugInIsRefusedWhatOnlyAnUnconfinedManagerMay) {
    Platform p;
    // The greeter signed as a manager; the keyboard plug-in not signed at all.
    ASSERT_TRUE(codesign::sign(p.plugInPath("com.example.greeter") + "/Sample", p.key, std::nullopt,
                               dict({{"com.corvane.private.annexa.manager", true}})).ok());
    UUID keys = p.uuids.at("com.example.keys");
    Value annotateKeys = request("annotate", {{"uuids", Value(Array{Value(keys)})}, {"annotations", dict({{"election", 1}})}});
    struct Case {
        const char* name;
        const char* plugIn;
        Value request;
        Value reply;  // null: any reply without an error
    };
    const Case cases[] = {
        {"every plug-in", "com.example.greeter", request("match", {{"flags", uint64_t{0x200}}}),
         dict({{"errorcode", uint64_t{11}}, {"error", "unauthorized discovery flag (AXDiscoverAll)"}})},
        {"the explanation", "com.example.greeter", request("match", {{"flags", uint64_t{0x10000}}}),
         dict({{"errorcode", uint64_t{11}}, {"error", "unauthorized discovery flag (explain)"}})},
        {"every plug-in, unsigned", "com.example.keys", request("match", {{"flags", uint64_t{0x200}}}),
         dict({{"errorcode", uint64_t{11}}, {"error", "unauthorized discovery flag (AXDiscoverAll)"}})},
        {"a removal, unsigned", "com.example.keys", request("remove", {{"paths", Value(Array{Value(p.app)})}}),
         dict({{"errorcode", uint64_t{11}}, {"error", "caller lacks entitlement for this operation"}})},
        {"a match", "com.example.greeter", request("match"), Value()},
        {"an annotation", "com.example.keys", annotateKeys, Value()},
        {"a token", "com.example.keys", request("access", {{"uuids", Value(Array{Value(keys)})}}), Value()},
    };
    for (const auto& c : cases) {
        Value reply = p.run(c.plugIn, dict({{"do", "axd"}, {"request", c.request}}));
        if (c.reply.isNull()) {
            EXPECT_TRUE(reply.isDictionary() && reply["errorcode"].isNull()) << c.name << ": " << reply.description();
        } else {
            EXPECT_EQ(reply, c.reply) << c.name;
        }
    }
    // Still registered: the refused removal removed nothing.
    EXPECT_EQ(p.axctl({"ready", keys.string()}).status, 0);
}
