// axsign: makes signing keys, trusts them, signs bundles and executables with entitlements, and
// shows or verifies signatures. See docs/code-signing.md.
#include <sys/stat.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "platform/codesign/CodeSign.h"
#include "platform/plist/Plist.h"

using namespace corvane;

namespace {

const char* kUsage =
    "usage: axsign keygen --out KEY\n"
    "       axsign trust KEY.pub\n"
    "       axsign sign --key KEY [--identifier ID] [--entitlements FILE.plist] PATH\n"
    "       axsign show PATH\n"
    "       axsign verify PATH\n"
    "PATH is a bundle directory or an executable. Keys: KEY holds the secret key (mode 0600),\n"
    "KEY.pub the public key; `trust` installs a public key in the platform's trust directory.\n";

int fail(const std::string& text) {
    std::fprintf(stderr, "axsign: %s\n", text.c_str());
    return 1;
}

bool wantsHelp(const std::vector<std::string>& args) {
    for (const auto& a : args)
        if (a == "--help" || a == "-h") return true;
    return false;
}

codesign::Verification verify(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return codesign::verifyBundle(path);
    return codesign::verifyExecutable(path);
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string> args(argv + 1, argv + argc);
    if (args.empty() || args[0] == "--help" || args[0] == "-h") {
        std::fputs(kUsage, args.empty() ? stderr : stdout);
        return args.empty() ? 64 : 0;
    }
    std::string command = args[0];
    args.erase(args.begin());
    if (wantsHelp(args)) {
        std::fputs(kUsage, stdout);
        return 0;
    }
    if (command == "keygen") {
        if (args.size() != 2 || args[0] != "--out") return fail("keygen needs --out KEY");
        if (Status err = codesign::writeKeyPair(args[1], codesign::generateKey()); !err.ok()) return fail(err.error().description());
        std::printf("wrote %s and %s.pub\n", args[1].c_str(), args[1].c_str());
        return 0;
    }
    if (command == "trust") {
        if (args.size() != 1) return fail("trust needs one public key file");
        if (Status err = codesign::trustKey(args[0]); !err.ok()) return fail(err.error().description());
        std::printf("trusted %s in %s\n", args[0].c_str(), codesign::trustDirectory().c_str());
        return 0;
    }
    if (command == "sign") {
        std::string key;
        std::optional<std::string> identifier;
        Value entitlements = Value(Dictionary{});
        std::string path;
        for (size_t i = 0; i < args.size(); ++i) {
            if (args[i] == "--key" && i + 1 < args.size()) {
                key = args[++i];
            } else if (args[i] == "--identifier" && i + 1 < args.size()) {
                identifier = args[++i];
            } else if (args[i] == "--entitlements" && i + 1 < args.size()) {
                auto e = plist::readFile(args[++i]);
                if (!e) return fail(args[i] + ": " + e.error().description());
                entitlements = *e;
            } else if (path.empty() && args[i][0] != '-') {
                path = args[i];
            } else {
                return fail("unexpected argument " + args[i]);
            }
        }
        if (key.empty() || path.empty()) return fail("sign needs --key KEY and a PATH");
        auto keys = codesign::readSecretKey(key);
        if (!keys) return fail(keys.error().description());
        if (Status err = codesign::sign(path, *keys, identifier, entitlements); !err.ok()) return fail(err.error().description());
        std::printf("signed %s\n", path.c_str());
        return 0;
    }
    if (command == "show" || command == "verify") {
        if (args.size() != 1) return fail(command + " needs one PATH");
        codesign::Verification v = verify(args[0]);
        if (command == "verify") {
            if (!v.valid) return fail(args[0] + ": " + v.reason);
            std::printf("%s: valid\n", args[0].c_str());
            return 0;
        }
        auto bytes = plist::readWholeFile(codesign::signaturePath(args[0]));
        auto file = bytes ? codesign::parseSignature(*bytes) : std::nullopt;
        std::printf("path: %s\nsignature: %s\n", args[0].c_str(), codesign::signaturePath(args[0]).c_str());
        if (file) {
            std::printf("identifier: %s\n", file->identifier.c_str());
        }
        std::printf("signer: %s\nverifies: %s\n", v.valid ? v.signer.c_str() : "-",
                    v.valid ? "yes" : ("no (" + v.reason + ")").c_str());
        std::printf("entitlements: %s\n", v.entitlements.description().c_str());
        return v.valid ? 0 : 1;
    }
    return fail("unknown command " + command + "\n" + kUsage);
}
