// The tools' shared command-line convention, tried on the real programs: usage errors, bad data,
// an unreachable daemon, and help on every subcommand, each with its exit status.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include <map>
#include <string>
#include <vector>

#include "tests/support/TestSupport.h"
#include "tools/cli/Cli.h"

namespace cli = corvane::cli;

TEST(Cli, EveryToolFollowsTheConvention) {
    axtest::PlatformRoot root;
    axtest::writeFile(root / "garbage.plist", "not a property list");
    std::filesystem::create_directories(root / "Fifo.app");
    ASSERT_EQ(::mkfifo((root / "Fifo.app/Info.plist").c_str(), 0600), 0);
    const std::string uuid = "01234567-89AB-CDEF-0123-456789ABCDEF";
    struct Case {
        std::vector<std::string> argv;
        int status;
        std::string stderrHas;  // empty: nothing to look for
        std::string input = {};
    };
    const Case cases[] = {
        // axctl
        {{"axctl"}, 64, "usage: axctl"},
        {{"axctl", "-S"}, 64, "option -S needs a value"},
        {{"axctl", "frobnicate"}, 64, "unknown command frobnicate"},
        {{"axctl", "add"}, 64, "usage: axctl [-S servicename] add PATH..."},
        {{"axctl", "add", "--bogus", "/x"}, 64, "unknown option --bogus"},
        {{"axctl", "send", "a", "b"}, 64, "unexpected argument b"},
        {{"axctl", "annotate", uuid, "--election"}, 64, "option --election needs a value"},
        {{"axctl", "annotate", "--election", "x", uuid}, 64, "--election needs an integer"},
        {{"axctl", "annotate", "not-a-uuid"}, 64, "not a UUID: not-a-uuid"},
        {{"axctl", "add", "--help"}, 0, ""},
        {{"axctl", "send"}, 65, "at offset 7: expected \":\"", "{\"key\" 1}"},
        {{"axctl", "bulk-annotate", root / "garbage.plist"}, 65, "is not a property-list dictionary"},
        {{"axctl", "-S", "com.nobody.here", "add", "/x"}, 69, "cannot reach the daemon at com.nobody.here"},
        // vantry
        {{"vantry"}, 64, "usage: vantry"},
        {{"vantry", "list", "--xml"}, 64, "unknown option --xml"},
        {{"vantry", "list", "extra"}, 64, "unexpected argument extra"},
        {{"vantry", "show"}, 64, "missing operand"},
        {{"vantry", "show", "--help"}, 0, ""},
        {{"vantry", "register", root / "nowhere"}, 65, "not a bundle"},
        {{"pcx", "grant", root / "Fifo.app", "com.example.camera"}, 65, "Info.plist: a FIFO, not a regular file"},
        {{"vantry", "show", uuid}, 65, "no plug-in"},
        // axsign
        {{"axsign"}, 64, "usage: axsign"},
        {{"axsign", "keygen"}, 64, "keygen needs --out KEY"},
        {{"axsign", "keygen", "--out"}, 64, "option --out needs a value"},
        {{"axsign", "sign", "--key", root / "k"}, 64, "missing operand"},
        {{"axsign", "verify", "a", "b"}, 64, "unexpected argument b"},
        {{"axsign", "trust", root / "nowhere.pub"}, 66, ""},
        {{"axsign", "sign", "--key", root / "nowhere", root.path()}, 66, ""},
        {{"axsign", "sign", "--key", root / "nowhere", root / "absent"}, 66, ""},
        {{"axsign", "verify", "--help"}, 0, ""},
    };
    for (const auto& c : cases) {
        std::vector<std::string> argv = c.argv;
        argv[0] = axtest::binary(argv[0]);
        auto r = axtest::run(argv, {}, c.input);
        std::string line;
        for (const auto& a : c.argv) line += a + " ";
        EXPECT_EQ(r.status, c.status) << line << "\n" << r.err;
        if (!c.stderrHas.empty()) {
            EXPECT_NE(r.err.find(c.stderrHas), std::string::npos) << line << "\n" << r.err;
        }
        if (c.status == cli::kUsage) {
            EXPECT_NE(r.err.find("usage: "), std::string::npos) << line << "\n" << r.err;
        }
        if (c.status == cli::kSuccess) {
            EXPECT_EQ(r.out.rfind("usage: ", 0), 0u) << line << "\n" << r.out;
        }
    }
}

// A new key over an old one would leave everything signed with the old one untrusted.
TEST(Cli, KeygenRefusesToReplaceAKeyUnlessForced) {
    axtest::PlatformRoot root;
    const std::string key = root / "demo.key";
    ASSERT_EQ(axtest::run({axtest::binary("axsign"), "keygen", "--out", key}).status, 0);
    std::string before = axtest::readFile(key);
    auto refused = axtest::run({axtest::binary("axsign"), "keygen", "--out", key});
    EXPECT_EQ(refused.status, 73);
    EXPECT_NE(refused.err.find("--force"), std::string::npos) << refused.err;
    EXPECT_EQ(axtest::readFile(key), before);
    ASSERT_EQ(axtest::run({axtest::binary("axsign"), "keygen", "--out", key, "--force"}).status, 0);
    EXPECT_NE(axtest::readFile(key), before);
}

TEST(Cli, ParsesOptionsValuesAndOperands) {
    const cli::Syntax syntax{"x [--flag] [--value V] A...", {"--flag"}, {"--value"}, 1, 3};
    auto p = cli::parse("tool", syntax, {"a", "--value", "1", "--flag", "--value", "2", "--", "-b"});
    ASSERT_TRUE(p.parsed);
    EXPECT_TRUE(p.parsed->has("--flag"));
    EXPECT_EQ(p.parsed->value("--value"), std::optional<std::string>("2"));
    EXPECT_EQ(p.parsed->operands, (std::vector<std::string>{"a", "-b"}));
    EXPECT_EQ(cli::parse("tool", syntax, {"-"}).parsed->operands, std::vector<std::string>{"-"});
}

// A root or a runtime directory that cannot be used is named at once, with what to do, by every
// program that needs it; an absent daemon is named by its socket and how to start it.
TEST(Cli, ProgramsNameThePlaceTheyCannotUseAndHowToStartTheDaemon) {
    axtest::PlatformRoot root;
    axtest::writeFile(root / "file", "");
    const std::string noRuntime = "/run/user/" + std::to_string(::getuid());
    struct Case {
        std::vector<std::string> argv;
        std::map<std::string, std::string> environment;
        int status;
        std::string stderrHas;
    };
    std::vector<Case> cases = {
        {{"axctl", "match"}, {{"CORVANE_ROOT", "relative/root"}}, 78, "CORVANE_ROOT=relative/root is not an absolute path"},
        {{"vantry", "list"}, {{"CORVANE_ROOT", root / "nowhere"}}, 78, "CORVANE_ROOT=" + root / "nowhere" + ": No such file"},
        {{"pcx", "list", "/x"}, {{"CORVANE_ROOT", root / "file"}}, 78, "CORVANE_ROOT=" + root / "file" + " is not a directory"},
        {{"spawnd"}, {{"CORVANE_ROOT", "relative"}}, 78, "CORVANE_ROOT=relative is not an absolute path"},
        {{"axd"}, {{"CORVANE_ROOT", "relative"}}, 78, "CORVANE_ROOT=relative is not an absolute path"},
        {{"axsign", "verify", root / "file"}, {{"CORVANE_ROOT", "relative"}}, 78, "is not an absolute path"},
        {{"axctl", "match"}, {}, 69,
         "cannot reach the daemon at com.corvane.annexa.axd: nothing answers on " + root / "run/user/" +
             std::to_string(::getuid()) + "/rpx/com.corvane.annexa.axd (start it with: systemctl --user start axd.socket)"},
    };
    // Without a user manager: only where this machine has no runtime directory for this user.
    struct stat st {};
    if (::stat(noRuntime.c_str(), &st) != 0) {
        cases.push_back({{"axctl", "match"}, {{"CORVANE_ROOT", ""}, {"XDG_RUNTIME_DIR", ""}}, 78,
                         "XDG_RUNTIME_DIR is not set, and " + noRuntime + ": No such file or directory"});
        // A tool that does not talk to the daemons does not need it.
        cases.push_back({{"axsign", "verify", root / "file"}, {{"CORVANE_ROOT", ""}, {"XDG_RUNTIME_DIR", ""}}, 1, "unsigned"});
    }
    for (const auto& c : cases) {
        std::vector<std::string> argv = c.argv;
        argv[0] = axtest::binary(argv[0]);
        auto r = axtest::run(argv, c.environment);
        EXPECT_EQ(r.status, c.status) << c.argv[0] << "\n" << r.err;
        if (!c.stderrHas.empty()) {
            EXPECT_NE(r.err.find(c.stderrHas), std::string::npos) << c.argv[0] << "\n" << r.err;
        }
    }
    auto help = axtest::run({axtest::binary("axd"), "--help"});
    EXPECT_EQ(help.status, 0);
    for (const char* option : {"-c LIMIT", "-d DATABASE", "-S SERVICENAME"})
        EXPECT_NE(help.out.find(option), std::string::npos) << help.out;
}
