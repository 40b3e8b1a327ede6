#include <gtest/gtest.h>
#include <sys/stat.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "axd/AXDAnnotationStore.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "tests/support/TestSupport.h"

using annexa::AXDAnnotationStore;
using annexa::Dictionary;
using annexa::Value;
namespace log = corvane::log;

namespace {

struct FakePlugIn {
    std::string key;
    const std::string& annotationKey() const { return key; }
};

Value table(std::initializer_list<Dictionary::value_type> entries) {
    return corvane::dict({{"version", 16}, {"data", corvane::dict(entries)}});
}

}  // namespace

TEST(AXDAnnotationStore, FirstStartIsEmptyAndSilentUntilTheFirstChange) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    AXDAnnotationStore store(nullptr);
    EXPECT_TRUE(store.annotations().empty());
    EXPECT_EQ(store.annotationsURL().rfind(root.path(), 0), 0u);
    EXPECT_NE(store.annotationsURL().find("/com.corvane.annexa/Annotations"), std::string::npos);
    for (const auto& r : capture.records()) EXPECT_NE(r.level, log::Level::Error) << r.message;
    EXPECT_FALSE(axtest::exists(store.annotationsURL()));

    ASSERT_TRUE(store.setAnnotationForPlugIn(corvane::dict({{"election", 1}}), FakePlugIn{"com.example.a"}).ok());
    auto onDisk = corvane::plist::readFile(store.annotationsURL());
    ASSERT_TRUE(onDisk);
    EXPECT_EQ(*onDisk, table({{"com.example.a", corvane::dict({{"election", 1}})}}));
    struct stat st {};
    stat(std::filesystem::path(store.annotationsURL()).parent_path().c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
}

TEST(AXDAnnotationStore, UnloadableFilesResetWithoutEndingTheProcess) {
    struct Case {
        const char* name;
        std::string contents;
        const char* logged;  // null: no error line expected
    };
    const Case cases[] = {
        {"version 15", *corvane::plist::toXML(corvane::dict({{"version", 15}, {"data", corvane::dict({})}})),
         "found database version 15 needed version 16"},
        {"no version", *corvane::plist::toXML(corvane::dict({{"data", corvane::dict({})}})),
         "found database version 0 needed version 16"},
        {"not a plist", "hello", "unable to load annotation database:"},
        {"zero bytes", "", "unable to load annotation database:"},
        {"truncated", corvane::plist::toXML(table({{"k", corvane::dict({})}}))->substr(0, 60),
         "unable to load annotation database:"},
        {"top level array", *corvane::plist::toXML(Value(corvane::Array{Value(16)})),
         "found database version 0"},
        {"data of the wrong type", *corvane::plist::toXML(corvane::dict({{"version", 16}, {"data", "x"}})),
         nullptr},
        {"version as text", *corvane::plist::toXML(corvane::dict({{"version", "16"}, {"data", corvane::dict({{"k", corvane::dict({{"election", 2}})}})}})),
         nullptr},
    };
    for (const auto& c : cases) {
        axtest::TempDir dir;
        std::string path = dir / "Annotations";
        axtest::writeFile(path, c.contents);
        log::CaptureSink capture;
        AXDAnnotationStore store(path.c_str());
        std::vector<std::string> aside;
        for (const auto& e : std::filesystem::directory_iterator(dir.path()))
            if (e.path().filename().string().rfind("Annotations.damaged-", 0) == 0) aside.push_back(e.path());
        if (c.logged) {
            EXPECT_TRUE(capture.contains(c.logged)) << c.name;
            // The file is kept beside before the table starts over, and the log says where.
            ASSERT_EQ(aside.size(), 1u) << c.name;
            EXPECT_EQ(axtest::readFile(aside[0]), c.contents) << c.name;
            EXPECT_TRUE(capture.contains("(resetting; the damaged file is kept as " + aside[0] + ")")) << c.name;
            EXPECT_TRUE(store.annotations().empty()) << c.name;
        } else {
            EXPECT_FALSE(capture.contains("(resetting")) << c.name;
            EXPECT_TRUE(aside.empty()) << c.name;
        }
        // The first change writes a good file over whatever was there.
        ASSERT_TRUE(store.setAnnotationForIdentifier(corvane::dict({{"election", 1}}), "p").ok()) << c.name;
        auto back = corvane::plist::readFile(path);
        ASSERT_TRUE(back) << c.name;
        EXPECT_EQ((*back)["version"], Value(16)) << c.name;
        EXPECT_EQ((*back)["data"]["p"], corvane::dict({{"election", 1}})) << c.name;
    }
}

TEST(AXDAnnotationStore, MigratesTheEarlierReleasesFileOnce) {
    axtest::PlatformRoot root;
    std::string old = corvane::layout::underRoot(AXDAnnotationStore::kEarlierReleasesFile);
    Value oldTable = table({{"com.example.a", corvane::dict({{"election", 1}})}});
    axtest::writeFile(old, *corvane::plist::toXML(oldTable));
    std::string oldBytes = axtest::readFile(old);
    std::string primary;
    {
        log::CaptureSink capture;
        AXDAnnotationStore store(nullptr);
        primary = store.annotationsURL();
        EXPECT_TRUE(capture.contains("migrating old annotations"));
        EXPECT_EQ(Value(store.annotations()), oldTable["data"]);
    }
    EXPECT_EQ(*corvane::plist::readFile(primary), oldTable);
    EXPECT_EQ(axtest::readFile(old), oldBytes);
    // Next start: the primary file loads and the old one is not read again.
    axtest::writeFile(old, *corvane::plist::toXML(table({})));
    log::CaptureSink capture;
    AXDAnnotationStore again(nullptr);
    EXPECT_FALSE(capture.contains("migrating old annotations"));
    EXPECT_EQ(Value(again.annotations()), oldTable["data"]);
}

TEST(AXDAnnotationStore, ChangesMergeByEntryAndSharedKeysSeeEachOther) {
    axtest::TempDir dir;
    std::string path = dir / "Annotations";
    AXDAnnotationStore store(path.c_str());
    FakePlugIn replaced{"com.example.a"};
    FakePlugIn replacer{"com.example.a"};  // its replace-plugin entitlement names the first
    Value e = corvane::dict({{"x", 1}, {"nested", corvane::dict({{"y", 2}})}});
    ASSERT_TRUE(store.setAnnotationForPlugIn(corvane::dict({{"election", 0}, {"extension", e}}), replaced).ok());
    ASSERT_TRUE(store.setAnnotationForPlugIn(corvane::dict({{"election", 1}}), replacer).ok());
    EXPECT_EQ(store.annotationForPlugIn(replaced), corvane::dict({{"election", 1}, {"extension", e}}));
    Value f = corvane::dict({{"nested", corvane::dict({})}});
    ASSERT_TRUE(store.setAnnotationForPlugIn(corvane::dict({{"extension", f}}), replaced).ok());
    EXPECT_EQ(store.annotationForPlugIn(replacer), corvane::dict({{"election", 1}, {"extension", f}}));
    ASSERT_TRUE(store.setAnnotationForPlugIn(Value(), replacer).ok());
    EXPECT_TRUE(store.annotationForPlugIn(replaced).isNull());
    EXPECT_EQ(*corvane::plist::readFile(path), table({}));

    // A value without a property-list form: the save fails and is logged, and the change is undone
    // with every other one since the last save, so memory holds what the file holds.
    store.changeAnnotationForIdentifier(corvane::dict({{"election", 5}}), "v");
    log::CaptureSink capture;
    EXPECT_FALSE(store.setAnnotationForIdentifier(corvane::dict({{"extension", Value(corvane::UUID::random())}}), "u").ok());
    EXPECT_TRUE(capture.contains("unable to save annotations:"));
    EXPECT_TRUE(store.annotationForIdentifier("u").isNull());
    EXPECT_TRUE(store.annotationForIdentifier("v").isNull());
    EXPECT_EQ(*corvane::plist::readFile(path), table({}));
    EXPECT_TRUE(store.setAnnotationForIdentifier(corvane::dict({{"election", 5}}), "v").ok());
    EXPECT_EQ(*corvane::plist::readFile(path), table({{"v", corvane::dict({{"election", 5}})}}));
}

TEST(AXDAnnotationStore, OtherReadersSeeExactlyVersionAndData) {
    axtest::TempDir dir;
    std::string path = dir / "Annotations";
    {
        AXDAnnotationStore store(path.c_str());
        ASSERT_TRUE(store.setAnnotationForIdentifier(corvane::dict({{"election", -1}}), "com.example.a").ok());
    }
    auto py = axtest::run({"/usr/bin/python3", "-c",
                           "import plistlib,sys; d=plistlib.load(open(sys.argv[1],'rb')); "
                           "print(sorted(d.keys()), d['version'], d['data'])",
                           path});
    ASSERT_EQ(py.status, 0) << py.err;
    EXPECT_EQ(py.out, "['data', 'version'] 16 {'com.example.a': {'election': -1}}\n");
}

TEST(AXDAnnotationStore, AKilledSaverLeavesTheOldOrTheNewTable) {
    axtest::TempDir dir;
    std::string path = dir / "Annotations";
    // Every table written has the 200 entries k0..k199 with one election each, so a mix would show.
    auto table = [](int election) {
        Dictionary big;
        for (int k = 0; k < 200; ++k) big.emplace("k" + std::to_string(k), corvane::dict({{"election", election}}));
        return corvane::dict({{"extension", Value(big)}});
    };
    {
        AXDAnnotationStore first(path.c_str());
        ASSERT_TRUE(first.setAnnotationForIdentifier(table(-1), "p").ok());
    }
    for (int round = 0; round < 20; ++round) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            AXDAnnotationStore store(path.c_str());
            for (int i = 0;; ++i) (void)store.setAnnotationForIdentifier(table(i), "p");
        }
        usleep(static_cast<useconds_t>(2000 + round * 1500));
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
        auto back = corvane::plist::readFile(path);
        ASSERT_TRUE(back) << "round " << round << ": " << back.error().description();
        const Value& ext = (*back)["data"]["p"]["extension"];
        ASSERT_TRUE(ext.isDictionary()) << "round " << round;
        ASSERT_EQ(ext.asDictionary()->size(), 200u) << "round " << round;
        Value first = ext["k0"]["election"];
        for (const auto& [k, v] : *ext.asDictionary()) ASSERT_EQ(v["election"], first) << k;
    }
    // A store opened after all that loads the last complete table, and nothing but the file is
    // left beside it: the kills left no temporary file, or the store's start removed it.
    axtest::writeFile(dir / ".Annotations.999.new", "left by a writer killed between link and rename");
    AXDAnnotationStore store(path.c_str());
    Value kept = store.annotationForIdentifier("p")["extension"];
    ASSERT_TRUE(kept.isDictionary());
    EXPECT_EQ(kept.asDictionary()->size(), 200u);
    std::vector<std::string> names;
    for (const auto& e : std::filesystem::directory_iterator(dir.path())) names.push_back(e.path().filename());
    EXPECT_EQ(names, std::vector<std::string>{"Annotations"});
}

// Changes made in memory reach the file at the next save, once, however many there were.
TEST(AXDAnnotationStore, ChangesAreSavedOnceWhenAsked) {
    axtest::TempDir dir;
    std::string path = dir / "Annotations";
    AXDAnnotationStore store(path.c_str());
    for (int i = 0; i < 50; ++i) store.changeAnnotationForIdentifier(corvane::dict({{"election", i}}), "k" + std::to_string(i));
    EXPECT_FALSE(axtest::exists(path));
    ASSERT_TRUE(store.saveIfChanged().ok());
    ASSERT_TRUE(axtest::exists(path));
    struct stat before {};
    ::stat(path.c_str(), &before);
    ASSERT_TRUE(store.saveIfChanged().ok());  // nothing changed: no write
    struct stat after {};
    ::stat(path.c_str(), &after);
    EXPECT_EQ(before.st_ino, after.st_ino);
    EXPECT_EQ((*corvane::plist::readFile(path))["data"].asDictionary()->size(), 50u);

    // Setting what is already stored is no change, and costs no write; anything else is one.
    struct Case {
        const char* name;
        Value annotation;
        const char* key;
        bool changes;
    };
    const Case cases[] = {
        {"the same election again", corvane::dict({{"election", 3}}), "k3", false},
        {"an empty change", corvane::dict({}), "k3", false},
        {"removing an entry that is not there", Value(), "nobody", false},
        {"another election", corvane::dict({{"election", 4}}), "k3", true},
        {"a new key beside the election", corvane::dict({{"extension", corvane::dict({})}}), "k3", true},
        {"a new entry", corvane::dict({}), "k50", true},
        {"removing an entry", Value(), "k0", true},
    };
    for (const auto& c : cases) {
        struct stat was {};
        ::stat(path.c_str(), &was);
        store.changeAnnotationForIdentifier(c.annotation, c.key);
        ASSERT_TRUE(store.saveIfChanged().ok()) << c.name;
        struct stat now {};
        ::stat(path.c_str(), &now);
        EXPECT_EQ(was.st_ino != now.st_ino, c.changes) << c.name;
    }
}

TEST(AXDAnnotationStoreDeathTest, NoContainerOrDirectoryEndsTheDaemon) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    {
        axtest::PlatformRoot root;
        // The per-user data directory is a file: no container can be made.
        axtest::writeFile(corvane::layout::userDataDir(), "in the way");
        EXPECT_DEATH(AXDAnnotationStore(nullptr), "unable to locate user container: error [0-9]+");
    }
    {
        axtest::PlatformRoot root;
        std::string container = AXDAnnotationStore::containerURL();
        axtest::writeFile(container + "/com.corvane.annexa", "in the way");
        EXPECT_DEATH(AXDAnnotationStore(nullptr), "unable to create plugin annotations directory:");
    }
}
