#include "axd/AXDPlugIn.h"

#include <cerrno>
#include <cstring>

#include "Annexa/AXSandboxExtension.h"
#include "platform/layout/Layout.h"
#include "platform/rpx/Wire.h"
#include "platform/sandbox/Sandbox.h"

namespace annexa {

namespace log = corvane::log;
using corvane::vantry::Scope;

std::shared_ptr<AXDPlugIn> AXDPlugIn::fromRegistryRecord(const corvane::vantry::PlugInRecordPtr& r) {
    if (!r || r->bundlePath().empty()) return nullptr;
    auto p = std::make_shared<AXDPlugIn>();
    // The registry record answers every lookup, so it is in place before anything asks.
    p->setVtproxy(r);
    std::optional<std::string> name;
    if (!r->identifier().empty()) name = r->identifier();
    if (!p->setup({.name = name, .url = r->bundlePath(), .info = r->pluginDictionary(), .uuid = r->uuid()}))
        return nullptr;
    p->setPlugInDictionary(r->pluginDictionary());
    p->setEntitlements(r->entitlements());
    p->setOriginalIdentifier(r->originalIdentifier());
    p->setLastModified(static_cast<int32_t>(r->registrationDate().wholeSeconds()));
    p->setOnSystemVolume(r->onSystemVolume());
    // Present, it is used whatever its type ("3" is 3); absent, the Info.plist decides.
    if (const Value* hub = r->pluginDictionary().find(keys::kHubProtocolVersion)) {
        p->setHubProtocolVersion(static_cast<uint32_t>(integerValueOf(*hub)));
    } else {
        p->setHubProtocolVersion(p->infoKey(keys::kOldStyle).isNull() ? 2 : 1);
    }
    if (const auto& app = r->containingApplication()) p->setContainingUrl(app->bundlePath());
    if (Status usable = p->diagnose(); !usable.ok()) {
        log::info(logOps(), "ignoring mis-configured plug-in at %@: %{public}@", r->bundlePath(),
                  usable.error().description());
        return nullptr;
    }
    p->learnWalkFacts();
    return p;
}

void AXDPlugIn::learnWalkFacts() {
    walkFacts_.identifier = identifier().value_or("");
    Value version = this->version();
    if (const std::string* text = version.asString()) walkFacts_.version = *text;
    // A name, or a list of names among which anything else is passed over.
    Value replaces = valueForEntitlement(keys::kReplaceEntitlement);
    if (const std::string* one = replaces.asString()) {
        walkFacts_.replaces.push_back(*one);
        walkFacts_.replacesByName = true;
    } else if (const Array* many = replaces.asArray()) {
        for (const Value& e : *many)
            if (const std::string* name = e.asString()) walkFacts_.replaces.push_back(*name);
    }
    walkFacts_.dedicated = isDedicated();
    walkFacts_.inApplication = containingUrl().has_value();
    walkFacts_.hostEntitlement = pluginKey(keys::kHostEntitlement);
}

Value AXDPlugIn::infoKey(std::string_view key) const {
    auto record = vtproxy();
    return record ? record->lookup(Scope::InfoPlist, key) : Value();
}
Value AXDPlugIn::pluginKey(std::string_view key) const {
    auto record = vtproxy();
    return record ? record->lookup(Scope::PlugIn, key) : Value();
}
Value AXDPlugIn::attribute(std::string_view key) const {
    auto record = vtproxy();
    return record ? record->lookup(Scope::Attributes, key) : Value();
}
Value AXDPlugIn::bundleInfoDictionary() const {
    auto record = vtproxy();
    return record ? record->infoDictionary() : Value();
}

corvane::vantry::PlugInRecordPtr AXDPlugIn::vtproxy() const {
    corvane::MutexLock lock(mutex_);
    return vtproxy_;
}

void AXDPlugIn::setVtproxy(corvane::vantry::PlugInRecordPtr record) {
    corvane::MutexLock lock(mutex_);
    vtproxy_ = std::move(record);
    dropEncodedForm();
}

// A name set on the plug-in wins; otherwise the registry record's answers.
std::optional<std::string> AXDPlugIn::localizedName() const {
    corvane::MutexLock lock(mutex_);
    if (setNames_ && setNames_->name) return setNames_->name;
    return vtproxy_ ? vtproxy_->localizedName() : std::nullopt;
}
void AXDPlugIn::setLocalizedName(const std::optional<std::string>& v) {
    corvane::MutexLock lock(mutex_);
    namesLocked().name = v;
    dropEncodedForm();
}
std::optional<std::string> AXDPlugIn::localizedShortName() const {
    corvane::MutexLock lock(mutex_);
    if (setNames_ && setNames_->shortName) return setNames_->shortName;
    return vtproxy_ ? vtproxy_->localizedShortName() : std::nullopt;
}
void AXDPlugIn::setLocalizedShortName(const std::optional<std::string>& v) {
    corvane::MutexLock lock(mutex_);
    namesLocked().shortName = v;
    dropEncodedForm();
}
std::optional<std::string> AXDPlugIn::localizedContainingName() const {
    corvane::MutexLock lock(mutex_);
    if (setNames_ && setNames_->containingName) return setNames_->containingName;
    if (!vtproxy_ || !vtproxy_->containingApplication()) return std::nullopt;
    return vtproxy_->containingApplication()->localizedName();
}
void AXDPlugIn::setLocalizedContainingName(const std::optional<std::string>& v) {
    corvane::MutexLock lock(mutex_);
    namesLocked().containingName = v;
    dropEncodedForm();
}

void AXDPlugIn::dropEncodedForm() {
    encodedForm_.reset();
    exportError_.reset();
    ++formsDropped_;
}

AXDPlugIn::SetNames& AXDPlugIn::namesLocked() {
    if (!setNames_) setNames_ = std::make_unique<SetNames>();
    return *setNames_;
}

Status AXDPlugIn::diagnose() const {
    if (Status usable = AXPlugInCore::diagnose(); !usable.ok()) return usable;
    auto record = vtproxy();
    if (!isData() && !(record && record->dataContainerPath()))
        return makeError(AXErrorCode::PlugInUnusable, "this plug-in has no sandbox data container");
    // Stand-alone plug-ins belong to the system volume (under the platform root when it moves).
    if (!containingUrl() && path().rfind(corvane::layout::systemRoot() + "/", 0) != 0)
        return makeError(AXErrorCode::PlugInUnusable, "plug-ins outside containing apps must be in /usr");
    return {};
}

Value AXDPlugIn::valueForEntitlement(const std::string& key) const { return entitlements()[key]; }

bool AXDPlugIn::hasEntitlement(const std::string& key) const { return entitlementGranted(valueForEntitlement(key)); }

const std::string& AXDPlugIn::annotationKey() const {
    return walkFacts_.replacesByName ? walkFacts_.replaces.front() : walkFacts_.identifier;
}

void AXDPlugIn::augmentForm(Dictionary& form) const {
    Value resources = pluginKey(keys::kShared);
    if (isAppExtension()) resources = Value(Array{Value(".")});
    // Only a name or a list of names is a resource list; anything else is none.
    if (!resources.isString() && !resources.isArray()) return;
    form.insert_or_assign(form::kExtensions, Value(issueResourceExtensions(resources)));
}

Dictionary AXDPlugIn::issueResourceExtensions(const Value& resources) const {
    Array list;
    if (resources.isString()) {
        list.push_back(resources);
    } else if (const Array* a = resources.asArray()) {
        list = *a;
    }
    Dictionary result;
    for (const Value& entry : list) {
        const std::string* name = entry.asString();
        if (!name) continue;
        // The bundle itself is the registry's path, resolved when it was registered: no look at
        // the file system for it (the broker refuses the token should a link stand on it since).
        // A named resource may lead anywhere, and is resolved now.
        bool bundle = *name == ".";
        std::string resource = bundle ? path() : path() + "/" + *name;
        auto token = bundle ? corvane::sandbox::issueFileReadExtension(corvane::sandbox::kReadOnlyClass, resource,
                                                                        corvane::sandbox::kResolvedPath)
                            : issueReadExtensionForURL(resource);
        if (token) {
            result.insert_or_assign(*name, Value(*token));
        } else {
            log::info(logOps(), "failed to make extension for %@ in plug-in at %@: %{public}s", resource, path(),
                      token.error().description());
        }
    }
    return result;
}

corvane::Result<AXDPlugIn::EncodedFormPtr> AXDPlugIn::encodedForm() const {
    {
        corvane::MutexLock lock(mutex_);
        if (encodedForm_) return encodedForm_;
        if (exportError_) return *exportError_;
    }
    // Made outside the lock (the export reads the names under it); two threads may both make it,
    // and the results are the same.
    corvane::Result<EncodedFormPtr> made = [&]() -> corvane::Result<EncodedFormPtr> {
        auto exported = exportForm();
        if (!exported) return exported.error();
        Dictionary form = *exported->asDictionary();
        augmentForm(form);
        form.erase(form::kAnnotations);
        auto encoded = std::make_shared<EncodedForm>();
        Value whole(form);
        encoded->nesting = corvane::rpx::wire::nestingOf(whole);
        encoded->kindsInside = whole.kindsInside();
        for (const auto& [key, value] : form) {
            if (!corvane::rpx::wire::appendEntry(encoded->entries, key, value))
                return makeError(AXErrorCode::PlugInUnusable, "cannot export plug-in: a value cannot be sent");
            ++encoded->count;
        }
        // Kept for as long as the plug-in is: without the room the appends left (up to as much
        // again), ten thousand forms take half the memory.
        encoded->entries.shrink_to_fit();
        return EncodedFormPtr(std::move(encoded));
    }();
    corvane::MutexLock lock(mutex_);
    if (made) {
        encodedForm_ = *made;
    } else {
        exportError_ = std::make_shared<const corvane::Error>(made.error());
    }
    return made;
}

Dictionary AXDPlugIn::prunedInfoDictionaryFor(const Value& dictionary) {
    Dictionary out;
    if (const Dictionary* d = dictionary.asDictionary())
        for (const auto& [k, v] : *d)
            if (k.rfind("DT", 0) != 0) out.emplace(k, v);
    return out;
}

}  // namespace annexa
