// spawnd with real processes: a registrar signed with (and without) the entitlement, the test as a
// host, the sample plug-in running under each sandbox profile.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "Annexa/AXPlugInRuntime.h"
#include "Annexa/c/annexa.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
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

// Where spawnd keeps the data container of a plug-in, for the platform root of the test.
std::string containerOf(const std::string& identifier) { return layout::userDataDir() + "/containers/4/" + identifier; }

class Spawnd {
public:
    // `launcher` runs spawnd (prlimit, say), with spawnd and its options after it.
    explicit Spawnd(std::vector<std::string> options = {}, std::vector<std::string> launcher = {}) {
        key_ = codesign::generateKey();
        EXPECT_TRUE(codesign::writeKeyPair(root / "key", key_).ok());
        EXPECT_TRUE(codesign::trustKey(root / "key.pub").ok());
        registrar = signedPeer("registrar", dict({{spawn::kDomainExtensionProxyEntitlement, true}}));
        fs::create_directories(root / "bin");
        unentitled = root / "bin/unentitled";
        fs::copy_file(axtest::binary("spawn_peer"), unentitled);
        for (const auto& o : axtest::spawndOptions()) options.push_back(o);
        options.insert(options.begin(), axtest::binary("spawnd"));
        options.insert(options.begin(), launcher.begin(), launcher.end());
        options_ = options;
        start();
    }

    // Stopped as a service manager stops it, so that it removes what it made (its cgroups).
    ~Spawnd() {
        daemon->signal(SIGTERM);
        daemon->wait(std::chrono::seconds(10));
    }

    // Starts spawnd (again), with its log on standard error.
    void start() {
        daemon = std::make_unique<axtest::Process>(options_, std::map<std::string, std::string>{{"CORVANE_LOG_SINK", "stderr"}, {"CORVANE_LOG", "info"}});
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

    // The overlay axd would send: the profile, the data container by name and the environment.
    Value overlay(const std::string& profile, const std::string& container, Dictionary extra = {}) {
        Dictionary service{{"EnvironmentVariables", Value(std::move(extra))},
                           {"_SandboxProfile", profile},
                           {"_OmitSandboxParameters", true}};
        if (!container.empty()) service["_DataContainer"] = Value(container);
        return dict({{"RPXService", Value(std::move(service))}, {"KFBundlePackageType", "RPX!"}});
    }

    // A bundle holding a C program of this build, with the library beside it (the sandbox lets a
    // plug-in read its own bundle, not the build tree); its executable's path.
    std::string cPlugIn(const std::string& identifier, const std::string& program) {
        fs::create_directories(root / "apps/C.app/PlugIns");
        std::string bundle = axtest::makeBundle(root / "apps/C.app/PlugIns", identifier + ".appex",
                                                axtest::plugInInfo(identifier, dict({}), "program"), axtest::binary(program));
        fs::copy_file(axtest::binary("../lib/libannexa.so.1"), bundle + "/libannexa.so.1", fs::copy_options::overwrite_existing);
        return bundle + "/program";
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
    std::vector<std::string> options_;
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
    Value good = d.overlay("plugin", "com.example.sample");
    EXPECT_EQ(d.add(::getpid(), executable, good, d.unentitled), EPERM);
    EXPECT_TRUE(d.daemon->waitForErr("with the com.corvane.private.rpx.domain-extension.proxy entitlement, and "));

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
        {"a container named by a path", ::getpid(), executable, d.overlay("plugin", "../../home"), EINVAL},
        {"a memory limit that is no number", ::getpid(), executable,
         dict({{"RPXService", dict({{"_MemoryLimit", "all"}})}, {"KFBundlePackageType", "RPX!"}}), EINVAL},
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
    std::string container = containerOf("com.example.plugin");
    // The overlay's own HOME and XDG_RUNTIME_DIR are not the instance's: spawnd sets those.
    ASSERT_EQ(d.add(::getpid(), d.plugIn("com.example.plugin"),
                    d.overlay("plugin", "com.example.plugin",
                              {{"GREETING", Value("hi")}, {"HOME", Value("/")}, {"XDG_RUNTIME_DIR", Value("/run")}})),
              0);

    Session session("com.example.plugin");
    ASSERT_TRUE(session.connection) << session.connection.error().description();
    Value hello = session.send(dict({}));
    EXPECT_EQ(hello["greeting"], Value("hello from a sample plug-in"));
    EXPECT_TRUE(hello["sandboxed"].isTrue());
    Value inside = session.send(dict({{"do", "environment"}}));
    // A clean environment: the overlay's variables, those spawnd makes of the container, the
    // platform root, and nothing of spawnd's.
    EXPECT_EQ(inside["environment"],
              dict({{"HOME", container}, {"KFFIXED_USER_HOME", container}, {"TMPDIR", container + "/tmp"},
                    {"XDG_CONFIG_HOME", container + "/.config"}, {"XDG_DATA_HOME", container + "/.local/share"},
                    {"XDG_STATE_HOME", container + "/.local/state"}, {"XDG_CACHE_HOME", container + "/.cache"},
                    {"GREETING", "hi"}, {"CORVANE_ROOT", d.root.path()}}));
    EXPECT_EQ(inside["directory"], Value(container));
    struct Row {
        const char* what;
        Value message;
        int64_t expected;
    } rows[] = {
        {"write in its container", dict({{"do", "write"}, {"path", container + "/note"}}), 0},
        {"write in its TMPDIR", dict({{"do", "write"}, {"path", container + "/tmp/note"}}), 0},
        {"write beside its container", dict({{"do", "write"}, {"path", containerOf("com.example.other")}}), EACCES},
        {"write in /tmp", dict({{"do", "write"}, {"path", "/tmp/annexa-sandbox-escape"}}), EACCES},
        {"write in its own bundle", dict({{"do", "write"}, {"path", d.root / "apps/Host.app/x"}}), EACCES},
        {"connect over TCP", dict({{"do", "tcp"}, {"port", int64_t{tcp.port}}}), 0},
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
        {"keyboard", EAFNOSUPPORT, EAFNOSUPPORT, 0},
        {"network-filter", 0, 0, 0},
        {"glancerd", EAFNOSUPPORT, EAFNOSUPPORT, EACCES},
        {"sandpit-devtools", 0, 0, 0},
    };
    for (const Row& row : rows) {
        std::string identifier = std::string("com.example.") + row.profile;
        std::string container = containerOf(identifier);
        ASSERT_EQ(d.add(::getpid(), d.plugIn(identifier), d.overlay(row.profile, identifier)), 0);
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
    ASSERT_EQ(d.add(::getpid(), d.cPlugIn("com.example.c-echo", "annexa_c_plugin"), d.overlay("plugin", "")), 0);

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

namespace {

// The processes whose parent is `parent` and that are zombies.
int zombiesOf(pid_t parent) {
    int zombies = 0;
    for (const auto& entry : fs::directory_iterator("/proc")) {
        std::string name = entry.path().filename();
        if (name.find_first_not_of("0123456789") != std::string::npos) continue;
        std::string stat = axtest::readFile(entry.path() / "stat");
        size_t close = stat.rfind(')');
        if (close == std::string::npos || close + 4 > stat.size()) continue;
        char state = stat[close + 2];
        pid_t ppid = std::atoi(stat.c_str() + close + 4);
        if (ppid == parent && state == 'Z') ++zombies;
    }
    return zombies;
}

// A line of /proc/PID/status as a number (hexadecimal for the capability sets); -1 without it.
int64_t statusField(pid_t pid, const std::string& field, int base) {
    std::string status = axtest::readFile("/proc/" + std::to_string(pid) + "/status");
    size_t at = status.find("\n" + field + ":");
    if (at == std::string::npos) return -1;
    return std::strtoll(status.c_str() + at + field.size() + 2, nullptr, base);
}

}  // namespace

// The probe plug-in tries every way out of its sandbox under each profile; each attempt's outcome
// is what the profile says: 0 where it may, a refusal everywhere else.
TEST(Spawnd, TheSandboxHoldsUnderEveryProfile) {
    Spawnd d;
    TcpListener tcp;
    ASSERT_NE(tcp.port, 0);
    axtest::writeFile(d.root / "secret", "the user's own\n", 0644);
    fs::create_directories(d.root / "outside");
    fs::create_directories(containerOf("com.example.other"));
    const std::vector<std::string> profiles = {"plugin", "keyboard", "network-filter", "glancerd", "sandpit-devtools"};
    constexpr int64_t kRefused = -1;  // any error
    struct Attempt {
        const char* name;
        std::vector<int64_t> expected;  // per profile, in the order above
    };
    auto everywhere = [](int64_t value) { return std::vector<int64_t>(5, value); };
    const std::vector<int64_t> inetOnly = {0, EAFNOSUPPORT, 0, EAFNOSUPPORT, 0};
    const Attempt attempts[] = {
        {"write-home", {0, 0, 0, EACCES, 0}},
        {"write-tmpdir", everywhere(0)},
        {"write-outside", everywhere(EACCES)},
        {"read-outside", everywhere(EACCES)},
        {"write-other-container", everywhere(EACCES)},
        {"mknod-device", everywhere(kRefused)},
        {"unix", everywhere(0)},
        {"tcp-connect", inetOnly},
        {"tcp-bind", {EACCES, EAFNOSUPPORT, 0, EAFNOSUPPORT, 0}},
        {"udp", inetOnly},
        {"mptcp", everywhere(kRefused)},
        {"raw-icmp", everywhere(kRefused)},
        {"ping", everywhere(kRefused)},
        {"packet", everywhere(EAFNOSUPPORT)},
        {"netlink", everywhere(EAFNOSUPPORT)},
        {"family-high-bits", everywhere(EAFNOSUPPORT)},
        {"protocol-high-bits", everywhere(kRefused)},
        {"socketpair-inet", everywhere(kRefused)},
        {"x32-socket", everywhere(kRefused)},
        {"i386-socketcall", everywhere(kRefused)},
        {"io_uring", everywhere(EPERM)},
        {"userfaultfd", everywhere(EPERM)},
        {"perf_event_open", everywhere(EPERM)},
        {"bpf", everywhere(EPERM)},
        {"kexec_load", everywhere(EPERM)},
        {"init_module", everywhere(EPERM)},
        {"proc-other-environ", everywhere(EACCES)},
        {"proc-other-cmdline", everywhere(EACCES)},
        {"proc-other-fd", everywhere(EACCES)},
        {"proc-self-status", everywhere(0)},
        {"proc-thread-self", everywhere(0)},
        {"capabilities-held", everywhere(0)},
    };
    for (size_t p = 0; p < profiles.size(); ++p) {
        const std::string& profile = profiles[p];
        std::string identifier = "com.example.probe." + profile;
        // The overlay also tries to give the plug-in another HOME and TMPDIR: spawnd sets those.
        Dictionary environment{{"PROBE_PORT", Value(std::to_string(tcp.port))},
                               {"PROBE_OTHER_PID", Value(std::to_string(d.daemon->pid()))},
                               {"PROBE_OUTSIDE", Value(d.root / "outside/written")},
                               {"PROBE_SECRET", Value(d.root / "secret")},
                               {"PROBE_OTHER_CONTAINER", Value(containerOf("com.example.other"))},
                               {"HOME", Value(d.root.path())},
                               {"TMPDIR", Value(d.root / "outside")}};
        ASSERT_EQ(d.add(::getpid(), d.cPlugIn(identifier, "sandbox_probe"), d.overlay(profile, identifier, environment)), 0);
        Session session(identifier);
        ASSERT_TRUE(session.connection) << profile << ": " << session.connection.error().description();
        Value outcomes = session.send(Value("battery"));
        ASSERT_TRUE(outcomes.isDictionary()) << profile;
        for (const Attempt& attempt : attempts) {
            auto got = outcomes[attempt.name].int64Value();
            ASSERT_TRUE(got) << profile << " " << attempt.name;
            int64_t expected = attempt.expected[p];
            if (expected == kRefused) {
                EXPECT_NE(*got, 0) << profile << ": " << attempt.name << " was not refused";
            } else {
                EXPECT_EQ(*got, expected) << profile << ": " << attempt.name << " (" << std::strerror(static_cast<int>(*got)) << ")";
            }
        }
        // Every capability set of the running instance is empty, whoever runs spawnd.
        pid_t pid = static_cast<pid_t>(outcomes["pid"].int64Value().value_or(0));
        for (const char* set : {"CapInh", "CapPrm", "CapEff", "CapBnd", "CapAmb"})
            EXPECT_EQ(statusField(pid, set, 16), 0) << profile << " " << set;
    }
    EXPECT_FALSE(fs::exists(d.root / "outside/written"));
    EXPECT_FALSE(fs::exists(d.root / "probe"));
}

// What one instance can do to spawnd and to the machine is bounded: its children are reaped, its
// tasks and memory are limited, its busy reasons are cut, a symbolic link it puts in its container
// is never followed, and nothing of it outlives a spawnd that is killed.
TEST(Spawnd, AnInstanceCannotOutgrowItsBoundsOrOutliveSpawnd) {
    Spawnd d;
    std::string identifier = "com.example.probe";
    std::string executable = d.cPlugIn(identifier, "sandbox_probe");
    std::string container = containerOf(identifier);
    fs::create_directories(d.root / "outside");
    auto outsideMode = fs::status(d.root / "outside").permissions();
    Value overlay = d.overlay("plugin", identifier, {{"PROBE_OUTSIDE_DIR", Value(d.root / "outside")}});
    ASSERT_EQ(d.add(::getpid(), executable, overlay), 0);
    bool bounded = d.daemon->waitForErr("instances are bounded to 256 tasks each", std::chrono::seconds(2));
    {
        Session session(identifier);
        ASSERT_TRUE(session.connection) << session.connection.error().description();
        // Children made with CLONE_PARENT are spawnd's; none stays a zombie.
        EXPECT_EQ(session.send(Value("clone-parent"))["made"], Value(50));
        EXPECT_TRUE(axtest::eventually([&] { return zombiesOf(d.daemon->pid()) == 0; }, std::chrono::milliseconds(1500)))
            << zombiesOf(d.daemon->pid()) << " zombies";
        // Memory past the limit is refused; tasks past it, where a cgroup bounds them.
        if (!axtest::kAddressSanitizer) {
            EXPECT_EQ(session.send(Value("memory"))["errno"], Value(ENOMEM));
        }
        int64_t made = session.send(Value("tasks"))["made"].int64Value().value_or(0);
        if (bounded) {
            EXPECT_LT(made, 256) << "tasks were not bounded";
        }
        // Busy reasons are cut to a kilobyte; spawnd does not grow with them.
        EXPECT_EQ(session.send(Value("busy-flood"))["taken"], Value(64));
        EXPECT_TRUE(axtest::eventually([&] {
            auto busy = spawn::busyExtensionInstances({identifier});
            return busy && busy->size() == 1 && (*busy)[0]["reason"].asString()->size() == 1024;
        }));
        if (!axtest::kAddressSanitizer) {  // whose quarantine keeps what was freed
            EXPECT_LT(statusField(d.daemon->pid(), "VmRSS", 10), 40 * 1024) << "kB";
        }

        // A symbolic link where TMPDIR was: the next launch refuses it, naming the path, and nothing
        // outside the container is touched.
        EXPECT_EQ(session.send(Value("swap-tmp"))["errno"], Value(0));
    }
    ASSERT_EQ(d.remove(identifier), 0);
    ASSERT_EQ(d.add(::getpid(), executable, overlay), 0);
    auto refused = spawn::connectToService(identifier);
    ASSERT_FALSE(refused);
    EXPECT_NE(refused.error().description().find("a symbolic link is where the directory " + container + "/tmp should be"),
              std::string::npos)
        << refused.error().description();
    EXPECT_TRUE(fs::is_empty(d.root / "outside"));
    EXPECT_EQ(fs::status(d.root / "outside").permissions(), outsideMode);
    fs::remove(container + "/tmp");
    fs::rename(container + "/tmp.aside", container + "/tmp");

    // spawnd killed: the instance dies with it, and what it started ends when spawnd starts again.
    pid_t instance = 0, lingering = 0;
    {
        Session session(identifier);
        ASSERT_TRUE(session.connection) << session.connection.error().description();
        instance = static_cast<pid_t>(session.send(Value("battery"))["pid"].int64Value().value_or(0));
        lingering = static_cast<pid_t>(session.send(Value("linger"))["pid"].int64Value().value_or(0));
    }
    ASSERT_GT(instance, 0);
    ASSERT_GT(lingering, 0);
    d.daemon->signal(SIGKILL);
    d.daemon->wait();
    EXPECT_TRUE(axtest::processGone(instance));
    d.start();
    if (bounded) {
        EXPECT_TRUE(axtest::processGone(lingering)) << "pid " << lingering << " outlived its spawnd";
    } else {
        ::kill(lingering, SIGKILL);
    }
}

// A host past its share of instances is refused with the reason, and spawnd runs no more instances
// than its descriptor limit serves beside a reserve, so that vigild and new hosts stay served.
TEST(Spawnd, ManyInstancesAreRefusedClearlyAndOthersStayServed) {
    Spawnd d({"--instances-per-host", "3"}, {"/usr/bin/prlimit", "--nofile=300:300"});
    EXPECT_TRUE(d.daemon->waitForErr("at most 43 instances run: the descriptor limit is 300")) << d.daemon->err();
    std::vector<Session> sessions;
    for (int i = 0; i < 4; ++i) {
        std::string identifier = "com.example.many" + std::to_string(i);
        ASSERT_EQ(d.add(::getpid(), d.plugIn(identifier), d.overlay("plugin", "")), 0);
        if (i < 3) {
            sessions.emplace_back(identifier);
            ASSERT_TRUE(sessions.back().connection) << i << ": " << sessions.back().connection.error().description();
            continue;
        }
        auto refused = spawn::connectToService(identifier);
        ASSERT_FALSE(refused);
        EXPECT_EQ(refused.error().code, EAGAIN);
        EXPECT_NE(refused.error().description().find("too many instances for host " + std::to_string(::getpid())),
                  std::string::npos)
            << refused.error().description();
    }
    EXPECT_TRUE(spawn::busyExtensionInstances({"com.example.many0"}));
    // Another host is served.
    std::string hostPeer = d.signedPeer("host", dict({{spawn::kDomainExtensionProxyEntitlement, true}}));
    axtest::Process host({hostPeer, "host", d.plugIn("com.example.other"), "com.example.other", d.overlay("plugin", "").description()});
    EXPECT_TRUE(host.waitForOut("reply ")) << host.out() << host.err();
}
