// Reading bundles from disk at registration: the plug-in's metadata merged with its SDK, its
// verified entitlements, its data container, its names, and a fingerprint of all of it.
#include <dirent.h>
#include <sodium.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "platform/codesign/CodeSign.h"
#include "platform/containers/Containers.h"
#include "platform/bundle/Bundle.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/sdk/Sdk.h"
#include "platform/vantry/Store.h"

namespace corvane::vantry {

namespace {

std::string fileStamp(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return "-";
    return std::to_string(st.st_size) + ":" + std::to_string(st.st_mtim.tv_sec) + "." +
           std::to_string(st.st_mtim.tv_nsec);
}

// A stable digest (BLAKE2b), so a fingerprint stored by one build matches the next build's.
std::string digest(std::string_view text) {
    unsigned char hash[16];
    crypto_generichash(hash, sizeof hash, reinterpret_cast<const unsigned char*>(text.data()), text.size(),
                       nullptr, 0);
    char hex[sizeof hash * 2 + 1];
    sodium_bin2hex(hex, sizeof hex, hash, sizeof hash);
    return hex;
}

// The user's languages, most preferred first: "de_DE", then "de".
std::vector<std::string> languages() {
    const char* value = nullptr;
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        const char* v = std::getenv(name);
        if (v && *v) {
            value = v;
            break;
        }
    }
    std::vector<std::string> out;
    if (!value) return out;
    std::string lang = value;
    lang = lang.substr(0, lang.find_first_of(".@"));
    if (lang.empty() || lang == "C" || lang == "POSIX") return out;
    out.push_back(lang);
    size_t underscore = lang.find('_');
    if (underscore != std::string::npos) out.push_back(lang.substr(0, underscore));
    return out;
}

}  // namespace

LocalizedNames localizedNames(const std::string& bundle, const Value& info) {
    Value table;
    for (const auto& lang : languages()) {
        auto t = bundle::readPropertyListOfBundle(bundle + "/Names/" + lang + ".plist");
        if (t && t->isDictionary()) {
            table = *t;
            break;
        }
    }
    auto pick = [&](const char* key) {
        auto v = stringAt(table, key);
        return v ? v : stringAt(info, key);
    };
    auto display = pick("KFBundleDisplayName");
    auto shortName = pick("KFBundleName");
    return {display ? display : shortName, shortName};
}

Result<Value> readInfoDictionary(const std::string& bundlePath) {
    std::string file = bundlePath + "/Info.plist";
    auto info = bundle::readPropertyListOfBundle(file);
    if (!info) {
        const Error& e = info.error();
        if (e.domain == kFileErrorDomain && e.code == kFileNoSuchFile) return refusal("missing Info.plist in " + bundlePath);
        if (e.domain == kFileErrorDomain) return refusal("unreadable Info.plist: " + e.description());
        return refusal("malformed Info.plist: " + e.description());
    }
    if (!info->isDictionary()) return refusal("malformed Info.plist: " + file + " holds no dictionary");
    return info;
}

Result<Value> readPlugInInfo(const std::string& path) {
    auto info = readInfoDictionary(path);
    if (!info) return info.error();
    if (!(*info)["KSExtension"].isDictionary()) return refusal("no plug-in dictionary (KSExtension) in " + path);
    auto extId = stringAt((*info)["KSExtension"], "KSExtensionIdentifier");
    if (!extId && stringAt(*info, "KFBundleIdentifier").value_or("").empty())
        return refusal("plug-in without identifier: " + path);
    if (extId && extId->empty()) return refusal("plug-in without identifier: " + path);
    return *info;
}

Result<std::vector<std::string>> plugInPathsOf(const std::string& appPath) {
    std::vector<std::string> paths;
    std::string plugInsDir = appPath + "/PlugIns";
    auto canonicalDir = layout::canonicalPath(plugInsDir);
    DIR* d = canonicalDir ? opendir(canonicalDir->c_str()) : nullptr;
    if (!d) return paths;
    // A directory entry of the canonical PlugIns/ is canonical as it is; a link (or an entry whose
    // type the file system does not say) is resolved.
    std::vector<std::pair<std::string, bool>> names;
    while (struct dirent* e = readdir(d)) {
        std::string n = e->d_name;
        if (n.size() > 6 && n.substr(n.size() - 6) == ".appex") names.emplace_back(n, e->d_type == DT_DIR);
    }
    closedir(d);
    std::sort(names.begin(), names.end());
    for (const auto& [n, directory] : names) {
        if (directory) {
            paths.push_back(*canonicalDir + "/" + n);
            continue;
        }
        auto p = layout::canonicalPath(plugInsDir + "/" + n);
        if (!p) {
            return refusal((errno == ELOOP ? "symbolic link loop under PlugIns/: " : "unreadable plug-in: ") +
                           plugInsDir + "/" + n);
        }
        paths.push_back(*p);
    }
    return paths;
}

Status checkBundle(const std::string& given) {
    auto path = layout::canonicalPath(given);
    struct stat st {};
    if (!path || ::stat(path->c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return refusal("not a bundle: " + given);
    auto info = readInfoDictionary(*path);
    if (!info) return info.error();
    if ((*info)["KSExtension"].isDictionary()) return readPlugInInfo(*path).status();
    if (!stringAt(*info, "KFBundleIdentifier"))
        return refusal("application without identifier (KFBundleIdentifier): " + *path);
    auto plugIns = plugInPathsOf(*path);
    if (!plugIns) return plugIns.error();
    for (const auto& p : *plugIns) {
        if (auto read = readPlugInInfo(p); !read) return read.error();
    }
    return {};
}

Result<ScannedPlugIn> scanPlugIn(const std::string& path) {
    auto read = readPlugInInfo(path);
    if (!read) return read.error();
    const Value& info = *read;
    ScannedPlugIn s;
    s.path = path;
    s.bundleIdentifier = stringAt(info, "KFBundleIdentifier").value_or("");
    auto extId = stringAt(info["KSExtension"], "KSExtensionIdentifier");
    s.identifier = extId ? *extId : s.bundleIdentifier;
    s.bundleVersion = stringAt(info, "KFBundleVersion").value_or("");
    auto resolved = sdk::resolve(info);
    s.info = resolved.info;
    s.plugin = resolved.plugin;
    s.entitlements = codesign::entitlementsOfBundle(path, info);
    s.system = layout::isBeneath(path, layout::systemRoot());
    if (!(s.plugin["KSExtensionProtocol"] == Value("#Data"))) {
        // The identifier must name a container. Each reader names its own from it, and the service
        // manager makes it at the plug-in's first launch: registering thousands of plug-ins makes
        // no directory.
        auto container = containers::dataContainerPath(containers::kPlugInDataClass, s.identifier);
        if (!container) return refusal("no data container for " + path + ": " + container.error().description());
    }
    LocalizedNames names = localizedNames(path, info);
    s.name = names.display;
    s.shortName = names.shortName;
    std::string exe = path + "/" + stringAt(info, "KFBundleExecutable").value_or("");
    s.fingerprint = digest(info.description() + "|" + s.entitlements.description() + "|" + fileStamp(exe) + "|" +
                           s.name.value_or("") + "|" + s.shortName.value_or("") + "|" + s.plugin.description());
    return s;
}

PlugInRecordPtr makeRecord(const ScannedPlugIn& s, const ApplicationRecordPtr& app) {
    auto r = std::make_shared<PlugInRecord>();
    r->uuid_ = UUID::random();
    r->bundlePath_ = s.path;
    r->identifier_ = s.identifier;
    r->bundleIdentifier_ = s.bundleIdentifier;
    r->originalIdentifier_ = s.bundleIdentifier.empty() ? s.identifier : s.bundleIdentifier;
    r->bundleVersion_ = s.bundleVersion;
    r->plugin_ = s.plugin;
    r->info_ = s.info;
    r->entitlements_ = s.entitlements;
    r->registered_ = Date::now();
    r->system_ = s.system;
    r->application_ = app;
    r->localizedName_ = s.name;
    r->localizedShortName_ = s.shortName;
    return r;
}

}  // namespace corvane::vantry
