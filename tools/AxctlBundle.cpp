// axctl bundle: `new` writes a skeleton (Info.plist and a sample executable in C or Python) that
// registers as it is; `check` reads a bundle as registration, signing, the extension point's SDK
// definition, the sandbox and discovery would, and says what each would make of it.
#include "tools/AxctlBundle.h"

#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "Annexa/AXDaemonClient.h"
#include "platform/codesign/CodeSign.h"
#include "platform/plist/Plist.h"
#include "platform/sdk/Sdk.h"
#include "platform/vantry/Store.h"
#include "platform/vantry/Vantry.h"

namespace axctl {

namespace cli = corvane::cli;
namespace fs = std::filesystem;
using corvane::Value;

const cli::Syntax kBundle{
    "bundle new --plugin|--app --identifier ID [--name NAME] [--extension-point POINT] [--language c|python] DIR\n"
    "       axctl bundle check PATH",
    {"--plugin", "--app"},
    {"--identifier", "--name", "--extension-point", "--language"},
    2,
    2};

namespace {

constexpr const char* kTool = "axctl";

const char* kPythonPlugIn =
    "#!/usr/bin/python3\n"
    "import annexa.plugin\n\n\n"
    "def handle(message):\n"
    "    return {\"echo\": message}\n\n\n"
    "annexa.plugin.run(handle)\n";

const char* kCPlugIn =
    "#include <annexa.h>\n"
    "#include <stdio.h>\n"
    "#include <stdlib.h>\n\n"
    "static char* handle(const char* message, void* context) {\n"
    "    (void)context;\n"
    "    size_t size = snprintf(NULL, 0, \"{\\\"echo\\\": %s}\", message) + 1;\n"
    "    char* reply = malloc(size);\n"
    "    if (reply) snprintf(reply, size, \"{\\\"echo\\\": %s}\", message);\n"
    "    return reply;\n"
    "}\n\n"
    "int main(void) { return annexa_plugin_serve(handle, NULL, ANNEXA_NOTATION_JSON) == 0 ? 0 : 1; }\n";

const char* kApplication =
    "#!/bin/sh\n"
    "# The application's own program; its plug-ins go in PlugIns/.\n";

bool writeText(const fs::path& path, const std::string& text, mode_t mode) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
    out.close();
    return out && ::chmod(path.c_str(), mode) == 0;
}

// The last dot-separated part of an identifier, for a name and an executable.
std::string lastPart(const std::string& identifier) {
    size_t dot = identifier.rfind('.');
    return dot == std::string::npos ? identifier : identifier.substr(dot + 1);
}

int bundleNew(const cli::Parsed& p) {
    bool plugIn = p.has("--plugin");
    if (plugIn == p.has("--app")) return cli::usageError(kTool, "say --plugin or --app", kBundle.usage);
    std::string identifier = *p.value("--identifier");
    std::string language = p.value("--language").value_or(plugIn ? "python" : "c");
    if (language != "c" && language != "python")
        return cli::usageError(kTool, "--language is c or python, not " + language, kBundle.usage);
    if (identifier.empty() || identifier.find_first_of("/ \t\n") != std::string::npos)
        return cli::usageError(kTool, "--identifier is reverse-DNS, like com.example.tool: " + identifier, kBundle.usage);
    std::string name = p.value("--name").value_or(lastPart(identifier));
    std::string executable = lastPart(identifier);
    fs::path bundle = fs::path(p.operands[1]) / (name + (plugIn ? ".appex" : ".app"));
    // A C plug-in's source goes beside the bundle; neither replaces anything of the user's.
    std::string source = plugIn && language == "c" ? (fs::path(p.operands[1]) / (executable + ".c")).string() : "";
    std::error_code ec;
    for (const std::string& made : {bundle.string(), source}) {
        if (!made.empty() && fs::symlink_status(made, ec).type() != fs::file_type::not_found)
            return cli::fail(kTool, made + " exists already", cli::kCannotCreate);
    }
    if (!fs::create_directories(bundle, ec)) return cli::fail(kTool, "cannot make " + bundle.string() + ": " + ec.message(), cli::kCannotCreate);

    corvane::Dictionary info{{"KFBundleIdentifier", Value(identifier)},
                             {"KFBundleDisplayName", Value(name)},
                             {"KFBundleShortVersionString", Value("1.0")},
                             {"KFBundleVersion", Value("1")},
                             {"KFBundlePackageType", Value(plugIn ? "RPX!" : "APP!")}};
    if (plugIn) {
        std::string point = p.value("--extension-point").value_or("com.example." + executable);
        info["KSExtension"] = corvane::dict({{"KSExtensionPointIdentifier", Value(point)},
                                            {"KSExtensionAttributes", Value(corvane::Dictionary{})}});
    }
    info["KFBundleExecutable"] = Value(executable);
    auto xml = corvane::plist::toXML(Value(info));
    bool written = xml && writeText(bundle / "Info.plist", *xml, 0644);
    if (plugIn && language == "python") {
        written = written && writeText(bundle / executable, kPythonPlugIn, 0755);
    } else if (plugIn) {
        written = written && writeText(source, kCPlugIn, 0644);
    } else {
        written = written && writeText(bundle / executable, kApplication, 0755);
    }
    if (!written) return cli::fail(kTool, "cannot write the skeleton in " + bundle.string(), cli::kCannotCreate);
    std::printf("%s\n", bundle.c_str());
    if (!source.empty()) {
        std::printf("build its executable with:\n  cc %s $(pkg-config --cflags --libs annexa) -o %s\n", source.c_str(),
                    (bundle / executable).c_str());
    }
    std::printf("then: axctl bundle check %s\n", bundle.c_str());
    return cli::kSuccess;
}

void line(const char* what, const std::string& text) { std::printf("%-16s %s\n", what, text.c_str()); }

std::string text(const Value& v) {
    const std::string* s = v.asString();
    return s ? *s : v.description();
}

// Whether a host could match the plug-in now: the daemon's own explanation, when this client may
// see it.
void checkDiscovery(const std::string& service, const std::string& path, const std::string& identifier) {
    auto registry = corvane::vantry::Registry::openDefault();
    if (!registry || !(*registry)->plugInForPath(path)) {
        line("discovery", "not registered: `axctl add " + path + "` (or of its application) makes it findable with -r "
                          "KSExtensionIdentifier=" + identifier);
        return;
    }
    annexa::AXDaemonClient client(service);
    Value rules = corvane::dict({{"KSExtensionIdentifier", Value(identifier)}});
    auto reply = client.wait([&](auto done) { client.matchPlugIns(rules, annexa::discovery::kExplain, done); });
    if (!reply.ok()) {
        line("discovery", "registered; axd cannot be reached, so what a host would find is unknown");
        return;
    }
    const corvane::Array* explanations = reply.value["explanations"].asArray();
    for (const Value& e : explanations ? *explanations : corvane::Array{}) {
        if (text(e["path"]) != path) continue;
        line("discovery", "registered; a host matching -r KSExtensionIdentifier=" + identifier + ": " + text(e["outcome"]));
        return;
    }
    line("discovery", "registered, but hidden from this client: a plug-in outside an application and the system "
                      "volume, dedicated to another application, held, or needing an entitlement (a manager sees why)");
}

int bundleCheck(const std::string& service, const cli::Parsed& p) {
    std::error_code ec;
    std::string path = fs::weakly_canonical(fs::absolute(p.operands[1]), ec).string();
    auto info = corvane::vantry::readInfoDictionary(path);
    if (!info) {
        line("Info.plist", info.error().description());
        return cli::kDataError;
    }
    const std::string type = text((*info)["KFBundlePackageType"]);
    const bool plugIn = type == "RPX!";
    line("bundle", path + (plugIn ? " (a plug-in)" : type == "APP!" ? " (an application)" : " (package type " + type + ")"));
    corvane::Status registrable = corvane::vantry::Registry::checkBundle(path);
    line("registration", registrable.ok() ? "the registry accepts it" : "refused: " + registrable.error().description());
    auto verification = corvane::codesign::verifyBundle(path);
    line("signature", verification.valid ? "valid, identifier " + verification.identifier + ", signed by " + verification.signer
                                         : "none that verifies: " + verification.reason);
    if (verification.valid) line("entitlements", verification.entitlements.description());
    int status = registrable.ok() ? cli::kSuccess : cli::kDataError;
    if (!plugIn) return status;

    const Value& extension = (*info)["KSExtension"];
    const std::string* point = extension["KSExtensionPointIdentifier"].asString();
    if (!point) {
        line("extension point", "none: KSExtension has no KSExtensionPointIdentifier string");
        return cli::kDataError;
    }
    auto definition = corvane::sdk::readDefinition(*point);
    line("extension point", *point + (definition ? ", defined by " + corvane::sdk::sdkDirectory() + "/" + *point + ".plist"
                                                 : ", with no SDK definition (nothing is merged in)"));
    auto resolved = corvane::sdk::resolve(*info);
    line("attributes", resolved.plugin["KSExtensionAttributes"].description());
    auto choice = corvane::sdk::sandboxProfileFor(*point, false);
    line("sandbox", choice.profile + ": " + choice.why);
    if (registrable.ok()) {
        std::string identifier = text(resolved.plugin["KSExtensionIdentifier"]);
        if (identifier.empty() || identifier == "null") identifier = text((*info)["KFBundleIdentifier"]);
        checkDiscovery(service, path, identifier);
    }
    return status;
}

}  // namespace

int bundle(const std::string& service, const cli::Parsed& p) {
    const std::string& what = p.operands[0];
    if (what == "new") {
        if (!p.value("--identifier")) return cli::usageError(kTool, "bundle new needs --identifier", kBundle.usage);
        return bundleNew(p);
    }
    if (what == "check") return bundleCheck(service, p);
    return cli::usageError(kTool, "bundle new or bundle check, not bundle " + what, kBundle.usage);
}

}  // namespace axctl
