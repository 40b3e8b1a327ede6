#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "Annexa/AXUtilities.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/vantry/Store.h"
#include "platform/vantry/Vantry.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
namespace fs = std::filesystem;
using vantry::Registry;
using vantry::Scope;

namespace {

size_t countOf(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
    return n;
}

// A signed application with three plug-ins: one with its own extension identifier and a
// registered SDK, one data-only, one unsigned.
struct Fixture {
    axtest::PlatformRoot root;
    std::string app;
    codesign::KeyPair key = codesign::generateKey();
    Value shareEntitlements = dict({{"com.corvane.developer.auto-elect-plugin", true}});

    Fixture() {
        setenv("LANG", "de_DE.UTF-8", 1);
        EXPECT_TRUE(codesign::writeKeyPair(root / "key", key).ok());
        EXPECT_TRUE(codesign::trustKey(root / "key.pub").ok());
        EXPECT_TRUE(layout::makeDirectories(layout::sharedDataDir() + "/sdk", 0755).ok());
        EXPECT_TRUE(plist::writeXMLFile(layout::sharedDataDir() + "/sdk/com.corvane.share.plist",
                            dict({{"KSExtension", dict({{"KSExtensionProtocol", "ShareProtocol"},
                                                        {"KSExtensionAttributes",
                                                         dict({{"KSExtensionPointName", "Share"}})}})}})).ok());
        Value appInfo = axtest::appInfo("com.example.app");
        Dictionary appDict = *appInfo.asDictionary();
        appDict["KFBundleDisplayName"] = Value("Example");
        app = axtest::makeBundle(root.path(), "Example.app", Value(appDict), "/bin/true");
        axtest::writeFile(app + "/Names/de.plist",
                          *plist::toXML(dict({{"KFBundleDisplayName", "Beispiel"}})));
        axtest::writeFile(app + "/Receipt", "receipt");
        std::string plugins = app + "/PlugIns";
        std::string share = axtest::makeBundle(
            plugins, "Share.appex",
            axtest::plugInInfo("com.example.app.share",
                               dict({{"KSExtensionPointIdentifier", "com.corvane.share"},
                                     {"KSExtensionIdentifier", "com.example.share"}})),
            "/bin/true");
        EXPECT_TRUE(codesign::sign(share, key, std::nullopt, shareEntitlements).ok());
        std::string data = axtest::makeBundle(
            plugins, "Data.appex",
            axtest::plugInInfo("com.example.app.data",
                               dict({{"KSExtensionProtocol", "#Data"}, {"KSExtensionAttributes", dict({})}})),
            "/bin/true");
        EXPECT_TRUE(codesign::sign(data, key, std::nullopt, dict({})).ok());
        axtest::makeBundle(plugins, "Plain.appex",
                           axtest::plugInInfo("com.example.app.plain",
                                              dict({{"KSExtensionAttributes",
                                                     dict({{"KSExtensionPointName", Value(corvane::Array{Value("A"), Value("B")})},
                                                           {"KSExtensionVersion", "v01"}})}})),
                           "/bin/true");
    }
    ~Fixture() { unsetenv("LANG"); }

    axtest::RunResult vantry(std::vector<std::string> args) {
        args.insert(args.begin(), axtest::binary("vantry"));
        return axtest::run(args);
    }
};

}  // namespace

TEST(Vantry, RegisterReadBackUnregisterWithAnObserverInAnotherProcess) {
    Fixture f;
    axtest::Process watch({axtest::binary("vantry"), "watch"});
    ASSERT_TRUE(watch.waitForOut("watching")) << watch.err();

    auto reg = f.vantry({"register", f.app});
    ASSERT_EQ(reg.status, 0) << reg.err;
    ASSERT_TRUE(watch.waitForOut("install event: 3 plug-in(s)"));

    auto registry = Registry::open(Registry::defaultPath());
    ASSERT_TRUE(registry) << registry.error().description();
    auto& r = **registry;
    auto share = r.plugInForPath(f.app + "/PlugIns/Share.appex");
    ASSERT_TRUE(share);
    EXPECT_EQ(r.plugInForUUID(share->uuid()), share);
    EXPECT_EQ(share->identifier(), "com.example.share");
    EXPECT_EQ(share->bundleIdentifier(), "com.example.app.share");
    EXPECT_EQ(share->originalIdentifier(), "com.example.app.share");
    EXPECT_EQ(share->bundleVersion(), "1");
    EXPECT_EQ(share->lookup(Scope::PlugIn, "KSExtensionProtocol"), Value("ShareProtocol"));  // from the SDK
    EXPECT_EQ(share->lookup(Scope::Attributes, "KSExtensionPointName"), Value("Share"));
    EXPECT_EQ(share->lookup(Scope::Attributes, "KSExtensionVersion"), Value("1.0"));  // canonical
    EXPECT_EQ(share->lookup(Scope::InfoPlist, "KFBundleExecutable"), Value("plugin"));
    EXPECT_EQ(share->entitlements(), f.shareEntitlements);
    EXPECT_LT(std::abs(share->registrationDate().wholeSeconds() - Date::now().wholeSeconds()), 60);
    EXPECT_FALSE(share->onSystemVolume());
    // The container is named, and made only when the plug-in is first launched.
    EXPECT_EQ(share->dataContainerPath(), layout::userDataDir() + "/containers/4/com.example.share");
    struct stat st {};
    EXPECT_NE(stat(share->dataContainerPath()->c_str(), &st), 0);
    auto app = share->containingApplication();
    ASSERT_TRUE(app);
    EXPECT_EQ(app->bundlePath(), f.app);
    EXPECT_EQ(app->identifier(), "com.example.app");
    EXPECT_EQ(app->localizedName(), std::optional<std::string>("Beispiel"));
    EXPECT_EQ(app->receiptPath(), f.app + "/Receipt");
    EXPECT_FALSE(app->isPlaceholder());
    auto plugins = r.applicationForPath(f.app)->plugIns();
    ASSERT_EQ(plugins.size(), 3u);
    EXPECT_EQ(plugins[0]->bundlePath(), f.app + "/PlugIns/Data.appex");
    EXPECT_EQ(plugins[1]->bundlePath(), f.app + "/PlugIns/Plain.appex");
    EXPECT_FALSE(plugins[0]->dataContainerPath());  // data-only plug-ins have none
    EXPECT_EQ(plugins[1]->entitlements(), dict({}));  // unsigned
    EXPECT_EQ(r.installedPlugIns().size(), 3u);

    // Unchanged: nothing happens, UUIDs stay.
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    EXPECT_EQ(r.plugInForPath(f.app + "/PlugIns/Share.appex")->uuid(), share->uuid());

    ASSERT_EQ(f.vantry({"unregister", f.app}).status, 0);
    ASSERT_TRUE(watch.waitForOut("uninstall event: 3 plug-in(s)"));
    std::string out = watch.out();
    EXPECT_EQ(countOf(out, "install event"), 2u) << out;  // "install" and "uninstall", once each
    EXPECT_EQ(countOf(out, share->uuid().string()), 2u) << out;
    EXPECT_FALSE(r.plugInForUUID(share->uuid()));
    EXPECT_TRUE(r.installedPlugIns().empty());
}

// An observer that was stopped while a bundle came and went gets both events, with the records,
// though the installed plug-ins' rows are gone by the time it reads them.
TEST(Vantry, AnObserverAwayWhileABundleCameAndWentGetsBothEvents) {
    Fixture f;
    axtest::Process watch({axtest::binary("vantry"), "watch"});
    ASSERT_TRUE(watch.waitForOut("watching")) << watch.err();
    watch.signal(SIGSTOP);
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    ASSERT_EQ(f.vantry({"unregister", f.app}).status, 0);
    watch.signal(SIGCONT);
    ASSERT_TRUE(watch.waitForOut("uninstall event: 3 plug-in(s)")) << watch.out();
    std::string out = watch.out();
    size_t install = out.find("install event: 3 plug-in(s)");
    ASSERT_NE(install, std::string::npos) << out;
    EXPECT_LT(install, out.find("uninstall event")) << out;
    EXPECT_EQ(countOf(out, " com.example.share " + f.app + "/PlugIns/Share.appex"), 2u) << out;
}

// The indexed columns hold versionKey(text), so an index lookup finds exactly the texts that the
// exact test's numeric-aware comparison calls equal.
TEST(Vantry, TheIndexKeyIsEqualExactlyWhereTheVersionComparisonIs) {
    const char* texts[] = {"",     "0",     "00",   "1",      "01",    "001",   "10",     "1.9",
                           "1.10", "1.010", "1.0",  "1.00",   "1.",    "v1",    "v01",    "v10",
                           "a0b",  "a00b",  "ab",   "1a",     "01a",   "x007y2", "x7y02", "9",
                           "09",   "0.0",   "com.example.share", "com.example.share2"};
    for (const char* a : texts) {
        for (const char* b : texts) {
            bool same = annexa::compareVersionString(a, b) == annexa::Ordering::Same;
            EXPECT_EQ(corvane::vantry::versionKey(a) == corvane::vantry::versionKey(b), same)
                << '"' << a << "\" vs \"" << b << '"';
        }
    }
}

TEST(Vantry, QueriesDropOnlyWhatCannotFitAndFilterBeforeBuilding) {
    Fixture f;
    auto registry = Registry::open(Registry::defaultPath());
    auto& r = **registry;
    ASSERT_TRUE(r.registerBundle(f.app).ok());
    struct Case {
        Value pattern;
        std::vector<std::string> identifiers;
    };
    const Case cases[] = {
        {dict({{"KSExtensionIdentifier", "com.example.share"}}), {"com.example.share"}},
        {dict({{"KSExtensionIdentifier", "=com.example.share"}}), {"com.example.share"}},
        {dict({{"KSExtensionPointName", "Share"}}), {"com.example.app.plain", "com.example.share"}},  // array subject kept
        {dict({{"KSExtensionPointName", "Nothing"}}), {"com.example.app.plain"}},
        {dict({{"KSExtensionIdentifier", Value(corvane::Array{Value("com.example.app.data"), Value("x")})}}),
         {"com.example.app.data"}},
        {dict({{"KSExtensionIdentifier", ">a"}}), {"com.example.app.data", "com.example.app.plain", "com.example.share"}},
        {dict({}), {"com.example.app.data", "com.example.app.plain", "com.example.share"}},
    };
    for (const auto& c : cases) {
        std::vector<std::string> got;
        for (const auto& p : r.query(c.pattern, nullptr)) got.push_back(p->identifier());
        std::sort(got.begin(), got.end());
        EXPECT_EQ(got, c.identifiers) << c.pattern.description();
    }
    // The filter sees identifier and entitlements; what it refuses is left out.
    std::vector<std::string> asked;
    auto kept = r.query(dict({}), [&](const std::string& id, const Value& ents) {
        asked.push_back(id);
        return ents.has("com.corvane.developer.auto-elect-plugin");
    });
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(kept[0]->identifier(), "com.example.share");
    EXPECT_EQ(asked.size(), 3u);
}

TEST(Vantry, UnreadableBundlesAreRefusedAndChangeNothing) {
    Fixture f;
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    auto before = f.vantry({"list"}).out;
    struct Case {
        const char* name;
        std::function<std::string()> make;
        const char* reason;
    };
    const Case cases[] = {
        {"not a bundle", [&] { axtest::writeFile(f.root / "file", "x"); return f.root / "file"; }, "not a bundle"},
        {"missing Info.plist", [&] { fs::create_directories(f.root / "Empty.app"); return f.root / "Empty.app"; },
         "Info.plist"},
        {"malformed Info.plist", [&] { axtest::writeFile(f.root / "Bad.app/Info.plist", "<plist><dict>"); return f.root / "Bad.app"; },
         "Info.plist"},
        {"plug-in without identifier",
         [&] {
             std::string a = axtest::makeBundle(f.root.path(), "NoId.app", axtest::appInfo("com.example.noid"));
             axtest::makeBundle(a + "/PlugIns", "X.appex", dict({{"KSExtension", dict({})}}));
             return a;
         },
         "without identifier"},
        {"symbolic link loop under PlugIns",
         [&] {
             std::string a = axtest::makeBundle(f.root.path(), "Loop.app", axtest::appInfo("com.example.loop"));
             fs::create_directories(a + "/PlugIns");
             fs::create_symlink(a + "/PlugIns/B.appex", a + "/PlugIns/A.appex");
             fs::create_symlink(a + "/PlugIns/A.appex", a + "/PlugIns/B.appex");
             return a;
         },
         "symbolic link loop"},
        {"a changed plug-in that became unreadable inside a registered application",
         [&] {
             axtest::writeFile(f.app + "/PlugIns/Plain.appex/Info.plist", "garbage");
             return f.app;
         },
         "Info.plist"},
    };
    for (const auto& c : cases) {
        auto result = f.vantry({"register", c.make()});
        EXPECT_NE(result.status, 0) << c.name;
        EXPECT_NE(result.err.find(c.reason), std::string::npos) << c.name << ": " << result.err;
        EXPECT_EQ(f.vantry({"list"}).out, before) << c.name;
    }
    EXPECT_NE(f.vantry({"unregister", f.root / "never"}).status, 0);
}

TEST(Vantry, AChangedPlugInIsReplacedAndOthersKeepTheirIdentity) {
    Fixture f;
    auto registry = Registry::open(Registry::defaultPath());
    auto& r = **registry;
    ASSERT_TRUE(r.registerBundle(f.app).ok());
    auto share = r.plugInForPath(f.app + "/PlugIns/Share.appex");
    auto data = r.plugInForPath(f.app + "/PlugIns/Data.appex");
    Value info = *plist::readFile(f.app + "/PlugIns/Data.appex/Info.plist");
    Dictionary changed = *info.asDictionary();
    changed["KFBundleVersion"] = Value("2");
    EXPECT_TRUE(plist::writeXMLFile(f.app + "/PlugIns/Data.appex/Info.plist", Value(changed)).ok());
    ASSERT_TRUE(r.registerBundle(f.app).ok());
    EXPECT_EQ(r.plugInForPath(f.app + "/PlugIns/Share.appex")->uuid(), share->uuid());
    auto newData = r.plugInForPath(f.app + "/PlugIns/Data.appex");
    EXPECT_NE(newData->uuid(), data->uuid());
    EXPECT_EQ(newData->bundleVersion(), "2");
    EXPECT_FALSE(r.plugInForUUID(data->uuid()));
    // Placeholders and stand-alone plug-ins.
    ASSERT_TRUE(r.registerBundle(f.app, true).ok());
    EXPECT_TRUE(r.applicationForPath(f.app)->isPlaceholder());
    std::string alone = axtest::makeBundle(layout::systemRoot(), "Alone.appex",
                                           axtest::plugInInfo("com.corvane.alone", dict({})), "/bin/true");
    ASSERT_TRUE(r.registerBundle(alone).ok());
    auto a = r.plugInForPath(alone);
    ASSERT_TRUE(a);
    EXPECT_TRUE(a->onSystemVolume());
    EXPECT_FALSE(a->containingApplication());
}

// The listing names every application, those without plug-ins too, in text and in JSON.
TEST(Vantry, ListingShowsApplicationsWithoutPlugIns) {
    Fixture f;
    std::string bare = axtest::makeBundle(f.root.path(), "Bare.app", axtest::appInfo("com.example.bare"), "/bin/true");
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    ASSERT_EQ(f.vantry({"register", bare}).status, 0);
    auto text = f.vantry({"list"});
    EXPECT_NE(text.out.find(bare + "  (no plug-ins)\n"), std::string::npos) << text.out;
    EXPECT_NE(text.out.find(f.app + "\n  "), std::string::npos) << text.out;
    auto json = f.vantry({"list", "--json"});
    ASSERT_EQ(json.status, 0);
    auto document = Value::parseJson(json.out);
    ASSERT_TRUE(document) << json.out;
    const Array* apps = (*document)["applications"].asArray();
    ASSERT_TRUE(apps);
    ASSERT_EQ(apps->size(), 2u);
    EXPECT_EQ((*apps)[0]["path"], Value(bare));
    EXPECT_EQ((*apps)[0]["plugins"], Value(Array{}));
    EXPECT_EQ((*apps)[1]["plugins"].asArray()->size(), 3u);
    // Values keep their kinds: the registration date reads back as a date.
    const Value& record = (*(*apps)[1]["plugins"].asArray())[0];
    EXPECT_TRUE(record["registered"].asDate()) << json.out;
}

TEST(Vantry, ADamagedDatabaseIsReportedAndRebuilt) {
    Fixture f;
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    std::string db = Registry::defaultPath();
    for (const char* suffix : {"-wal", "-shm"}) fs::remove(db + suffix);
    axtest::writeFile(db, std::string(8192, 'x'));
    auto broken = f.vantry({"list"});
    EXPECT_NE(broken.status, 0);
    EXPECT_NE(broken.err.find("vantry rebuild"), std::string::npos) << broken.err;
    auto rebuilt = f.vantry({"rebuild"});
    EXPECT_EQ(rebuilt.status, 0) << rebuilt.err;
    auto list = f.vantry({"list", "--json"});
    EXPECT_EQ(list.status, 0);
    EXPECT_NE(list.out.find("com.example.share"), std::string::npos) << list.out;
}

// A registration the disk refuses (full: a file-size limit; read-only: a read-only mount of the
// registry's directory, or its modes for an ordinary user) fails with the reason and leaves the
// registry as it was; the same registration succeeds once the disk takes writes again.
TEST(Vantry, ARegistrationTheDiskRefusesChangesNothing) {
    Fixture f;
    ASSERT_EQ(f.vantry({"register", f.app}).status, 0);
    std::string db = Registry::defaultPath();
    std::string dir = db.substr(0, db.rfind('/'));
    std::string vantry = axtest::binary("vantry");
    struct Case {
        const char* name;
        std::vector<std::string> command;  // registers the second application under the fault
        const char* reason;
    };
    // 32 KiB (in 512-byte blocks): the registry opens, and its commit does not fit.
    std::string script = "trap '' XFSZ; ulimit -f 64; exec \"$0\" register \"$1\"";
    std::vector<std::string> readOnly =
        ::geteuid() == 0
            ? std::vector<std::string>{"/usr/bin/unshare", "-m", "/bin/sh", "-c",
                                       "mount --bind -o ro \"$2\" \"$2\" && exec \"$0\" register \"$1\"", vantry}
            : std::vector<std::string>{"/bin/sh", "-c",
                                       "chmod a-w \"$2\" \"$2\"/*; \"$0\" register \"$1\"; s=$?; chmod u+w \"$2\" \"$2\"/*; exit $s",
                                       vantry};
    const Case cases[] = {
        {"a full disk", {"/bin/sh", "-c", script, vantry}, "COMMIT: disk I/O error"},
        {"a read-only registry", readOnly, "unable to open database file"},
    };
    int round = 0;
    for (const auto& c : cases) {
        std::string n = std::to_string(++round);
        std::string other = axtest::makeBundle(f.root.path(), "Other" + n + ".app", axtest::appInfo("com.example.other" + n),
                                               "/bin/true");
        axtest::makeBundle(other + "/PlugIns", "P.appex",
                           axtest::plugInInfo("com.example.other.p" + n,
                                              dict({{"KSExtensionAttributes", dict({})}})),
                           "/bin/true");
        std::string before = f.vantry({"list", "--json"}).out;
        std::vector<std::string> command = c.command;
        command.push_back(other);
        command.push_back(dir);
        auto refused = axtest::run(command);
        EXPECT_NE(refused.status, 0) << c.name << ": " << refused.out;
        EXPECT_EQ(refused.err.find("vantry: registry database " + db + ": "), 0u) << c.name << ": " << refused.err;
        EXPECT_NE(refused.err.find(c.reason), std::string::npos) << c.name << ": " << refused.err;
        EXPECT_EQ(f.vantry({"list", "--json"}).out, before) << c.name;
        auto again = f.vantry({"register", other});
        EXPECT_EQ(again.status, 0) << c.name << ": " << again.err;
        EXPECT_NE(f.vantry({"list"}).out.find(other), std::string::npos) << c.name;
    }
}

// The system registry holds what is in the system applications directory and the user's registry
// everything else; read together they are one registry, and both tell every observer.
TEST(Vantry, TheSystemAndTheUserRegistryAreReadAsOne) {
    axtest::PlatformRoot root;
    auto makeApp = [](const std::string& parent, const std::string& name, const std::string& id) {
        std::string app = axtest::makeBundle(parent, name, axtest::appInfo(id), "/bin/true");
        axtest::makeBundle(app + "/PlugIns", "P.appex",
                           axtest::plugInInfo(id + ".p", dict({{"KSExtensionPointIdentifier", "com.example.point"}})),
                           "/bin/true");
        return app;
    };
    ASSERT_TRUE(layout::makeDirectories(layout::systemApplicationsDir(), 0755).ok());
    std::string systemApp = makeApp(layout::systemApplicationsDir(), "Tools.app", "com.example.tools");
    std::string userApp = makeApp(layout::userApplicationsDir(), "Mine.app", "com.example.mine");

    auto both = Registry::openDefault();
    ASSERT_TRUE(both) << both.error().description();
    struct Counter : vantry::Observer {
        std::atomic<int> installs{0}, uninstalls{0};
        void pluginsDidInstall(const std::vector<vantry::PlugInRecordPtr>& r) override { installs += int(r.size()); }
        void pluginsWillUninstall(const std::vector<vantry::PlugInRecordPtr>& r) override { uninstalls += int(r.size()); }
    } counter;
    auto subscription = (*both)->subscribe(counter);

    // Written by the package system's run of `vantry --system sync`, in another process.
    auto synced = axtest::run({axtest::binary("vantry"), "--system", "sync"});
    ASSERT_EQ(synced.status, 0) << synced.err;
    EXPECT_EQ(synced.out, "registered " + systemApp + "\n");
    ASSERT_TRUE((*both)->registerBundle(userApp).ok());
    EXPECT_TRUE(axtest::eventually([&] { return counter.installs == 2; }));

    auto system = (*both)->plugInForPath(systemApp + "/PlugIns/P.appex");
    auto mine = (*both)->plugInForPath(userApp + "/PlugIns/P.appex");
    ASSERT_TRUE(system && mine);
    EXPECT_TRUE(system->onSystemVolume());
    EXPECT_FALSE(mine->onSystemVolume());
    EXPECT_EQ((*both)->plugInForUUID(system->uuid()), system);
    // Each reader of the system registry gets a data container of its own.
    EXPECT_EQ(system->dataContainerPath(), layout::userDataDir() + "/containers/4/com.example.tools.p");
    EXPECT_EQ((*both)->installedPlugIns().size(), 2u);
    EXPECT_EQ((*both)->query(dict({}), nullptr).size(), 2u);
    EXPECT_TRUE((*both)->isSystemBundle(systemApp));
    EXPECT_FALSE((*both)->isSystemBundle(userApp));
    // Which database holds which: the user's knows nothing of the system's application.
    auto userOnly = Registry::open(Registry::defaultPath());
    ASSERT_TRUE(userOnly);
    EXPECT_FALSE((*userOnly)->plugInForPath(systemApp + "/PlugIns/P.appex"));
    EXPECT_TRUE((*userOnly)->plugInForPath(userApp + "/PlugIns/P.appex"));

    // Sync again: an unchanged bundle keeps its UUIDs, a changed one is registered again, one that
    // left is unregistered, one that cannot be read is reported and the others still go in.
    ASSERT_EQ(axtest::run({axtest::binary("vantry"), "--system", "sync"}).out, "");
    EXPECT_EQ((*both)->plugInForPath(systemApp + "/PlugIns/P.appex")->uuid(), system->uuid());
    std::string second = makeApp(layout::systemApplicationsDir(), "Second.app", "com.example.second");
    std::string broken = axtest::makeBundle(layout::systemApplicationsDir(), "Broken.app", axtest::appInfo("com.example.broken"));
    axtest::writeFile(broken + "/Info.plist", "<plist><dict>");
    fs::create_directory_symlink(userApp, layout::systemApplicationsDir() + "/Elsewhere.app");
    axtest::writeFile(systemApp + "/PlugIns/P.appex/Info.plist",
                      *plist::toXML(axtest::plugInInfo("com.example.tools.p", dict({{"KSExtensionPointIdentifier", "com.example.other"}}))));
    synced = axtest::run({axtest::binary("vantry"), "--system", "sync"});
    EXPECT_EQ(synced.status, 65);
    EXPECT_EQ(synced.out, "registered " + second + "\nregistered again " + systemApp + "\n");
    EXPECT_NE(synced.err.find("malformed Info.plist"), std::string::npos) << synced.err;
    EXPECT_NE(synced.err.find("Elsewhere.app leads out of"), std::string::npos) << synced.err;
    EXPECT_NE((*both)->plugInForPath(systemApp + "/PlugIns/P.appex")->uuid(), system->uuid());
    fs::remove_all(second);
    fs::remove_all(broken);
    fs::remove(layout::systemApplicationsDir() + "/Elsewhere.app");
    synced = axtest::run({axtest::binary("vantry"), "--system", "sync"});
    EXPECT_EQ(synced.status, 0) << synced.err;
    EXPECT_EQ(synced.out, "unregistered " + second + "\n");
    EXPECT_TRUE(axtest::eventually([&] { return counter.uninstalls == 2 && counter.installs == 4; }))
        << counter.installs << " " << counter.uninstalls;

    // A path is in one registry only: the system's application cannot go to the user's, and one
    // the user registers stays out of the system's.
    auto refused = axtest::run({axtest::binary("vantry"), "register", systemApp});
    EXPECT_EQ(refused.status, 0) << refused.err;  // root here may write the system registry
    EXPECT_FALSE((*userOnly)->plugInForPath(systemApp + "/PlugIns/P.appex"));
    auto systemAlone = Registry::openSystem();
    ASSERT_TRUE(systemAlone);
    EXPECT_FALSE((*systemAlone)->plugInForPath(userApp + "/PlugIns/P.appex"));
    // The shared database is readable by everyone and written with a rollback journal.
    struct stat st {};
    ASSERT_EQ(::stat(Registry::systemPath().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0644u);
    EXPECT_FALSE(fs::exists(Registry::systemPath() + "-wal"));
}

// Records are stored in the binary value encoding; a database whose rows an earlier release wrote
// as XML property lists reads the same, and a damaged row is no record rather than a crash.
TEST(Vantry, RecordsWrittenAsPropertyListsReadAsTheBinaryOnes) {
    Fixture f;
    auto registry = Registry::open(Registry::defaultPath());
    auto& r = **registry;
    ASSERT_TRUE(r.registerBundle(f.app).ok());
    auto share = r.plugInForPath(f.app + "/PlugIns/Share.appex");
    ASSERT_TRUE(share);
    Value binary = share->serialize();

    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(Registry::defaultPath().c_str(), &db), SQLITE_OK);
    auto rewrite = [&](const char* table, const std::string& bytes) {
        sqlite3_stmt* st = nullptr;
        std::string sql = std::string("UPDATE ") + table + " SET record = ?";
        ASSERT_EQ(sqlite3_prepare_v2(db, sql.c_str(), -1, &st, nullptr), SQLITE_OK);
        sqlite3_bind_blob(st, 1, bytes.data(), static_cast<int>(bytes.size()), SQLITE_TRANSIENT);
        EXPECT_EQ(sqlite3_step(st), SQLITE_DONE);
        sqlite3_finalize(st);
    };
    sqlite3_stmt* st = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(db, "SELECT record FROM plugins WHERE path = ?", -1, &st, nullptr), SQLITE_OK);
    std::string sharePath = share->bundlePath();
    sqlite3_bind_text(st, 1, sharePath.c_str(), -1, SQLITE_TRANSIENT);
    ASSERT_EQ(sqlite3_step(st), SQLITE_ROW);
    std::string stored(static_cast<const char*>(sqlite3_column_blob(st, 0)), sqlite3_column_bytes(st, 0));
    sqlite3_finalize(st);
    EXPECT_EQ(stored.substr(0, vantry::kRecordMarker.size()), vantry::kRecordMarker);
    // The row keeps nothing its columns hold or reading derives: the application (app_path names
    // it), the UUID, path and identifier, the data container, and the identifiers and version
    // that the Info.plist says.
    Value row = *vantry::decodeRecord(stored);
    for (const char* key : {"application", "uuid", "path", "identifier", "container", "bundleIdentifier",
                            "originalIdentifier", "version"})
        EXPECT_FALSE(row.has(key)) << key;
    EXPECT_EQ(row["info"], binary["info"]);  // the SDK's canonical form changed the plug-in dictionary

    // A plug-in dictionary that is the Info.plist's own is kept once, and read back in both places.
    Dictionary fields = *binary.asDictionary();
    Dictionary info = *binary["info"].asDictionary();
    info["KSExtension"] = binary["plugin"];
    fields["info"] = Value(info);
    Value same(fields);
    Dictionary leanInfo = info;
    leanInfo.erase("KSExtension");
    Dictionary lean = fields;
    lean["info"] = Value(leanInfo);
    lean["infoLacksPlugIn"] = Value(true);

    std::string application = *vantry::encodeRecord(share->containingApplication()->serialize());
    struct Case {
        std::string name, plugIn, application;
        Value read;  // null: no record
    };
    for (const Case& c : std::vector<Case>{
             {"what this release wrote", stored, application, binary},
             {"XML rows of an earlier release", *plist::toXML(binary), *plist::toXML(share->containingApplication()->serialize()),
              *plist::parse(*plist::toXML(binary))},  // as far as XML carries it (dates in whole seconds)
             {"a binary row of an earlier release, the application inside", *vantry::encodeRecord(binary), application, binary},
             {"the plug-in dictionary kept once", *vantry::encodeRecord(Value(lean)), application, same},
             {"a marker and garbage", std::string(vantry::kRecordMarker) + "\x0b\xff", std::string(vantry::kRecordMarker), Value()},
             {"neither encoding", "not a record", "nor this", Value()},
         }) {
        rewrite("plugins", c.plugIn);
        rewrite("applications", c.application);
        r.dropCaches();
        auto read = r.plugInForUUID(share->uuid());
        ASSERT_EQ(bool(read), !c.read.isNull()) << c.name;
        if (read) {
            EXPECT_EQ(read->serialize(), c.read) << c.name;
        }
    }
    sqlite3_close(db);
}
