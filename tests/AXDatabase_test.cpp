#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "axd/AXDatabase.h"
#include "platform/codesign/CodeSign.h"
#include "platform/notify/Notify.h"
#include "platform/plist/Plist.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace annexa;
using corvane::dict;
namespace log = corvane::log;
namespace vantry = corvane::vantry;

namespace {

// An application with three signed plug-ins: one asks to be elected automatically, one replaces
// another plug-in's identifier, one is plain.
struct Fixture {
    axtest::PlatformRoot root;
    std::string app;
    std::string auto_;
    std::string plain;
    std::string replacer;

    Fixture() {
        auto key = corvane::codesign::generateKey();
        EXPECT_TRUE(corvane::codesign::writeKeyPair(root / "key", key).ok());
        EXPECT_TRUE(corvane::codesign::trustKey(root / "key.pub").ok());
        app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
        auto plugIn = [&](const std::string& name, const std::string& id, const Value& ents) {
            std::string p = axtest::makeBundle(
                app + "/PlugIns", name,
                axtest::plugInInfo(id, dict({{"KSExtensionProtocol", "P"},
                                             {"KSExtensionAttributes", dict({{"KSExtensionVersion", "1"}})}})),
                "/bin/true");
            EXPECT_TRUE(corvane::codesign::sign(p, key, std::nullopt, ents).ok());
            return p;
        };
        auto_ = plugIn("Auto.appex", "com.example.auto", dict({{"com.corvane.developer.auto-elect-plugin", true}}));
        plain = plugIn("Plain.appex", "com.example.plain", dict({}));
        replacer = plugIn("Replacer.appex", "com.example.replacer",
                          dict({{"com.corvane.developer.replace-plugin", "com.example.plain"}}));
    }

    // The registry of this fixture's platform root, opened on first use.
    std::shared_ptr<vantry::Registry> registry() {
        if (!registry_) {
            auto opened = vantry::Registry::open(vantry::Registry::defaultPath());
            EXPECT_TRUE(opened) << opened.error().description();
            registry_ = std::move(*opened);
        }
        return registry_;
    }
    std::shared_ptr<vantry::Registry> registry_;

    static int vantry(const std::vector<std::string>& args) {
        std::vector<std::string> argv{axtest::binary("vantry")};
        argv.insert(argv.end(), args.begin(), args.end());
        return axtest::run(argv).status;
    }
    Value annotationsOnDisk(AXDatabase& db) {
        auto v = corvane::plist::readFile(db.annotationsURL());
        return v ? (*v)["data"] : Value();
    }
};

struct Delegate : AXDatabaseDelegate {
    std::mutex m;
    std::condition_variable cv;
    std::vector<std::vector<vantry::PlugInRecordPtr>> calls;
    void removedPlugIns(const std::vector<vantry::PlugInRecordPtr>& records) override {
        std::lock_guard lock(m);
        calls.push_back(records);
        cv.notify_all();
    }
    bool waitForCall() {
        std::unique_lock lock(m);
        return cv.wait_for(lock, std::chrono::seconds(10), [&] { return !calls.empty(); });
    }
};

}  // namespace

TEST(AXDatabase, LookupsBuildRecordsOnceAndServeThemFromTheCache) {
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    AXDatabase db(nullptr, f.registry());
    db.setCacheLimit(1000000);
    auto plain = db.findPlugInAtPath(f.plain);
    ASSERT_TRUE(plain);
    EXPECT_EQ(db.findPlugIn(*plain->uuid()), plain);  // the same object
    EXPECT_EQ(db.findPlugInAtPath(f.plain), plain);
    auto within = db.plugInsWithinApplication(f.app);
    ASSERT_TRUE(within);
    ASSERT_EQ(within->size(), 3u);
    EXPECT_EQ((*within)[0]->path(), f.auto_);
    EXPECT_EQ((*within)[1], plain);
    EXPECT_EQ(db.cacheCount(), 3u);

    log::CaptureSink capture;
    auto unknown = corvane::UUID::random();
    EXPECT_FALSE(db.findPlugIn(unknown));
    EXPECT_TRUE(capture.contains("Vantry cannot find plug-in with UUID:" + unknown.string()));
    EXPECT_FALSE(db.findPlugInAtPath(f.root / "nowhere.appex"));
    EXPECT_TRUE(capture.contains("Vantry cannot find plug-in at path:"));
    EXPECT_FALSE(db.plugInsWithinApplication(f.root / "Nothing.app"));
    EXPECT_EQ(db.cacheCount(), 3u);

    corvane::Status refused = db.addPlugIn(f.root / "not-a-bundle");
    ASSERT_FALSE(refused.ok());
    EXPECT_EQ(refused.error().code, 2);
    EXPECT_EQ(refused.error().text, "Vantry failed to register the plug-in");
    EXPECT_EQ(db.removePlugIn(f.root / "never").error().text, "Vantry failed to deregister the plug-in");
}

TEST(AXDatabase, CacheLimitTextIsReadFromItsLeadingDigits) {
    const std::pair<const char*, uint32_t> cases[] = {
        {"5", 5}, {" 5", 5}, {"+5", 5}, {"12abc", 12}, {"abc", 0}, {"", 0}, {"0", 0}, {"-0", 0}, {"007", 7},
    };
    for (const auto& [text, limit] : cases) EXPECT_EQ(AXDatabase::cacheLimitFromText(text), limit) << '"' << text << '"';
}

TEST(AXDatabase, TheCacheIsClearedWhenAnInsertionFindsItOverItsLimit) {
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    std::string extra = axtest::makeBundle(f.app + "/PlugIns", "Fourth.appex",
                                           axtest::plugInInfo("com.example.fourth",
                                                              dict({{"KSExtensionProtocol", "P"},
                                                                    {"KSExtensionAttributes", dict({})}})),
                                           "/bin/true");
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    AXDatabase db(nullptr, f.registry());
    auto records = f.registry()->applicationForPath(f.app)->plugIns();
    ASSERT_EQ(records.size(), 4u);

    db.setCacheLimit(0);
    db.plugInForProxy(records[0]);
    db.plugInForProxy(records[1]);
    EXPECT_EQ(db.cacheCount(), 1u);  // every insertion into a non-empty cache clears it first

    db.setCacheLimit(2);
    db.plugInForProxy(records[0]);  // count 1 -> 2 (the equal count does not purge)
    db.plugInForProxy(records[2]);  // 2 -> 3: inserted after the check
    EXPECT_EQ(db.cacheCount(), 3u);
    log::CaptureSink capture;
    db.plugInForProxy(records[3]);
    EXPECT_EQ(db.cacheCount(), 1u);
    EXPECT_TRUE(capture.contains("purging cache for 3 > 2"));
}

TEST(AXDatabase, AutoElectionIsWrittenOnceAndNeverOverridesAnElection) {
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    {
        AXDatabase db(nullptr, f.registry());
        db.setCacheLimit(1000000);
        auto a = db.findPlugInAtPath(f.auto_);
        ASSERT_TRUE(a);
        EXPECT_EQ(f.annotationsOnDisk(db)["com.example.auto"], dict({{"election", 1}}));
        EXPECT_EQ(corvane::notify::count(kAnnotationChangeNotification), 0u);  // no notification
        // The plain plug-in, without the entitlement, is not elected.
        db.findPlugInAtPath(f.plain);
        EXPECT_TRUE(f.annotationsOnDisk(db)["com.example.plain"].isNull());
    }
    struct Case {
        Value stored;
        Value after;
    };
    Value e = dict({{"k", "v"}});
    const Case cases[] = {
        {dict({{"election", 0}, {"extension", e}}), dict({{"election", 1}, {"extension", e}})},
        {dict({{"election", 2}}), dict({{"election", 2}})},
        {dict({{"election", -1}}), dict({{"election", -1}})},
        // An election stored as text counts by its integer value.
        {dict({{"election", "2"}}), dict({{"election", "2"}})},
        {dict({{"election", "0"}}), dict({{"election", 1}})},
    };
    for (const auto& c : cases) {
        AXDatabase db(nullptr, f.registry());
        auto record = f.registry()->plugInForPath(f.auto_);
        auto p = AXDPlugIn::fromRegistryRecord(record);
        db.setAnnotationForPlugIn(Value(), *p);
        db.setAnnotationForPlugIn(c.stored, *p);
        db.findPlugIn(*p->uuid());  // a fresh database builds the record: auto-election runs
        EXPECT_EQ(db.annotationForPlugIn(*p), c.after) << c.stored.description();
    }
}

TEST(AXDatabase, UninstallDropsTheCacheAndTellsTheDelegateOnceWithEveryRecord) {
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    AXDatabase db(nullptr, f.registry());
    db.setCacheLimit(1000000);
    Delegate delegate;
    db.setDelegate(&delegate);
    auto plain = db.findPlugInAtPath(f.plain);
    auto replacer = db.findPlugInAtPath(f.replacer);
    ASSERT_TRUE(plain && replacer);
    // Plug-ins sharing an annotation key see each other's changes.
    db.setAnnotationForPlugIn(dict({{"extension", dict({{"from", "replacer"}})}}), *replacer);
    EXPECT_EQ(db.annotationForPlugIn(*plain), dict({{"extension", dict({{"from", "replacer"}})}}));

    log::CaptureSink capture;
    ASSERT_EQ(Fixture::vantry({"unregister", f.app}), 0);  // another process
    ASSERT_TRUE(delegate.waitForCall());
    {
        std::lock_guard lock(delegate.m);
        ASSERT_EQ(delegate.calls.size(), 1u);
        EXPECT_EQ(delegate.calls[0].size(), 3u);
    }
    EXPECT_EQ(capture.count("plug-in UNINSTALLED:com.example.plain com.example.plain(1) "), 1u);
    EXPECT_EQ(capture.count("plug-in UNINSTALLED:"), 3u);
    EXPECT_EQ(db.cacheCount(), 0u);  // both cached records are gone
    EXPECT_FALSE(db.findPlugIn(*plain->uuid()));

    // Reinstalled under a new UUID, the annotation is still there; the install only logs.
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    EXPECT_TRUE(axtest::eventually([&] { return capture.count("plug-in INSTALLED:") >= 3; }));
    EXPECT_EQ(capture.count("plug-in INSTALLED:"), 3u);
    auto again = db.findPlugInAtPath(f.plain);
    ASSERT_TRUE(again);
    EXPECT_NE(*again->uuid(), *plain->uuid());
    EXPECT_EQ(db.annotationForPlugIn(*again), dict({{"extension", dict({{"from", "replacer"}})}}));
}

// The answer of every installed plug-in is kept between walks. Each change below must show in
// the next answer, and an answer given again is the same plug-ins and logs what the first logged.
TEST(AXDatabase, EveryInstalledPlugInIsAnsweredAgainOnlyWhileNothingChanged) {
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    // Registered, but no plug-in: a stand-alone plug-in outside the system volume.
    std::string loose = axtest::makeBundle(
        f.root.path(), "Loose.appex", axtest::plugInInfo("com.example.loose", dict({{"KSExtensionProtocol", "P"}})),
        "/bin/true");
    ASSERT_EQ(Fixture::vantry({"register", loose}), 0);
    // Registered, but passed over: the plug-in of an application still being installed.
    std::string pending = axtest::makeBundle(f.root.path(), "Pending.app", axtest::appInfo("com.example.pending"), "/bin/true");
    axtest::makeBundle(pending + "/PlugIns", "Pending.appex",
                       axtest::plugInInfo("com.example.pending.p", dict({{"KSExtensionProtocol", "P"}})), "/bin/true");
    ASSERT_TRUE(f.registry()->registerBundle(pending, true).ok());
    AXDatabase db(nullptr, f.registry());
    db.setCacheLimit(1000000);
    auto paths = [](const std::vector<AXDPlugInPtr>& list) {
        std::vector<std::string> out;
        for (const auto& p : list) out.push_back(p->path());
        return out;
    };
    log::CaptureSink capture;
    auto first = db.findPlugIns(Value());
    EXPECT_EQ(paths(first), (std::vector<std::string>{f.auto_, f.plain, f.replacer}));
    const std::string logged[] = {"ignoring mis-configured plug-in at " + loose, "because its app is a placeholder"};
    for (const auto& line : logged) EXPECT_EQ(capture.count(line), 1u) << line;
    EXPECT_EQ(db.findPlugIns(Value()), first);  // the same objects
    for (const auto& line : logged) EXPECT_EQ(capture.count(line), 2u) << line;

    std::string fourth = f.app + "/PlugIns/Fourth.appex";
    std::string other = f.root / "Other.app";
    std::string otherPlugIn = other + "/PlugIns/Other.appex";
    struct Change {
        const char* what;
        std::function<void()> make;
        std::vector<std::string> expected;
    };
    const Change changes[] = {
        {"another application registered",  // no record of the first changes
         [&] {
             axtest::makeBundle(f.root.path(), "Other.app", axtest::appInfo("com.example.other"), "/bin/true");
             axtest::makeBundle(other + "/PlugIns", "Other.appex",
                                axtest::plugInInfo("com.example.other.p", dict({{"KSExtensionProtocol", "P"}})),
                                "/bin/true");
             ASSERT_EQ(Fixture::vantry({"register", other}), 0);
         },
         {f.auto_, f.plain, f.replacer, otherPlugIn}},
        {"a plug-in registered",
         [&] {
             axtest::makeBundle(f.app + "/PlugIns", "Fourth.appex",
                                axtest::plugInInfo("com.example.fourth", dict({{"KSExtensionProtocol", "P"}})),
                                "/bin/true");
             ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
         },
         {f.auto_, fourth, f.plain, f.replacer, otherPlugIn}},
        {"the cache purged",
         [&] {
             db.databaseQueue().sync([&] {
                 db.databaseQueue().assertCurrent();
                 db.purgeCachesToLimit(0);
             });
         },
         {f.auto_, fourth, f.plain, f.replacer, otherPlugIn}},
        {"a plug-in unregistered",
         [&] {
             std::filesystem::remove_all(fourth);
             ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
         },
         {f.auto_, f.plain, f.replacer, otherPlugIn}},
        {"the application unregistered", [&] { ASSERT_EQ(Fixture::vantry({"unregister", f.app}), 0); },
         {otherPlugIn}},
    };
    auto before = first;
    for (const auto& change : changes) {
        change.make();
        auto now = db.findPlugIns(Value());
        EXPECT_EQ(paths(now), change.expected) << change.what;
        EXPECT_EQ(db.findPlugIns(Value()), now) << change.what;
        // After a purge the plug-ins are built anew: none of the objects given before comes back.
        if (std::string(change.what).find("purged") != std::string::npos) {
            for (const auto& p : now)
                EXPECT_EQ(std::find(before.begin(), before.end(), p), before.end()) << p->path();
        }
        before = now;
    }
}

// Calls a queue-bound method from the wrong thread on purpose; the static
// analysis would otherwise reject what this test checks at run time.
static void createOffQueue(AXDatabase& db, const corvane::vantry::PlugInRecordPtr& record) NO_THREAD_SAFETY_ANALYSIS {
    db.createPlugInForProxy(record);
}

TEST(AXDatabaseDeathTest, QueueRulesAreEnforced) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    Fixture f;
    ASSERT_EQ(Fixture::vantry({"register", f.app}), 0);
    EXPECT_DEATH(
        {
            AXDatabase db(nullptr, f.registry());
            createOffQueue(db, f.registry()->plugInForPath(f.plain));
        },
        "must run on this queue \\(queue \"AXDatabase\"\\)");
    EXPECT_DEATH(
        {
            AXDatabase db(nullptr, f.registry());
            db.databaseQueue().sync([&] { db.findPlugIn(corvane::UUID::random()); });
        },
        "must not run on this queue \\(queue \"AXDatabase\"\\)");
}
