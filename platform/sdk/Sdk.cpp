#include "platform/sdk/Sdk.h"

#include <algorithm>

#include "platform/bundle/Bundle.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"

namespace corvane::sdk {

namespace {

const Dictionary& dictionaryOrEmpty(const Value& v) {
    static const Dictionary kEmpty;
    const Dictionary* d = v.asDictionary();
    return d ? *d : kEmpty;
}

Array listOf(const Value& v) {
    if (const Array* a = v.asArray()) return *a;
    if (v.isString()) return Array{v};
    return {};
}

}  // namespace

std::string sdkDirectory() { return layout::sharedDataDir() + "/sdk"; }

std::optional<Value> readDefinition(const std::string& identifier) {
    if (identifier.empty() || identifier[0] == '.' || identifier.find('/') != std::string::npos ||
        identifier.find('\0') != std::string::npos)
        return std::nullopt;
    // A system file, which may be a link the distribution made; bounded and never blocking all the same.
    auto v = bundle::readPropertyListOfBundle(sdkDirectory() + "/" + identifier + ".plist", true);
    if (!v || !v->isDictionary()) return std::nullopt;
    return std::move(*v);
}

bool sdkOverridesKey(std::string_view key) { return key == "CleanTimeout" || key == kSandboxMemoryLimit; }

Value mergeSharedResources(const Value& sdkList, const Value& pluginList) {
    Array result = listOf(pluginList);
    for (const Value& e : listOf(sdkList)) {
        if (std::find(result.begin(), result.end(), e) == result.end()) result.push_back(e);
    }
    return Value(std::move(result));
}

Value mergeDictionary(const Value& sdk, const Value& plugin) {
    Dictionary result = dictionaryOrEmpty(plugin);
    for (const auto& [key, sdkValue] : dictionaryOrEmpty(sdk)) {
        auto it = result.find(key);
        if (it == result.end()) {
            result.emplace(key, sdkValue);  // the SDK fills what the plug-in leaves out
        } else if (sdkOverridesKey(key)) {
            it->second = sdkValue;
        } else if (key == "Shared") {
            it->second = mergeSharedResources(sdkValue, it->second);
        } else if (sdkValue.isDictionary() && it->second.isDictionary()) {
            it->second = mergeDictionary(sdkValue, it->second);
        }
        // Otherwise the plug-in's own value stays: strings, numbers, arrays other than "Shared",
        // and values whose shape differs from the SDK's.
    }
    return Value(std::move(result));
}

Value canonicalPlugInDictionary(const Value& plugInDictionary, const Value& info) {
    Dictionary plugin = dictionaryOrEmpty(plugInDictionary);
    Dictionary attributes = dictionaryOrEmpty(plugin.count("KSExtensionAttributes")
                                                  ? plugin["KSExtensionAttributes"]
                                                  : Value());
    if (!attributes.count("KSExtensionVersion")) {
        const Value& shortVersion = info["KFBundleShortVersionString"];
        attributes.emplace("KSExtensionVersion",
                           shortVersion.isNull() ? Value("1") : shortVersion);
    }
    plugin.insert_or_assign("KSExtensionAttributes", Value(std::move(attributes)));
    return Value(std::move(plugin));
}

Resolved resolve(const Value& info) {
    Resolved r{info, info["KSExtension"], false};
    const Value& point = r.plugin["KSExtensionPointIdentifier"];
    if (!point.isNull() && !point.isString()) {
        r.invalidSdkKey = true;
        return r;
    }
    Value sdkMemoryLimit;
    if (const std::string* id = point.asString()) {
        if (auto definition = readDefinition(*id)) {
            r.info = mergeDictionary(*definition, info);
            r.plugin = r.info["KSExtension"];
            sdkMemoryLimit = (*definition)["KSExtension"][kSandboxMemoryLimit];
        }
    }
    r.plugin = canonicalPlugInDictionary(r.plugin, r.info);
    // A sandbox's memory is the extension point's to set, never the plug-in's: a value the plug-in
    // wrote itself is dropped.
    if (sdkMemoryLimit.isNull() && r.plugin.has(kSandboxMemoryLimit)) {
        Dictionary plugin = *r.plugin.asDictionary();
        plugin.erase(kSandboxMemoryLimit);
        r.plugin = Value(std::move(plugin));
    }
    return r;
}

SandboxChoice sandboxProfileFor(std::string_view point, bool keyboardNetworkGranted) {
    if (point == "com.corvane.keyboard-service") {
        if (keyboardNetworkGranted)
            return {"plugin", "a keyboard whose user granted its application network access (pcx)"};
        return {"keyboard", "a keyboard: what the user types stays on the machine unless the user grants its "
                            "application network access (pcx), which moves it to plugin"};
    }
    if (point == "com.corvane.netshield.filter-data") return {"network-filter", "a network filter serves the network"};
    if (point == "com.corvane.glancer.extension.preview") return {"glancerd", "a preview needs to reach nothing"};
    if (point == "com.corvane.app.non-ui-extension" || point == "com.corvane.app.non-ui-extension.multiple-instances")
        return {"sandpit-devtools", "a non-UI extension may serve the network"};
    return {"plugin", "the profile of every extension point the platform does not name"};
}

}  // namespace corvane::sdk
