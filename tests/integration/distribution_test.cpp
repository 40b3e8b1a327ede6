// What a distribution relies on: the systemd units verify, socket activation starts each daemon on
// its first client, both daemons report readiness, and "watch" reports changes as they happen.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <regex>

#include "Annexa/AXDaemonClient.h"
#include "platform/rpx/Rpx.h"
#include "platform/spawn/Spawn.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

const std::map<std::string, std::string> kStderrLog = {{"CORVANE_LOG_SINK", "stderr"}, {"CORVANE_LOG", "default"}};

std::string executableOf(pid_t pid) {
    std::error_code ec;
    return fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", ec).string();
}

Value request(const char* name, Dictionary extra = {}) {
    extra["request"] = Value(name);
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

// A datagram socket standing in for the service manager's notification socket.
struct NotifySocket {
    axtest::TempDir dir;
    std::string path = dir / "notify";
    int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    NotifySocket() {
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
        EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        timeval timeout{5, 0};
        ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    }
    ~NotifySocket() { ::close(fd); }
    std::string next() {
        char buffer[4096];
        ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
        return n > 0 ? std::string(buffer, static_cast<size_t>(n)) : std::string();
    }
};

}  // namespace

TEST(Distribution, TheUnitsPassSystemdVerification) {
    axtest::TempDir dir;
    std::string units = axtest::binary("../dist/systemd");
    for (const char* name : {"axd.socket", "axd.service", "spawnd.socket", "spawnd.service"}) {
        // The build's programs stand in for the installed ones the units name.
        std::string text = axtest::readFile(units + "/" + name);
        text = std::regex_replace(text, std::regex("ExecStart=.*/(axd|spawnd)"), "ExecStart=" + axtest::binary("$1"));
        axtest::writeFile(dir / name, text);
    }
    auto verified = axtest::run({"/usr/bin/systemd-analyze", "verify", "--man=no", dir / "axd.socket", dir / "axd.service",
                                 dir / "spawnd.socket", dir / "spawnd.service"});
    EXPECT_EQ(verified.status, 0) << verified.out << verified.err;
    EXPECT_EQ(verified.err, "");

    // How exposed each daemon is, by systemd's own measure (lower is better): as far as a per-user
    // service can be confined without breaking what it does.
    struct Goal {
        const char* unit;
        double most;
    };
    for (Goal goal : {Goal{"axd.service", 3.5}, Goal{"spawnd.service", 5.5}}) {
        auto scored = axtest::run({"/usr/bin/systemd-analyze", "security", "--offline=yes", "--no-pager", dir / goal.unit});
        std::smatch level;
        ASSERT_TRUE(std::regex_search(scored.out, level, std::regex("Overall exposure level for [a-z.]+: ([0-9.]+)")))
            << scored.out << scored.err;
        EXPECT_LE(std::stod(level[1]), goal.most) << goal.unit << "\n" << scored.out;
    }
}

TEST(Distribution, SocketActivationStartsEachDaemonOnItsFirstClient) {
    axtest::PlatformRoot root;
    std::string rpx = fs::path(rpx::endpointPath("x")).parent_path();
    fs::create_directories(rpx);
    fs::permissions(rpx, fs::perms::owner_all);
    std::string activate = "/usr/bin/systemd-socket-activate";
    // It passes on only the environment it is told to.
    std::string rootVariable = "--setenv=CORVANE_ROOT=" + root.path();

    axtest::Process axd({activate, rootVariable, "-l", rpx::endpointPath("com.corvane.annexa.axd"),
                         "--fdname=com.corvane.annexa.axd", axtest::binary("axd")}, kStderrLog);
    std::vector<std::string> spawndArgs = {activate, rootVariable};
    for (const char* endpoint : {"com.corvane.spawnd", "com.corvane.vigild", "com.corvane.sandbox", "com.corvane.pcx"}) {
        spawndArgs.push_back("-l");
        spawndArgs.push_back(rpx::endpointPath(endpoint));
    }
    spawndArgs.push_back(axtest::binary("spawnd"));
    axtest::Process spawnd(spawndArgs, kStderrLog);
    ASSERT_TRUE(axtest::eventually([&] { return axd.err().find("Listening on") != std::string::npos; })) << axd.err();
    ASSERT_TRUE(axtest::eventually([&] { return spawnd.err().find("Communication") != std::string::npos ||
                                                 spawnd.err().find("Listening on") != std::string::npos; }));
    // Nothing runs until a client comes.
    EXPECT_EQ(executableOf(axd.pid()), activate);
    EXPECT_EQ(executableOf(spawnd.pid()), activate);

    annexa::AXDaemonClient client;
    auto reply = client.wait([&](auto done) { client.send(request("bulk"), done); });
    EXPECT_TRUE(reply.ok()) << reply.description();
    EXPECT_EQ(reply.value, dict({}));
    EXPECT_EQ(executableOf(axd.pid()), axtest::binary("axd"));

    auto busy = spawn::busyExtensionInstances({"com.example.nothing"});
    ASSERT_TRUE(busy) << busy.error().description();
    EXPECT_EQ(busy->size(), 0u);
    EXPECT_EQ(executableOf(spawnd.pid()), axtest::binary("spawnd"));
    // Every endpoint is served on the socket the service manager made.
    auto consent = axtest::run({axtest::binary("pcx"), "list"});
    EXPECT_EQ(consent.status, 0) << consent.err;
    spawnd.signal(SIGTERM);
    EXPECT_EQ(spawnd.wait(5s), 0);
    // The service manager's socket files stay for the next start.
    EXPECT_TRUE(fs::exists(rpx::endpointPath("com.corvane.spawnd")));
}

TEST(Distribution, BothDaemonsTellTheServiceManagerWhenTheyAreReady) {
    axtest::PlatformRoot root;
    NotifySocket notify;
    auto environment = kStderrLog;
    environment["NOTIFY_SOCKET"] = notify.path;
    axtest::Process axd({axtest::binary("axd")}, environment);
    std::string ready = notify.next();
    EXPECT_NE(ready.find("READY=1"), std::string::npos) << ready;
    EXPECT_NE(ready.find("STATUS=serving " + rpx::endpointPath("com.corvane.annexa.axd")), std::string::npos) << ready;
    EXPECT_TRUE(axtest::endpointAnswers(rpx::endpointPath("com.corvane.annexa.axd")));

    axtest::Process spawnd({axtest::binary("spawnd")}, environment);
    ready = notify.next();
    EXPECT_NE(ready.find("READY=1"), std::string::npos) << ready;
    EXPECT_TRUE(axtest::endpointAnswers(rpx::endpointPath("com.corvane.pcx")));
    spawnd.signal(SIGTERM);
    EXPECT_NE(notify.next().find("STOPPING=1"), std::string::npos);
    EXPECT_EQ(spawnd.wait(5s), 0);
}

TEST(Distribution, WatchersSeeEveryChangeAsItHappensAndASlowOneIsDropped) {
    axtest::PlatformRoot root;
    axtest::Process axd({axtest::binary("axd")}, kStderrLog);
    ASSERT_TRUE(axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath("com.corvane.annexa.axd")); }));
    auto queue = dispatch::Queue::create("test.watch");

    // A watcher that reads everything, and one that stops reading after its first event.
    std::mutex mutex;
    std::vector<Value> seen;
    auto watcher = rpx::Connection::connect("com.corvane.annexa.axd", queue);
    watcher->setEventHandler([&](const rpx::Event& ev) {
        if (ev.isError()) return;
        std::lock_guard lock(mutex);
        seen.push_back(ev.message);
    });
    watcher->resume();
    ASSERT_EQ(watcher->sendWithReplySync(request("watch")).value, dict({}));
    std::promise<void> unblock;
    std::shared_future<void> released = unblock.get_future().share();
    auto slow = rpx::Connection::connect("com.corvane.annexa.axd", dispatch::Queue::create("test.slow"));
    slow->setEventHandler([released](const rpx::Event& ev) {
        if (!ev.isError()) released.wait();
    });
    slow->resume();
    ASSERT_EQ(slow->sendWithReplySync(request("watch")).value, dict({}));

    std::string app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    std::string plugIn = axtest::makeBundle(app + "/PlugIns", "One.appex",
                                            axtest::plugInInfo("com.example.one", dict({{"KSExtensionAttributes", dict({})}})),
                                            "/bin/true");
    annexa::AXDaemonClient client;
    auto send = [&](const Value& message) { return client.wait([&](auto done) { client.send(message, done); }).value; };
    ASSERT_EQ(send(request("add", {{"paths", Value(Array{Value(app)})}})), dict({}));
    auto events = [&](const std::string& kind) {
        std::lock_guard lock(mutex);
        std::vector<Value> found;
        for (const Value& event : seen) {
            if (event["event"] == Value(kind)) found.push_back(event);
        }
        return found;
    };
    ASSERT_TRUE(axtest::eventually([&] { return events("installed").size() == 1; }));
    Value one = events("installed")[0]["plugin"];
    EXPECT_EQ(one["identifier"], Value("com.example.one"));
    EXPECT_EQ(one["path"], Value(plugIn));
    const UUID* uuid = one["uuid"].asUUID();
    ASSERT_TRUE(uuid);

    // Annotations with their old and new values; enough of them to leave the slow watcher behind.
    std::string large(64 * 1024, 'x');
    for (int i = 0; i < 40; ++i) {
        Value annotations = dict({{"election", 1}, {"extension", dict({{"n", i}, {"padding", large}})}});
        ASSERT_EQ(send(request("annotate", {{"uuids", Value(Array{Value(*uuid)})}, {"annotations", annotations}})), dict({}));
    }
    EXPECT_TRUE(axtest::eventually([&] { return events("annotation").size() == 40; })) << events("annotation").size();
    auto annotations = events("annotation");
    ASSERT_FALSE(annotations.empty());
    EXPECT_TRUE(annotations[0]["old"].isNull());
    EXPECT_EQ(annotations[0]["new"]["extension"]["n"], Value(0));
    EXPECT_EQ(annotations.back()["old"]["extension"]["n"], Value(38));
    EXPECT_TRUE(axd.waitForErr("dropping watcher pid")) << axd.err();

    // Holds placed and released, with their plug-ins.
    Value granted = send(request("lock", {{"paths", Value(Array{Value(plugIn)})}, {"flags", uint64_t{2}}}));
    ASSERT_TRUE(granted["uuids"].isUUID()) << granted.description();
    EXPECT_EQ(send(request("lock", {{"uuids", Value(Array{granted["uuids"]})}})), dict({}));
    ASSERT_TRUE(axtest::eventually([&] { return events("release").size() == 1; }));
    // Who holds what, and never the token that would release it.
    EXPECT_TRUE(events("hold")[0]["token"].isNull()) << events("hold")[0].description();
    EXPECT_EQ(events("hold")[0]["hold"], events("release")[0]["hold"]);
    EXPECT_GT(events("hold")[0]["pid"].int64Value().value_or(0), 0);
    EXPECT_EQ(events("hold")[0].description().find(granted["uuids"].asUUID()->string()), std::string::npos);
    EXPECT_EQ(events("release")[0]["plugins"], Value(Array{one})) << events("release")[0].description() << one.description();

    // Uninstalling, whoever does it.
    EXPECT_EQ(axtest::run({axtest::binary("vantry"), "unregister", app}).status, 0);
    EXPECT_TRUE(axtest::eventually([&] { return events("uninstalled").size() == 1; }));
    unblock.set_value();
}
