// spawnd with real processes: a registrar signed with (and without) the entitlement, the test as a
// host, the sample plug-in running under each sandbox profile.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>

#include "Annexa/AXPlugInRuntime.h"
#include "Annexa/c/annexa.h"
#include "platform/codesign/CodeSign.h"
#include "platform/pcx/Pcx.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/spawn/Spawn.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

std::string sampleExecutable() { return axtest::binary("../samples/bin/ax_sample"); }


// A listening TCP socket on the loopback interface; its port.
struct TcpListener {
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int port = 0;
    TcpListener() {
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 && ::listen(fd, 8) == 0 &&
            ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) == 0) {
            port = ntohs(address.sin_port);
        }
    }
    ~TcpListener() { ::close(fd); }
};

class Spawnd {
public:
    explicit Spawnd(std::vector<std::string> options = {}) {
        key_ = codesign::generateKey();
        EXPECT_TRUE(codesign::writeKeyPair(root / "key", key_).ok());
        EXPECT_TRUE(codesign::trustKey(root / "key.pub").ok());
        registrar = signedPeer("registrar", dict({{spawn::kDomainExtensionProxyEntitlement, true}}));
        fs::create_directories(root / "bin");
        unentitled = root / "bin/unentitled";
        fs::copy_file(axtest::binary("spawn_peer"), unentitled);
        options.insert(options.begin(), axtest::binary("spawnd"));
        daemon = std::make_unique<axtest::Process>(options);
        EXPECT_TRUE(axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath(spawn::kEndpoint)); }));
    }

    std::string signedPeer(const std::string& name, const Value& entitlements) {
        fs::create_directories(root / "bin");
        std::string path = root / ("bin/" + name);
        fs::copy_file(axtest::binary("spawn_peer"), path, fs::copy_options::overwrite_existing);
        EXPECT_TRUE(codesign::sign(path, key_, std::nullopt, entitlements).ok());
        return path;
    }

    // A plug-in bundle holding the sample executable; its executable's path.
    std::string plugIn(const std::string& identifier) {
        fs::create_directories(root / "apps/Host.app/PlugIns");
        std::string bundle = axtest::makeBundle(root / "apps/Host.app/PlugIns", identifier + ".appex",
                                                axtest::plugInInfo(identifier, dict({}), "Sample"), sampleExecutable());
        return bundle + "/Sample";
    }

    // The overlay axd would send: the profile and the environment of a data container.
    Value overlay(const std::string& profile, const std::string& container, Dictionary extra = {}) {
        Dictionary environment = std::move(extra);
        if (!container.empty()) {
            environment["HOME"] = Value(container);
            environment["TMPDIR"] = Value(container + "/tmp");
        }
        return dict({{"RPXService", dict({{"EnvironmentVariables", Value(std::move(environment))},
                                          {"_SandboxProfile", profile},
                                          {"_OmitSandboxParameters", true}})},
                     {"KFBundlePackageType", "RPX!"}});
    }

    int add(pid_t host, const std::string& executable, const Value& overlay, const std::string& peer = "") {
        auto ran = axtest::run({peer.empty() ? registrar : peer, "add", std::to_string(host), executable, overlay.description()});
        int result = -1;
        std::sscanf(ran.out.c_str(), "result %d", &result);
        return result;
    }

    int remove(const std::string& identifier, const std::string& version = "") {
        auto ran = axtest::run({registrar, "remove", identifier, version});
        int result = -1;
        std::sscanf(ran.out.c_str(), "result %d", &result);
        return result;
    }

    axtest::PlatformRoot root;
    std::unique_ptr<axtest::Process> daemon;
    std::string registrar;
    std::string unentitled;

private:
    codesign::KeyPair key_;
};

// The test process as a host: a connection to the plug-in, and a blocking exchange on it.
struct Session {
    Result<rpx::ConnectionPtr> connection;
    explicit Session(const std::string& identifier)
        : connection(annexa::connectToPlugIn(identifier, dispatch::Queue::create("session"), [](const rpx::Event&) {})) {}
    Value send(const Value& message) {
        if (!connection) return Value();
        rpx::Reply reply = (*connection)->sendWithReplySync(message);
        return reply.ok() ? reply.value : Value();
    }
    int64_t errnoOf(const Value& message) { return send(message)["errno"].int64Value().value_or(-1); }
    pid_t pid() { return static_cast<pid_t>(send(dict({}))["pid"].int64Value().value_or(0)); }
};

}  // namespace

TEST(Spawnd, OnlyAnEntitledRegistrarRegistersAndBadRegistrationsAreRefused) {
    Spawnd d;
    std::string executable = d.plugIn("com.example.sample");
    Value good = d.overlay("plugin", d.root / "containers/sample");
    EXPECT_EQ(d.add(::getpid(), executable, good, d.unentitled), EPERM);
    EXPECT_TRUE(d.daemon->waitForErr("no com.corvane.private.rpx.domain-extension.proxy entitlement"));

    fs::create_directories(d.root / "loose");
    axtest::writeFile(d.root / "loose/tool", "#!/bin/sh\n", 0755);
    Value noService = dict({{"KFBundlePackageType", "RPX!"}});
    Value wrongType = dict({{"RPXService", dict({})}, {"KFBundlePackageType", "APP!"}});
    Value badEnvironment = dict({{"RPXService", dict({{"EnvironmentVariables", dict({{"A", 1}})}})}, {"KFBundlePackageType", "RPX!"}});
    struct Row {
        const char* what;
        pid_t host;
        std::string executable;
        Value overlay;
        int expected;
    } rows[] = {
        {"good", ::getpid(), executable, good, 0},
        {"again (replaces)", ::getpid(), executable, good, 0},
        {"no such executable", ::getpid(), d.root / "missing", good, ENOENT},
        {"a directory", ::getpid(), d.root / "apps", good, EINVAL},
        {"outside any bundle", ::getpid(), d.root / "loose/tool", good, ENOENT},
        {"overlay without service", ::getpid(), executable, noService, EINVAL},
        {"overlay of another package type", ::getpid(), executable, wrongType, EINVAL},
        {"environment of numbers", ::getpid(), executable, badEnvironment, EINVAL},
        {"overlay not a dictionary", ::getpid(), executable, Value("RPX!"), EINVAL},
        {"no such host", 0x3ffffff0, executable, good, ESRCH},
    };
    for (const Row& row : rows) EXPECT_EQ(d.add(row.host, row.executable, row.overlay), row.expected) << row.what;

    EXPECT_EQ(d.remove("com.example.nothing"), spawn::kNothingOnRecord);
    EXPECT_EQ(d.remove("com.example.sample", "2"), spawn::kNothingOnRecord);  // registered as version 1
    EXPECT_EQ(d.remove("com.example.sample", "1"), 0);
    auto gone = spawn::connectToService("com.example.sample");
    ASSERT_FALSE(gone);
    EXPECT_EQ(gone.error().code, ENOENT);
    // Still serving after all that.
    EXPECT_EQ(d.add(::getpid(), executable, good), 0);
}

TEST(Spawnd, APlugInRunsConfinedByItsProfile) {
    Spawnd d;
    TcpListener tcp;
    ASSERT_NE(tcp.port, 0);
    std::string container = d.root / "containers/plugin";
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.plugin"), d.overlay("plugin", container, {{"GREETING", Value("hi")}})), 0);

    Session session("com.example.plugin");
    ASSERT_TRUE(session.connection) << session.connection.error().description();
    Value hello = session.send(dict({}));
    EXPECT_EQ(hello["greeting"], Value("hello from a sample plug-in"));
    EXPECT_TRUE(hello["sandboxed"].isTrue());
    Value inside = session.send(dict({{"do", "environment"}}));
    // A clean environment: the overlay's variables and the platform root, nothing of spawnd's.
    EXPECT_EQ(inside["environment"], dict({{"HOME", container}, {"TMPDIR", container + "/tmp"}, {"GREETING", "hi"},
                                          {"CORVANE_ROOT", d.root.path()}}));
    EXPECT_EQ(inside["directory"], Value(container));
    struct Row {
        const char* what;
        Value message;
        int64_t expected;
    } rows[] = {
        {"write in its container", dict({{"do", "write"}, {"path", container + "/note"}}), 0},
        {"write in its TMPDIR", dict({{"do", "write"}, {"path", container + "/tmp/note"}}), 0},
        {"write beside its container", dict({{"do", "write"}, {"path", d.root / "containers/other"}}), EACCES},
        {"write in /tmp", dict({{"do", "write"}, {"path", "/tmp/annexa-sandbox-escape"}}), EACCES},
        {"write in its own bundle", dict({{"do", "write"}, {"path", d.root / "apps/Host.app/x"}}), EACCES},
        {"connect over TCP", dict({{"do", "tcp"}, {"port", int64_t{tcp.port}}}), EACCES},
        {"make an IPv4 socket", dict({{"do", "inet"}}), 0},
    };
    for (const Row& row : rows) EXPECT_EQ(session.errnoOf(row.message), row.expected) << row.what;
    EXPECT_FALSE(fs::exists("/tmp/annexa-sandbox-escape"));
    EXPECT_EQ(session.send(dict({{"do", "confined"}})),
              dict({{"unshare", int64_t{EPERM}}, {"clone", int64_t{EPERM}}, {"ptrace", int64_t{EPERM}}, {"setsid", int64_t{EPERM}}}));

    // One instance per host and plug-in: a host that connects in a loop reaches the same process
    // every time, and a connection it drops is dropped by the plug-in too.
    pid_t pid = session.pid();
    for (int i = 0; i < 100; ++i) {
        Session again("com.example.plugin");
        ASSERT_EQ(again.pid(), pid) << i;
    }
    auto open = [pid] {
        size_t count = 0;
        for ([[maybe_unused]] auto& entry : fs::directory_iterator("/proc/" + std::to_string(pid) + "/fd")) ++count;
        return count;
    };
    EXPECT_TRUE(axtest::eventually([&] { return open() < 20; })) << open() << " descriptors open in the plug-in";
}

TEST(Spawnd, EachProfileGrantsWhatItNames) {
    Spawnd d;
    TcpListener tcp;
    struct Row {
        const char* profile;
        int64_t tcpErrno;
        int64_t inetErrno;
        int64_t homeWriteErrno;
    } rows[] = {
        {"keyboard", EACCES, EACCES, 0},
        {"network-filter", 0, 0, 0},
        {"glancerd", EACCES, 0, EACCES},
        {"sandpit-devtools", 0, 0, 0},
    };
    for (const Row& row : rows) {
        std::string identifier = std::string("com.example.") + row.profile;
        std::string container = d.root / ("containers/" + std::string(row.profile));
        ASSERT_EQ(d.add(::getpid(), d.plugIn(identifier), d.overlay(row.profile, container)), 0);
        Session session(identifier);
        ASSERT_TRUE(session.connection) << row.profile << ": " << session.connection.error().description();
        EXPECT_EQ(session.errnoOf(dict({{"do", "tcp"}, {"port", int64_t{tcp.port}}})), row.tcpErrno) << row.profile;
        EXPECT_EQ(session.errnoOf(dict({{"do", "inet"}})), row.inetErrno) << row.profile;
        EXPECT_EQ(session.errnoOf(dict({{"do", "write"}, {"path", container + "/note"}})), row.homeWriteErrno) << row.profile;
        EXPECT_EQ(session.errnoOf(dict({{"do", "write"}, {"path", container + "/tmp/note"}})), 0) << row.profile;
    }
    // An unknown profile is never run unconfined.
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.unknown"), d.overlay("lenient", "")), 0);
    auto refused = spawn::connectToService("com.example.unknown");
    ASSERT_FALSE(refused);
    EXPECT_EQ(refused.error().code, EINVAL);
    EXPECT_NE(refused.error().description().find("unknown sandbox profile \"lenient\""), std::string::npos)
        << refused.error().description();
}

TEST(Spawnd, AnInstanceThatFailsBeforeAcceptingIsReportedAtOnceWithItsReason) {
    Spawnd d({"--accept-timeout-ms", "400"});
    std::string executable = d.plugIn("com.example.failing");
    fs::create_directories(d.root / "apps/Plain.app/PlugIns");
    std::string unexecutable = axtest::makeBundle(d.root / "apps/Plain.app/PlugIns", "NoExec.appex",
                                                  axtest::plugInInfo("com.example.noexec", dict({}), "Sample"),
                                                  sampleExecutable()) + "/Sample";
    fs::permissions(unexecutable, fs::perms::owner_read);
    struct Row {
        const char* what;
        std::string executable;
        const char* atStart;
        int64_t expectedErrno;
        const char* expectedText;
    } rows[] = {
        {"crash", executable, "crash", ECONNREFUSED, "was killed by SIGSEGV before accepting"},
        {"exit", executable, "exit", ECONNREFUSED, "exited with status 3 before accepting"},
        {"not executable", unexecutable, "", EACCES, "exec"},
        {"never accepts", executable, "hang", ETIMEDOUT, "did not accept the connection in time"},
    };
    for (const Row& row : rows) {
        std::string identifier = row.executable == executable ? "com.example.failing" : "com.example.noexec";
        Dictionary environment;
        if (*row.atStart) environment["SAMPLE_AT_START"] = Value(row.atStart);
        ASSERT_EQ(d.add(::getpid(), row.executable, d.overlay("plugin", "", environment)), 0) << row.what;
        auto started = std::chrono::steady_clock::now();
        auto refused = spawn::connectToService(identifier);
        auto waited = std::chrono::steady_clock::now() - started;
        ASSERT_FALSE(refused) << row.what;
        EXPECT_EQ(refused.error().code, row.expectedErrno) << row.what << ": " << refused.error().description();
        EXPECT_NE(refused.error().description().find(row.expectedText), std::string::npos)
            << row.what << ": " << refused.error().description();
        if (row.expectedErrno != ETIMEDOUT) {
            EXPECT_LT(waited, std::chrono::seconds(2)) << row.what;
        }
    }
    // A good registration afterwards is served: nothing of the failures stayed behind.
    ASSERT_EQ(d.add(::getpid(), executable, d.overlay("plugin", "")), 0);
    Session session("com.example.failing");
    EXPECT_NE(session.pid(), 0);
}

TEST(Spawnd, InstancesEndWithTheirServiceTheirHostAndTheirIdleness) {
    Spawnd d({"--grace-ms", "300", "--idle-ms", "300"});
    // Removal ends the instance and what it started.
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.removed"), d.overlay("plugin", "")), 0);
    pid_t instance, child;
    {
        Session session("com.example.removed");
        instance = session.pid();
        child = static_cast<pid_t>(session.send(dict({{"do", "fork"}}))["child"].int64Value().value_or(0));
        ASSERT_GT(instance, 0);
        ASSERT_GT(child, 0);
        EXPECT_EQ(d.remove("com.example.removed"), 0);
        EXPECT_TRUE(axtest::processGone(instance));
        EXPECT_TRUE(axtest::processGone(child));
    }

    // The host's exit ends its instances.
    std::string hostPeer = d.signedPeer("host", dict({{spawn::kDomainExtensionProxyEntitlement, true}}));
    axtest::Process host({hostPeer, "host", d.plugIn("com.example.hosted"), "com.example.hosted",
                          d.overlay("plugin", "").description()});
    ASSERT_TRUE(host.waitForOut("reply ")) << host.out() << host.err();
    auto reply = Value::parse(host.out().substr(host.out().find("reply ") + 6));
    ASSERT_TRUE(reply) << host.out();
    pid_t hosted = static_cast<pid_t>((*reply)["pid"].int64Value().value_or(0));
    ASSERT_GT(hosted, 0);
    host.signal(SIGKILL);
    EXPECT_TRUE(axtest::processGone(hosted));

    // An instance that serves nobody ends after the idle time.
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.idle"), d.overlay("plugin", "")), 0);
    pid_t idle;
    {
        Session session("com.example.idle");
        idle = session.pid();
        ASSERT_GT(idle, 0);
        std::this_thread::sleep_for(std::chrono::milliseconds(600));
        EXPECT_EQ(::kill(idle, 0), 0) << "ended while a host was connected";
        (*session.connection)->cancel();
    }
    EXPECT_TRUE(axtest::processGone(idle));
}

TEST(Spawnd, BusyAssertionsAreSeenUntilDroppedOrTheInstanceExits) {
    Spawnd d;
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.busy"), d.overlay("plugin", "")), 0);
    Session session("com.example.busy");
    pid_t pid = session.pid();
    auto busy = [] {
        auto instances = spawn::busyExtensionInstances({"com.example.busy", "com.example.other"});
        return instances ? Value(*instances) : Value();
    };
    EXPECT_EQ(busy(), Value(Array{}));
    uint64_t assertion = session.send(dict({{"do", "busy"}, {"reason", "saving"}}))["assertion"].uint64Value().value_or(0);
    Value expected(Array{dict({{"bundleIdentifier", "com.example.busy"}, {"pid", int64_t{pid}}, {"reason", "saving"}})});
    EXPECT_TRUE(axtest::eventually([&] { return busy() == expected; })) << busy().description();
    EXPECT_EQ(spawn::busyExtensionInstances({"com.example.other"})->size(), 0u);
    session.send(dict({{"do", "unbusy"}, {"assertion", assertion}}));
    EXPECT_TRUE(axtest::eventually([&] { return busy() == Value(Array{}); }));

    session.send(dict({{"do", "busy"}, {"reason", "again"}}));
    EXPECT_TRUE(axtest::eventually([&] { return busy() != Value(Array{}); }));
    (*session.connection)->send(dict({{"do", "exit"}}));
    EXPECT_TRUE(axtest::processGone(pid));
    EXPECT_TRUE(axtest::eventually([&] { return busy() == Value(Array{}); }));
}

TEST(Spawnd, HostsTheTokenBrokerAndConsentAndStopsItsInstancesOnSigterm) {
    Spawnd d;
    // The token broker.
    axtest::writeFile(d.root / "shared.txt", "shared");
    auto token = sandbox::issueFileReadExtension(sandbox::kReadOnlyClass, d.root / "shared.txt", sandbox::kCanonicalPath);
    ASSERT_TRUE(token);
    int64_t handle = sandbox::consumeExtension(*token);
    EXPECT_GE(handle, 0);
    EXPECT_EQ(sandbox::releaseExtension(handle), 0);

    // Consent: the user grants and revokes with pcx; only a manager, or the application itself,
    // may read the records.
    fs::create_directories(d.root / "apps");
    std::string app = axtest::makeBundle(d.root / "apps", "Keys.app", axtest::appInfo("com.example.keys"));
    auto pcxTool = [&](std::vector<std::string> args) {
        args.insert(args.begin(), axtest::binary("pcx"));
        return axtest::run(args);
    };
    EXPECT_EQ(pcxTool({"grant", app, pcx::kKeyboardNetworkService}).status, 0);
    EXPECT_EQ(pcxTool({"grant", app, "com.example.camera"}).status, 0);
    EXPECT_EQ(pcxTool({"revoke", app, "com.example.camera"}).status, 0);
    EXPECT_EQ(pcxTool({"list", app}).out,
              "com.example.keys\tcom.corvane.pcx.keyboard-network\tgranted\ncom.example.keys\tcom.example.camera\trevoked\n");
    EXPECT_EQ(pcxTool({"grant", d.root / "nowhere", "x"}).status, 65);
    EXPECT_EQ(pcxTool({"grant", app}).status, 64);

    EXPECT_FALSE(pcx::consentInformationForBundle(app));  // this test process is neither
    std::string manager = d.signedPeer("manager", dict({{pcx::kManagerEntitlement, true}}));
    auto asked = axtest::run({manager, "consent", app});
    EXPECT_EQ(asked.out, "[{\"granted\":true,\"service\":\"com.corvane.pcx.keyboard-network\"},"
                         "{\"granted\":false,\"service\":\"com.example.camera\"}]\n") << asked.err;
    std::string reader = d.signedPeer("reader", dict({}));
    EXPECT_EQ(axtest::run({reader, "consent", app}).out, "refused\n");

    // SIGTERM: the instances end, then spawnd.
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.last"), d.overlay("plugin", "")), 0);
    Session session("com.example.last");
    pid_t pid = session.pid();
    ASSERT_GT(pid, 0);
    d.daemon->signal(SIGTERM);
    EXPECT_EQ(d.daemon->wait(std::chrono::seconds(10)), 0);
    EXPECT_TRUE(axtest::processGone(pid));
}

TEST(Spawnd, APlugInAndAHostWrittenInCTalkThroughTheLibrary) {
    Spawnd d;
    // The plug-in brings its copy of the library in its bundle.
    fs::create_directories(d.root / "apps/C.app/PlugIns");
    std::string bundle = axtest::makeBundle(d.root / "apps/C.app/PlugIns", "Echo.appex",
                                            axtest::plugInInfo("com.example.c-echo", dict({}), "echo"),
                                            axtest::binary("annexa_c_plugin"));
    fs::copy_file(axtest::binary("../lib/libannexa.so.1"), bundle + "/libannexa.so.1");
    ASSERT_EQ(d.add(::getpid(), bundle + "/echo", d.overlay("plugin", "")), 0);

    char* error = nullptr;
    annexa_plugin* plugin = annexa_plugin_connect("com.example.c-echo", &error);
    ASSERT_NE(plugin, nullptr) << (error ? error : "");
    char* reply = nullptr;
    EXPECT_EQ(annexa_plugin_send(plugin, "{\"n\": 1}", &reply, &error), 0);
    EXPECT_STREQ(reply, "{\"echo\": {\"n\": 1}}");
    annexa_free(reply);
    EXPECT_EQ(annexa_plugin_send(plugin, "\"busy\"", &reply, &error), 0);
    annexa_free(reply);
    auto busy = spawn::busyExtensionInstances({"com.example.c-echo"});
    ASSERT_TRUE(busy);
    ASSERT_EQ(busy->size(), 1u);
    EXPECT_EQ((*busy)[0]["reason"], Value("written in C"));
    EXPECT_EQ(annexa_plugin_send(plugin, "{", &reply, &error), ANNEXA_EINVAL);
    EXPECT_NE(std::string(error).find("at offset 1"), std::string::npos) << error;
    annexa_free(error);
    annexa_plugin_close(plugin);

    EXPECT_EQ(annexa_plugin_connect("com.example.unregistered", &error), nullptr);
    EXPECT_NE(std::string(error).find("no service com.example.unregistered"), std::string::npos) << error;
    annexa_free(error);
}
