#include "Annexa/AXPlugInCore.h"

#include <cstdio>
#include <cstdlib>

#include "platform/sdk/Sdk.h"

namespace annexa {

namespace log = corvane::log;

namespace {

[[noreturn]] void inconsistency(const char* text) {
    std::fprintf(stderr, "internal inconsistency: %s\n", text);
    std::fflush(stderr);
    std::abort();
}

std::optional<std::string> stringOf(const Value& v) {
    if (const std::string* s = v.asString()) return *s;
    return std::nullopt;
}

bool endsWith(std::string_view s, std::string_view suffix) {
    return s.size() >= suffix.size() && s.substr(s.size() - suffix.size()) == suffix;
}

}  // namespace

AXPlugInCore::AXPlugInCore() = default;
AXPlugInCore::~AXPlugInCore() = default;

// ---- set-up

std::shared_ptr<AXPlugInCore> AXPlugInCore::fromSetup(const AXPlugInSetup& setup) {
    auto record = std::make_shared<AXPlugInCore>();
    if (!record->setup(setup)) return nullptr;
    if (record->plugInDictionary().isNull()) record->setPlugInDictionary(setup.info);
    return record;
}

bool AXPlugInCore::setup(const AXPlugInSetup& setup) {
    const auto& [name, url, bundleInfo, info, uuid] = setup;
    (void)info;  // the plug-in dictionary comes from the bundle metadata here
    if (!url) return false;
    if (!name) {
        log::error(logOps(), "missing identifier in plug-in at %@", *url);
        return false;
    }
    if (!bundleInfo.isNull()) {
        if (!setDictionaries(normalizeInfoDictionary(bundleInfo))) {
            log::notice(logOps(), "malformed plug-in dictionary in plug-in %@ at %@: %@", *name, *url,
                        bundleInfo);
            return false;
        }
    }
    setIdentifier(name);
    setUrl(*url);
    setUuid(uuid ? *uuid : UUID::random());
    return true;
}

Value AXPlugInCore::normalizeInfoDictionary(const Value& bundleInfo) { return bundleInfo; }

bool AXPlugInCore::setDictionaries(const Value& bundleInfo) {
    if (!bundleInfo.isDictionary()) return false;
    setBundleInfoDictionary(bundleInfo);
    const Value& plugin = bundleInfo[keys::kExtension];
    if (!plugin.isDictionary()) return false;
    setPlugInDictionary(plugin);
    if (plugin.has(keys::kMultiple)) {
        log::notice(logOps(), "multiplexed plug-ins (%{public}@ key) obsolete and ignored",
                    keys::kMultiple);
    }
    return true;
}

// ---- forms

std::shared_ptr<AXPlugInCore> AXPlugInCore::initWithForm(const Value& form) {
    auto record = std::make_shared<AXPlugInCore>();
    if (!record->setupWithForm(form)) return nullptr;
    return record;
}

bool AXPlugInCore::setupWithForm(const Value& f) {
    // Values of the wrong type count as absent: every writer of forms writes the right ones.
    std::optional<UUID> uuid;
    if (const std::string* text = f[form::kUUID].asString()) {
        if (auto parsed = UUID::parse(*text)) uuid = *parsed;
    }
    const Value& bundleInfo = f[form::kBundleInfo].isDictionary() ? f[form::kBundleInfo] : Value::null();
    if (!setup({.name = stringOf(f[form::kIdentifier]), .url = stringOf(f[form::kPath]), .bundleInfo = bundleInfo, .info = f[form::kInfo], .uuid = uuid}))
        return false;
    const Value& hub = f[form::kHubProtocolVersion];
    setHubProtocolVersion(hub.isNumber() ? static_cast<uint32_t>(*hub.uint64Value()) : 1);
    setOriginalIdentifier(stringOf(f[form::kOriginalIdentifier]));
    setCdhash(f[form::kHash].isData() ? f[form::kHash] : Value());
    setRequirement(stringOf(f[form::kRequirement]));
    const Value& modified = f[form::kLastModified];
    setLastModified(modified.isNumber() ? static_cast<int32_t>(*modified.int64Value()) : 0);
    setEntitlements(f[form::kEntitlements].isDictionary() ? f[form::kEntitlements] : Value());
    if (auto containing = stringOf(f[form::kContainingPath])) setContainingUrl(containing);
    setOnSystemVolume(f[form::kSystemResident].isTrue());
    setAnnotations(f[form::kAnnotations].isDictionary() ? f[form::kAnnotations] : Value());
    setLocalizedName(stringOf(f[form::kDisplayName]));
    setLocalizedShortName(stringOf(f[form::kShortName]));
    setLocalizedContainingName(stringOf(f[form::kContainingName]));
    return true;
}

void AXPlugInCore::updateFromForm(const Value& f) {
    setAnnotations(f[form::kAnnotations].isDictionary() ? f[form::kAnnotations] : Value());
}

Result<Value> AXPlugInCore::exportForm() const {
    auto missing = [](const char* what) {
        return makeErrorWithFormat(AXErrorCode::PlugInUnusable, "cannot export plug-in: missing %s", what);
    };
    Value info = bundleInfoDictionary();
    Value plugin = plugInDictionary();
    Value ver = version();
    auto original = originalIdentifier();
    auto ident = identifier();
    auto id = uuid();
    if (info.isNull()) return missing("bundle metadata");
    if (plugin.isNull()) return missing("plug-in dictionary");
    if (ver.isNull()) return missing("version");
    if (!original) return missing("original identifier");
    if (!ident || !id) return missing("identifier");

    Value bundleInfo = info;
    if (const Dictionary* entries = info.asDictionary(); entries && entries->count(keys::kInfoPlistURL)) {
        Dictionary copy = *entries;
        copy.erase(keys::kInfoPlistURL);
        bundleInfo = Value(std::move(copy));
    }
    Value annotationsValue = annotations();
    Dictionary f{
        {form::kHubProtocolVersion, Value(uint64_t{hubProtocolVersion()})},
        {form::kPath, Value(path())},
        {form::kSystemResident, Value(onSystemVolume())},
        {form::kIdentifier, Value(*ident)},
        {form::kOriginalIdentifier, Value(*original)},
        {form::kVersion, ver},
        {form::kBundleInfo, bundleInfo},
        {form::kInfo, plugin},
        {form::kUUID, Value(id->string())},
        {form::kLastModified, Value(int64_t{lastModified()})},
        {form::kAnnotations, annotationsValue.isDictionary() ? annotationsValue : Value(Dictionary{})},
    };
    Value ents = entitlements();
    if (ents.isDictionary()) f.emplace(form::kEntitlements, ents);
    if (auto c = containingPath()) f.emplace(form::kContainingPath, Value(*c));
    if (auto n = localizedContainingName()) f.emplace(form::kContainingName, Value(*n));
    if (auto n = localizedName()) f.emplace(form::kDisplayName, Value(*n));
    if (auto n = localizedShortName()) f.emplace(form::kShortName, Value(*n));
    return Value(std::move(f));
}

// ---- SDK resolution

void AXPlugInCore::resolveSDK() {
    Value info = bundleInfoDictionary();
    if (info.isNull()) inconsistency("cannot resolve SDK without materialized Info.plist");
    Value spec = sdkSpec();
    if (!spec.isNull()) {
        const std::string* point = spec.asString();
        if (!point) {
            log::error(logOps(), "invalid SDK key:%{public}@", spec.description());
            return;
        }
        Value definition = readSDKDictionary(*point);
        if (!definition.isNull()) (void)setDictionaries(mergeDictionaryInto(definition, info));
    }
    canonicalize();
}

Value AXPlugInCore::mergeDictionaryInto(const Value& sdk, const Value& plugin) {
    return corvane::sdk::mergeDictionary(sdk, plugin);
}

bool AXPlugInCore::sdkOverridesKey(std::string_view key) { return corvane::sdk::sdkOverridesKey(key); }

Value AXPlugInCore::mergeSharedResourcesInto(const Value& sdkList, const Value& pluginList) {
    return corvane::sdk::mergeSharedResources(sdkList, pluginList);
}

void AXPlugInCore::canonicalize() {
    // Through the lookups, so that a subclass's answers are what gets canonical form.
    Value current = plugInDictionary();
    Dictionary plugin = current.isDictionary() ? *current.asDictionary() : Dictionary{};
    plugin.insert_or_assign(keys::kAttributes, attributes());
    Dictionary info;
    Value shortVersion = infoKey(keys::kShortVersion);
    if (!shortVersion.isNull()) info.emplace(keys::kShortVersion, shortVersion);
    setPlugInDictionary(corvane::sdk::canonicalPlugInDictionary(Value(std::move(plugin)),
                                                                Value(std::move(info))));
}

Value AXPlugInCore::readSDKDictionary(const std::string& extensionPointIdentifier) const {
    auto definition = corvane::sdk::readDefinition(extensionPointIdentifier);
    if (!definition) {
        log::notice(logOps(), "plug-in sdk \"%{public}@\" not registered", extensionPointIdentifier);
        return Value();
    }
    return *definition;
}

// ---- lookups

Value AXPlugInCore::infoKey(std::string_view key) const { return bundleInfoDictionary()[key]; }
Value AXPlugInCore::pluginKey(std::string_view key) const { return plugInDictionary()[key]; }
Value AXPlugInCore::attributes() const { return pluginKey(keys::kAttributes); }
Value AXPlugInCore::attribute(std::string_view key) const { return attributes()[key]; }

// ---- derived properties

Value AXPlugInCore::version() const { return attribute(keys::kVersion); }

bool AXPlugInCore::isAppExtension() const { return endsWith(url(), ".appex"); }

Value AXPlugInCore::protocolSpec() const {
    Value v = pluginKey(keys::kProtocol);
    if (v.isNull() && isAppExtension()) return Value(keys::kDefaultSpec);
    return v;
}

Value AXPlugInCore::principalSpec() const {
    Value v = pluginKey(keys::kPrincipalClass);
    if (v.isNull() && isAppExtension()) return Value(keys::kDefaultSpec);
    return v;
}

Value AXPlugInCore::embeddedProtocolSpec() const {
    Value v = pluginKey(keys::kEmbeddedProtocol);
    return v.isNull() ? protocolSpec() : v;
}

Value AXPlugInCore::sdkSpec() const { return pluginKey(keys::kPointIdentifier); }

bool AXPlugInCore::isHybrid() const { return !pluginKey(keys::kEmbeddedCode).isNull(); }

bool AXPlugInCore::isDedicated() const { return pluginKey(keys::kDedicated).boolValue().value_or(false); }

bool AXPlugInCore::isData() const { return protocolSpec() == Value(keys::kDataProtocol); }

bool AXPlugInCore::oldStyle() const {
    if (!infoKey(keys::kExtension).isNull()) return false;
    if (!infoKey(keys::kOldStyle).isNull()) return true;
    inconsistency("unknown plug-in configuration style");
}

Date AXPlugInCore::timestamp() const { return Date{int64_t{lastModified()} * 1000000}; }

Value AXPlugInCore::augmentInterface(const Value& /*interface*/) const { return Value(); }

Status AXPlugInCore::diagnose() const {
    if (!identifier())
        return makeError(AXErrorCode::PlugInUnusable, "missing identifier (no KSExtensionIdentifier, nor even KFBundleIdentifier)");
    if (protocolSpec().isNull())
        return makeErrorWithFormat(AXErrorCode::PlugInUnusable, "missing \"%@\" key in Info.plist or SDK", keys::kProtocol);
    if (attributes().isNull())
        return makeErrorWithFormat(AXErrorCode::PlugInUnusable, "missing \"%@\" key in Info.plist or SDK", keys::kAttributes);
    if (isAppExtension() && !(principalSpec() == Value(keys::kDefaultSpec)))
        return makeErrorWithFormat(AXErrorCode::PlugInUnusable, "Application Extensions may not use the \"%@\" key",
                                   keys::kPrincipalClass);
    if (!pluginKey(keys::kPassProxy).isNull())
        return makeErrorWithFormat(AXErrorCode::PlugInUnusable, "the \"%@\" key is not supported on this platform",
                                   keys::kPassProxy);
    if (isHybrid()) return makeError(AXErrorCode::PlugInUnusable, "hybrid plug-ins are not supported on this platform");
    return {};
}

void AXPlugInCore::setAnnotationValue(const std::string& key, const Value& value) {
    corvane::MutexLock lock(mutex_);
    if (annotations_.isNull()) return;
    annotations_ = Value(dictionaryChanging(annotations_, key, value));
}

// ---- identity

bool AXPlugInCore::isEqual(const AXPlugInCore& other) const {
    auto mine = uuid();
    auto theirs = other.uuid();
    if (!mine || !theirs) inconsistency("self.uuid");
    return *mine == *theirs;
}

size_t AXPlugInCore::hash() const {
    auto mine = uuid();
    if (!mine) inconsistency("self.uuid");
    return corvane::UUIDHash()(*mine);
}

std::string AXPlugInCore::description() const {
    auto id = uuid();
    return identifier().value_or("(null)") + "(" + (id ? id->string() : "(null)") + ")";
}

// ---- fields: whole values under the lock

#define AX_FIELD(Type, getter, setter, member)      \
    Type AXPlugInCore::getter() const {             \
        corvane::MutexLock lock(mutex_);               \
        return member;                              \
    }                                               \
    void AXPlugInCore::setter(const Type& v) {      \
        corvane::MutexLock lock(mutex_);               \
        member = v;                                 \
    }

AX_FIELD(Value, plugInDictionary, setPlugInDictionary, plugInDictionary_)
AX_FIELD(std::optional<std::string>, identifier, setIdentifier, identifier_)
AX_FIELD(std::optional<std::string>, originalIdentifier, setOriginalIdentifier, originalIdentifier_)
AX_FIELD(std::string, url, setUrl, url_)
AX_FIELD(std::optional<std::string>, containingUrl, setContainingUrl, containingUrl_)
AX_FIELD(Value, bundleInfoDictionary, setBundleInfoDictionary, bundleInfoDictionary_)
AX_FIELD(Value, entitlements, setEntitlements, entitlements_)
AX_FIELD(Value, annotations, setAnnotations, annotations_)
AX_FIELD(std::optional<UUID>, uuid, setUuid, uuid_)

#undef AX_FIELD

// Unset, a rare field reads as its empty value.
#define AX_RARE_FIELD(Type, getter, setter, member)         \
    Type AXPlugInCore::getter() const {                      \
        corvane::MutexLock lock(mutex_);                     \
        return rare_ ? rare_->member : Type();               \
    }                                                        \
    void AXPlugInCore::setter(const Type& v) {               \
        corvane::MutexLock lock(mutex_);                     \
        if (!rare_) rare_ = std::make_unique<Rare>();        \
        rare_->member = v;                                   \
    }

AX_RARE_FIELD(std::optional<std::string>, localizedName, setLocalizedName, localizedName)
AX_RARE_FIELD(std::optional<std::string>, localizedShortName, setLocalizedShortName, localizedShortName)
AX_RARE_FIELD(std::optional<std::string>, localizedContainingName, setLocalizedContainingName,
              localizedContainingName)
AX_RARE_FIELD(Value, cdhash, setCdhash, cdhash)
AX_RARE_FIELD(std::optional<std::string>, requirement, setRequirement, requirement)

#undef AX_RARE_FIELD

}  // namespace annexa
