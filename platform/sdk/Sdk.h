// Extension-point SDK definitions and the rules that merge them into plug-in metadata.
//
// An extension point may have an SDK definition: a dictionary shaped like a plug-in's Info.plist
// (its plug-in dictionary under "KSExtension") that supplies defaults for the plug-ins serving
// that extension point. Definitions are files "<extension point identifier>.plist" in
// sdkDirectory(). Merging fills in what the plug-in leaves out, at every depth; the plug-in's own
// value wins, except for "CleanTimeout" (the SDK's wins) and "Shared" (the union of both lists).
//
// Thread-safety: every function is safe to call from any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace corvane::sdk {

// <shared data>/sdk under the platform root.
std::string sdkDirectory();

// The memory (MiB) a sandboxed plug-in of the extension point may use; only an SDK definition sets
// it (it replaces the plug-in's own value, and a plug-in's own is dropped without one).
inline constexpr const char* kSandboxMemoryLimit = "SandboxMemoryLimit";

// The definition of an extension point, or nullopt when none is registered, it cannot be read, or
// it is not a dictionary. Identifiers that could name another file (empty, containing '/', or
// starting with '.') are never looked up.
std::optional<Value> readDefinition(const std::string& extensionPointIdentifier);

// A new dictionary: `plugin` with the SDK's values merged in by the rules above. A non-dictionary
// argument counts as an empty dictionary.
Value mergeDictionary(const Value& sdk, const Value& plugin);
// True for the keys whose SDK value replaces the plug-in's own: only "CleanTimeout".
bool sdkOverridesKey(std::string_view key);
// The set union of two lists (each element once, compared by value). A value that is not a list
// counts as a list of one when it is a string, else as empty.
Value mergeSharedResources(const Value& sdkList, const Value& pluginList);

// The plug-in dictionary in canonical form: its attributes ("KSExtensionAttributes", empty when
// absent) always present, with "KSExtensionVersion" taken from the bundle's
// "KFBundleShortVersionString", or "1", when the attributes have none.
Value canonicalPlugInDictionary(const Value& plugInDictionary, const Value& info);

// What resolving does to a plug-in's Info.plist: merge the definition of its
// KSExtension.KSExtensionPointIdentifier (when that is a string and a definition exists) into it,
// then canonicalize the plug-in dictionary. `info` is the merged Info.plist; `plugin` the canonical
// plug-in dictionary. An identifier that is not a string leaves both as they were (the plug-in
// dictionary not even canonicalized) and sets `invalidSdkKey`.
struct Resolved {
    Value info;
    Value plugin;
    bool invalidSdkKey = false;
};
Resolved resolve(const Value& info);

// The sandbox profile spawnd runs a plug-in of this extension point under (docs/sandbox.md), and
// why, in words for the plug-in's developer. A keyboard's plug-in gets the network only when it
// asks for open access and the user granted its application the keyboard-network service.
struct SandboxChoice {
    std::string profile;
    std::string why;
};
SandboxChoice sandboxProfileFor(std::string_view extensionPoint, bool keyboardNetworkGranted);

}  // namespace corvane::sdk
