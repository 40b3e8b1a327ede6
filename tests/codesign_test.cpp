#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <condition_variable>

#include <filesystem>
#include <functional>
#include <fstream>

#include "platform/codesign/CodeSign.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
namespace fs = std::filesystem;

namespace {

const Value kEntitlements = dict({{"com.corvane.private.annexa.manager", true},
                                  {"com.corvane.developer.annexa.allowedplugins", dict({{"KSExtensionIdentifier", "x"}})}});

struct Keys {
    codesign::KeyPair trusted = codesign::generateKey();
    codesign::KeyPair stranger = codesign::generateKey();
    explicit Keys(const std::string& dir) {
        EXPECT_TRUE(codesign::writeKeyPair(dir + "/trusted", trusted).ok());
        EXPECT_TRUE(codesign::trustKey(dir + "/trusted.pub").ok());
    }
};

std::string copyExecutable(const std::string& to) {
    fs::create_directories(fs::path(to).parent_path());
    fs::copy_file(axtest::binary("rpx_peer"), to, fs::copy_options::overwrite_existing);
    return to;
}

void appendByte(const std::string& path) {
    std::ofstream f(path, std::ios::app | std::ios::binary);
    f.put('\0');
}

}  // namespace

TEST(CodeSign, OnlyATrustedSignatureOverTheCurrentFileGivesEntitlements) {
    axtest::PlatformRoot root;
    Keys keys(root.path());
    struct Case {
        const char* name;
        std::function<std::string(const std::string& dir)> prepare;  // returns the executable
        bool valid;
        const char* reason;
    };
    const Case cases[] = {
        {"signed by a trusted key",
         [&](const std::string& d) {
             auto exe = copyExecutable(d + "/tool");
             EXPECT_TRUE(codesign::sign(exe, keys.trusted, std::string("com.example.tool"), kEntitlements).ok());
             return exe;
         },
         true, ""},
        {"unsigned", [&](const std::string& d) { return copyExecutable(d + "/tool"); }, false, "unsigned"},
        {"signed by the program's own key",
         [&](const std::string& d) {
             auto exe = copyExecutable(d + "/tool");
             EXPECT_TRUE(codesign::sign(exe, keys.stranger, std::nullopt, kEntitlements).ok());
             return exe;
         },
         false, "untrusted key"},
        {"altered after signing",
         [&](const std::string& d) {
             auto exe = copyExecutable(d + "/tool");
             EXPECT_TRUE(codesign::sign(exe, keys.trusted, std::nullopt, kEntitlements).ok());
             appendByte(exe);
             return exe;
         },
         false, "executable changed"},
        {"entitlements edited in the signature file",
         [&](const std::string& d) {
             auto exe = copyExecutable(d + "/tool");
             EXPECT_TRUE(codesign::sign(exe, keys.trusted, std::nullopt, dict({{"harmless", true}})).ok());
             auto sig = plist::readFile(exe + ".axsig");
             Dictionary edited = *sig->asDictionary();
             auto xml = *plist::toXML(kEntitlements);
             edited["entitlements"] = Value::data(xml.data(), xml.size());
             EXPECT_TRUE(plist::writeXMLFile(exe + ".axsig", Value(edited)).ok());
             return exe;
         },
         false, "does not verify"},
        {"a signature copied from another executable",
         [&](const std::string& d) {
             auto other = copyExecutable(d + "/other");
             appendByte(other);
             EXPECT_TRUE(codesign::sign(other, keys.trusted, std::nullopt, kEntitlements).ok());
             auto exe = copyExecutable(d + "/tool");
             fs::copy_file(other + ".axsig", exe + ".axsig");
             return exe;
         },
         false, "executable changed"},
        {"a signature file that is garbage",
         [&](const std::string& d) {
             auto exe = copyExecutable(d + "/tool");
             axtest::writeFile(exe + ".axsig", "garbage");
             return exe;
         },
         false, "unreadable"},
    };
    int n = 0;
    for (const auto& c : cases) {
        std::string dir = root / ("case" + std::to_string(n++));
        std::string exe = c.prepare(dir);
        log::CaptureSink capture;
        auto v = codesign::verifyExecutable(exe);
        EXPECT_EQ(v.valid, c.valid) << c.name << ": " << v.reason;
        if (c.valid) {
            EXPECT_EQ(v.entitlements, kEntitlements) << c.name;
            EXPECT_EQ(v.identifier, "com.example.tool");
        } else {
            EXPECT_EQ(v.entitlements, dict({})) << c.name;
            EXPECT_NE(v.reason.find(c.reason), std::string::npos) << c.name << ": " << v.reason;
            EXPECT_EQ(capture.count("no entitlements for "), 1u) << c.name;
        }
    }
}

TEST(CodeSign, BundlesKeepTheirSignatureInside) {
    axtest::PlatformRoot root;
    Keys keys(root.path());
    std::string app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"),
                                         axtest::binary("rpx_peer"));
    ASSERT_TRUE(codesign::sign(app, keys.trusted, std::nullopt, kEntitlements).ok());
    EXPECT_TRUE(axtest::exists(app + "/Signature.plist"));
    auto v = codesign::verifyBundle(app);
    EXPECT_TRUE(v.valid) << v.reason;
    EXPECT_EQ(v.identifier, "com.example.app");
    EXPECT_EQ(codesign::entitlementsOfExecutable(app + "/app"), kEntitlements);
    // The axsign tool says the same.
    auto verify = axtest::run({axtest::binary("axsign"), "verify", app});
    EXPECT_EQ(verify.status, 0) << verify.err;
    appendByte(app + "/app");
    EXPECT_EQ(codesign::entitlementsOfBundle(app), dict({}));
    EXPECT_NE(axtest::run({axtest::binary("axsign"), "verify", app}).status, 0);
}

// A bundle without executable (a data plug-in) is signed over its contents: any file added, changed
// or removed afterwards breaks the signature. Unsigned, it is said once per identity of its files.
TEST(CodeSign, DataBundlesAreSignedOverTheirContents) {
    axtest::PlatformRoot root;
    Keys keys(root.path());
    auto dataInfo = [](const std::string& identifier) {
        Value full = axtest::plugInInfo(identifier, dict({{"KSExtensionProtocol", "#Data"}}));
        Dictionary info = *full.asDictionary();
        info.erase("KFBundleExecutable");
        return Value(info);
    };
    std::string data = axtest::makeBundle(root.path(), "Data.appex", dataInfo("com.example.data"), "");
    axtest::writeFile(data + "/Resources/table.txt", "rows");
    corvane::Status signedData = codesign::sign(data, keys.trusted, std::nullopt, kEntitlements);
    ASSERT_TRUE(signedData.ok()) << signedData.error().description();
    auto v = codesign::verifyBundle(data);
    EXPECT_TRUE(v.valid) << v.reason;
    EXPECT_EQ(v.identifier, "com.example.data");
    EXPECT_EQ(codesign::entitlementsOfBundle(data), kEntitlements);
    EXPECT_EQ(axtest::run({axtest::binary("axsign"), "verify", data}).status, 0);

    const std::pair<const char*, std::function<void()>> changes[] = {
        {"a resource changed", [&] { axtest::writeFile(data + "/Resources/table.txt", "other rows"); }},
        {"a file added", [&] { axtest::writeFile(data + "/Resources/extra.txt", "x"); }},
        {"a file removed", [&] { std::filesystem::remove(data + "/Resources/table.txt"); }},
    };
    for (const auto& [name, change] : changes) {
        axtest::writeFile(data + "/Resources/table.txt", "rows");
        std::filesystem::remove(data + "/Resources/extra.txt");
        ASSERT_TRUE(codesign::verifyBundle(data).valid) << name;
        change();
        auto after = codesign::verifyBundle(data);
        EXPECT_FALSE(after.valid) << name;
        EXPECT_EQ(after.reason, "bundle changed since it was signed") << name;
    }

    std::string plain = axtest::makeBundle(root.path(), "Plain.appex", dataInfo("com.example.plain"), "");
    log::CaptureSink capture;
    for (int i = 0; i < 3; ++i) EXPECT_EQ(codesign::verifyBundle(plain).reason, "unsigned");
    EXPECT_EQ(capture.count("no entitlements for "), 1u);
}

TEST(CodeSign, EntitlementsOfARunningProcessThroughItsConnection) {
    axtest::PlatformRoot root;
    Keys keys(root.path());
    std::string signedExe = copyExecutable(root / "signed/peer");
    ASSERT_TRUE(codesign::sign(signedExe, keys.trusted, std::nullopt, kEntitlements).ok());
    std::string unsignedExe = copyExecutable(root / "unsigned/peer");
    std::string alteredExe = copyExecutable(root / "altered/peer");
    ASSERT_TRUE(codesign::sign(alteredExe, keys.trusted, std::nullopt, kEntitlements).ok());
    appendByte(alteredExe);

    auto queue = dispatch::Queue::create("test.listener");
    auto listener = rpx::Listener::create("com.test.sign", queue);
    ASSERT_TRUE(listener);
    std::mutex m;
    std::condition_variable cv;
    std::vector<rpx::ConnectionPtr> connections;
    (*listener)->setConnectionHandler([&](rpx::ConnectionPtr c) {
        c->setEventHandler([](const rpx::Event&) {});
        c->resume();
        std::lock_guard lock(m);
        connections.push_back(c);
        cv.notify_all();
    });
    (*listener)->resume();

    struct Case {
        std::string exe;
        Value manager;
    };
    const Case cases[] = {{signedExe, Value(true)}, {unsignedExe, Value()}, {alteredExe, Value()}};
    for (const auto& c : cases) {
        axtest::Process peer({c.exe, "hang", "com.test.sign"});
        {
            std::unique_lock lock(m);
            ASSERT_TRUE(cv.wait_for(lock, std::chrono::seconds(10), [&] { return !connections.empty(); }));
        }
        auto connection = connections.back();
        connections.clear();
        EXPECT_EQ(connection->peer().executablePath, c.exe);
        auto handle = codesign::Handle::fromAuditToken(connection->peer().auditToken);
        EXPECT_EQ(handle->valueForEntitlement("com.corvane.private.annexa.manager"), c.manager) << c.exe;
        EXPECT_TRUE(handle->valueForEntitlement("com.corvane.missing").isNull());
        // Once the process is gone its token names nobody.
        peer.signal(SIGKILL);
        peer.wait();
        auto late = codesign::Handle::fromAuditToken(connection->peer().auditToken);
        EXPECT_TRUE(late->valueForEntitlement("com.corvane.private.annexa.manager").isNull());
    }
}

TEST(CodeSign, KeysAndTheTool) {
    axtest::PlatformRoot root;
    auto keygen = axtest::run({axtest::binary("axsign"), "keygen", "--out", root / "k"});
    ASSERT_EQ(keygen.status, 0) << keygen.err;
    struct stat st {};
    stat((root / "k").c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    ASSERT_EQ(axtest::run({axtest::binary("axsign"), "trust", root / "k.pub"}).status, 0);
    std::string exe = copyExecutable(root / "tool");
    EXPECT_TRUE(plist::writeXMLFile(root / "ents.plist", kEntitlements).ok());
    auto sign = axtest::run({axtest::binary("axsign"), "sign", "--key", root / "k", "--identifier", "com.x",
                             "--entitlements", root / "ents.plist", exe});
    ASSERT_EQ(sign.status, 0) << sign.err;
    auto show = axtest::run({axtest::binary("axsign"), "show", exe});
    EXPECT_EQ(show.status, 0);
    EXPECT_NE(show.out.find("identifier: com.x"), std::string::npos) << show.out;
    EXPECT_NE(show.out.find("verifies: yes"), std::string::npos) << show.out;
    EXPECT_NE(show.out.find("com.corvane.private.annexa.manager"), std::string::npos);
    for (const char* cmd : {"keygen", "trust", "sign", "show", "verify"})
        EXPECT_EQ(axtest::run({axtest::binary("axsign"), cmd, "--help"}).status, 0) << cmd;
    EXPECT_NE(axtest::run({axtest::binary("axsign"), "sign", exe}).status, 0);
    EXPECT_FALSE(codesign::readSecretKey(root / "k.pub"));
}
