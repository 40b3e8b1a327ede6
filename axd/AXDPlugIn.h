// The daemon's plug-in record: an AXPlugInCore built from the application registry's record of one
// plug-in, answering its metadata lookups from that record instead of from stored dictionaries.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Annexa/AXPlugInCore.h"
#include "platform/vantry/Vantry.h"

namespace annexa {

class AXDRpxClient;

// Thread-safe: the registry record and the three name caches are replaced whole under one lock, and
// readers take their own reference.
class AXDPlugIn : public AXPlugInCore {
public:
    // A record for the registry's record, or null: no bundle location, no identifier, or a
    // misconfigured plug-in (logged).
    static std::shared_ptr<AXDPlugIn> fromRegistryRecord(const corvane::vantry::PlugInRecordPtr& record);

    Value infoKey(std::string_view key) const override;
    Value pluginKey(std::string_view key) const override;
    Value attribute(std::string_view key) const override;
    Value bundleInfoDictionary() const override;
    std::optional<std::string> localizedName() const override;
    void setLocalizedName(const std::optional<std::string>& v) override;
    std::optional<std::string> localizedShortName() const override;
    void setLocalizedShortName(const std::optional<std::string>& v) override;
    std::optional<std::string> localizedContainingName() const override;
    void setLocalizedContainingName(const std::optional<std::string>& v) override;
    Status diagnose() const override;

    // The plug-in's own entitlement, or null.
    Value valueForEntitlement(const std::string& key) const;
    // Present and not equal to false (a number 0 counts as false).
    bool hasEntitlement(const std::string& key) const;
    // The key of the plug-in's annotations: the identifier named by its replace-plugin entitlement
    // when that is a string, else its own identifier.
    const std::string& annotationKey() const;
    // Adds "extensions": read tokens for the plug-in's shared resources (the bundle itself for an
    // application extension).
    void augmentForm(Dictionary& form) const;
    // Resource name -> read token, for a name or a list of names ("." is the bundle itself).
    Dictionary issueResourceExtensions(const Value& resources) const;
    // The form as the match reply sends it, encoded for the wire: every entry of exportForm and
    // augmentForm but "annotations", which each reply takes from the annotation store. Made once and
    // kept until the registry record or a name is replaced; the export's error when there is none.
    struct EncodedForm {
        std::string entries;  // `count` dictionary entries, one after the other
        uint32_t count = 0;
        size_t nesting = 0;       // of the whole form (corvane::rpx::wire::nestingOf)
        uint32_t kindsInside = 0;  // of the whole form (Value::kindsInside)
    };
    using EncodedFormPtr = std::shared_ptr<const EncodedForm>;
    corvane::Result<EncodedFormPtr> encodedForm() const;
    // Changes whenever any plug-in's kept form is dropped (its record or a name was replaced).
    static uint64_t formsDropped() { return formsDropped_.load(); }

    // The entries whose keys do not begin with "DT".
    static Dictionary prunedInfoDictionaryFor(const Value& dictionary);

    // ---- the pattern language (AXDPlugInMatching.cpp; docs/discovery.md)
    // Pure: they read the record, the user's annotation (through the server, so never on the
    // database queue) and the type system, and change nothing. Everything malformed answers false.

    // `match:`: the plug-in passes every test of the pattern dictionary; null (absent) and an empty
    // dictionary match every plug-in.
    bool match(const Value& patterns) const;
    // `matchKey:pattern:`: one test; the key selects the subject, the pattern tests it.
    bool matchKeyPattern(const std::string& key, const Value& pattern) const;
    // `matchValue:patterns:`: a string pattern, or an array of them of which one must match.
    bool matchValuePatterns(const std::string& subject, const Value& patterns) const;
    // `matchValue:pattern:`: one operator pattern ("?TY-CONFORMS:", "?TY-IS:", "<>", "<=", ">=",
    // "=", "<", ">", or plain equality) against a string, by the numeric-aware comparison.
    bool matchValuePattern(const std::string& subject, const std::string& pattern) const;
    // `matchDictionary:pattern:`: the plug-in's activation rule (subject) against a host's offer.
    bool matchDictionaryPattern(const Value& subject, const Value& pattern) const;

    // ---- host authorization (AXDPlugInAuthorization.cpp)

    // `allowForClient:`: nothing when the client may use the plug-in, else the reason. The host's
    // restricting entitlement (a pattern dictionary) is tested first, then the plug-in's
    // "KSExtensionHostEntitlement".
    std::optional<std::string> allowForClient(const AXDRpxClient& client) const;
    // The same for a host known only by its entitlements (`entitlement` gives a key's value).
    std::optional<std::string> allowForHost(const std::function<Value(const std::string&)>& entitlement) const;
    // `allowedPCXServices`: the privacy-consent services granted to the plug-in's containing
    // application; empty when there are none or they cannot be learnt.
    std::set<std::string> allowedPCXServices() const;

    // ---- activation (AXDPlugInActivation.cpp; docs/spawnd.md)

    // The sandbox profile the plug-in runs under, by its extension point.
    std::string sandboxProfile() const;
    // `enableForClient:`: registers the plug-in's executable with the service manager for the
    // host, with its activation overlay. An error of code 4 when that fails.
    Status enableForClient(const AXDRpxClient& client) const;
    // `checkBusy`: {"bundleIdentifier": ID} when a process of the plug-in is busy, else nothing.
    std::optional<Value> checkBusy() const;

    // The registry record, replaced whole; readers get their own reference.
    corvane::vantry::PlugInRecordPtr vtproxy() const;
    void setVtproxy(corvane::vantry::PlugInRecordPtr record);

    // What a match walk reads of every candidate, learnt once when the plug-in is made from its
    // record and not changed after (a changed registration makes a new plug-in). Kept together in
    // the plug-in itself: a walk over thousands of plug-ins then reads one object for each, where
    // the lookups behind these (a lock, the record, its dictionaries) cost a cache miss apiece.
    struct WalkFacts {
        std::string identifier;             // "" when there is none
        std::string version;                // the version attribute when it is a string, else ""
        std::vector<std::string> replaces;  // the names of its replace-plugin entitlement
        bool replacesByName = false;        // that entitlement is one name (no list)
        bool dedicated = false;             // its plug-in dictionary's "Dedicated" reads as true
        bool inApplication = false;         // it has a containing application
        Value hostEntitlement;              // the entitlement it asks of hosts; null for none
    };
    const WalkFacts& walkFacts() const { return walkFacts_; }

private:
    void learnWalkFacts();
    WalkFacts walkFacts_;
    mutable corvane::Mutex mutex_;
    corvane::vantry::PlugInRecordPtr vtproxy_ GUARDED_BY(mutex_);
    // Names set on the plug-in itself, made on the first set: most plug-ins have none, and the
    // daemon keeps thousands.
    struct SetNames {
        std::optional<std::string> name, shortName, containingName;
    };
    SetNames& namesLocked() REQUIRES(mutex_);
    void dropEncodedForm() REQUIRES(mutex_);
    static inline std::atomic<uint64_t> formsDropped_{0};
    std::unique_ptr<SetNames> setNames_ GUARDED_BY(mutex_);
    // The kept form, or why the export failed. The form is held inline, so that a walk finds it
    // in the plug-in itself; the error through a pointer: an Error inline would make each of
    // thousands of plug-ins 80 bytes larger.
    mutable EncodedFormPtr encodedForm_ GUARDED_BY(mutex_);
    mutable std::shared_ptr<const corvane::Error> exportError_ GUARDED_BY(mutex_);
};

using AXDPlugInPtr = std::shared_ptr<AXDPlugIn>;

}  // namespace annexa
