// The in-memory record of one plug-in: who it is (identifier and UUID), where it lies, what its
// bundle metadata and plug-in dictionary say, and what the user has annotated on it.
//
// Two dictionaries carry the description: the bundle metadata (the bundle's whole Info.plist) and
// the plug-in dictionary (its "KSExtension" entry, which holds the attributes under
// "KSExtensionAttributes"). A record is built from a name, a location and bundle metadata
// (fromSetup), from a plug-in form received over the wire (initWithForm),
// or in the daemon from the application registry's record (a subclass). Two records are equal
// exactly when their UUIDs are equal.
//
// The lookups a subclass answers from another source (infoKey, pluginKey, attribute,
// bundleInfoDictionary, the localized names, diagnose, originalIdentifier, entitlements) are
// virtual, and every derived property is built on them, so it follows the subclass's answers.
//
// Locations ("URLs") are absolute file-system paths.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "Annexa/AXUtilities.h"

namespace annexa {

// Keys of bundle metadata, plug-in dictionaries, attributes, match rules, entitlements, annotations
// and forms, shared by the whole system.
namespace keys {
inline constexpr const char* kExtension = "KSExtension";
inline constexpr const char* kOldStyle = "Annexa";
inline constexpr const char* kMultiple = "Multiple";
inline constexpr const char* kAttributes = "KSExtensionAttributes";
inline constexpr const char* kVersion = "KSExtensionVersion";
inline constexpr const char* kProtocol = "KSExtensionProtocol";
inline constexpr const char* kPrincipalClass = "PrincipalClass";
inline constexpr const char* kEmbeddedProtocol = "EmbeddedProtocol";
inline constexpr const char* kEmbeddedCode = "EmbeddedCode";
inline constexpr const char* kDedicated = "Dedicated";
inline constexpr const char* kPassProxy = "PassProxy";
inline constexpr const char* kPointIdentifier = "KSExtensionPointIdentifier";
inline constexpr const char* kHubProtocolVersion = "HubProtocolVersion";
inline constexpr const char* kShared = "Shared";
inline constexpr const char* kCleanTimeout = "CleanTimeout";
inline constexpr const char* kHostEntitlement = "KSExtensionHostEntitlement";
inline constexpr const char* kShortVersion = "KFBundleShortVersionString";
inline constexpr const char* kBundleIdentifier = "KFBundleIdentifier";
inline constexpr const char* kInfoPlistURL = "KFBundleInfoPlistURL";
inline constexpr const char* kExtensionIdentifier = "KSExtensionIdentifier";
inline constexpr const char* kPointName = "KSExtensionPointName";
inline constexpr const char* kContainingApp = "KSExtensionContainingApp";
inline constexpr const char* kUserElection = "KSUserElection";
inline constexpr const char* kUUIDMatch = "com.corvane.uuid";
inline constexpr const char* kDataProtocol = "#Data";
inline constexpr const char* kDefaultSpec = "KSObject";
inline constexpr const char* kManagerEntitlement = "com.corvane.private.annexa.manager";
inline constexpr const char* kAllowedPlugInsEntitlement = "com.corvane.developer.annexa.allowedplugins";
inline constexpr const char* kReplaceEntitlement = "com.corvane.developer.replace-plugin";
inline constexpr const char* kAutoElectEntitlement = "com.corvane.developer.auto-elect-plugin";
inline constexpr const char* kElection = "election";
inline constexpr const char* kAnnotationData = "data";
inline constexpr const char* kAnnotationExtension = "extension";
inline constexpr const char* kAnnotationVersion = "version";
}  // namespace keys

// Keys of a plug-in form.
namespace form {
inline constexpr const char* kHubProtocolVersion = "hubProtocolVersion";
inline constexpr const char* kPath = "path";
inline constexpr const char* kSystemResident = "systemResident";
inline constexpr const char* kIdentifier = "identifier";
inline constexpr const char* kOriginalIdentifier = "original-identifier";
inline constexpr const char* kVersion = "version";
inline constexpr const char* kBundleInfo = "bundleInfo";
inline constexpr const char* kInfo = "info";
inline constexpr const char* kUUID = "uuid";
inline constexpr const char* kLastModified = "lastmodified";
inline constexpr const char* kAnnotations = "annotations";
inline constexpr const char* kEntitlements = "entitlements";
inline constexpr const char* kContainingPath = "containingPath";
inline constexpr const char* kContainingName = "localizedContainingDisplayName";
inline constexpr const char* kDisplayName = "localizedDisplayName";
inline constexpr const char* kShortName = "localizedShortName";
inline constexpr const char* kHash = "hash";
inline constexpr const char* kRequirement = "requirement";
inline constexpr const char* kExtensions = "extensions";
inline constexpr const char* kOverrider = "overrider";
inline constexpr const char* kOverriding = "overriding";
}  // namespace form

// Thread-safe: object-valued fields are read and written whole under the record's lock, so a
// reader never sees half a value and keeps a consistent one after a concurrent change; scalars are
// atomics.
// What a record is set up from. Without a uuid the record gets a random one.
struct AXPlugInSetup {
    std::optional<std::string> name{};
    std::optional<std::string> url{};  // the bundle's location
    Value bundleInfo{};                 // the bundle metadata (Info.plist)
    Value info{};                       // the plug-in dictionary, when the metadata has none
    std::optional<UUID> uuid{};
};

class AXPlugInCore {
public:
    // `init`: an empty record.
    AXPlugInCore();
    virtual ~AXPlugInCore();
    AXPlugInCore(const AXPlugInCore&) = delete;
    AXPlugInCore& operator=(const AXPlugInCore&) = delete;

    // A record set up from a name, a location and bundle metadata (the design's
    // `initWithName:url:bundleInfo:info:uuid:`); null when set-up fails. When the bundle metadata
    // gave no plug-in dictionary, `info` becomes it.
    static std::shared_ptr<AXPlugInCore> fromSetup(const AXPlugInSetup& setup);
    // `setupWithName:url:bundleInfo:info:uuid:`: false without a location or a name, or when the
    // bundle metadata is malformed.
    bool setup(const AXPlugInSetup& setup);
    bool setDictionaries(const Value& bundleInfo);
    // A hook for subclasses; the shared code returns its argument.
    virtual Value normalizeInfoDictionary(const Value& bundleInfo);

    // ---- plug-in forms
    // A record rebuilt from a form, or null when set-up fails.
    static std::shared_ptr<AXPlugInCore> initWithForm(const Value& form);
    bool setupWithForm(const Value& form);
    // Replaces the annotations by the form's "annotations" (absent clears them).
    void updateFromForm(const Value& form);
    // The record as a form (`export:`, a C++ keyword). Values are exported as they are, whatever
    // their type; only a missing always-present value (original identifier, version, bundle
    // metadata, plug-in dictionary) fails, with code 12.
    Result<Value> exportForm() const;

    // ---- SDK resolution
    void resolveSDK();
    static Value mergeDictionaryInto(const Value& sdk, const Value& plugin);
    static bool sdkOverridesKey(std::string_view key);
    static Value mergeSharedResourcesInto(const Value& sdkList, const Value& pluginList);
    void canonicalize();
    // The SDK definition of an extension point, or null (logged). Virtual so that a subclass may
    // supply another source.
    virtual Value readSDKDictionary(const std::string& extensionPointIdentifier) const;

    // ---- lookups (null when absent)
    virtual Value infoKey(std::string_view key) const;
    virtual Value pluginKey(std::string_view key) const;
    Value attributes() const;
    virtual Value attribute(std::string_view key) const;

    // ---- derived properties
    std::string path() const { return url(); }
    std::optional<std::string> containingPath() const { return containingUrl(); }
    Value version() const;
    bool isAppExtension() const;
    Value protocolSpec() const;
    Value principalSpec() const;
    Value embeddedProtocolSpec() const;
    Value sdkSpec() const;
    bool isHybrid() const;
    bool isDedicated() const;
    bool isData() const;
    bool isMultiplexed() const { return false; }
    std::optional<std::string> embeddedCodePath() const { return std::nullopt; }
    // Aborts ("unknown plug-in configuration style") for metadata with neither "KSExtension" nor
    // "Annexa".
    bool oldStyle() const;
    Date timestamp() const;
    virtual Value augmentInterface(const Value& interface) const;

    // Null when sound, else an error of code 12 naming the misconfiguration.
    virtual Status diagnose() const;

    // Replaces the annotations by a copy in which `key` maps to `value` (null removes it). Absent
    // annotations stay absent.
    void setAnnotationValue(const std::string& key, const Value& value);

    // ---- identity: equal exactly when the UUIDs are equal
    bool isEqual(const AXPlugInCore& other) const;
    size_t hash() const;
    friend bool operator==(const AXPlugInCore& a, const AXPlugInCore& b) { return a.isEqual(b); }

    // A short text for logs: "<identifier>(<uuid>)".
    std::string description() const;

    // ---- fields
    bool onSystemVolume() const { return onSystemVolume_.load(); }
    void setOnSystemVolume(bool v) { onSystemVolume_.store(v); }
    Value plugInDictionary() const;
    void setPlugInDictionary(const Value& v);
    std::optional<std::string> identifier() const;
    void setIdentifier(const std::optional<std::string>& v);
    virtual std::optional<std::string> originalIdentifier() const;
    void setOriginalIdentifier(const std::optional<std::string>& v);
    std::string url() const;
    void setUrl(const std::string& v);
    std::optional<std::string> containingUrl() const;
    void setContainingUrl(const std::optional<std::string>& v);
    virtual Value bundleInfoDictionary() const;
    void setBundleInfoDictionary(const Value& v);
    virtual Value entitlements() const;
    void setEntitlements(const Value& v);
    uint32_t hubProtocolVersion() const { return hubProtocolVersion_.load(); }
    void setHubProtocolVersion(uint32_t v) { hubProtocolVersion_.store(v); }
    virtual std::optional<std::string> localizedName() const;
    virtual void setLocalizedName(const std::optional<std::string>& v);
    virtual std::optional<std::string> localizedShortName() const;
    virtual void setLocalizedShortName(const std::optional<std::string>& v);
    virtual std::optional<std::string> localizedContainingName() const;
    virtual void setLocalizedContainingName(const std::optional<std::string>& v);
    Value annotations() const;
    void setAnnotations(const Value& v);
    int32_t lastModified() const { return lastModified_.load(); }
    void setLastModified(int32_t v) { lastModified_.store(v); }
    std::optional<UUID> uuid() const;
    void setUuid(const std::optional<UUID>& v);
    Value cdhash() const;
    void setCdhash(const Value& v);
    std::optional<std::string> requirement() const;
    void setRequirement(const std::optional<std::string>& v);

private:
    mutable corvane::Mutex mutex_;
    std::atomic<bool> onSystemVolume_{false};
    Value plugInDictionary_;
    std::optional<std::string> identifier_;
    std::optional<std::string> originalIdentifier_;
    std::string url_;
    std::optional<std::string> containingUrl_;
    Value bundleInfoDictionary_;
    Value entitlements_;
    std::atomic<uint32_t> hubProtocolVersion_{0};
    Value annotations_;
    std::atomic<int32_t> lastModified_{0};
    std::optional<UUID> uuid_;
    // Fields that many records never set (the daemon's plug-ins answer names from the registry),
    // made on the first set: the daemon keeps thousands of records.
    struct Rare {
        std::optional<std::string> localizedName;
        std::optional<std::string> localizedShortName;
        std::optional<std::string> localizedContainingName;
        Value cdhash;
        std::optional<std::string> requirement;
    };
    std::unique_ptr<Rare> rare_;
};

// Hash and equality by UUID, for sets and maps of shared records.
struct AXPlugInHash {
    template <class P>
    size_t operator()(const P& p) const {
        return p->hash();
    }
};
struct AXPlugInEqual {
    template <class P>
    bool operator()(const P& a, const P& b) const {
        return a->isEqual(*b);
    }
};

}  // namespace annexa
