#include <gtest/gtest.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <fcntl.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <sstream>
#include <thread>

#include "Annexa/AXDaemonClient.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/notify/Notify.h"
#include "platform/plist/Plist.h"
#include "platform/prefs/Prefs.h"
#include "platform/rpx/Rpx.h"
#include "platform/vantry/Vantry.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

constexpr const char* kChange = "com.corvane.annexa.annotation-change";

// The real daemon on a private platform root, with its log on standard error.
struct Daemon {
    axtest::PlatformRoot root;
    std::unique_ptr<axtest::Process> axd;
    dispatch::QueuePtr queue = dispatch::Queue::create("test.client");

    explicit Daemon(std::vector<std::string> args = {}) { start(std::move(args)); }
    ~Daemon() { stop(); }
    void start(std::vector<std::string> args = {}) {
        args.insert(args.begin(), axtest::binary("axd"));
        axd = std::make_unique<axtest::Process>(args, std::map<std::string, std::string>{
                                                          {"CORVANE_LOG", "debug"}, {"CORVANE_LOG_SINK", "stderr"}, {"CORVANE_LOG_PRIVATE", "1"}});
        // A socket file left by the daemon before does not count: the endpoint must answer.
        axtest::eventually([] { return axtest::endpointAnswers(rpx::endpointPath("com.corvane.annexa.axd")); });
    }
    void stop() {
        axd->signal(SIGTERM);
        axd->wait(5s);
    }
    std::shared_ptr<rpx::Connection> connect() {
        auto c = rpx::Connection::connect("com.corvane.annexa.axd", queue);
        c->setEventHandler([](const rpx::Event&) {});
        c->resume();
        return c;
    }
    Value send(const Value& message) {
        auto c = connect();
        auto r = c->sendWithReplySync(message);
        EXPECT_TRUE(r.ok()) << r.description();
        return r.value;
    }
    axtest::RunResult axctl(std::vector<std::string> args, const std::string& input = {},
                            const std::string& program = "") {
        args.insert(args.begin(), program.empty() ? axtest::binary("axctl") : program);
        return axtest::run(args, {}, input);
    }
};

Value request(const char* name, Dictionary extra = {}) {
    extra["request"] = Value(name);
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

Value error(uint64_t code, const std::string& text) {
    return dict({{"errorcode", Value(code)}, {"error", Value(text)}});
}

// An application with two plug-ins.
std::string makeApp(const std::string& root) {
    std::string app = axtest::makeBundle(root, "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    for (const char* name : {"One", "Two"}) {
        axtest::makeBundle(app + "/PlugIns", std::string(name) + ".appex",
                           axtest::plugInInfo(std::string("com.example.") + name,
                                              dict({{"KSExtensionProtocol", "P"},
                                                    {"KSExtensionAttributes", dict({{"KSExtensionVersion", "1"}})}})),
                           "/bin/true");
    }
    return app;
}

}  // namespace

TEST(Axd, MalformedRequestsGetTheirErrorReplies) {
    Daemon d;
    UUID unknown = UUID::random();
    struct Case {
        const char* name;
        Value message;
        Value reply;
    };
    const Case cases[] = {
        {"no version", dict({{"request", "bulk"}}), error(7, "unsupported protocol version 0 (current 3)")},
        {"version 1", dict({{"request", "bulk"}, {"version", uint64_t{1}}}), error(7, "unsupported protocol version 1 (current 3)")},
        {"version 4", dict({{"request", "bulk"}, {"version", uint64_t{4}}}), error(7, "unsupported protocol version 4 (current 3)")},
        // JSON has no unsigned numbers: a signed 3 is version 3, and a number that is no version is
        // named as it was sent.
        {"signed version 3 is served", dict({{"request", "bulk"}, {"version", int64_t{3}}}), dict({})},
        {"negative version", dict({{"request", "bulk"}, {"version", int64_t{-1}}}),
         error(7, "unsupported protocol version -1 (current 3)")},
        {"version of another type", dict({{"request", "bulk"}, {"version", 3.0}}),
         error(7, "unsupported protocol version 0 (current 3)")},
        {"version 2 is served", dict({{"request", "bulk"}, {"version", uint64_t{2}}}), dict({})},
        {"no request name", dict({{"version", uint64_t{3}}}), error(4, "invalid request format (missing type)")},
        {"case-changed name", request("Add"), error(4, "unrecognized request")},
        {"unknown name", request("frobnicate"), error(4, "unrecognized request")},
        {"relative path", request("add", {{"paths", Value(Array{Value("rel/x")})}}), error(9, "absolute path required: rel/x")},
        {"non-string path", request("add", {{"paths", Value(Array{Value(5)})}}), error(4, "invalid request format")},
        {"no paths", request("add"), error(4, "invalid request format")},
        {"missing bundle", request("add", {{"paths", Value(Array{Value("/no/such.app")})}}),
         error(9, "invalid plugin path: /no/such.app")},
        {"empty paths", request("add", {{"paths", Value(Array{})}}), dict({})},
        {"bulk with flags", request("bulk", {{"flags", uint64_t{0xff}}}), dict({})},
        {"annotate without annotations", request("annotate"), error(4, "invalid request format (bad annotations dictionary)")},
        {"annotate, election a string", request("annotate", {{"annotations", dict({{"election", "1"}})}}),
         error(4, "invalid request format (annotation election)")},
        {"annotate, extension a number", request("annotate", {{"annotations", dict({{"election", 1}, {"extension", 3}})}}),
         error(4, "invalid request format (annotation extension)")},
        {"annotate nothing", request("annotate", {{"annotations", dict({{"other", 1}})}}), dict({})},
        {"annotate, no uuids", request("annotate", {{"annotations", dict({{"election", 1}})}}),
         error(4, "invalid request format (uuid)")},
        {"annotate, uuid as text", request("annotate", {{"annotations", dict({{"election", 1}})}, {"uuids", Value(Array{Value(unknown.string())})}}),
         error(4, "invalid request (bad uuid array)")},
        {"annotate, unknown uuid", request("annotate", {{"annotations", dict({{"election", 1}})}, {"uuids", Value(Array{Value(unknown)})}}),
         error(4, "no such plugin (uuid not found)")},
        {"bulk-annotate, value not a dictionary", request("bulk-annotate", {{"annotations", dict({{unknown.string(), 1}})}}),
         error(18, "annotations values must be dictionaries")},
        {"bulk-annotate, key not a UUID", request("bulk-annotate", {{"annotations", dict({{"nope", dict({})}})}}),
         error(18, "invalid plug-in UUID value")},
        {"bulk-annotate, unknown UUID", request("bulk-annotate", {{"annotations", dict({{unknown.string(), dict({})}})}}),
         error(2, "no plug-in with the requested uuid")},
    };
    for (const auto& c : cases) EXPECT_EQ(d.send(c.message), c.reply) << c.name;
    // Only the requests that changed nothing but succeeded without plug-ins post nothing.
    EXPECT_EQ(notify::count(kChange), 0u);
    EXPECT_TRUE(d.axd->waitForErr("bulk options 0xff not supported"));
}

// Every request is answered, and nothing is acknowledged that the annotation file cannot hold: such
// values are refused before anything changes, so a later save cannot fail because of them.
TEST(Axd, AnnotationsTheFileCannotHoldAreRefusedAndAnswered) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    UUID one = (*registry)->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    auto descriptor = Value(std::make_shared<corvane::FileDescriptor>(::dup(0)));
    const Value bad = error(4, "invalid request format (bad annotations dictionary)");
    const std::pair<const char*, Value> values[] = {
        {"a null", Value()},
        {"a descriptor", descriptor},
        {"a UUID", Value(UUID::random())},
        {"a control character in a string", Value("bell \x01")},
        {"a date past year 9999", Value(corvane::Date{int64_t{300000000000} * 1000000})},
        {"a control character in a key", dict({{"k\x01", 1}})},
    };
    auto c = d.connect();
    for (const auto& [name, value] : values) {
        Value extension = dict({{"deep", Value(Array{value})}});
        auto annotate = c->sendWithReplySync(request("annotate", {{"annotations", dict({{"extension", extension}})},
                                                                  {"uuids", Value(Array{Value(one)})}}));
        ASSERT_TRUE(annotate.ok()) << name;
        EXPECT_EQ(annotate.value, bad) << name;
        auto bulk = c->sendWithReplySync(request("bulk-annotate", {{"annotations", dict({{one.string(), extension}})}}));
        ASSERT_TRUE(bulk.ok()) << name;
        EXPECT_EQ(bulk.value, bad) << name;
    }
    // Hundreds of them leave the connection serving, and a good annotation is written.
    for (int i = 0; i < 300; ++i) {
        ASSERT_TRUE(c->sendWithReplySync(request("annotate", {{"annotations", dict({{"x", Value()}})}})).ok()) << i;
    }
    auto good = c->sendWithReplySync(request("annotate", {{"annotations", dict({{"election", 2}})},
                                                          {"uuids", Value(Array{Value(one)})}}));
    ASSERT_TRUE(good.ok());
    EXPECT_EQ(good.value, dict({}));
    std::string file = layout::userDataDir() + "/containers/10/com.corvane.axd/com.corvane.annexa/Annotations";
    EXPECT_EQ((*plist::readFile(file))["data"]["com.example.One"], dict({{"election", 2}}));
    EXPECT_FALSE(d.axd->waitForErr("unable to save annotations", 100ms));

    // A version is reported as it was sent, whatever its size.
    EXPECT_EQ(d.send(dict({{"request", "bulk"}, {"version", (uint64_t{1} << 32) + 3}})),
              error(7, "unsupported protocol version 4294967299 (current 3)"));
    EXPECT_EQ(d.send(dict({{"request", "bulk"}, {"version", ~uint64_t{0}}})),
              error(7, "unsupported protocol version 18446744073709551615 (current 3)"));
}

// One request writes the annotation file once, after its last change and before its reply, also
// when it ends in an error after earlier plug-ins changed.
TEST(Axd, ARequestWritesTheAnnotationFileOnce) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    UUID one = (*registry)->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    UUID two = (*registry)->plugInForPath(app + "/PlugIns/Two.appex")->uuid();
    std::string file = layout::userDataDir() + "/containers/10/com.corvane.axd/com.corvane.annexa/Annotations";
    std::string dir = file.substr(0, file.rfind('/'));
    ASSERT_EQ(d.send(request("annotate", {{"annotations", dict({{"election", 1}})}, {"uuids", Value(Array{Value(one)})}})),
              dict({}));
    // Each write renames a new file into place; count the renames.
    int in = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    ASSERT_GE(inotify_add_watch(in, dir.c_str(), IN_MOVED_TO), 0);
    auto renames = [&] {
        int count = 0;
        alignas(struct inotify_event) char buf[4096];
        ssize_t n;
        while ((n = ::read(in, buf, sizeof buf)) > 0)
            for (char* p = buf; p < buf + n; p += sizeof(struct inotify_event) + reinterpret_cast<struct inotify_event*>(p)->len)
                ++count;
        return count;
    };
    Array many;
    for (int i = 0; i < 200; ++i) many.push_back(Value(i % 2 ? one : two));
    EXPECT_EQ(d.send(request("annotate", {{"annotations", dict({{"election", 3}})}, {"uuids", Value(many)}})), dict({}));
    EXPECT_EQ(renames(), 1);
    // Two known plug-ins change, then an unknown UUID ends the request: the changes are on disk
    // when the error comes.
    EXPECT_EQ(d.send(request("annotate", {{"annotations", dict({{"election", 4}})},
                                         {"uuids", Value(Array{Value(one), Value(two), Value(UUID::random())})}})),
              error(4, "no such plugin (uuid not found)"));
    EXPECT_EQ(renames(), 1);
    EXPECT_EQ((*plist::readFile(file))["data"]["com.example.Two"], dict({{"election", 4}}));
    ::close(in);
}

// A skeleton from `axctl bundle new` registers as it is, and `bundle check` says what each part of
// the platform would make of a bundle, before and after registration.
TEST(Axd, BundleNewWritesSkeletonsThatCheckSaysHowThePlatformSeesThem) {
    Daemon d;
    const std::string dir = d.root.path();
    struct New {
        std::vector<std::string> args;
        const char* bundle;
        const char* expected;  // in check's output
    };
    const New skeletons[] = {
        {{"--plugin", "--identifier", "com.example.tools.echo"}, "echo.appex", "sandbox          plugin: the profile of every"},
        {{"--plugin", "--identifier", "com.example.keys", "--extension-point", "com.corvane.keyboard-service", "--name", "Keys"},
         "Keys.appex", "sandbox          keyboard: a keyboard"},
        {{"--plugin", "--language", "c", "--identifier", "com.example.cecho"}, "cecho.appex", "extension point  com.example.cecho"},
        {{"--app", "--identifier", "com.example.host"}, "host.app", "(an application)"},
    };
    for (const auto& c : skeletons) {
        std::vector<std::string> args = {"bundle", "new"};
        args.insert(args.end(), c.args.begin(), c.args.end());
        args.push_back(dir);
        auto made = d.axctl(args);
        ASSERT_EQ(made.status, 0) << made.err;
        auto check = d.axctl({"bundle", "check", dir + "/" + c.bundle});
        EXPECT_EQ(check.status, 0) << check.out << check.err;
        EXPECT_NE(check.out.find("registration     the registry accepts it"), std::string::npos) << check.out;
        EXPECT_NE(check.out.find(c.expected), std::string::npos) << check.out;
    }
    EXPECT_TRUE(fs::exists(dir + "/cecho.c"));
    EXPECT_EQ(fs::status(dir + "/echo.appex/echo").permissions() & fs::perms::owner_exec, fs::perms::owner_exec);
    EXPECT_EQ(d.axctl({"bundle", "new", "--plugin", "--identifier", "com.example.tools.echo", dir}).status, 73);
    // The C source beside a bundle is the user's once written: a second skeleton does not replace it.
    EXPECT_EQ(d.axctl({"bundle", "new", "--plugin", "--language", "c", "--name", "Other", "--identifier", "com.example.cecho", dir})
                  .status,
              73);
    EXPECT_FALSE(fs::exists(dir + "/Other.appex"));

    // A plug-in inside its application: found once the application is registered. One standing
    // alone is registered but hidden from hosts.
    std::string echo = dir + "/echo.appex";
    ASSERT_EQ(d.axctl({"bundle", "new", "--plugin", "--identifier", "com.example.host.inner", dir + "/host.app/PlugIns"}).status, 0);
    std::string inner = dir + "/host.app/PlugIns/inner.appex";
    EXPECT_NE(d.axctl({"bundle", "check", inner}).out.find("not registered: `axctl add " + inner), std::string::npos);
    ASSERT_EQ(d.axctl({"add", dir + "/host.app"}).status, 0);
    ASSERT_EQ(d.axctl({"add", echo}).status, 0);
    auto registered = d.axctl({"bundle", "check", inner});
    EXPECT_NE(registered.out.find("registered; a host matching -r KSExtensionIdentifier=com.example.host.inner: returned"),
              std::string::npos)
        << registered.out;
    EXPECT_NE(d.axctl({"bundle", "check", echo}).out.find("registered, but hidden from this client"), std::string::npos);

    struct Bad {
        std::vector<std::string> args;
        int status;
        const char* message;
    };
    axtest::writeFile(dir + "/host.app/Info.plist", "<plist");
    const Bad bad[] = {
        {{"bundle", "check", dir + "/host.app"}, 65, "malformed Info.plist"},
        {{"bundle", "check", dir + "/none.appex"}, 65, "Info.plist"},
        {{"bundle", "new", "--identifier", "x", dir}, 64, "say --plugin or --app"},
        {{"bundle", "new", "--plugin", dir}, 64, "needs --identifier"},
        {{"bundle", "new", "--plugin", "--identifier", "a/b", dir}, 64, "reverse-DNS"},
        {{"bundle", "new", "--plugin", "--identifier", "x", "--language", "rust", dir}, 64, "c or python"},
        {{"bundle", "rename", dir}, 64, "bundle new or bundle check"},
    };
    for (const auto& b : bad) {
        auto r = d.axctl(b.args);
        EXPECT_EQ(r.status, b.status) << b.args[2] << r.out << r.err;
        EXPECT_NE((r.out + r.err).find(b.message), std::string::npos) << r.out << r.err;
    }
}

TEST(Axd, RegistrationAndAnnotationsThroughTheTools) {
    Daemon d;
    // A bundle the registry cannot read: the reply's text is fixed, the reason comes beside it.
    std::string broken = axtest::makeBundle(d.root.path(), "Broken.app", axtest::appInfo("com.example.broken"), "/bin/true");
    axtest::makeBundle(broken + "/PlugIns", "NoDictionary.appex", axtest::appInfo("com.example.nodict"), "/bin/true");
    auto refusedAdd = d.axctl({"add", broken});
    EXPECT_EQ(refusedAdd.status, 1);
    EXPECT_NE(refusedAdd.err.find("unable to register plug-in at " + broken + ": no plug-in dictionary (KSExtension) in " +
                                  broken + "/PlugIns/NoDictionary.appex (error 2)"),
              std::string::npos)
        << refusedAdd.err;
    EXPECT_TRUE(d.axd->waitForErr("<error> com.corvane.Annexa:ops: Vantry cannot register"));

    std::string app = makeApp(d.root.path());
    auto add = d.axctl({"add", app});
    ASSERT_EQ(add.status, 0) << add.err;
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    auto one = (*registry)->plugInForPath(app + "/PlugIns/One.appex");
    auto two = (*registry)->plugInForPath(app + "/PlugIns/Two.appex");
    ASSERT_TRUE(one && two);

    // annotate two plug-ins: both change, one notification.
    auto annotate = d.axctl({"annotate", "--election", "1", one->uuid().string(), two->uuid().string()});
    ASSERT_EQ(annotate.status, 0) << annotate.err;
    EXPECT_EQ(notify::count(kChange), 1u);
    std::string file = layout::userDataDir() + "/containers/10/com.corvane.axd/com.corvane.annexa/Annotations";
    auto onDisk = plist::readFile(file);
    ASSERT_TRUE(onDisk) << file;
    EXPECT_EQ(*onDisk, dict({{"version", 16},
                             {"data", dict({{"com.example.One", dict({{"election", 1}})},
                                            {"com.example.Two", dict({{"election", 1}})}})}}));
    // The second UUID unknown: the first is changed and saved, no notification.
    Value partial = d.send(request("annotate", {{"annotations", dict({{"election", 2}})},
                                                 {"uuids", Value(Array{Value(one->uuid()), Value(UUID::random())})}}));
    EXPECT_EQ(partial, error(4, "no such plugin (uuid not found)"));
    EXPECT_EQ(notify::count(kChange), 1u);
    // A plug-in named twice, then an element that is no UUID: changed, saved, and refused.
    Value repeated = d.send(request("annotate", {{"annotations", dict({{"election", 3}})},
                                                  {"uuids", Value(Array{Value(two->uuid()), Value(two->uuid()), Value("two")})}}));
    EXPECT_EQ(repeated, error(4, "invalid request (bad uuid array)"));
    EXPECT_EQ((*plist::readFile(file))["data"]["com.example.Two"], dict({{"election", 3}}));
    // bulk-annotate replaces the extension whole and keeps the election.
    ASSERT_TRUE(plist::writeXMLFile(d.root / "bulk.plist", dict({{one->uuid().string(), dict({})}})).ok());
    ASSERT_EQ(d.axctl({"bulk-annotate", d.root / "bulk.plist"}).status, 0);
    EXPECT_EQ(notify::count(kChange), 2u);
    EXPECT_EQ((*plist::readFile(file))["data"]["com.example.One"], dict({{"election", 2}, {"extension", dict({})}}));
    EXPECT_TRUE(d.axd->waitForErr("election := 1"));

    // axctl's rules: KEY=PATTERN is a string as written, also when it looks like a number (the
    // election's subject is the text "2"); KEY:=VALUE is a value in the notation.
    struct RuleCase {
        std::string rule;
        int status;
        std::string found;  // an identifier the answer has, or "" for none
    };
    for (const RuleCase& c : std::vector<RuleCase>{{"KSUserElection=2", 0, "com.example.One"},
                                                   {"KSUserElection=3", 0, "com.example.Two"},
                                                   {"KSUserElection:=\"3\"", 0, "com.example.Two"},
                                                   {"KSUserElection:=[3", 65, ""},
                                                   {":=3", 64, ""}}) {
        auto matched = d.axctl({"match", "-r", c.rule});
        EXPECT_EQ(matched.status, c.status) << c.rule << "\n" << matched.err;
        if (!c.found.empty()) {
            EXPECT_NE(matched.out.find(c.found), std::string::npos) << c.rule << "\n" << matched.out;
            EXPECT_EQ(matched.out.find('\n'), matched.out.size() - 1) << c.rule << ": one plug-in\n" << matched.out;
        }
    }

    // remove: refused without the manager entitlement, served with it.
    auto refused = d.axctl({"remove", app});
    EXPECT_EQ(refused.status, 77);  // refused for lack of an entitlement
    EXPECT_NE(refused.err.find("caller lacks entitlement for this operation (error 11)"), std::string::npos) << refused.err;
    EXPECT_TRUE((*registry)->plugInForPath(app + "/PlugIns/One.appex"));
    EXPECT_EQ(d.send(request("remove", {{"paths", Value(Array{})}})), dict({}));  // no path: no test
    auto key = codesign::generateKey();
    ASSERT_TRUE(codesign::writeKeyPair(d.root / "key", key).ok());
    ASSERT_TRUE(codesign::trustKey(d.root / "key.pub").ok());
    std::string manager = d.root / "bin/axctl";
    fs::create_directories(d.root / "bin");
    fs::copy_file(axtest::binary("axctl"), manager);
    ASSERT_TRUE(codesign::sign(manager, key, std::nullopt, dict({{"com.corvane.private.annexa.manager", true}})).ok());
    auto removed = d.axctl({"remove", app}, {}, manager);
    EXPECT_EQ(removed.status, 0) << removed.err;
    EXPECT_FALSE((*registry)->plugInForPath(app + "/PlugIns/One.appex"));
    EXPECT_TRUE(d.axd->waitForErr("plug-in UNINSTALLED:com.example.One"));
    EXPECT_TRUE(d.axd->waitForErr("requesting spawnd termination of plug-in: com.example.One(1)"));
}

TEST(Axd, AHostWrittenInCDrivesTheDaemon) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    auto one = (*registry)->plugInForPath(app + "/PlugIns/One.appex");
    ASSERT_TRUE(one);
    auto host = axtest::run({axtest::binary("annexa_c_client"), app, one->uuid().string()});
    ASSERT_EQ(host.status, 0) << host.err;
    const std::string nobody = rpx::endpointPath("com.nobody.here");
    EXPECT_EQ(host.out,
              "send: 0 {}\n"
              "send garbage: -1 the message is not one value in the text notation: at offset 1: expected a key in double quotes\n"
              "add: 0 -\n"
              "add relative: 9 absolute path required: relative/App.app\n"
              "annotate: 0 -\n"
              "annotate string election: 4 invalid request format (annotation election)\n"
              "annotate bad uuid: -1 not a UUID: not-a-uuid\n"
              "match: 0 One\n"
              "match garbage: -1 the rules are not one value in the text notation: at offset 1: expected a key in double quotes\n"
              "ready: 4 unable\n"
              "access: 0 two tokens\n"
              "lock: 0 token\n"
              "ready while held: 11 access to plugin com.example.One denied: the plug-in is on hold\n"
              "unlock: 0 -\n"
              "lock bad flags: 4 invalid request format (unsupported hold flags)\n"
              "receipt: 2 caller is not a known plug-in\n"
              "bulk-annotate: 0 -\n"
              "notation 7: -1\n"
              "json send: 0 {}\n"
              "json match: 0 plain numbers\n"
              "watch: started\n"
              "watch nothing yet: -3 no event came in time\n"
              "json annotate: 0 -\n"
              "watch event: 0 annotation\n"
              "json annotate in the text notation: -1 the annotations are not one JSON value: at offset 14: expected \",\" or \"}\"\n"
              "remove: 11 caller lacks entitlement for this operation\n"
              "unreachable: -2 cannot reach the daemon at com.nobody.here: nothing answers on " + nobody + "\n"
              "send unreachable: -2 cannot reach the daemon at com.nobody.here: nothing answers on " + nobody + "\n");
    // The library logged its communications errors, but not on the host's standard error.
    EXPECT_EQ(host.err, "");
    std::string file = layout::userDataDir() + "/containers/10/com.corvane.axd/com.corvane.annexa/Annotations";
    EXPECT_EQ((*plist::readFile(file))["data"]["com.example.One"],
              dict({{"election", 0}, {"extension", dict({{"from", "C"}})}}));
}

// A long-running host keeps its client: the request after the daemon went away fails as
// unreachable, and the first one after it came back connects again and is served.
TEST(Axd, AHostKeepsItsClientAcrossADaemonRestart) {
    Daemon d;
    annexa::AXDaemonClient client;
    auto bulk = [&] { return client.wait([&](auto done) { client.bulkPlugIns(0, done); }); };
    EXPECT_TRUE(bulk().ok());
    d.stop();
    auto gone = bulk();
    EXPECT_FALSE(gone.ok());
    EXPECT_EQ(gone.description(), "Connection invalid");
    d.start();
    for (int i = 0; i < 3; ++i) {
        auto served = bulk();
        EXPECT_TRUE(served.ok()) << i << ": " << served.description();
        EXPECT_EQ(served.value, dict({}));
    }
}

// Out of descriptors, the daemon sheds new connections instead of spinning on them, and serves
// again once descriptors are free.
TEST(Axd, OutOfDescriptorsTheDaemonBacksOffAndRecovers) {
#if defined(__has_feature)
#if __has_feature(address_sanitizer)
    // The sanitizers' runtime needs descriptors of its own (it probes memory through a pipe), and
    // without them reports errors that are not there.
    GTEST_SKIP() << "not under the sanitizers";
#endif
#endif
    axtest::PlatformRoot root;
    axtest::Process axd({"/bin/sh", "-c", "ulimit -n 40 && exec \"$0\"", axtest::binary("axd")},
                        {{"CORVANE_LOG_SINK", "stderr"}});
    std::string endpoint = rpx::endpointPath("com.corvane.annexa.axd");
    ASSERT_TRUE(axtest::eventually([&] { return axtest::endpointAnswers(endpoint); }));
    auto cpuTicks = [&] {
        std::string stat = axtest::readFile("/proc/" + std::to_string(axd.pid()) + "/stat");
        std::istringstream fields(stat.substr(stat.rfind(')') + 2));
        std::string field;
        long long utime = 0, stime = 0;
        for (int i = 3; i <= 15 && fields >> field; ++i) {
            if (i == 14) utime = std::stoll(field);
            if (i == 15) stime = std::stoll(field);
        }
        return utime + stime;
    };
    std::vector<int> held;
    for (int i = 0; i < 50; ++i) {
        int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr {};
        addr.sun_family = AF_UNIX;
        std::memcpy(addr.sun_path, endpoint.c_str(), endpoint.size() + 1);
        if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) {
            held.push_back(fd);
        } else {
            ::close(fd);
        }
    }
    std::this_thread::sleep_for(200ms);
    long long start = cpuTicks();
    std::this_thread::sleep_for(1s);
    EXPECT_LT(cpuTicks() - start, 30) << "clock ticks of CPU in one second\n" << axd.err();  // spinning: ~100
    EXPECT_TRUE(axd.waitForErr("out of file descriptors"));
    for (int fd : held) ::close(fd);
    annexa::AXDaemonClient client;
    EXPECT_TRUE(axtest::eventually([&] { return client.wait([&](auto done) { client.bulkPlugIns(0, done); }).ok(); }))
        << axd.err();
    axd.signal(SIGTERM);
    EXPECT_EQ(axd.wait(5s), 0) << axd.err();
}

// A client sending messages that are no requests is logged a few times a second, each line cut
// short, however fast it sends.
TEST(Axd, UnexpectedMessagesAreLoggedSparingly) {
    Daemon d;
    auto c = d.connect();
    for (int i = 0; i < 200; ++i) c->send(Value(std::string(10000, 'x')));
    ASSERT_TRUE(c->sendWithReplySync(request("bulk")).ok());  // after the 200, in order
    std::string err = d.axd->err();
    size_t lines = 0;
    for (size_t at = err.find("unexpected message: "); at != std::string::npos; at = err.find("unexpected message: ", at + 1)) {
        ++lines;
        size_t end = err.find('\n', at);
        EXPECT_LT(end - at, 400u);
    }
    EXPECT_GE(lines, 1u);
    EXPECT_LE(lines, 15u);
}

// Discovery through the real daemon: visibility, rules, collapsing by version, the election,
// exclusions, replacement marks, authorization of signed hosts and the explanation.
TEST(Axd, MatchFindsWhatFitsOneRegistrationPerIdentifier) {
    Daemon d;
    auto key = codesign::generateKey();
    ASSERT_TRUE(codesign::writeKeyPair(d.root / "key", key).ok());
    ASSERT_TRUE(codesign::trustKey(d.root / "key.pub").ok());
    auto plugIn = [&](const std::string& app, const char* name, const char* id, const char* version, const Value& ents) {
        std::string path = axtest::makeBundle(
            app + "/PlugIns", std::string(name) + ".appex",
            axtest::plugInInfo(id, dict({{"KSExtensionProtocol", "P"},
                                         {"KSExtensionAttributes", dict({{"KSExtensionVersion", version}})}})),
            "/bin/true");
        EXPECT_TRUE(codesign::sign(path, key, std::nullopt, ents).ok());
    };
    std::string app = axtest::makeBundle(d.root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    plugIn(app, "Old", "com.example.one", "1.9", dict({}));
    plugIn(app, "Two", "com.example.two", "1", dict({}));
    std::string other = axtest::makeBundle(d.root.path(), "Other.app", axtest::appInfo("com.example.other"), "/bin/true");
    plugIn(other, "New", "com.example.one", "1.10", dict({}));
    plugIn(other, "Replacer", "com.example.replacer", "1", dict({{"com.corvane.developer.replace-plugin", "com.example.two"}}));
    // Dedicated to its own application: a host outside it (axctl is in no bundle) never sees it.
    std::string dedicated = axtest::makeBundle(
        other + "/PlugIns", "Own.appex",
        axtest::plugInInfo("com.example.own", dict({{"KSExtensionProtocol", "P"},
                                                    {"Dedicated", true},
                                                    {"KSExtensionAttributes", dict({{"KSExtensionVersion", "1"}})}})),
        "/bin/true");
    ASSERT_EQ(d.axctl({"add", app, other}).status, 0);

    auto identifiers = [](const Value& reply) {
        std::vector<std::string> out;
        if (const Array* forms = reply["matches"].asArray())
            for (const Value& f : *forms) out.push_back(*f["identifier"].asString() + "@" + *f["version"].asString());
        std::sort(out.begin(), out.end());
        return out;
    };
    using Ids = std::vector<std::string>;
    EXPECT_EQ(identifiers(d.send(request("match"))),
              (Ids{"com.example.one@1.10", "com.example.replacer@1", "com.example.two@1"}));
    EXPECT_EQ(identifiers(d.send(request("match", {{"flags", uint64_t{1}}}))),
              (Ids{"com.example.one@1.10", "com.example.one@1.9", "com.example.replacer@1", "com.example.two@1"}));
    EXPECT_EQ(identifiers(d.send(request("match", {{"rules", dict({{"KSExtensionVersion", "<1.10"}})}}))),
              (Ids{"com.example.one@1.9", "com.example.replacer@1", "com.example.two@1"}));
    EXPECT_EQ(identifiers(d.send(request("match", {{"rules", dict({{"KSExtensionIdentifier", "com.example.two"}})}}))),
              (Ids{"com.example.two@1"}));
    EXPECT_EQ(d.send(request("match", {{"rules", "x"}})), error(4, "invalid request format (bad rules dictionary)"));
    EXPECT_EQ(d.send(request("match", {{"flags", uint64_t{0x200}}})), error(11, "unauthorized discovery flag (AXDiscoverAll)"));
    EXPECT_EQ(d.send(dict({{"request", "match"}, {"version", uint64_t{2}}})), dict({}));  // no "matches" at version 2

    // The replaced plug-in names its replacer, the replacer what it replaces; both stay.
    Value all = d.send(request("match"));
    for (const Value& f : *all["matches"].asArray()) {
        if (f["identifier"] == Value("com.example.two")) {
            EXPECT_TRUE(f["overrider"].isString());
        }
        if (f["identifier"] == Value("com.example.replacer")) {
            EXPECT_EQ(f["overriding"], Value("com.example.two"));
        }
    }

    // The election: only what the user elected.
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    UUID two = (*registry)->plugInForPath(app + "/PlugIns/Two.appex")->uuid();
    ASSERT_EQ(d.axctl({"annotate", "--election", "1", two.string()}).status, 0);
    // The replacer keeps its annotations under the identifier it replaces: elected with it.
    EXPECT_EQ(identifiers(d.send(request("match", {{"rules", dict({{"KSUserElection", "1"}})}}))),
              (Ids{"com.example.replacer@1", "com.example.two@1"}));

    // The user's exclusions leave plug-ins out, also those the rules name.
    ASSERT_TRUE(prefs::setValue("exclusions", Value(Array{dict({{"KSExtensionIdentifier", "com.example.replacer"}})}),
                                "com.corvane.annexa.userprefs").ok());
    EXPECT_EQ(identifiers(d.send(request("match", {{"rules", dict({{"KSExtensionIdentifier", "com.example.replacer"}})}}))),
              Ids{});

    // Hosts: restricted by their entitlement, or privileged.
    auto signedAxctl = [&](const std::string& name, const Value& ents) {
        std::string path = d.root / ("bin/" + name);
        fs::create_directories(d.root / "bin");
        fs::copy_file(axtest::binary("axctl"), path);
        EXPECT_TRUE(codesign::sign(path, key, std::nullopt, ents).ok());
        return path;
    };
    std::string restricted = signedAxctl("restricted", dict({{"com.corvane.developer.annexa.allowedplugins",
                                                              dict({{"KSExtensionIdentifier", "com.example.two"}})}}));
    auto onlyTwo = d.axctl({"match"}, {}, restricted);
    EXPECT_EQ(onlyTwo.status, 0) << onlyTwo.err;
    EXPECT_NE(onlyTwo.out.find("com.example.two"), std::string::npos) << onlyTwo.out;
    EXPECT_EQ(onlyTwo.out.find("com.example.one"), std::string::npos) << onlyTwo.out;
    std::string invalid = signedAxctl("invalid", dict({{"com.corvane.developer.annexa.allowedplugins", "com.example.two"}}));
    EXPECT_EQ(d.axctl({"match"}, {}, invalid).out, "");
    std::string manager = signedAxctl("manager", dict({{"com.corvane.private.annexa.manager", true}}));
    auto privileged = d.axctl({"match", "--all"}, {}, manager);
    EXPECT_EQ(privileged.status, 0) << privileged.err;
    EXPECT_EQ(d.axctl({"match", "--all"}).status, 77);
    // The same entitled host, confined (here: in a mount namespace of its own), is refused the
    // privileged flag and the explanation.
    for (const char* flag : {"--all", "--explain"}) {
        auto confined = axtest::run({"/usr/bin/unshare", "-m", manager, "match", flag});
        EXPECT_EQ(confined.status, 77) << flag << ": " << confined.err;
        EXPECT_NE(confined.err.find("unauthorized discovery flag"), std::string::npos) << confined.err;
    }

    // The explanation: one line per installed plug-in, with the step that left it out.
    auto explained = d.axctl({"match", "--explain", "-r", "KSExtensionIdentifier=<>com.example.two"});
    ASSERT_EQ(explained.status, 0) << explained.err;
    auto line = [&](const std::string& path) {
        auto r = (*registry)->plugInForPath(path);
        std::string lines = "\n" + explained.out;
        size_t at = lines.find("\n" + r->uuid().string());
        return at == std::string::npos ? std::string() : lines.substr(at + 1, lines.find('\n', at + 1) - at - 1);
    };
    EXPECT_NE(line(app + "/PlugIns/Old.appex").find("collapsed in favour of"), std::string::npos) << explained.out;
    EXPECT_NE(line(other + "/PlugIns/New.appex").find("returned"), std::string::npos) << explained.out;
    EXPECT_NE(line(app + "/PlugIns/Two.appex").find("rule KSExtensionIdentifier does not match"), std::string::npos)
        << explained.out;
    EXPECT_NE(line(other + "/PlugIns/Replacer.appex").find("excluded by the user"), std::string::npos) << explained.out;
    explained = d.axctl({"match", "--explain", "--system-only"});
    EXPECT_NE(line(app + "/PlugIns/Two.appex").find("not on the system volume"), std::string::npos) << explained.out;
    // A host explains only what it may see: the plug-in dedicated to another application is not
    // named to it, nor one its entitlement does not allow; the manager's explanation names them all.
    EXPECT_EQ(line(dedicated), "") << explained.out;
    explained = d.axctl({"match", "--explain"}, {}, restricted);
    EXPECT_EQ(line(other + "/PlugIns/New.appex"), "") << explained.out;
    EXPECT_NE(line(app + "/PlugIns/Two.appex").find("returned"), std::string::npos) << explained.out;
    explained = d.axctl({"match", "--explain"}, {}, manager);
    EXPECT_NE(line(dedicated).find("dedicated to another application"), std::string::npos) << explained.out;
    EXPECT_NE(line(other + "/PlugIns/New.appex").find("returned"), std::string::npos) << explained.out;
    // The manager explains what an application would be told: the plug-in dedicated to Other is
    // offered to Other, and to Example it is dedicated to another application.
    explained = d.axctl({"match", "--explain", "--host", other}, {}, manager);
    EXPECT_NE(line(dedicated).find("returned"), std::string::npos) << explained.err << explained.out;
    explained = d.axctl({"match", "--explain", "--host", app}, {}, manager);
    EXPECT_NE(line(dedicated).find("dedicated to another application"), std::string::npos) << explained.out;
    struct Refused {
        std::vector<std::string> args;
        std::string program, error;
    };
    for (const Refused& r : std::vector<Refused>{
             {{"--explain", "--host", other}, "", "unauthorized discovery key (host)"},
             {{"--host", other}, manager, "--host explains"},
             {{"--explain", "--host", d.root / "Nowhere.app"}, manager, "no registered application there"},
             {{"--explain", "--host", dedicated}, manager, "no registered application there"},
         }) {
        std::vector<std::string> args{"match"};
        args.insert(args.end(), r.args.begin(), r.args.end());
        auto refused = d.axctl(args, {}, r.program);
        EXPECT_NE(refused.status, 0) << r.error;
        EXPECT_NE(refused.err.find(r.error), std::string::npos) << refused.err;
    }
}

// A host that asks again on its connection gets its last answer again only while nothing it
// depends on changed: after each change below, the same question sees the change.
TEST(Axd, AnAnswerGivenAgainFollowsEveryChange) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto host = d.connect();
    auto holder = d.connect();
    // Without rules, and with rules that every plug-in here meets: each answer is kept apart.
    auto matchWith = [&](const Value& rules) {
        auto r = host->sendWithReplySync(rules.isNull() ? request("match") : request("match", {{"rules", rules}}));
        EXPECT_TRUE(r.ok()) << r.description();
        std::vector<std::string> out;
        if (const Array* forms = r.value["matches"].asArray())
            for (const Value& f : *forms) out.push_back(*f["identifier"].asString() + f["annotations"].description());
        std::sort(out.begin(), out.end());
        return out;
    };
    auto match = [&] {
        auto all = matchWith(Value());
        auto ruled = matchWith(dict({{"KSExtensionIdentifier", "<>com.example.none"}}));
        // A change may land between the two; the step asks again then.
        if (all != ruled) ruled.insert(ruled.begin(), "with rules:");
        return all == ruled ? all : ruled;
    };
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    UUID one = (*registry)->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    std::string later = axtest::makeBundle(d.root.path(), "Later.app", axtest::appInfo("com.example.later"), "/bin/true");
    axtest::makeBundle(later + "/PlugIns", "Three.appex", axtest::plugInInfo("com.example.three", dict({{"KSExtensionProtocol", "P"}})), "/bin/true");
    auto setExclusions = [](Value list) {
        ASSERT_TRUE(prefs::setValue("exclusions", std::move(list), "com.corvane.annexa.userprefs").ok());
    };
    using Ids = std::vector<std::string>;
    struct Step {
        const char* change;
        std::function<void()> make;
        Ids expected;
    };
    std::vector<Step> steps = {
        {"nothing", [] {}, {"com.example.One{}", "com.example.Two{}"}},
        {"nothing again", [] {}, {"com.example.One{}", "com.example.Two{}"}},
        {"an election", [&] { ASSERT_EQ(d.axctl({"annotate", "--election", "1", one.string()}).status, 0); },
         {"com.example.One{\"election\": 1}", "com.example.Two{}"}},
        {"an exclusion", [&] { setExclusions(Value(Array{dict({{"KSExtensionIdentifier", "com.example.Two"}})})); },
         {"com.example.One{\"election\": 1}"}},
        {"no exclusions", [&] { setExclusions(Value(Array{})); },
         {"com.example.One{\"election\": 1}", "com.example.Two{}"}},
        {"a hold",
         [&] {
             auto r = holder->sendWithReplySync(
                 request("lock", {{"paths", Value(Array{Value(app + "/PlugIns/Two.appex")})}, {"flags", uint64_t{2}}}));
             ASSERT_TRUE(r.ok() && r.value["errorcode"].isNull()) << r.value.description();
         },
         {"com.example.One{\"election\": 1}"}},
        {"the holder gone", [&] { holder.reset(); }, {"com.example.One{\"election\": 1}", "com.example.Two{}"}},
        {"an installation", [&] { ASSERT_EQ(d.axctl({"add", later}).status, 0); },
         {"com.example.One{\"election\": 1}", "com.example.Two{}", "com.example.three{}"}},
        {"an uninstallation", [&] { ASSERT_TRUE((*registry)->unregisterBundle(app).ok()); }, {"com.example.three{}"}},
    };
    for (const auto& step : steps) {
        step.make();
        // Holds and registry events reach the daemon on their own threads: the answer follows soon.
        Ids got;
        EXPECT_TRUE(axtest::eventually([&] { return (got = match()) == step.expected; }))
            << "after " << step.change << ": " << ::testing::PrintToString(got);
    }
}

TEST(Axd, SendRoundTripsTheTextNotation) {
    Daemon d;
    auto sent = d.axctl({"send"}, "{ \"request\" : \"bulk\", \"version\": 3u }");
    EXPECT_EQ(sent.status, 0) << sent.err;
    EXPECT_EQ(sent.out, "{}\n");
    auto bad = d.axctl({"send"}, "{\"request\": \"x\", \"version\": 3u}");
    EXPECT_EQ(bad.status, 0);  // a reply came, whatever it says
    EXPECT_EQ(Value::parse(bad.out), error(4, "unrecognized request"));
    EXPECT_EQ(d.axctl({"send"}, "not the notation").status, 65);
    EXPECT_EQ(d.axctl({"-S", "com.nobody", "send"}, "{}").status, 69);
    EXPECT_EQ(d.axctl({"--help"}).status, 0);
}

TEST(Axd, ClientsThatMisbehaveDisturbNobodyElse) {
    Daemon d;
    // Garbage frames, a request cut in half, a flood of requests nobody reads, a client that
    // leaves mid-request.
    auto raw = [&] {
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr {};
        addr.sun_family = AF_UNIX;
        std::string path = rpx::endpointPath("com.corvane.annexa.axd");
        std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
        connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        return fd;
    };
    int garbage = raw();
    (void)!write(garbage, std::string(100, '\xee').data(), 100);
    int flood = raw();
    fcntl(flood, F_SETFL, O_NONBLOCK);
    auto flooder = d.connect();
    for (int i = 0; i < 2000; ++i) flooder->send(request("bulk"));
    auto leaver = d.connect();
    leaver->sendWithReply(request("bulk"), d.queue, [](const rpx::Reply&) {});
    leaver->cancel();
    close(garbage);
    EXPECT_EQ(d.send(request("bulk")), dict({}));
    EXPECT_TRUE(d.axd->waitForErr("is dead"));
    close(flood);
    // A non-dictionary message is logged, and answered when the sender waits for an answer.
    auto c = d.connect();
    c->send(Value(Array{Value(1)}));
    EXPECT_TRUE(d.axd->waitForErr("unexpected message: [1] from: "));
    EXPECT_EQ(d.send(Value("text")), error(4, "invalid request format"));
    EXPECT_EQ(d.send(request("bulk")), dict({}));
}

TEST(Axd, TheThousandthRequestOfAClientIsLogged) {
    Daemon d;
    auto c = d.connect();
    for (int i = 0; i < 999; ++i) c->send(request("bulk"));
    ASSERT_TRUE(c->sendWithReplySync(request("bulk")).ok());  // the 1000th, and all before it are done
    EXPECT_TRUE(d.axd->waitForErr("used 1000 requests so far"));
    EXPECT_EQ(d.axd->err().find("used 999 requests"), std::string::npos);
}

TEST(Axd, CommandLineAndTermination) {
    axtest::PlatformRoot root;
    struct Case {
        std::vector<std::string> args;
        int status;
    };
    const Case cases[] = {{{"extra"}, 2}, {{"-x"}, 2}, {{"-c"}, 2}, {{"-S"}, 2}};
    for (const auto& c : cases) {
        std::vector<std::string> argv{axtest::binary("axd")};
        argv.insert(argv.end(), c.args.begin(), c.args.end());
        auto r = axtest::run(argv);
        EXPECT_EQ(r.status, c.status) << c.args[0];
        EXPECT_NE(r.err.find("Usage: axd [-S servicename] [-v]"), std::string::npos);
    }
    Daemon d({"-v", "-v", "-c", "abc"});
    EXPECT_TRUE(d.axd->waitForErr("axd is launching"));
    auto c = d.connect();
    std::atomic<bool> invalid{false};
    c->setEventHandler([&](const rpx::Event& e) {
        if (e.error == rpx::ErrorKind::ConnectionInvalid) invalid = true;
    });
    ASSERT_TRUE(c->sendWithReplySync(request("bulk")).ok());
    std::string err = d.axd->err();
    size_t lines = 0;
    for (size_t at = err.find("verbose option -v is ineffective"); at != std::string::npos;
         at = err.find("verbose option -v is ineffective", at + 1))
        ++lines;
    EXPECT_EQ(lines, 2u);
    d.axd->signal(SIGTERM);
    EXPECT_EQ(d.axd->wait(5s), 0);
    EXPECT_NE(d.axd->err().find("termination imminent"), std::string::npos);
    EXPECT_TRUE(axtest::eventually([&] { return invalid.load(); }));
    // A second daemon on a served endpoint cannot construct its server.
    Daemon first;
    auto second = axtest::run({axtest::binary("axd")}, {{"CORVANE_LOG_SINK", "stderr"}});
    EXPECT_EQ(second.status, 1);
    EXPECT_NE(second.err.find("unable to construct server"), std::string::npos);
}

// X 1.0 declares it replaces Y; X 2.0, registered later and declaring nothing, displaces it. Y is
// marked by the registration that declared the replacement, and X 2.0 carries no mark.
TEST(Axd, AReplacementDeclaredByADisplacedRegistrationStillMarksItsTarget) {
    Daemon d;
    auto key = codesign::generateKey();
    ASSERT_TRUE(codesign::writeKeyPair(d.root / "key", key).ok());
    ASSERT_TRUE(codesign::trustKey(d.root / "key.pub").ok());
    auto application = [&](const char* name, const char* id, const char* version, const Value& ents) {
        std::string app = axtest::makeBundle(d.root.path(), std::string(name) + ".app",
                                             axtest::appInfo(std::string("com.example.") + name), "/bin/true");
        std::string plugIn = axtest::makeBundle(
            app + "/PlugIns", "P.appex",
            axtest::plugInInfo(id, dict({{"KSExtensionProtocol", "P"},
                                         {"KSExtensionAttributes", dict({{"KSExtensionVersion", version}})}})),
            "/bin/true");
        if (!ents.isNull()) {
            EXPECT_TRUE(codesign::sign(plugIn, key, std::nullopt, ents).ok());
        }
        EXPECT_EQ(d.axctl({"add", app}).status, 0);
        return (*vantry::Registry::open(vantry::Registry::defaultPath()))->plugInForPath(plugIn)->uuid().string();
    };
    std::string x1 = application("X1", "com.example.x", "1.0", dict({{"com.corvane.developer.replace-plugin", "com.example.y"}}));
    std::string x2 = application("X2", "com.example.x", "2.0", Value());
    std::string y = application("Y", "com.example.y", "1.0", Value());
    Value reply = d.send(request("match"));
    std::map<std::string, Value> byUuid;
    for (const Value& f : *reply["matches"].asArray()) byUuid[*f["uuid"].asString()] = f;
    ASSERT_EQ(byUuid.size(), 2u) << reply.description();
    ASSERT_TRUE(byUuid.count(x2) && byUuid.count(y)) << reply.description();
    EXPECT_EQ(byUuid[y]["overrider"], Value(x1));
    EXPECT_TRUE(byUuid[x2]["overriding"].isNull()) << byUuid[x2].description();
    EXPECT_TRUE(byUuid[x2]["overrider"].isNull()) << byUuid[x2].description();
    EXPECT_TRUE(d.axd->waitForErr("plug-in " + x1 + " overrides " + y));
}

// The election filter is made only from texts that begin with "=" or a letter, mark or number;
// with any other element there is none, and the exact test alone decides. Y's election 65537
// reads as "1" to the filter and as itself to the exact test, so the answers show which applied.
// Explaining changes no answer.
TEST(Axd, TheElectionFilterAndTheExplanationLeaveTheAnswerAsTheRulesGiveIt) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    UUID one = (*registry)->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    ASSERT_EQ(d.send(request("annotate", {{"annotations", dict({{"election", 65537}})}, {"uuids", Value(Array{Value(one)})}})),
              dict({}));
    struct Case {
        const char* name;
        Value election;
        bool returned;
    };
    auto with = [](const char* other) { return Value(Array{Value("65537"), Value(other)}); };
    const Case cases[] = {
        {"the text alone: filtered", Value("65537"), false},
        {"beside a guillemet: no filter", with("\u00ab1"), true},
        {"beside a dash: no filter", with("\u2014"), true},
        {"beside a no-break space: no filter", with("\u00a01"), true},
        {"beside an operator: no filter", with(">0"), true},
        {"beside a letter: filtered", with("\u00e9"), false},
        {"beside a combining mark: filtered", with("\u0301a"), false},
        {"beside an Arabic-Indic digit: filtered", with("\u0663"), false},
        {"beside a roman numeral: filtered", with("\u216b"), false},
    };
    for (const auto& c : cases) {
        Value rules = dict({{"KSUserElection", c.election}, {"KSExtensionIdentifier", "com.example.One"}});
        Value plain = d.send(request("match", {{"rules", rules}}));
        ASSERT_TRUE(plain["matches"].isArray()) << c.name << ": " << plain.description();
        EXPECT_EQ(plain["matches"].asArray()->size(), c.returned ? 1u : 0u) << c.name;
        Value explained = d.send(request("match", {{"rules", rules}, {"flags", uint64_t{0x10000}}}));
        EXPECT_EQ(explained["matches"], plain["matches"]) << c.name;
        // The explanation says why One was left out, naming the filter when it was the filter.
        for (const Value& e : *explained["explanations"].asArray()) {
            if (e["uuid"] != Value(one.string())) continue;
            const std::string& outcome = *e["outcome"].asString();
            if (c.returned) {
                EXPECT_EQ(outcome, "returned") << c.name;
            } else {
                EXPECT_EQ(outcome, "left out by the election filter: its election reads as 1") << c.name;
            }
        }
    }
}

// The reason a host is refused names the entitlement with its own characters, in the reply and in
// the log.
TEST(Axd, AHostIsToldWhichEntitlementItLacks) {
    Daemon d;
    std::string app = axtest::makeBundle(d.root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    std::string plugIn = axtest::makeBundle(
        app + "/PlugIns", "Needy.appex",
        axtest::plugInInfo("com.example.needy", dict({{"KSExtensionProtocol", "P"},
                                                      {"KSExtensionHostEntitlement", "com.example.required"},
                                                      {"KSExtensionAttributes", dict({})}})),
        "/bin/true");
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    UUID needy = (*vantry::Registry::open(vantry::Registry::defaultPath()))->plugInForPath(plugIn)->uuid();
    const std::string reason = "the host does not have the \"com.example.required\" entitlement";
    EXPECT_EQ(d.send(request("ready", {{"uuids", Value(Array{Value(needy)})}})),
              error(11, "access to plugin com.example.needy denied: " + reason));
    EXPECT_TRUE(d.axd->waitForErr("(" + needy.string() + "): " + reason));
    auto refused = d.axctl({"ready", needy.string()});
    EXPECT_EQ(refused.status, 77);
    EXPECT_NE(refused.err.find(reason), std::string::npos) << refused.err;
}

// A change the annotation file cannot take (here its directory does not exist) is refused with the
// reason and not kept: the daemon's answers keep showing what the file holds, and it goes on
// serving.
TEST(Axd, AnAnnotationThatCannotBeSavedIsRefusedAndNotKept) {
    axtest::TempDir nowhere;
    Daemon d({"-d", nowhere / "missing/Annotations"});
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    UUID one = (*vantry::Registry::open(vantry::Registry::defaultPath()))->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    auto annotated = d.axctl({"annotate", "--election", "3", one.string()});
    EXPECT_NE(annotated.status, 0);
    EXPECT_NE(annotated.err.find("unable to save annotations: cannot write " + nowhere / "missing/Annotations" +
                                 ": No such file or directory"),
              std::string::npos)
        << annotated.err;
    EXPECT_TRUE(d.axd->waitForErr("unable to save annotations:"));
    EXPECT_EQ(d.send(request("bulk-annotate", {{"annotations", dict({{one.string(), dict({{"x", 1}})}})}}))["errorcode"],
              Value(uint64_t{4}));
    Value all = d.send(request("match", {{"rules", dict({{"KSExtensionIdentifier", "com.example.One"}})}}));
    ASSERT_EQ(all["matches"].asArray()->size(), 1u) << all.description();
    EXPECT_EQ((*all["matches"].asArray())[0]["annotations"], dict({}));
}

// Files a bundle holds are read without blocking and only up to their size: a FIFO, a huge file
// or a link to a device as Info.plist or Receipt is that request's error, at once, and another
// client is served meanwhile.
TEST(Axd, ABundleFileThatIsAFifoAHugeFileOrADeviceIsAnErrorAtOnce) {
    Daemon d;
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    // A plug-in whose executable is a copy of axctl, so that axctl run from it asks as that plug-in.
    std::string app = axtest::makeBundle(d.root.path(), "Host.app", axtest::appInfo("com.example.host"), "/bin/true");
    std::string plugIn = axtest::makeBundle(
        app + "/PlugIns", "Asker.appex",
        axtest::plugInInfo("com.example.asker", dict({{"KSExtensionAttributes", dict({})}}), "asker"),
        axtest::binary("axctl"));
    axtest::writeFile(app + "/Receipt", "the receipt");
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto askForReceipt = [&] { return axtest::run({plugIn + "/asker", "send"}, {}, "{\"request\": \"receipt\", \"version\": 3u}"); };
    auto served = askForReceipt();
    ASSERT_EQ(served.out, "{\"data\": <7468652072656365697074>}\n") << served.err;

    auto fifo = [](const std::string& path) { ASSERT_EQ(::mkfifo(path.c_str(), 0644), 0) << path; };
    auto huge = [](const std::string& path) {
        int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(::ftruncate(fd, off_t{200} << 20), 0);
        ::close(fd);
    };
    auto device = [](const std::string& path) { ASSERT_EQ(::symlink("/dev/zero", path.c_str()), 0); };
    struct Case {
        const char* name;
        std::function<void(const std::string&)> make;
    };
    const Case cases[] = {{"a FIFO", fifo}, {"a 200 MiB file", huge}, {"a link to /dev/zero", device}};
    auto residentKiB = [&] {
        std::string status = axtest::readFile("/proc/" + std::to_string(d.axd->pid()) + "/status");
        return std::atol(status.c_str() + status.find("VmRSS:") + 6);
    };
    const long residentBefore = residentKiB();
    auto good = d.connect();
    int round = 0;
    for (const auto& c : cases) {
        // Info.plist of a bundle being added.
        std::string bundle = d.root / ("Bad" + std::to_string(++round) + ".app");
        fs::create_directories(bundle);
        c.make(bundle + "/Info.plist");
        auto started = std::chrono::steady_clock::now();
        Value reply = d.send(request("add", {{"paths", Value(Array{Value(bundle)})}}));
        EXPECT_EQ(reply["errorcode"], Value(uint64_t{2})) << c.name << ": " << reply.description();
        EXPECT_LT(std::chrono::steady_clock::now() - started, 2s) << c.name;
        EXPECT_TRUE(good->sendWithReplySync(request("match")).ok()) << c.name;

        // The Receipt, swapped after registration.
        fs::remove(app + "/Receipt");
        c.make(app + "/Receipt");
        started = std::chrono::steady_clock::now();
        auto refused = askForReceipt();
        EXPECT_NE(refused.out.find("\"errorcode\": 15u"), std::string::npos) << c.name << ": " << refused.out;
        EXPECT_LT(std::chrono::steady_clock::now() - started, 2s) << c.name;
        EXPECT_TRUE(good->sendWithReplySync(request("match")).ok()) << c.name;
    }
    EXPECT_TRUE(d.axd->waitForErr("Info.plist: a FIFO, not a regular file"));
    EXPECT_TRUE(d.axd->waitForErr("Info.plist: 200 MiB, larger than the 1 MiB it may be"));
    EXPECT_TRUE(d.axd->waitForErr("Info.plist: a symbolic link, which is not followed"));
    EXPECT_TRUE(d.axd->waitForErr("Receipt: 200 MiB, larger than the 1 MiB it may be"));
    // Still serving, and its memory did not grow by the huge file.
    EXPECT_LT(residentKiB() - residentBefore, 32 * 1024);
}

// What one client may ask at once is bounded, and past a bound it gets an error reply while the
// daemon serves on; within the bounds, a long request is answered in its turn, after the client's
// earlier requests and before its later ones.
TEST(Axd, EveryBoundOfARequestIsThatClientsErrorAndOrderIsKept) {
    Daemon d;
    std::string app = makeApp(d.root.path());
    ASSERT_EQ(d.axctl({"add", app}).status, 0);
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    ASSERT_TRUE(registry.ok());
    UUID one = (*registry)->plugInForPath(app + "/PlugIns/One.appex")->uuid();
    UUID two = (*registry)->plugInForPath(app + "/PlugIns/Two.appex")->uuid();
    auto uuids = [&](size_t n) {
        Array list;
        for (size_t i = 0; i < n; ++i) list.push_back(Value(i % 2 ? two : one));
        return Value(std::move(list));
    };
    auto paths = [&](size_t n) { return Value(Array(n, Value(app + "/PlugIns/One.appex"))); };
    auto rulesWith = [](Dictionary rules) { return request("match", {{"rules", Value(std::move(rules))}}); };
    Dictionary manyKeys;
    for (int i = 0; i < 65; ++i) manyKeys["key" + std::to_string(i)] = Value("x");
    Array manyPatterns(257, Value("p"));
    Array manyItems(1025, Value("public.text"));

    struct Case {
        const char* name;
        Value message;
        Value reply;
    };
    const Case cases[] = {
        {"4097 uuids", request("access", {{"uuids", uuids(4097)}}), error(4, "invalid request format (more than 4096 uuids)")},
        {"4097 uuids to ready", request("ready", {{"uuids", uuids(4097)}}), error(4, "invalid request format (more than 4096 uuids)")},
        {"4097 paths", request("remove", {{"paths", paths(4097)}}), error(4, "invalid request format (more than 4096 paths)")},
        {"65 rule keys", rulesWith(manyKeys), error(4, "invalid request format (rules: at most 64 keys)")},
        {"257 patterns", rulesWith({{"KSExtensionIdentifier", Value(manyPatterns)}}),
         error(4, "invalid request format (rules: at most 256 patterns under KSExtensionIdentifier)")},
        {"1025 offered items", rulesWith({{"Types", dict({{"offered", Value(manyItems)}})}}),
         error(4, "invalid request format (rules: at most 1024 offered items under Types)")},
        {"a 5000-byte pattern", rulesWith({{"KSExtensionIdentifier", Value(std::string(5000, 'x'))}}),
         error(4, "invalid request format (rules: a key or pattern longer than 4096 bytes)")},
        {"300 KiB of rules", rulesWith({{"a", Value(std::string(150 << 10, 'x'))}, {"b", Value(std::string(150 << 10, 'y'))}}),
         error(4, "invalid request format (rules: more than 256 KiB)")},
    };
    for (const auto& c : cases) EXPECT_EQ(d.send(c.message), c.reply) << c.name;

    // 4096 is served, in slices, and one connection's replies come in the order it asked.
    auto c = d.connect();
    std::vector<std::string> order;
    Mutex orderMutex;
    std::atomic<int> answered{0};
    auto record = [&](const char* name, Value* kept = nullptr) {
        return [&, name, kept](const rpx::Reply& r) {
            {
                MutexLock lock(orderMutex);
                order.push_back(name);
                if (kept) *kept = r.value;
            }
            ++answered;
        };
    };
    Value accessed;
    c->sendWithReply(request("access", {{"uuids", uuids(4096)}}), d.queue, record("access", &accessed));
    c->sendWithReply(request("bulk"), d.queue, record("bulk"));
    c->sendWithReply(request("match"), d.queue, record("match"));
    ASSERT_TRUE(axtest::eventually([&] { return answered.load() == 3; }));
    {
        MutexLock lock(orderMutex);
        EXPECT_EQ(order, (std::vector<std::string>{"access", "bulk", "match"}));
        const Array* tokens = accessed["extensions"].asArray();
        ASSERT_TRUE(tokens) << accessed.description();
        EXPECT_EQ(tokens->size(), 4096u);
    }

    // Holds: 1024 on one connection, then that connection's error; another connection still holds.
    Value hold = request("lock", {{"paths", paths(1)}, {"flags", uint64_t{2}}});
    auto holder = d.connect();
    for (int i = 0; i < 1024; ++i) ASSERT_TRUE(holder->sendWithReplySync(hold).value["uuids"].isUUID()) << i;
    EXPECT_EQ(holder->sendWithReplySync(hold).value, error(4, "too many holds (1024 on this connection)"));
    EXPECT_TRUE(d.connect()->sendWithReplySync(hold).value["uuids"].isUUID());

    // Watchers: eight for one process, the ninth is refused.
    std::vector<std::shared_ptr<rpx::Connection>> watchers;
    for (int i = 0; i < 8; ++i) {
        watchers.push_back(d.connect());
        EXPECT_EQ(watchers.back()->sendWithReplySync(request("watch")).value, dict({})) << i;
    }
    EXPECT_EQ(d.connect()->sendWithReplySync(request("watch")).value, error(4, "too many watchers (8 a process, 256 in all)"));
    watchers.back()->cancel();
    watchers.pop_back();
    EXPECT_TRUE(axtest::eventually([&] { return d.connect()->sendWithReplySync(request("watch")).value == dict({}); }));
    EXPECT_EQ(d.send(request("bulk")), dict({}));
}
