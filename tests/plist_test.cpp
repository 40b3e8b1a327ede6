#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/plist/Plist.h"
#include "tests/support/TestSupport.h"

namespace plist = corvane::plist;
using corvane::Array;
using corvane::Date;
using corvane::Value;

namespace {

Value sample() {
    return corvane::dict({
        {"version", 16},
        {"data", corvane::dict({{"com.example.a", corvane::dict({{"election", -1},
                                                                 {"extension", corvane::dict({
                                                                      {"s", "<&>"},
                                                                      {"r", 1.25},
                                                                      {"b", true},
                                                                      {"d", Value::data("\x00\x01\x02", 3)},
                                                                      {"t", Value(Date{1795341600000000})},
                                                                      {"a", Value(Array{Value(1), Value("x")})},
                                                                      {"big", Value(uint64_t{1} << 62)},
                                                                      {"empty", corvane::dict({})},
                                                                  })}})}})},
    });
}

}  // namespace

TEST(Plist, XmlRoundTripKeepsEveryPropertyListKind) {
    auto xml = plist::toXML(sample());
    ASSERT_TRUE(xml) << xml.error().description();
    auto back = plist::parse(*xml);
    ASSERT_TRUE(back) << back.error().description();
    EXPECT_EQ(*back, sample()) << back->description();
}

TEST(Plist, OtherReadersAgree) {
    axtest::TempDir dir;
    std::string path = dir / "a.plist";
    ASSERT_TRUE(plist::writeXMLFile(path, sample()).ok());
    // plistutil (libplist) converts our XML to the binary form, and we read that back too.
    auto conv = axtest::run({"/usr/bin/plistutil", "-i", path, "-o", dir / "a.bin"});
    ASSERT_EQ(conv.status, 0) << conv.err;
    auto bin = plist::readFile(dir / "a.bin");
    ASSERT_TRUE(bin) << bin.error().description();
    EXPECT_EQ(*bin, sample());
    // Python's plistlib reads the XML with the same numbers.
    auto py = axtest::run({"/usr/bin/python3", "-c",
                           "import plistlib,sys; d=plistlib.load(open(sys.argv[1],'rb')); "
                           "print(d['version'], d['data']['com.example.a']['election'])",
                           path});
    ASSERT_EQ(py.status, 0) << py.err;
    EXPECT_EQ(py.out, "16 -1\n");
}

TEST(Plist, WriterNamesNoDocumentTypeAndReaderAcceptsAny) {
    auto xml = plist::toXML(sample());
    ASSERT_TRUE(xml);
    EXPECT_EQ(xml->find("<!DOCTYPE"), std::string::npos);
    EXPECT_EQ(xml->rfind("<?xml", 0), 0u);
    // Files written by other tools may carry a document type line; it is skipped, whatever it names.
    const std::string body = "<plist version=\"1.0\"><dict><key>a</key><integer>1</integer></dict></plist>";
    for (const std::string& prolog : {std::string(), std::string("<?xml version=\"1.0\"?>\n"),
                                      std::string("<?xml version=\"1.0\"?>\n<!DOCTYPE notes SYSTEM \"notes.dtd\">\n"),
                                      std::string("<!DOCTYPE anything>")}) {
        auto r = plist::parse(prolog + body);
        ASSERT_TRUE(r) << prolog;
        EXPECT_EQ(*r, corvane::dict({{"a", 1}})) << prolog;
    }
}

TEST(Plist, MalformedInputIsAnErrorValue) {
    const std::string inputs[] = {
        "", "not a plist at all", "<?xml version=\"1.0\"?><plist><dict><key>a</key></plist>",
        std::string("bplist00\xff\xff\xff\xff", 12), "<plist version=\"1.0\"><integer>1</plist>",
        "<plist><string>nul &#0; inside</string></plist>",
        "<plist><dict><key>a&#0;</key><true/></dict></plist>",
        "<plist><string>&#x110000; past Unicode</string></plist>",
        "<plist><string>&#x100000041; wraps to A in 32 bits</string></plist>",
        "<plist><string>&#xD800; a lone surrogate</string></plist>",
        "<plist><string>\xff\xfe</string></plist>",
        "<plist><integer>99999999999999999999</integer></plist>",
        "<plist><date>2026-13-01T00:00:00Z</date></plist>",
        "<plist><data>AA=A</data></plist>",
        "<plist><dict><string>no key</string></dict></plist>",
        "<plist>" + std::string(3000, '[').replace(0, 3000, "") + std::string(600 * 7, ' ') + "</plist>",
        [] {
            std::string deep;
            for (int i = 0; i < 600; ++i) deep += "<array>";
            for (int i = 0; i < 600; ++i) deep += "</array>";
            return "<plist>" + deep + "</plist>";
        }()};
    for (const auto& in : inputs) {
        auto r = plist::parse(in);
        EXPECT_FALSE(r) << in;
        if (!r) {
            EXPECT_EQ(r.error().domain, plist::kPlistErrorDomain);
        }
    }
    auto missing = plist::readFile("/nonexistent/file.plist");
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error().domain, corvane::kFileErrorDomain);
    EXPECT_EQ(missing.error().code, corvane::kFileNoSuchFile);
}

TEST(Plist, ValueWithoutPropertyListFormWritesNothing) {
    axtest::TempDir dir;
    std::string path = dir / "f.plist";
    axtest::writeFile(path, "old");
    for (const Value& bad : {Value(corvane::UUID::random()), corvane::dict({{"a", Value()}}),
                             Value("bell \x07")}) {
        corvane::Status written = plist::writeXMLFile(path, corvane::dict({{"v", bad}}));
        ASSERT_FALSE(written.ok());
        EXPECT_EQ(written.error().domain, plist::kPlistErrorDomain);
        EXPECT_EQ(axtest::readFile(path), "old");
    }
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()), {}), 1);
}

TEST(Plist, FailedWriteLeavesTheOldFileAndNoTemporary) {
    axtest::TempDir dir;
    std::string path = dir / "f.plist";
    axtest::writeFile(path, "old contents");
    // A child whose file-size limit is smaller than what it writes: the write fails half-way.
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        signal(SIGXFSZ, SIG_IGN);
        struct rlimit lim {4096, 4096};
        setrlimit(RLIMIT_FSIZE, &lim);
        corvane::Status written = plist::writeFileAtomically(path, std::string(100000, 'x'));
        _exit(!written.ok() && written.error().code == corvane::kFileWriteUnknown ? 0 : 1);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(axtest::readFile(path), "old contents");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()), {}), 1);
    // And a successful write replaces it whole, with the process's default permissions.
    mode_t old = umask(022);
    ASSERT_TRUE(plist::writeFileAtomically(path, "new").ok());
    umask(old);
    EXPECT_EQ(axtest::readFile(path), "new");
    struct stat st {};
    stat(path.c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0644u);
}

// A synced replacement fsyncs the file and its directory; an unsynced one neither, and both leave
// the new contents whole and nothing beside them.
TEST(Plist, UnsyncedReplacementWritesWholeWithoutFsyncs) {
    struct CountingSyncs : plist::FileSystem {
        int syncs = 0;
        int syncFile(int fd) override { return ++syncs, FileSystem::syncFile(fd); }
        int syncDirectory(const std::string& path) override { return ++syncs, FileSystem::syncDirectory(path); }
    };
    for (auto [durability, syncs] : {std::pair{plist::Durability::Synced, 2}, std::pair{plist::Durability::Unsynced, 0}}) {
        axtest::TempDir dir;
        std::string path = dir / "list";
        axtest::writeFile(path, "old");
        CountingSyncs counting;
        plist::setFileSystem(&counting);
        corvane::Status written = plist::writeFileAtomically(path, "new list", 0644, durability);
        plist::setFileSystem(nullptr);
        ASSERT_TRUE(written.ok());
        EXPECT_EQ(counting.syncs, syncs);
        EXPECT_EQ(axtest::readFile(path), "new list");
        EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()), {}), 1);
    }
}
