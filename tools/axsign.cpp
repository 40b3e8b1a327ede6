// axsign: makes signing keys, trusts them, signs bundles and executables with entitlements, and
// shows or verifies signatures. See docs/code-signing.md and docs/tools.md.
#include <sys/stat.h>

#include <cstdio>
#include <string>
#include <vector>

#include "platform/codesign/CodeSign.h"
#include "platform/log/Log.h"
#include "platform/plist/Plist.h"
#include "tools/cli/Cli.h"

using namespace corvane;
namespace cli = corvane::cli;

namespace {

constexpr const char* kTool = "axsign";

const cli::Syntax kKeygen{"keygen --out KEY [--force]", {"--force"}, {"--out"}, 0, 0};
const cli::Syntax kTrust{"trust KEY.pub", {}, {}, 1, 1};
const cli::Syntax kUntrust{"untrust KEY.pub", {}, {}, 1, 1};
const cli::Syntax kSign{"sign --key KEY [--identifier ID] [--entitlements FILE.plist] [--machine] PATH", {"--machine"},
                      {"--key", "--identifier", "--entitlements"}, 1, 1};
const cli::Syntax kShow{"show PATH", {}, {}, 1, 1};
const cli::Syntax kVerify{"verify PATH", {}, {}, 1, 1};

const char* kUsage =
    "usage: axsign keygen --out KEY [--force]\n"
    "       axsign trust KEY.pub\n"
    "       axsign untrust KEY.pub\n"
    "       axsign sign --key KEY [--identifier ID] [--entitlements FILE.plist] [--machine] PATH\n"
    "       axsign show PATH\n"
    "       axsign verify PATH\n"
    "PATH is a bundle directory or an executable. Keys: KEY holds the secret key (mode 0600),\n"
    "KEY.pub the public key; `trust` installs a public key in the platform's trust directory (root's\n"
    "on an installed system), `untrust` removes it. --machine keeps an executable's signature in the\n"
    "machine's store instead of beside it (for programs a package installed).\n"
    "COMMAND --help shows one command's usage. See docs/code-signing.md.\n";

codesign::Verification verify(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return codesign::verifyBundle(path);
    return codesign::verifyExecutable(path);
}

bool exists(const std::string& path) {
    struct stat st {};
    return ::lstat(path.c_str(), &st) == 0;
}

bool permissionDenied(const Error& e) {
    return (e.domain == kPosixErrorDomain && (e.code == EACCES || e.code == EPERM || e.code == EROFS)) ||
           (e.domain == kFileErrorDomain && (e.code == kFileNoPermission || e.code == kFileWriteNoPermission));
}

// A file that could not be read: missing (66), not allowed (77), or not what it should be (65).
int readFailure(const Error& e) {
    if (permissionDenied(e)) return cli::fail(kTool, e.description(), cli::kNoPermission);
    if ((e.domain == kFileErrorDomain && e.code == kFileNoSuchFile) || (e.domain == kPosixErrorDomain && e.code == ENOENT))
        return cli::fail(kTool, e.description(), cli::kNoInput);
    return cli::fail(kTool, e.description(), cli::kDataError);
}

// A file that could not be written: not allowed (77; the trust directory and the machine's store
// are root's on an installed system), or otherwise not made (73).
int writeFailure(const Error& e) {
    if (permissionDenied(e))
        return cli::fail(kTool, e.description() + " (the platform's trust directory and signature store are root's: run it as root)",
                         cli::kNoPermission);
    return cli::fail(kTool, e.description(), cli::kCannotCreate);
}

int keygen(const cli::Parsed& p) {
    auto out = p.value("--out");
    if (!out) return cli::usageError(kTool, "keygen needs --out KEY", kKeygen.usage);
    // A new key in place of an old one leaves everything signed with the old one untrusted.
    if (!p.has("--force") && (exists(*out) || exists(*out + ".pub")))
        return cli::fail(kTool, *out + " exists; --force replaces it (what it signed will no longer verify)",
                         cli::kCannotCreate);
    if (Status written = codesign::writeKeyPair(*out, codesign::generateKey()); !written.ok())
        return writeFailure(written.error());
    std::printf("wrote %s and %s.pub\n", out->c_str(), out->c_str());
    return cli::kSuccess;
}

int trust(const cli::Parsed& p) {
    const std::string& key = p.operands[0];
    if (auto read = codesign::readPublicKey(key); !read) return readFailure(read.error());
    if (Status trusted = codesign::trustKey(key); !trusted.ok()) return writeFailure(trusted.error());
    std::printf("trusted %s in %s\n", key.c_str(), codesign::trustDirectory().c_str());
    return cli::kSuccess;
}

int untrust(const cli::Parsed& p) {
    const std::string& key = p.operands[0];
    if (auto read = codesign::readPublicKey(key); !read) return readFailure(read.error());
    auto removed = codesign::untrustKey(key);
    if (!removed) return writeFailure(removed.error());
    if (!*removed) return cli::fail(kTool, key + " is not trusted in " + codesign::trustDirectory(), cli::kDataError);
    std::printf("no longer trusted: %s\n", key.c_str());
    return cli::kSuccess;
}

int sign(const cli::Parsed& p) {
    auto key = p.value("--key");
    if (!key) return cli::usageError(kTool, "sign needs --key KEY", kSign.usage);
    Value entitlements = Value(Dictionary{});
    if (auto file = p.value("--entitlements")) {
        auto e = plist::readFile(*file);
        if (!e || !e->isDictionary())
            return cli::fail(kTool, *file + ": " + (e ? "not a dictionary" : e.error().description()), cli::kDataError);
        entitlements = *e;
    }
    auto keys = codesign::readSecretKey(*key);
    if (!keys) return readFailure(keys.error());
    const std::string& path = p.operands[0];
    if (!exists(path)) return cli::fail(kTool, path + ": no such file or directory", cli::kNoInput);
    auto placement = p.has("--machine") ? codesign::Placement::Machine : codesign::Placement::Beside;
    if (Status made = codesign::sign(path, *keys, p.value("--identifier"), entitlements, placement); !made.ok())
        return writeFailure(made.error());
    std::printf("signed %s\n", path.c_str());
    return cli::kSuccess;
}

int show(const cli::Parsed& p) {
    const std::string& path = p.operands[0];
    codesign::Verification v = verify(path);
    auto bytes = plist::readWholeFile(codesign::signaturePath(path));
    auto file = bytes ? codesign::parseSignature(*bytes) : std::nullopt;
    std::printf("path: %s\nsignature: %s\n", path.c_str(), codesign::signaturePath(path).c_str());
    if (file) std::printf("identifier: %s\n", file->identifier.c_str());
    std::printf("signer: %s\nverifies: %s\n", v.valid ? v.signer.c_str() : "-",
                v.valid ? "yes" : ("no (" + v.reason + ")").c_str());
    std::printf("entitlements: %s\n", v.entitlements.description().c_str());
    return v.valid ? cli::kSuccess : cli::kFailure;
}

int verifyCommand(const cli::Parsed& p) {
    const std::string& path = p.operands[0];
    codesign::Verification v = verify(path);
    if (!v.valid) return cli::fail(kTool, path + ": " + v.reason);
    std::printf("%s: valid\n", path.c_str());
    return cli::kSuccess;
}

}  // namespace

int main(int argc, char** argv) {
    log::setStandardErrorFallback(true);
    const std::vector<cli::Command> commands = {{"keygen", kKeygen, keygen}, {"trust", kTrust, trust}, {"untrust", kUntrust, untrust},
                                                {"sign", kSign, sign},       {"show", kShow, show},
                                                {"verify", kVerify, verifyCommand}};
    return cli::runCommand(kTool, kUsage, commands, std::vector<std::string>(argv + 1, argv + argc), false);
}
